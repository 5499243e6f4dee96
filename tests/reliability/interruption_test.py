"""Usage: interruption_test.py BUILD_FOLDER
       interruption_test.py BUILD_FOLDER --table

Ends the updater, or the whole unit, at each command of an update in turn, on stand-in units: right before the command
takes effect and right after. --table prints the result of each.
"""

import sys
import unittest
from pathlib import Path

from bench.scenario import Scenario
from tests.command_line import take_path
from tests.reliability.disturbed import DisturbedUnit
from tests.reliability.interruption import HEADER, POINTS, Aftermath, Interruption, interrupt_all

BUILD = Path()
AT_ONCE = 4

# The updater alone: its command runs to its end. The unit: everything ends, the updater first, which must not continue
# once its command is gone.
KILLS = {
    "updater": 'kill -s KILL "$updater"',
    "unit": 'kill -s KILL "$updater"; kill -s KILL -- "-$updater"',
}
# Where a second run is too late for the first-boot marker: both are up to date, so that nothing is installed.
MARKER_STAYS = {
    ("updater", "install-board", "before"),
    ("updater", "install-board", "after"),
    ("unit", "install-board", "after"),
    ("unit", "remove-marker", "before"),
}


class InterruptedStandIn(DisturbedUnit):
    """A stand-in unit that is interrupted in its first run."""

    def __init__(self, what: Scenario, folder: Path, interruption: Interruption | None) -> None:
        super().__init__(what, folder, BUILD)
        if interruption is None:
            return
        tool, arguments = POINTS[interruption.point]
        kill = f'read -r updater <"$UNIT/unit.pid"; {KILLS[interruption.killed]}'
        steps = f'real "$@"; status=$?; {kill}; exit "$status"'
        if interruption.moment == "before":
            steps = f'{kill}; real "$@"'
        if interruption.point == "stop-updater":  # the service manager's own end of the updater is not the interruption
            steps = kill
        self.change_tool(tool, f'case "$*" in {arguments}) {steps} ;; *) real "$@" ;; esac')

    def start(self) -> None:
        """Starts the updater, the second time without an interruption."""
        if self._made:
            self.restore_tools()
        super().start()

    def audit(self) -> str:
        """A stand-in unit has no package database."""
        return ""

    def end(self) -> None:
        """Ends the unit."""
        self.close()


class InterruptionTest(unittest.TestCase):
    """One table of aftermaths, checked in several ways."""

    aftermaths: list[Aftermath]

    @classmethod
    def setUpClass(cls) -> None:
        cls.aftermaths = interrupt_all(InterruptedStandIn, list(KILLS), list(POINTS), AT_ONCE)

    def test_every_command_is_interrupted(self) -> None:
        self.assertEqual(len(self.aftermaths), len(KILLS) * len(POINTS) * 2)
        self.assertEqual(len(POINTS), 12)

    def test_next_run_ends_as_a_first_run_on_that_state(self) -> None:
        self.maxDiff = None
        for aftermath in self.aftermaths:
            with self.subTest(aftermath.interruption):
                self.assertEqual(aftermath.differences(), [])

    def test_next_run_gives_the_instrument_back(self) -> None:
        for aftermath in self.aftermaths:
            with self.subTest(aftermath.interruption):
                self.assertEqual(aftermath.second["harl"], "active")
                self.assertFalse(aftermath.second["stick"])

    def test_package_and_board_are_up_to_date_after_the_next_run(self) -> None:
        for aftermath in self.aftermaths:
            with self.subTest(aftermath.interruption):
                self.assertEqual(aftermath.second["package"], "1.3.0")
                self.assertEqual(aftermath.second["board"], "2.2.0")

    def test_marker_stays_only_where_both_were_installed_before_the_interruption(self) -> None:
        for aftermath in self.aftermaths:
            what = aftermath.interruption
            with self.subTest(what):
                self.assertEqual(aftermath.second["marker"], (what.killed, what.point, what.moment) in MARKER_STAYS)


def print_table() -> None:
    """A row for each interruption."""
    print(HEADER)
    for aftermath in interrupt_all(InterruptedStandIn, list(KILLS), list(POINTS), AT_ONCE):
        print(aftermath.row())


if __name__ == "__main__":
    BUILD = take_path()
    if sys.argv[1:] == ["--table"]:
        print_table()
    else:
        unittest.main()
