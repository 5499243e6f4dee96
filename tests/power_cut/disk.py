"""A disk that records its writes, and the disks that a power cut at any of them leaves. Needs root.

The disk is an ext4 file system in a file. While it is recorded, QEMU's storage daemon serves the file through FUSE and
logs every write in the format of the kernel's dm-log-writes (Documentation/admin-guide/device-mapper/log-writes.rst): a
superblock, then the entries, each in a sector of its own and followed by its data.
"""

import contextlib
import itertools
import random
import shutil
import struct
import subprocess
import tempfile
import time
from collections.abc import Callable, Iterator
from dataclasses import dataclass, replace
from pathlib import Path

from tests.mounts import separate_mounts

TOOLS = ["qemu-storage-daemon", "mkfs.ext4", "e2fsck", "losetup", "/dev/fuse", "/dev/loop-control"]
SECTOR = 512  # bytes
MAGIC, VERSION = 0x6A736677736872, 1
FLUSH, DISCARD = 1, 4
SUPERBLOCK_MIDDLE = 3  # sectors from the start of the disk: ext4's superblock begins at 1024 bytes
LOG_SIZE = 4 << 30  # bytes, sparse
LONGEST_WAIT = 20  # s, for the storage daemon and for an unmount


@dataclass(frozen=True)
class Write:
    """One write to the disk."""

    sector: int
    sectors: int
    data: int  # offset of the data in the log's file, bytes


@dataclass(frozen=True)
class Cut:
    """What a power cut leaves: the first `whole` writes, `some` of the later ones, `sectors` of the very next one."""

    kind: str  # "in order"; "reordered": the disk's cache wrote in another order; "torn": in the middle of a write
    whole: int
    some: tuple[int, ...] = ()
    sectors: int = 0


class Recording:
    """The disk `before`, the `writes` to it in their order, and how many of them were done at each of the `flushes`."""

    def __init__(self, before: Path, log: Path) -> None:
        self._before = before
        self._log = log
        self.writes: list[Write] = []
        self.flushes = [0]
        with log.open("rb") as file:
            magic, version, entries, size = struct.unpack("<QQQI", file.read(28))
            if (magic, version, size) != (MAGIC, VERSION, SECTOR):
                raise ValueError(f"{log}: not a log of writes in sectors of {SECTOR} bytes")
            offset = SECTOR
            for _ in range(entries):
                file.seek(offset)
                sector, sectors, flags = struct.unpack("<QQQ", file.read(24))
                offset += SECTOR
                if flags & FLUSH:
                    self.flushes.append(len(self.writes))
                if sectors and not flags & DISCARD:
                    self.writes.append(Write(sector, sectors, offset))
                    offset += sectors * SECTOR

    def cuts(self, subsets: int = 20, borders: int = 3, seed: int = 20) -> list[Cut]:
        """Every cut, once each: after each write, with the writes in another order, in the middle of a write.

        @param subsets  for each flush, this many random choices of the writes since the previous flush
        @param borders  for each write, this many of its sectors' borders; and the one in the superblock's 1 KiB
        """
        chance = random.Random(seed)
        found = [Cut("in order", number) for number in range(len(self.writes) + 1)]
        for first, end in itertools.pairwise(self.flushes):
            for _ in range(subsets):
                some = tuple(number for number in range(first, end) if chance.random() < 0.5)
                if some != tuple(range(first, first + len(some))):
                    found.append(Cut("reordered", first, some))
        for number, write in enumerate(self.writes):
            inner = range(1, write.sectors)
            chosen = chance.sample(inner, min(borders, len(inner))) + [SUPERBLOCK_MIDDLE] * (write.sector == 0)
            found += [Cut("torn", number, sectors=at) for at in chosen]
        return list(dict.fromkeys(found))

    def make_image(self, cut: Cut, image: Path) -> None:
        """Writes the disk after the cut into the file `image`."""
        copy(self._before, image)
        done = [self.writes[number] for number in (*range(cut.whole), *cut.some)]
        if cut.sectors:
            done.append(replace(self.writes[cut.whole], sectors=cut.sectors))
        with self._log.open("rb") as log, image.open("r+b") as disk:
            for write in done:
                log.seek(write.data)
                disk.seek(write.sector * SECTOR)
                disk.write(log.read(write.sectors * SECTOR))


