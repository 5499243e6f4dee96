"""tests/power_cut/run: cuts the power at every write of an update to the unit's disk, then starts the next run on it.

The service updates the package and the board, and in a second recording itself as well, on a machine with real systemd,
apt and dpkg whose disk records its writes. Every disk that a power cut could leave is mounted and checked. Disks that
the unit cannot distinguish form a group, and one of each group goes through the next runs of the service: with network
and stick, without network, without stick. Ends with 1 if one of them is not as expected.
"""

import argparse
import os
import sys
import time
from collections import Counter, defaultdict

from bench.build import BUILD
from bench.real.systemd import obstacle
from tests.power_cut.cuts import Group, PowerCuts
from tests.power_cut.disk import missing, own_mounts
from tests.power_cut.unit import SITUATIONS
from tests.service.service import built_package

JOBS = 2 * (os.cpu_count() or 1)  # a run waits for about half of its time
UPDATES = {False: "the package and the board", True: "the package, the board and the updater itself"}


def print_groups(groups: list[Group]) -> None:
    """The states that the cuts left, and their results."""
    states: dict[str, list[Group]] = defaultdict(list)
    for group in groups:
        states[group.before.packages + (f", {group.remedy}" if group.remedy else "")].append(group)
    print(" images groups  state after the cut, and what the next run shows (groups)")
    for state, these in sorted(states.items(), key=lambda item: -sum(group.images for group in item[1])):
        print(f"{sum(group.images for group in these):7} {len(these):6}  {state}")
        for situation in SITUATIONS:
            shown = Counter(group.shown.get(situation.name, "no end") for group in these)
            print(f"{'':16}{situation.name}: " + ", ".join(f"{what} ({count})" for what, count in shown.items()))
    for group in groups:
        for fault in group.faults:
            print(f"WRONG: {group.before.packages}, {group.cut}, {group.images} images: {fault}")


def number(text: str) -> int:
    """A number of the command line, 1 or more."""
    if not text.isdecimal() or int(text) < 1:
        raise argparse.ArgumentTypeError(f"{text}: give a number, 1 or more")
    return int(text)


def judged(cuts: PowerCuts, every: int, jobs: int, repairs: bool) -> list[Group]:
    """The groups of an update after their next runs."""
    print(f"{len(cuts.recording.writes)} writes, {len(cuts.recording.flushes) - 1} flushes", flush=True)
    begin = time.monotonic()
    these = cuts.recording.cuts()[::every]
    groups = cuts.groups(these, jobs)
    kinds = ", ".join(f"{count} {kind}" for kind, count in Counter(cut.kind for cut in these).items())
    print(f"{len(these)} images ({kinds}) in {len(groups)} groups, {time.monotonic() - begin:.0f} s", flush=True)
    return cuts.judged(groups, jobs, repairs)


def main() -> int:
    """The command."""
    parser = argparse.ArgumentParser(prog="tests/power_cut/run", description=__doc__)
    parser.add_argument("--every", type=number, default=1, metavar="N", help="take each Nth image only")
    parser.add_argument("--jobs", type=number, default=JOBS, metavar="N", help=f"at a time; default: {JOBS}")
    parser.add_argument("--without-repair", action="store_true", help="the service leaves broken installations alone")
    given = parser.parse_args()
    if reason := obstacle() or missing():
        sys.exit(f"tests/power_cut/run: a machine with a recorded disk cannot be made here: {reason}")
    package = built_package("harl-updater")
    if not package:
        sys.exit("tests/power_cut/run: there is no package for this machine: run packaging/build")
    begin = time.monotonic()
    found: list[Group] = []
    with own_mounts() as folder:
        for upgrades_itself, what in UPDATES.items():
            own = folder / str(upgrades_itself)
            own.mkdir()
            print(f"An update of {what}", end=": ", flush=True)
            cuts = PowerCuts(own, package, BUILD, upgrades_itself)
            groups = judged(cuts, given.every, given.jobs, not given.without_repair)
            print_groups(groups)
            found += groups
    wrong = sum(1 for group in found if group.faults)
    images = sum(group.images for group in found)
    print(f"{images} images in {len(found)} groups, {wrong} groups wrong, {time.monotonic() - begin:.0f} s")
    return 1 if wrong else 0


if __name__ == "__main__":
    sys.exit(main())
