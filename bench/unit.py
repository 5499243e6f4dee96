"""The interface of a unit; the stand-in unit and the real one are two implementations of it."""

from dataclasses import dataclass, field
from pathlib import Path
from typing import Protocol

from bench.scenario import Setup

# The program that runs on a unit, in the folder of the programs, by what `updater.program` in a scenario says.
PROGRAMS = {"remote": Path("harl-updater"), "main": Path("bench/main-head")}


# What a user can change while a unit runs: its two states, the one in order first. Without power nothing runs on the
# head, which keeps its disk. A board that hangs answers nobody; its link stays up.
PARTS = {
    "power": ("on", "off"),
    "stick": ("in", "out"),
    "board": ("works", "hangs"),
    "link": ("up", "down"),
    "mirrors": ("up", "down"),
    "sound": ("on", "off"),
    "bus": ("up", "down"),
}


@dataclass
class State:
    """The state of a unit at any moment of a run."""

    package: str  # version of the head's package, "(none)" when it is not installed
    board: str  # version in the board's version file, "" when it cannot be read from the bench's side
    marker: bool  # the first-boot marker exists
    stick: bool  # the stick is mounted
    harl: str  # "active", "inactive" or "unknown"
    updater: str = "inactive"  # its service: "active" or "inactive"
    sounds: list[str] = field(default_factory=list)  # base names of the sound files that were played to their end


@dataclass
class Files:
    """Where a unit writes what happens, each file appended to while the updater runs and read as it grows.

    `log`: the updater's standard output.
    `calls`: what bench/call_recorder.cpp, preloaded into the updater alone, writes: one line for each start and end
    of a `system`, a `popen`/`pclose` or a `nanosleep` of the updater. Its path is in BENCH_CALLS.
    `panel`: one line for each byte that reached the LED controller: seconds of CLOCK_BOOTTIME, a blank, two hex digits.
    """

    log: Path
    calls: Path
    panel: Path


class UnitError(Exception):
    """The unit cannot be made on this machine; the text says what is missing and what to do."""


class Unit(Protocol):
    """A head with its board, stick and panel as a scenario describes them, in which the updater runs once.

    `__init__(scenario, folder, speed, build)` only keeps its arguments: the scenario, an empty folder for everything
    the unit needs, how many times faster the updater's own clock and waits run (1: full length), and the folder of the
    programs. The rest of the bench calls `start`, then `ended` and `state` repeatedly, and `close` in any case.
    """

    kind: str  # "real" or "stand-in"
    name: str  # one line for the output: what is real and what is a stand-in
    files: Files
    log_is_exact: bool  # False: blanks at the ends of the log's lines are lost

    def start(self) -> None:
        """Makes the unit and starts the updater. Raises UnitError."""

    def ended(self) -> int | None:
        """None while the updater runs, then its status: the exit code, or minus the number of the signal."""

    def state(self) -> State:
        """The unit as it is now; called several times a second while the updater runs, and once after it."""

    def parts(self) -> dict[str, bool]:
        """Which of the PARTS are in order, before the start as the scenario says."""

    def switch(self, part: str) -> None:
        """Puts one of the PARTS into its other state. Raises UnitError."""

    def set_speed(self, speed: float) -> None:
        """How many times faster the updater's clock and waits run from now on. To be called before `start`, too, where
        the speed is to change later."""

    def update(self) -> None:
        """Starts the updater again, once it has ended; `files` begin anew. Raises UnitError."""

    def updater(self) -> int | None:
        """The process id of the updater, as this machine numbers it; None when it does not run."""

    def shell(self) -> tuple[list[str], dict[str, str]]:
        """A command that runs a shell on the head, and its environment."""

    def close(self) -> None:
        """Ends every process of the unit and undoes everything. May be called at any time and more than once."""


def parts_of(setup: Setup) -> dict[str, bool]:
    """Which of the PARTS are in order before the start."""
    return {
        "power": True,
        "stick": setup.stick.inserted,
        "board": setup.board.link != "hangs",
        "link": setup.board.link != "down",
        "mirrors": setup.mirrors.refresh != "unreachable",
        "sound": setup.head.sound == "present",
        "bus": setup.head.panel == "present",
    }


def with_pid_file(folder: Path, command: list[str | Path]) -> list[str | Path]:
    """`command`, to be started in its own session, preceded by a line that writes its process id into `folder`.

    Whoever removes the folder ends the session; a command that finds the folder gone does not start.
    """
    return ["/bin/sh", "-c", 'echo $$ >"$0/unit.pid" && exec "$@"', folder, *command]
