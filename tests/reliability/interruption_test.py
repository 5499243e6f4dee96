"""Ends the updater, or the whole unit, at each command of an update in turn, on stand-in units: right before the
command takes effect and right after."""

from functools import partial
from pathlib import Path

import pytest

from bench.scenario import Scenario
from tests.reliability.disturbed import DisturbedUnit
from tests.reliability.interruption import POINTS, Aftermath, Interruption, interrupt_all, interruptions

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

    def __init__(self, build: Path, what: Scenario, folder: Path, interruption: Interruption | None) -> None:
        super().__init__(what, folder, build)
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


CASES = interruptions(KILLS, POINTS)


@pytest.fixture(scope="module")
def aftermaths(build: Path) -> dict[Interruption, Aftermath]:
    all_of_them = interrupt_all(partial(InterruptedStandIn, build), CASES, AT_ONCE)
    return {aftermath.interruption: aftermath for aftermath in all_of_them}


@pytest.fixture(params=CASES, ids=lambda case: f"{case.killed}-{case.moment}-{case.point}")
def aftermath(aftermaths: dict[Interruption, Aftermath], request: pytest.FixtureRequest) -> Aftermath:
    return aftermaths[request.param]


def test_every_command_is_interrupted() -> None:
    assert len(CASES) == len(KILLS) * len(POINTS) * 2
    assert len(POINTS) == 12


def test_next_run_ends_as_a_first_run_on_that_state(aftermath: Aftermath) -> None:
    assert aftermath.differences() == []


def test_next_run_gives_the_instrument_back(aftermath: Aftermath) -> None:
    assert aftermath.second["harl"] == "active"
    assert not aftermath.second["stick"]


def test_package_and_board_are_up_to_date_after_the_next_run(aftermath: Aftermath) -> None:
    assert aftermath.second["package"] == "1.3.0"
    assert aftermath.second["board"] == "2.2.0"


def test_marker_stays_only_where_both_were_installed_before_the_interruption(aftermath: Aftermath) -> None:
    what = aftermath.interruption
    assert aftermath.second["marker"] == ((what.killed, what.point, what.moment) in MARKER_STAYS)
