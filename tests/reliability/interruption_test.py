"""Usage: interruption_test.py BUILD_FOLDER
       interruption_test.py BUILD_FOLDER --table

Ends the updater, or the whole unit, at each command of an update in turn: right before the command takes effect and
right after. The next run must end as a fresh run on a unit in that state would. --table prints what became of each.
"""

import copy
import sys
import unittest
from concurrent.futures import ThreadPoolExecutor
from dataclasses import dataclass
from functools import cache
from pathlib import Path

from bench import scenario
from bench.runner import run_on, temporary_folder
from bench.unit import State
from tests.reliability.disturbed import SPEED, DisturbedUnit, outcome

BUILD = Path()
AT_ONCE = 4

# Tool and arguments (a pattern of the shell) of each command of an update of package and board, in order.
COMMANDS = {
    "stop-harl": ("systemctl", "stop?harl"),
    "refresh-mirrors": ("apt", "update"),
    "read-package": ("apt-cache", "*"),
    "install-package": ("apt", "*install*"),
    "read-board": ("ssh", "*version.txt*"),
    "list-stick": ("ls", "*"),
    "upload-board": ("scp", "*OSUpgrade.zip*"),
    "install-board": ("ssh", "*/unzipUpgrade.sh"),
    "remove-marker": ("rm", "*"),
    "release-stick": ("umount", "*"),
    "start-harl": ("systemctl", "start?harl"),
    "stop-updater": ("systemctl", "stop?harl-updater"),
}
# The updater alone: its command runs on to its end. The unit: nothing runs on, the updater first, which must not go on
# while its command is already gone.
KILL = {
    "updater": 'kill -s KILL "$updater"',
    "unit": 'kill -s KILL "$updater"; kill -s KILL -- "-$updater"',
}
# Where a second run comes too late for the first-boot marker: both are up to date, so that nothing is installed.
MARKER_STAYS = {
    ("updater", "install-board", "before"),
    ("updater", "install-board", "after"),
    ("unit", "install-board", "after"),
    ("unit", "remove-marker", "before"),
}


@dataclass(frozen=True)
class Interruption:
    """Who is killed, at which command, before or after it takes effect."""

    killed: str
    command: str
    moment: str


@dataclass
class Aftermath:
    """A unit after an interruption, and what the next run and a fresh one made of it."""

    interruption: Interruption
    state: State
    second: dict[str, object]
    fresh: dict[str, object]


def interrupt(what: Interruption) -> Aftermath:
    """Interrupts an update, then runs another one on the same unit."""
    tool, arguments = COMMANDS[what.command]
    kill = f'read -r updater <"$UNIT/unit.pid"; {KILL[what.killed]}'
    steps = f'{kill}; real "$@"' if what.moment == "before" else f'real "$@"; status=$?; {kill}; exit "$status"'
    if what.command == "stop-updater":  # the service manager's own end of the updater is not the interruption
        steps = kill
    with temporary_folder() as folder:
        unit = DisturbedUnit(scenario.load("package-and-board"), folder, BUILD)
        unit.change_tool(tool, f'case "$*" in {arguments}) {steps} ;; *) real "$@" ;; esac')
        run_on(unit, lambda run, log: None, SPEED)
        state = unit.state()
        unit.restore_tools()
        second = outcome(run_on(unit, lambda run, log: None, SPEED))
    return Aftermath(what, state, second, fresh_run(state.package, state.board, state.marker, state.stick))


@cache
def fresh_run(package: str, board: str, marker: bool, stick: bool) -> dict[str, object]:
    """What a first run makes of a unit in that state. Whether harl runs makes no difference: an update stops it."""
    what = copy.deepcopy(scenario.load("package-and-board"))
    what.unit["package"]["installed"] = package
    what.unit["board"]["installed"] = board
    what.unit["head"]["marker"] = marker
    what.unit["stick"]["inserted"] = stick
    with temporary_folder() as folder:
        return outcome(run_on(DisturbedUnit(what, folder, BUILD), lambda run, log: None, SPEED))


def all_interruptions() -> list[Interruption]:
    """Every command, before and after, the updater and the unit."""
    return [
        Interruption(killed, command, moment)
        for killed in KILL
        for command in COMMANDS
        for moment in ("before", "after")
    ]


class InterruptionTest(unittest.TestCase):
    """One table of aftermaths, looked at from several sides."""

    aftermaths: list[Aftermath]

    @classmethod
    def setUpClass(cls) -> None:
        cls.aftermaths = interrupt_all()

    def test_next_run_ends_as_a_fresh_run_on_that_state(self) -> None:
        self.maxDiff = None
        for aftermath in self.aftermaths:
            with self.subTest(aftermath.interruption):
                self.assertEqual(aftermath.second, aftermath.fresh)

    def test_next_run_gives_the_instrument_back(self) -> None:
        for aftermath in self.aftermaths:
            with self.subTest(aftermath.interruption):
                self.assertEqual(aftermath.second["harl"], "active")
                self.assertFalse(aftermath.second["stick"])

    def test_package_and_board_are_up_to_date_behind_the_next_run(self) -> None:
        for aftermath in self.aftermaths:
            with self.subTest(aftermath.interruption):
                self.assertEqual(aftermath.second["package"], "1.3.0")
                self.assertEqual(aftermath.second["board"], "2.2.0")

    def test_marker_stays_only_where_both_were_installed_before_the_interruption(self) -> None:
        for aftermath in self.aftermaths:
            what = aftermath.interruption
            with self.subTest(what):
                self.assertEqual(aftermath.second["marker"], (what.killed, what.command, what.moment) in MARKER_STAYS)


def interrupt_all() -> list[Aftermath]:
    """All interruptions, some at a time."""
    with ThreadPoolExecutor(AT_ONCE) as pool:
        return list(pool.map(interrupt, all_interruptions()))


def print_table() -> None:
    """A row for each interruption: the unit right after it, and what the next run shows and leaves."""
    print("killed   command          moment  | package board  marker stick  harl     | next run         marker")
    for aftermath in interrupt_all():
        what, state, second = aftermath.interruption, aftermath.state, aftermath.second
        panel = " ".join(f"{led} {color}" for led, color in second["panel"].items())  # type: ignore[attr-defined]
        print(
            f"{what.killed:8} {what.command:16} {what.moment:7} | {state.package:7} {state.board:6} "
            f"{'there' if state.marker else 'gone':6} {'there' if state.stick else 'gone':6} {state.harl:8} | "
            f"{panel:22} {'stays' if second['marker'] else 'gone'}"
        )


if __name__ == "__main__":
    BUILD = Path(sys.argv.pop(1))
    if sys.argv[1:] == ["--table"]:
        print_table()
    else:
        unittest.main()
