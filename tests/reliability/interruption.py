"""Interrupts an update of package and board once, then runs the updater again on the unit as it was left.

That run must end as a first run on a unit with that package, board, marker and stick does.
"""

import copy
import shlex
from collections.abc import Callable, Iterable
from concurrent.futures import ThreadPoolExecutor
from dataclasses import dataclass
from functools import cache, partial
from pathlib import Path
from typing import Protocol

from bench import scenario
from bench.expected import COMMANDS
from bench.runner import run_on, temporary_folder
from bench.scenario import Scenario
from bench.unit import State, Unit
from tests.reliability.disturbed import SPEED, observed

SCENARIO = "package-and-board"
MOMENTS = ("before", "after")


def _point(command: str) -> tuple[str, str]:
    """A command line's first tool, and a pattern of the shell for its arguments."""
    tool, *arguments = shlex.split(command.split(" && ")[0])
    return tool, "*".join(shlex.quote(part) if part else "" for part in " ".join(arguments).split("*"))


# Tool and arguments (a pattern of the shell) of each command of the update, in order.
POINTS = {name: _point(COMMANDS[name]) for name in scenario.load(SCENARIO).expect.commands}


@dataclass(frozen=True)
class Interruption:
    """Who is killed, at which command, before or after it takes effect."""

    killed: str
    point: str
    moment: str


@dataclass
class Aftermath:
    """A unit after an interruption, and the results of the next run and of a first run on it."""

    interruption: Interruption
    state: State
    second: dict[str, object]
    first: dict[str, object]
    audit: str  # the output of the package database's own check

    def differences(self) -> list[str]:
        """The differences between the next run and a first one."""
        seen = self.second
        return [f"{key}: {seen[key]!r}, not {due!r}" for key, due in self.first.items() if seen[key] != due]

    def row(self) -> str:
        """One line: the unit right after the interruption, and what the next run shows and leaves."""
        what, state, second = self.interruption, self.state, self.second
        panel = second["panel"]
        assert isinstance(panel, dict)
        return (
            f"{what.killed:8} {what.point:16} {what.moment:7} | {state.package:7} {state.board or '?':6} "
            f"{'there' if state.marker else 'gone':6} {'there' if state.stick else 'gone':6} {state.harl:8} | "
            f"{' '.join(f'{led} {color}' for led, color in panel.items()):22} {second['package']!s:7} "
            f"{second['board']!s:6} {'stays' if second['marker'] else 'gone':6} "
            f"{'not configured' if self.audit else 'clean'}"
        )


HEADER = (
    "killed   command          moment  | package board  marker stick  harl     | "
    "next run               package board  marker database"
)


class InterruptedUnit(Unit, Protocol):
    """A unit that kills the updater, or everything that runs, once; it can be started again and stays until `end`."""

    def audit(self) -> str:
        """The output of the package database's own check."""

    def end(self) -> None:
        """Ends the unit."""


# Makes a unit in a folder for a scenario; None: without an interruption.
Maker = Callable[[Scenario, Path, Interruption | None], InterruptedUnit]


def interruptions(killed: Iterable[str], points: Iterable[str]) -> list[Interruption]:
    """Every one of `killed` at all `points`."""
    return [Interruption(who, point, moment) for who in killed for point in points for moment in MOMENTS]


def interrupt_all(make: Maker, cases: list[Interruption], at_once: int) -> list[Aftermath]:
    """The result of each case, `at_once` at a time."""
    with ThreadPoolExecutor(at_once) as pool:
        return list(pool.map(partial(_interrupt, make), cases))


def _interrupt(make: Maker, what: Interruption) -> Aftermath:
    with temporary_folder() as folder:
        unit = make(scenario.load(SCENARIO), folder, what)
        try:
            run_on(unit, lambda run, log: None, SPEED)
            state = unit.state()
            second = observed(run_on(unit, lambda run, log: None, SPEED))
            audit = unit.audit()
        finally:
            unit.end()
    first = _first_run(make, state.package, state.board, state.marker, state.stick)
    return Aftermath(what, state, second, first, audit)


@cache
def _first_run(make: Maker, package: str, board: str, marker: bool, stick: bool) -> dict[str, object]:
    """The result of a first run on a unit in that state. Whether harl runs makes no difference: an update stops it."""
    what = copy.deepcopy(scenario.load(SCENARIO))
    what.setup.package.installed = package
    what.setup.board.installed = board
    what.setup.head.marker = marker
    what.setup.stick.inserted = stick
    with temporary_folder() as folder:
        unit = make(what, folder, None)
        try:
            return observed(run_on(unit, lambda run, log: None, SPEED))
        finally:
            unit.end()
