"""Usage: seeds.py FOLDER

Writes the fuzzers' first inputs: what the tools print in each of the bench's scenarios.
"""

import sys
from pathlib import Path

sys.path.insert(0, str(Path(__file__).parents[1] / "bench"))

import scenario

MARKER = "/root/USB_MOUNT/debs/installTV\n"


def package_seed(unit: dict[str, dict[str, object]]) -> str:
    """A query's status and output."""
    package = unit["package"]
    if not package["known"]:
        return "0"
    installed, offered = package["installed"], package["offered"]
    return (
        f"0solvik4-rh:\n  Installed: {installed}\n  Candidate: {offered}\n  Version table:\n"
        f"     {offered} 500\n        500 file:/srv/repository ./ Packages\n *** {installed} 100\n"
        "        100 /var/lib/dpkg/status\n"
    )


def board_seed(unit: dict[str, dict[str, object]]) -> str:
    """Statuses and outputs of the version's reading and of the stick's listing."""
    board, stick = unit["board"], unit["stick"]
    version = str(board["version_file"]).replace("{version}", str(board["installed"]))
    lines = "".join(line for line in version.splitlines(keepends=True) if "Brimvale" in line)
    read = "5" if board["link"] in ("down", "hangs") or board["login"] != "accepted" else "0" if lines else "1"
    listed = "0" if stick["inserted"] else "2"
    directories = stick["directories"]
    assert isinstance(directories, list)
    return f"{read}{listed}{lines}\x1e" + "".join(f"{name}\n" for name in directories)


def teamviewer_seed(unit: dict[str, dict[str, object]]) -> str:
    """The status and the output of the marker's listing."""
    return {"absent": "2", "file": "0" + MARKER, "directory": "0", "unreadable": "1"}[str(unit["stick"]["teamviewer"])]


def main() -> None:
    """The command."""
    for target, seed in {"package": package_seed, "board": board_seed, "teamviewer": teamviewer_seed}.items():
        folder = Path(sys.argv[1]) / target
        folder.mkdir(parents=True, exist_ok=True)
        for name in scenario.names():
            (folder / name).write_bytes(seed(scenario.load(name).unit).encode())


main()
