"""Usage: scenario_test.py SCENARIO BUILD_FOLDER

Runs the scenario on the unit of real tools and compares what comes out with what its file says.
"""

import sys
from pathlib import Path

sys.path.insert(0, str(Path(__file__).parents[2] / "bench"))

import scenario
from compare import differences
from session import run_on, temporary_folder
from unit_real import RealUnit, forbidden

SPEED = 2000  # times shorter waits, each 0.2 s at least
SKIPPED = 77

if reason := forbidden():
    print(f"skipped: this machine forbids namespaces: {reason}")
    sys.exit(SKIPPED)
what = scenario.load(sys.argv[1])
with temporary_folder() as folder:
    result = run_on(RealUnit(what, folder, SPEED, Path(sys.argv[2])), lambda run, log: None, SPEED)
wrong = differences(what, result)
print("\n".join([*wrong, result.run.log]) if wrong else "as the scenario says")
sys.exit(1 if wrong else 0)