def missing() -> str:
    """What this machine lacks to record a disk; "" when it lacks nothing."""
    return ", ".join(tool for tool in TOOLS if not (shutil.which(tool) or Path(tool).exists()))


@contextlib.contextmanager
def own_mounts() -> Iterator[Path]:
    """A folder in memory. Only this process sees its mounts, which end with it however it ends."""
    separate_mounts()
    with tempfile.TemporaryDirectory(prefix="power-cut-") as folder:
        run("mount", "-t", "tmpfs", "tmpfs", folder)
        try:
            yield Path(folder)
        finally:
            run("umount", "--lazy", folder)


def make_disk(image: Path, size: int) -> None:
    """Makes an empty ext4 file system of `size` MiB. No part of it is initialised later, which would be a write."""
    with image.open("wb") as file:
        file.truncate(size << 20)
    # The block size of a larger disk.
    run("mkfs.ext4", "-q", "-F", "-b", "4096", "-E", "lazy_itable_init=0,lazy_journal_init=0,nodiscard", image)


def copy(disk: Path, other: Path) -> None:
    """Copies a disk that is not in use."""
    run("cp", "--sparse=auto", disk, other)


@contextlib.contextmanager
def mounted(image: Path, where: Path) -> Iterator[None]:
    """The file system of the disk, mounted as a boot mounts it: its journal is replayed."""
    run("mount", "-o", "loop,nodiscard", image, where)
    try:
        yield
    finally:
        run("umount", where)


def file_system_errors(image: Path) -> str:
    """What e2fsck finds on the disk, which is not mounted; "" when it is clean."""
    done = subprocess.run(["e2fsck", "-f", "-n", image], capture_output=True, text=True, check=False)
    return done.stdout if done.returncode else ""


def repair_file_system(image: Path) -> str:
    """Repairs what a boot cannot. Returns how."""
    remedy = ["e2fsck", "-f", "-y"]
    status = subprocess.run([*remedy, image], capture_output=True, check=False).returncode
    if status != 1:  # e2fsck(8): errors corrected
        raise OSError(f"e2fsck: status {status}")
    return " ".join(remedy)


@contextlib.contextmanager
def recorded(image: Path, log: Path, disk: Path) -> Iterator[None]:
    """The disk `image` appears as the file `disk`; until the end of the block its writes also go to `log`.

    At the end of the block it waits until nothing mounts `disk` any more.
    """
    disk.touch()
    with log.open("wb") as file:
        file.truncate(LOG_SIZE)
    daemon = subprocess.Popen(
        ["qemu-storage-daemon"]
        + ["--blockdev", f"driver=file,node-name=image,filename={image}"]
        + ["--blockdev", f"driver=file,node-name=log,filename={log}"]
        + ["--blockdev", f"driver=blklogwrites,node-name=logged,file=image,log=log,log-sector-size={SECTOR}"]
        + ["--export", f"type=fuse,id=disk,node-name=logged,mountpoint={disk},writable=on"]
    )
    try:
        _wait("the disk is not there", lambda: daemon.poll() is not None or disk.stat().st_size > 0)
        yield
        wait_until_unmounted(disk)
    finally:
        daemon.terminate()
        daemon.wait()


def wait_until_unmounted(disk: Path) -> None:
    """The mounts of a machine disappear shortly after it."""
    _wait(f"{disk} is still mounted", lambda: not run("losetup", "--noheadings", "--associated", disk))


def run(*command: str | Path) -> bytes:
    """What a command prints. Raises subprocess.CalledProcessError when it fails."""
    return subprocess.run(command, check=True, capture_output=True).stdout


def _wait(problem: str, condition: Callable[[], bool]) -> None:
    end = time.monotonic() + LONGEST_WAIT
    while not condition():
        if time.monotonic() > end:
            raise OSError(problem)
        time.sleep(0.05)
