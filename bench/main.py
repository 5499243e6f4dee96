"""bench/run: runs one update of the real updater on a unit that a scenario describes, with its log and its panel."""

import argparse
import os
import signal
import subprocess
import sys
from pathlib import Path

import scenario
from compare import differences
from display import PlainDisplay, print_outcome
from session import make_unit, run_on, temporary_folder
from unit import UnitError

ROOT = Path(__file__).parent.parent


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


def run(what: scenario.Scenario, speed: float) -> int:
    """Runs the scenario `what` and shows it. Returns the status of the command."""
    with temporary_folder() as folder:
        unit = make_unit(what, folder, speed)
        print(f"{what.name}: {what.summary}\nUnit: {unit.name}\n", flush=True)
        result = run_on(unit, PlainDisplay().show, speed)
    print_outcome(what, result)
    wrong = differences(what, result)
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
