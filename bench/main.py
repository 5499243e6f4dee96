"""bench/run: runs one update of the real updater on a unit that a scenario describes, with its log and its panel."""

import argparse
import contextlib
import os
import signal
import subprocess
import sys
import tempfile
import time
from collections.abc import Iterator
from pathlib import Path

import scenario
from compare import differences
from display import PlainDisplay, print_outcome
from observe import Run, now
from unit import Unit, UnitError
from unit_standin import StandInUnit

ROOT = Path(__file__).parent.parent
POLL = 0.02  # s
LONGEST_RUN = 120  # s, of shortened waits; a run that takes longer hangs


def build() -> None:
    """Brings the updater and the recorder up to date. Says nothing unless something fails."""
    packages = ["cmake", "ninja-build", "g++-11", "libgtest-dev", "libgmock-dev"]
    for command in (
        ["scripts/install-packages", *packages],
        ["cmake", "--preset", "default"],
        ["cmake", "--build", "--preset", "default", "--target", "harl-updater", "tap"],
    ):
        done = subprocess.run(command, cwd=ROOT, stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, check=False)
        if done.returncode != 0:
            sys.exit(f"{done.stdout}bench: {' '.join(command)} failed with status {done.returncode}")


@contextlib.contextmanager
def temporary_folder() -> Iterator[Path]:
    """A folder that goes with this process, even when it is killed."""
    folder = tempfile.mkdtemp(prefix="bench-")
    # The guard reads until this process ends in whatever way, then clears away what still runs and lies there.
    guard = subprocess.Popen(
        ["/bin/sh", "-c", 'read -r _; read -r pid <"$0/updater.pid" && kill -s KILL -- "-$pid"; rm -rf "$0"', folder],
        stdin=subprocess.PIPE,
        stderr=subprocess.DEVNULL,
        start_new_session=True,
    )
    try:
        yield Path(folder)
    finally:
        assert guard.stdin
        guard.stdin.close()
        guard.wait()


def make_unit(what: scenario.Scenario, folder: Path, speed: float) -> Unit:
    """The best unit that this machine can make."""
    return StandInUnit(what, folder, speed)


def run(what: scenario.Scenario, speed: float) -> int:
    """Runs the scenario `what` and shows it. Returns the status of the command."""
    longest = LONGEST_RUN if speed > 1 else LONGEST_RUN + 900
    with temporary_folder() as folder:
        unit = make_unit(what, folder, speed)
        display = PlainDisplay()
        seen = Run(unit.files)
        begin = now()
        try:
            print(f"{what.name}: {what.summary}\nUnit: {unit.name}\n", flush=True)
            unit.start()
            while (status := unit.ended()) is None:
                display.show(seen, seen.update())
                if now() - begin > longest:
                    print(f"bench: the updater still runs after {longest} s", file=sys.stderr)
                    return 1
                time.sleep(POLL)
            display.show(seen, seen.update())
            state = unit.state()
        finally:
            unit.close()
        print_outcome(what, seen, state, status, now() - begin)
        wrong = differences(what, seen, state, status)
        for line in wrong:
            print(f"DIFFERENCE: {line}")
        return 1 if wrong else 0


def main() -> int:
    """The command."""
    parser = argparse.ArgumentParser(prog="bench/run", description=__doc__, formatter_class=argparse.RawTextHelpFormatter)
    parser.add_argument("scenario", nargs="?", default="package-and-board", help="default: %(default)s")
    parser.add_argument("--list", action="store_true", help="show all scenarios")
    parser.add_argument("--full-length", action="store_true", help="keep every wait: up to 14 minutes")
    parser.add_argument("--speed", type=float, default=300, help="shorten the waits N times (default: %(default)s)", metavar="N")
    arguments = parser.parse_args()
    if arguments.speed < 1:
        parser.error("--speed: must be 1 or more")
    signal.signal(signal.SIGTERM, lambda *_: sys.exit(143))
    try:
        if arguments.list:
            for name in scenario.names():
                print(f"{name:32}  {scenario.load(name).summary}")
            return 0
        what = scenario.load(arguments.scenario)
        build()
        return run(what, 1 if arguments.full_length else arguments.speed)
    except (scenario.ScenarioError, UnitError) as error:
        print(f"bench: {error}", file=sys.stderr)
        return 1
    except KeyboardInterrupt:
        return 130
    except BrokenPipeError:
        os.dup2(os.open(os.devnull, os.O_WRONLY), sys.stdout.fileno())
        return 1


sys.exit(main())
