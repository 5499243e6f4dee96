"""Usage: scenario_test.py SCENARIO UNIT BUILD_FOLDER

Runs the scenario on a unit of the kind UNIT and compares what comes out with what its file says.
"""

import sys
from pathlib import Path

from bench import scenario
from bench.compare import differences
from bench.real.systemd import obstacle
from bench.real.unit import forbidden
from bench.runner import NotServed, UnitMaker, run_on, temporary_folder

SPEED = 2000  # times shorter waits, each 0.2 s at least
SKIPPED = 77

name, kind, build = sys.argv[1:]
if kind != "stand-in" and (reason := forbidden()):
    print(f"skipped: this machine forbids namespaces: {reason}")
    sys.exit(SKIPPED)
if kind == "real" and (reason := obstacle()):
    print(f"skipped: no systemd in the unit: {reason}")
    sys.exit(SKIPPED)
what = scenario.load(name)
maker = UnitMaker(kind, SPEED, Path(build))
with temporary_folder() as folder:
    try:
        unit = maker.make(what, folder)
    except NotServed as error:
        print(f"skipped: {error}")
        sys.exit(SKIPPED)
    result = run_on(unit, lambda run, log: None, SPEED)
wrong = differences(what, result)
print("\n".join([*wrong, result.run.log]) if wrong else "as the scenario says")
sys.exit(1 if wrong else 0)
