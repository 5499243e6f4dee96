"""One update whose disk loses its power at every write: a recording, the groups of its disks, and their next runs."""

import itertools
import subprocess
import tempfile
from collections.abc import Iterator
from concurrent.futures import ProcessPoolExecutor
from dataclasses import dataclass, field, replace
from pathlib import Path

from bench.machine.machine import MachineError, machine
from bench.outcomes import CHECK_FAILED, INSTALLATION_FAILED, UP_TO_DATE, UPDATED
from tests.power_cut.disk import (
    Cut,
    Recording,
    copy,
    file_system_errors,
    make_disk,
    mounted,
    recorded,
    repair_file_system,
    wait_until_unmounted,
)
from tests.power_cut.unit import (
    MARKER,
    NEWER_BOARD,
    OLDER_BOARD,
    PACKAGE,
    SITUATIONS,
    UPDATER,
    WITH_ALL,
    Situation,
    State,
    Unit,
    make_repository,
)
from tests.power_cut.view import digest, package_states

SYSTEM = Path("/")
DISK_SIZE = 256  # MiB, sparse; ext4 keeps a copy of its superblock from 128 on


@dataclass
class Group:
    """Disks that the unit cannot distinguish."""

    cut: Cut  # one of them
    before: State
    remedy: str = ""  # of its file system, by hand
    images: int = 0
    shown: dict[str, str] = field(default_factory=dict)  # the outcome of the next run, by situation
    faults: list[str] = field(default_factory=list)


class PowerCuts:
    """One update, on the package under test in the file `package`; `programs` is the build folder.

    `folder` takes several hundred MiB.
    """

    def __init__(self, folder: Path, package: Path, programs: Path, upgrades_itself: bool) -> None:
        self._folder = folder
        self._package = package
        self._programs = programs
        self._repository = folder / "repository"
        self._newest = ""  # state of the packages after an update
        make_repository(package if upgrades_itself else None, self._repository)
        self.recording = self._record()

    def groups(self, cuts: list[Cut], jobs: int) -> list[Group]:
        """Boots the disk of every cut, `jobs` at a time, and groups equal ones."""
        found: dict[str, Group] = {}
        with ProcessPoolExecutor(jobs) as pool:
            for seen, image in pool.map(self._look, cuts, chunksize=8):
                group = found.setdefault(seen, replace(image, faults=[]))
                group.images += 1
                group.faults += image.faults
        return list(found.values())

    def judged(self, groups: list[Group], jobs: int, repairs: bool = True) -> list[Group]:
        """The groups after their next runs, `jobs` at a time.

        @param repairs  false: a service that leaves broken installations alone, which is a fault to detect
        """
        with ProcessPoolExecutor(jobs) as pool:
            return list(pool.map(self._judge, groups, itertools.repeat(repairs)))

    def _record(self) -> Recording:
        """Raises AssertionError when the update fails, or the log does not reproduce the disk."""
        disk, before, writes, seen = (self._folder / name for name in ("disk.img", "before.img", "writes", "disk"))
        make_disk(disk, DISK_SIZE)
        with machine(SYSTEM, disk) as made:
            Unit(made, self._repository).install(self._package, self._programs)
        wait_until_unmounted(disk)
        copy(disk, before)
        with recorded(disk, writes, seen), machine(SYSTEM, seen) as made:
            unit = Unit(made, self._repository)
            unit.start(OLDER_BOARD, WITH_ALL)
            unit.run_service(WITH_ALL)
            after = unit.state()
        assert after.shown == UPDATED.meaning and not after.database and not after.withheld, after
        self._newest = after.packages
        recording = Recording(before, writes)
        image = self._folder / "replayed.img"
        recording.make_image(Cut("in order", len(recording.writes)), image)
        assert subprocess.run(["cmp", image, disk], check=False).returncode == 0, "the log does not give the disk again"
        image.unlink()
        return recording

    def _look(self, cut: Cut) -> tuple[str, Group]:
        """What the unit sees after the cut, as one word, and a group with only this image."""
        with tempfile.TemporaryDirectory(dir=self._folder) as name:
            image, where = Path(name) / "image", Path(name) / "mount"
            where.mkdir()
            self.recording.make_image(cut, image)
            remedy = ""
            try:
                seen, before = _mount_and_look(image, where)
            except subprocess.CalledProcessError:
                remedy = repair_file_system(image)
                seen, before = _mount_and_look(image, where)
            errors = file_system_errors(image)
        word = f"{remedy} {before.packages} {seen}"
        return word, Group(cut, before, remedy, faults=[f"{cut}: {errors}"] if errors else [])

    def _judge(self, group: Group, repairs: bool) -> Group:
        with tempfile.TemporaryDirectory(dir=self._folder) as name:
            image, disk = Path(name) / "image", Path(name) / "disk"
            self.recording.make_image(group.cut, image)
            if group.remedy:
                repair_file_system(image)
            for situation in SITUATIONS:
                copy(image, disk)
                try:
                    with machine(SYSTEM, disk) as made:
                        found = list(self._run(Unit(made, self._repository, repairs), group, situation))
                except (AssertionError, MachineError, OSError, subprocess.SubprocessError) as error:
                    found = [str(error)]
                wait_until_unmounted(disk)
                group.faults += [f"{situation.name}: {fault}" for fault in found]
        return group

    def _run(self, unit: Unit, group: Group, situation: Situation) -> Iterator[str]:
        """Goes through the runs of a situation; returns what is wrong after them."""
        before = group.before
        unit.start(before.board, situation)
        unit.run_service(situation)
        after = unit.state()
        group.shown[situation.name] = after.shown
        yield from self._faults(situation, before, after)
        if situation == WITH_ALL:
            unit.run_service(situation)
            again = unit.state()
            if again != replace(after, shown=UP_TO_DATE.meaning):
                yield f"the run after it finds something to do: {again}"

    def _faults(self, situation: Situation, before: State, after: State) -> Iterator[str]:
        """What is wrong after a run."""
        if after.withheld:
            yield f"not given back: {after.withheld}"
        is_new = after.packages == self._newest and not after.database
        has_new_board = after.board == NEWER_BOARD or not situation.stick
        is_changed = (before.packages, before.board) != (after.packages, after.board)
        wrong = {
            UPDATED.meaning: not (is_new and has_new_board and is_changed),
            UP_TO_DATE.meaning: not (is_new and has_new_board and before.board == after.board),
            CHECK_FAILED.meaning: situation == WITH_ALL,
            INSTALLATION_FAILED.meaning: situation == WITH_ALL or is_new and has_new_board,
        }
        if wrong.get(after.shown, True):
            yield f"shows {after.shown!r} over {after}"
        if situation == WITH_ALL and after.marker:
            yield "the marker stays"


def _mount_and_look(image: Path, where: Path) -> tuple[str, State]:
    """What the unit sees on the disk, as one word, and its state. The board is new once the marker has gone."""
    with mounted(image, where):
        root = where / "root"
        has_marker = (root / MARKER).exists()
        packages = package_states(root, [UPDATER, PACKAGE])
        return digest(where), State(packages, OLDER_BOARD if has_marker else NEWER_BOARD, has_marker)
