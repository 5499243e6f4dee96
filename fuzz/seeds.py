"""Usage: seeds.py FOLDER

Writes the fuzzers' first inputs: the output of the tools in each of the bench's scenarios, its sticks, some archives,
the golden logs, and what earlier runs kept in fuzz/corpus.
"""

import io
import sys
import zipfile
from pathlib import Path

from bench import scenario
from bench.makers.board import version_text
from bench.scenario import Setup

CORPUS = Path(__file__).parent / "corpus"
MARKER = "/root/USB_MOUNT/debs/installTV\n"


def package_seed(setup: Setup) -> str:
    """A query's status and output."""
    package = setup.package
    if not package.known:
        return "0"
    installed, offered = package.installed, package.offered
    return (
        f"0solvik4-rh:\n  Installed: {installed}\n  Candidate: {offered}\n  Version table:\n"
        f"     {offered} 500\n        500 file:/srv/repository ./ Packages\n *** {installed} 100\n"
        "        100 /var/lib/dpkg/status\n"
    )


def board_seed(setup: Setup) -> str:
    """Statuses and outputs of the version's reading and of the stick's listing."""
    board, stick = setup.board, setup.stick
    version = version_text(board.installed, board.version_file)
    lines = "".join(line for line in version.splitlines(keepends=True) if "Brimvale" in line)
    read = "5" if board.link in ("down", "hangs") or board.login != "accepted" else "0" if lines else "1"
    listed = "0" if stick.inserted else "2"
    return f"{read}{listed}{lines}\x1e" + "".join(f"{name}\n" for name in stick.directories)


def teamviewer_seed(setup: Setup) -> str:
    """The status and the output of the marker's listing."""
    return {"absent": "2", "file": "0" + MARKER, "directory": "0", "unreadable": "1"}[setup.stick.teamviewer]


BOARD_FOLDER = "debs/QUORB/armhf"
FIT_STICK = (
    f"ddebs\x1eddebs/QUORB\x1ed{BOARD_FOLDER}\x1ed{BOARD_FOLDER}/quorb2.2.0\x1ez{BOARD_FOLDER}/quorb2.2.0/OSUpgrade.zip"
    f"\x1ex{BOARD_FOLDER}/quorb2.2.0/unzipUpgrade.sh\x1f#!/bin/sh\nexit 0\n"
)
# Other contents of a stick that the bench does not have.
ODD_STICKS = {
    "hidden": f"{FIT_STICK}\x1ef{BOARD_FOLDER}/.hidden",
    "hidden-folder": FIT_STICK.replace("quorb2", ".quorb2"),
    "file-before": f"{FIT_STICK}\x1ef{BOARD_FOLDER}/README",
    "file-behind": f"{FIT_STICK}\x1ef{BOARD_FOLDER}/zero",
    "line-break": FIT_STICK.replace("2.2.0", "2.2.0\nnext"),
    "lower-case": FIT_STICK.replace("OSUpgrade", "osupgrade"),
    "link-inside": FIT_STICK.replace("/quorb2", "/.quorb2") + f"\x1el{BOARD_FOLDER}/quorb2.2.0\x1f.quorb2.2.0",
    "link-outside": f"{FIT_STICK}\x1el{BOARD_FOLDER}/aaaaa1\x1f../../../..",
    "link-in-place": FIT_STICK.replace("/OSUpgrade.zip", "/kept.zip")
    + f"\x1el{BOARD_FOLDER}/quorb2.2.0/OSUpgrade.zip\x1fkept.zip",
    "pipe": FIT_STICK.replace(f"\x1ez{BOARD_FOLDER}", f"\x1ep{BOARD_FOLDER}"),
    "no-run-bit": FIT_STICK.replace("\x1ex", "\x1ef"),
    "windows-lines": FIT_STICK.replace("\n", "\r\n"),
}


def stick_seed(setup: Setup) -> str:
    """The names on the stick."""
    stick = setup.stick
    if not stick.inserted:
        return ""
    names = "\x1e".join([FIT_STICK.replace("quorb2.2.0", directory) for directory in stick.directories] or ["ddebs"])
    marker = {"absent": "", "directory": "\x1eddebs/installTV"}
    return names + marker.get(stick.teamviewer, "\x1efdebs/installTV")


def archive_seeds() -> dict[str, bytes]:
    """Intact archives of every tested kind, on a healthy medium."""
    seeds = {}
    for method in (zipfile.ZIP_STORED, zipfile.ZIP_DEFLATED, zipfile.ZIP_BZIP2):
        file = io.BytesIO()
        with zipfile.ZipFile(file, "w", method) as archive:
            archive.writestr("folder/", "")
            archive.writestr("folder/version.txt", "Brimvale\t2.2.0\r\n" * 20)
            with archive.open("zip64", "w", force_zip64=True) as entry:
                entry.write(b"x" * 100)
            archive.comment = b"comment"
        seeds[f"method-{method}"] = b"\xff" + file.getvalue()
    return seeds


def log_seeds() -> dict[str, bytes]:
    """The golden logs, in blocks of 65 bytes."""
    golden = Path(__file__).parents[1] / "tests/companion/golden/log"
    return {path.stem: b"@" + path.read_bytes() for path in golden.glob("*.log")}


def main() -> None:
    """The command."""
    readable = {"package": package_seed, "board": board_seed, "teamviewer": teamviewer_seed, "stick": stick_seed}
    setups = {name: scenario.load(name).setup for name in scenario.names()}
    inputs = {
        target: {name: seed(setup).encode() for name, setup in setups.items()} for target, seed in readable.items()
    }
    inputs["stick"] |= {name: odd.encode() for name, odd in ODD_STICKS.items()}
    inputs |= {"archive": archive_seeds(), "dress": log_seeds(), "log": log_seeds()}
    for target, contents in inputs.items():
        folder = Path(sys.argv[1]) / target
        folder.mkdir(parents=True, exist_ok=True)
        for name, content in contents.items():
            (folder / name).write_bytes(content)
        with zipfile.ZipFile(CORPUS / f"{target}.zip") as kept:
            kept.extractall(folder)


main()
