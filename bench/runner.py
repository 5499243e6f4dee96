"""Runs a scenario once, on the best unit that this machine can make, and cleans up."""

import contextlib
import os
import shutil
import subprocess
import sys
import tempfile
import time
from collections.abc import Callable, Iterator
from dataclasses import dataclass
from pathlib import Path

from bench.observation import Run, now
from bench.real import systemd
from bench.real.unit import RealUnit, forbidden
from bench.scenario import Scenario
from bench.standin.unit import StandInUnit
from bench.unit import State, Unit, UnitError

# best: real where this machine allows it. real: with systemd where this machine allows that.
KINDS = ["best", "real", "real-without-systemd", "stand-in"]
POLL = 0.02  # s
LONGEST_RUN = 120  # s, without the waits; a run that takes longer hangs
SPACE = 20  # MB, that a unit may take in its temporary folder
WAITS = 820  # s, of an update at full length
CLEANUP = Path(__file__).with_name("cleanup.py")


@dataclass
class Result:
    """How a run ended."""

    run: Run
    state: State
    status: int
    seconds: float
    log_is_exact: bool = True  # see Unit


@contextlib.contextmanager
def temporary_folder() -> Iterator[Path]:
    """A folder that is removed, and the updater ended, with this process, however it ends.

    Raises UnitError when it has no space for a unit.
    """
    place = tempfile.gettempdir()
    free = shutil.disk_usage(place).free // 1_000_000
    if free < SPACE:
        raise UnitError(f"{free} MB are free in {place}, a unit needs {SPACE}: make room there or name another TMPDIR")
    folder = tempfile.mkdtemp(prefix="bench-")
    try:
        guard = subprocess.Popen(
            [sys.executable, "-I", "-S", CLEANUP, folder],
            stdin=subprocess.PIPE,
            stderr=subprocess.DEVNULL,
            start_new_session=True,
        )
    except OSError:
        os.rmdir(folder)
        raise
    try:
        yield Path(folder)
    finally:
        assert guard.stdin
        guard.stdin.close()
        guard.wait()


class NotServed(UnitError):
    """The unit cannot serve a scenario that another kind of unit can."""


@dataclass
class UnitMaker:
    """Makes units of one of the KINDS."""

    kind: str
    speed: float
    build: Path  # folder of the programs

    def make(self, scenario: Scenario, folder: Path) -> Unit:
        """A unit for `scenario` in the empty `folder`. Raises UnitError; NotServed when another kind can serve it."""
        unit = self._make(scenario, folder)
        if scenario.only not in ("", unit.kind):
            raise NotServed(f"{scenario.name} needs the {scenario.only} unit")
        return unit

    def _make(self, scenario: Scenario, folder: Path) -> Unit:
        reason = forbidden() if self.kind != "stand-in" else ""
        if reason and self.kind.startswith("real"):
            raise UnitError(f"no real unit on this machine, it forbids namespaces: {reason}. Use --unit stand-in.")
        if not reason and self.kind != "stand-in":
            no_systemd = "as asked for" if self.kind == "real-without-systemd" else systemd.obstacle()
            return RealUnit(scenario, folder, self.speed, self.build, no_systemd)
        unit = StandInUnit(scenario, folder, self.speed, self.build)
        unit.name += f" (this machine forbids namespaces: {reason})" if reason else ""
        return unit


def run_on(unit: Unit, show: Callable[[Run, str], None], speed: float) -> Result:
    """Runs the updater on `unit`; `show` gets the observation so far and the new part of the log. Raises UnitError."""
    seen = Run(unit.files)
    begin = now()
    try:
        unit.start()
        while (status := unit.ended()) is None:
            show(seen, seen.update())
            if now() - begin > LONGEST_RUN + WAITS / speed:
                raise UnitError(f"the updater still runs after {now() - begin:.0f} s: ended")
            time.sleep(POLL)
        show(seen, seen.update())
        return Result(seen, unit.state(), status, now() - begin, unit.log_is_exact)
    finally:
        unit.close()
