"""Runs each scenario on each kind of unit and compares the result with what its file expects."""

from pathlib import Path

import pytest

from bench import scenario
from bench.compare import differences
from bench.real.systemd import obstacle
from bench.real.unit import forbidden
from bench.runner import NotServed, UnitMaker, run_on, temporary_folder

SPEED = 2000  # times shorter waits, each 0.2 s at least


@pytest.mark.parametrize("kind", ["real-without-systemd", "real", "stand-in"])
@pytest.mark.parametrize("name", scenario.names())
def test_comes_out_as_the_scenario_says(name: str, kind: str, build: Path) -> None:
    if kind != "stand-in" and (reason := forbidden()):
        pytest.skip(f"this machine forbids namespaces: {reason}")
    if kind == "real" and (reason := obstacle()):
        pytest.skip(f"no systemd in the unit: {reason}")
    what = scenario.load(name)
    with temporary_folder() as folder:
        try:
            unit = UnitMaker(kind, SPEED, build).make(what, folder)
        except NotServed as error:
            pytest.skip(str(error))
        result = run_on(unit, lambda run, log: None, SPEED)
    assert differences(what, result) == [], result.run.log
