"""What the checks say before and after the update of each scenario is what make_golden_checks.py has kept."""

from pathlib import Path

import pytest

from bench import scenario
from tests.companion.make_golden_checks import KINDS, golden


@pytest.mark.parametrize("name", scenario.names())
@pytest.mark.parametrize("kind", KINDS)
def test_said_as_kept(pytestconfig: pytest.Config, build: Path, kind: str, name: str) -> None:
    emulator: list[str] = pytestconfig.getoption("emulator")
    said = KINDS[kind](emulator, build, scenario.load(name))
    assert said == golden(kind).get(name, ""), f"if it is meant: tests/companion/make-golden-checks {name}"
