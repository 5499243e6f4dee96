"""Usage: scenario_test.py SCENARIO UNIT BUILD_FOLDER

Runs the scenario on a unit of the kind UNIT and compares the result with what its file expects.
"""

import sys

from bench import scenario
from bench.compare import differences
from bench.real.systemd import obstacle
from bench.real.unit import forbidden
from bench.runner import NotServed, UnitMaker, run_on, temporary_folder
from tests.command_line import skip, take_path, take_word

SPEED = 2000  # times shorter waits, each 0.2 s at least

name, kind, build = take_word(), take_word(), take_path()
if kind != "stand-in" and (reason := forbidden()):
    skip(f"this machine forbids namespaces: {reason}")
if kind == "real" and (reason := obstacle()):
    skip(f"no systemd in the unit: {reason}")
what = scenario.load(name)
maker = UnitMaker(kind, SPEED, build)
with temporary_folder() as folder:
    try:
        unit = maker.make(what, folder)
    except NotServed as error:
        skip(str(error))
    result = run_on(unit, lambda run, log: None, SPEED)
wrong = differences(what, result)
print("\n".join([*wrong, result.run.log]) if wrong else "as expected")
sys.exit(1 if wrong else 0)
