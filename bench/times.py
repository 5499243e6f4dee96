"""bench/times: prints what a run on the bench unit spends its time on, from the command to the clean-up.

Each figure is the median of the runs. The goals are for an idle machine with 2 cores.
"""

import argparse
import os
import statistics
import subprocess
import sys
import time

from bench import scenario
from bench.build import BUILD, build
from bench.command import status_of
from bench.compare import differences
from bench.runner import UnitMaker, run_on, temporary_folder
from bench.unit import UnitError

SPEED = 300
GOALS = {"up-to-date": 3.0, "package-and-board": 8.0}  # s


class Stopwatch:
    """Time by purpose, in the order in which the purposes come."""

    def __init__(self) -> None:
        self.spent: dict[str, float] = {}
        self._last = time.time()

    def lap(self, purpose: str, until: float | None = None) -> None:
        """The time since the last lap, up to `until` or now (s since the epoch), was for `purpose`."""
        moment = until or time.time()
        self.spent[purpose] = moment - self._last
        self._last = moment


def measure(name: str) -> tuple[str, dict[str, float]]:
    """One run of the scenario `name`: the unit it ran on, and the time for each purpose (s). Raises UnitError."""
    what = scenario.load(name)
    watch = Stopwatch()
    interpreter = [sys.executable, "-B", "-c", "import argparse, statistics, subprocess, tomllib, zipfile"]
    subprocess.run(["scripts/install-packages", "python3"], cwd=BUILD.parents[1], stdout=sys.stderr, check=True)
    subprocess.run(interpreter, check=True)
    watch.lap("start of the command")
    build()
    watch.lap("packages and build checked")
    with temporary_folder() as folder:
        unit = UnitMaker("best", SPEED, BUILD).make(what, folder)
        watch.lap("kind of unit chosen")
        result = run_on(unit, lambda *_: None, SPEED)
        run = result.run
        marks = {"variables": "files of the unit", "out/started": "namespaces, board, package, stick"}
        for file, purpose in marks.items():
            if (folder / file).exists():
                watch.lap(purpose, (folder / file).stat().st_mtime)
        since_boot = time.time() - time.clock_gettime(time.CLOCK_BOOTTIME)
        begin, end = run.calls[0].start, max(call.end or call.start for call in run.calls)
        watch.lap("start of the updater as a service", begin + since_boot)
        own = {
            "the updater's commands": [call for call in run.commands() if call.end is not None],
            "its waits": run.waits(),
            "its sound": [call for call in run.calls if call.text.startswith("aplay ")],
        }
        watch.lap("updater", end + since_boot)
        whole = watch.spent.pop("updater")
        for purpose, calls in own.items():
            watch.spent[purpose] = sum((call.end or call.start) - call.start for call in calls)
            whole -= watch.spent[purpose]
        watch.spent["its panel, and its own work"] = whole
    watch.lap("end of the service, unit cleared away")
    if wrong := differences(what, result):
        raise UnitError(f"{name}: {wrong[0]}")
    return unit.name, watch.spent


def print_times(name: str, runs: int) -> None:
    """Runs the scenario `name` and prints its table."""
    measured = [measure(name) for _ in range(runs)]
    totals = [sum(spent.values()) for _, spent in measured]
    goal = f", goal {GOALS[name]:.0f} s" if name in GOALS else ""
    print(f"\n{name}, {runs} runs, {measured[0][0]}")
    for purpose in measured[0][1]:
        print(f"  {statistics.median(spent[purpose] for _, spent in measured):6.2f} s  {purpose}")
    span = f"fastest {min(totals):.2f} s, slowest {max(totals):.2f} s"
    print(f"  {statistics.median(totals):6.2f} s  in all ({span}){goal}")


def main() -> int:
    """The command."""
    parser = argparse.ArgumentParser(prog="bench/times", description=__doc__)
    parser.add_argument("scenario", nargs="*", default=list(GOALS), help=f"default: {' '.join(GOALS)}")
    parser.add_argument("--runs", type=int, default=5, metavar="N", help="of each scenario (default: %(default)s)")
    given = parser.parse_args()
    if given.runs < 1:
        parser.error("--runs: must be 1 or more")
    return status_of(lambda: measure_all(given.scenario, given.runs))


def measure_all(names: list[str], runs: int) -> int:
    """Prints the table of each of the scenarios. Returns the status."""
    for name in names:
        scenario.load(name)
    build()
    load = os.getloadavg()[0]
    print(f"{os.cpu_count()} cores, load {load:.1f}; the updater's waits are {SPEED} times shorter")
    for name in names:
        print_times(name, runs)
    return 0


sys.exit(main())
