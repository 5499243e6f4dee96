"""A sample of what tests/power_cut/run checks, and a fault that it must detect, on the built package."""

from collections.abc import Iterator
from pathlib import Path

import pytest

from bench.real.systemd import obstacle
from tests.power_cut.cuts import Group, PowerCuts
from tests.power_cut.disk import missing, own_mounts
from tests.service.service import built_package

EVERY = 300  # images
JOBS = 2


@pytest.fixture(scope="module")
def power_cuts(build: Path) -> Iterator[PowerCuts]:
    """An update of the package, the board and the updater itself."""
    package = built_package("harl-updater")
    if not package:
        pytest.skip("there is no package for this machine: packaging/build")
    if reason := obstacle():
        pytest.skip(f"this machine allows no machine of its own: {reason}")
    if tools := missing():
        pytest.skip(f"a disk cannot be recorded without {tools}")
    with own_mounts() as folder:
        yield PowerCuts(folder, package, build, upgrades_itself=True)


@pytest.fixture(scope="module")
def groups(power_cuts: PowerCuts) -> list[Group]:
    return power_cuts.groups(power_cuts.recording.cuts()[::EVERY], JOBS)


def test_every_group_heals(power_cuts: PowerCuts, groups: list[Group]) -> None:
    judged = power_cuts.judged(groups, JOBS)
    assert [(group.before.packages, group.cut, group.faults) for group in judged if group.faults] == []


def test_service_without_its_repair_is_noticed(power_cuts: PowerCuts) -> None:
    some = power_cuts.recording.cuts()[:: EVERY // 10]
    images = (group for cut in some for group in power_cuts.groups([cut], 1))
    broken = next((image for image in images if "reinstreq" in image.before.packages), None)
    assert broken
    [judged] = power_cuts.judged([broken], 1, repairs=False)
    assert judged.faults
