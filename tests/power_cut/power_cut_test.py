"""Usage: power_cut_test.py BUILD_FOLDER [TEST...]

A sample of what tests/power_cut/run checks, and a fault that it must detect, on the built package in build/package/.
"""

import unittest

from bench.real.systemd import obstacle
from tests.command_line import skip, take_path
from tests.power_cut.cuts import Group, PowerCuts
from tests.power_cut.disk import missing, own_mounts
from tests.service.service_test import built_package

EVERY = 300  # images
JOBS = 2


class Sample(unittest.TestCase):
    """An update of the package, the board and the updater itself."""

    power_cuts: PowerCuts
    groups: list[Group]

    @classmethod
    def setUpClass(cls) -> None:
        cuts = cls.power_cuts.recording.cuts()[::EVERY]
        cls.groups = cls.power_cuts.groups(cuts, JOBS)

    def test_every_group_heals(self) -> None:
        for group in self.power_cuts.judged(self.groups, JOBS):
            with self.subTest(state=group.before.packages, cut=group.cut):
                self.assertEqual(group.faults, [])

    def test_service_without_its_repair_is_noticed(self) -> None:
        broken = [group for group in self.groups if "reinstreq" in group.before.packages]
        self.assertTrue(broken)
        [judged] = self.power_cuts.judged(broken[:1], JOBS, repairs=False)
        self.assertTrue(judged.faults)


def main() -> None:
    """Runs the tests of the program, as its usage says."""
    programs = take_path()
    package = built_package("harl-updater")
    if not package:
        skip("there is no package for this machine: packaging/build")
    if reason := obstacle():
        skip(f"this machine allows no machine of its own: {reason}")
    if tools := missing():
        skip(f"a disk cannot be recorded without {tools}")
    with own_mounts() as folder:
        Sample.power_cuts = PowerCuts(folder, package, programs, upgrades_itself=True)
        unittest.main(verbosity=2)


if __name__ == "__main__":
    main()
