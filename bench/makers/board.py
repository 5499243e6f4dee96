"""The board's version file."""

from pathlib import Path

VERSION_FILE = "root/App/AppExe/version.txt"  # below the board's root
TEXT = "Name\tQuorb\r\nBrimvale\t{version}\r\n"


def version_text(version: str, text: str = TEXT) -> str:
    """The version file of a board with `version`; `text` is a scenario's `board.version_file`."""
    return text.replace("{version}", version)


def write_version(root: Path, version: str, text: str = TEXT) -> None:
    """Writes the version file below the board's `root`, and its folder; with an empty `text` the folder alone."""
    path = root / VERSION_FILE
    path.parent.mkdir(parents=True, exist_ok=True)
    if text:
        path.write_text(version_text(version, text), newline="")


def read_version(root: Path) -> str:
    """The version in the file below the board's `root`, "" when there is none."""
    path = root / VERSION_FILE
    lines = path.read_text().splitlines() if path.exists() else []
    versions = [line.split("\t", 1)[1] for line in lines if line.startswith("Brimvale\t")]
    return versions[-1] if versions else ""
