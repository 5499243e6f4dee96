"""The emulated machine: boots a disk with a run's inputs, within a bounded time, and returns the run's results."""

import os
import shutil
import signal
import subprocess
import tarfile
import threading
import time
from pathlib import Path

BOOT_LIMIT = 900  # s, until the guest's own program runs; a minute on an idle machine
POLL = 0.2  # s
OUTPUT_SIZE = 128 << 20  # bytes, for the results of one boot
CUT = "target: power-cut"  # the line on the guest's console when the machine loses its power


stopping = threading.Event()


def stop_machines() -> None:
    """Ends all running machines and starts no more: for a program that ends early."""
    stopping.set()


class MachineError(Exception):
    """The boot failed; the text is one line that says where to look."""


def drive(name: str, file: Path, *options: str) -> list[str]:
    """The options for a virtio disk that the guest finds by `name`."""
    settings = ["if=none", f"id={name}", "format=raw", f"file={file}", *options]
    return ["-drive", ",".join(settings), "-device", f"virtio-blk-device,drive={name},serial={name}"]


def copy_disk(disk: Path, copy: Path) -> None:
    """Copies a disk image; holes take no space."""
    subprocess.run(["cp", "--sparse=always", disk, copy], check=True)


def boot(
    image: Path,
    disk: Path,
    inputs: Path,
    folder: Path,
    limit: float,
    keep: bool = False,
    cut: bool = False,
    copies: list[Path] | None = None,
) -> None:
    """Boots `disk` and waits for the end; `folder` then holds the guest's results, `console` and `bus`, the I2C trace.

    @param image   folder with the kernel, the device tree and the initrd
    @param disk    the root file system; written to only when `keep`
    @param inputs  the disk with the scenarios
    @param limit   how long the scenarios may take (s)
    @param cut     stop the machine hard when the guest asks for it; then the guest leaves no results
    @param copies  instead: where a copy of the disk goes each time that the guest asks for it
    Raises MachineError.
    """
    shutil.rmtree(folder, ignore_errors=True)
    folder.mkdir(parents=True)
    console, output = folder / "console", folder / "output.tar"
    console.touch()
    with output.open("wb") as file:
        file.truncate(OUTPUT_SIZE)
    command = ["setpriv", "--pdeathsig", "KILL", "nice", "qemu-system-arm"]  # it never outlives this process
    command += ["-M", "vexpress-a15", "-m", "1024", "-no-reboot", "-display", "none", "-monitor", "none"]
    command += ["-kernel", str(image / "vmlinuz"), "-initrd", str(image / "initrd"), "-dtb", str(image / "board.dtb")]
    # The guest's clock counts instructions (2 ns each): a busy host lengthens the run but delays no tool of the guest.
    command += ["-icount", "shift=1"]
    command += ["-append", "rw console=ttyAMA0 quiet", "-serial", f"file:{console}", "-audiodev", "none,id=none"]
    # The panel's controller: a chip that acknowledges at its address. Every byte on the bus goes into the trace.
    command += ["-device", "tmp105,bus=i2c,address=0x07", "-trace", "i2c_*", "-D", str(folder / "bus")]
    command += drive("root", disk, "cache=writeback" if keep else "snapshot=on")
    command += drive("in", inputs, "readonly=on") + drive("out", output, "cache=unsafe")
    with (folder / "errors").open("wb") as errors:
        machine = subprocess.Popen(command, stdin=subprocess.DEVNULL, stdout=errors, stderr=errors)
    try:
        cuts = follow(machine, console, limit, disk, copies or [])
    finally:
        machine.kill()
        machine.wait()
    expected = len(copies or []) + cut
    if cuts != expected:
        raise MachineError(f"the guest asked for {cuts} power cuts, not for {expected}: see {console}")
    if cut:
        return
    if machine.returncode != 0:
        raise MachineError(f"qemu-system-arm ended with {machine.returncode}: see {folder / 'errors'}")
    try:
        with tarfile.open(output) as archive:
            archive.extractall(folder, filter="data")  # type: ignore[call-arg]  # since Python 3.11.4
        status = (folder / "status").read_text().strip()
    except (tarfile.TarError, FileNotFoundError) as error:
        raise MachineError(f"the guest left no results: see {console}") from error
    output.unlink()
    if status != "0":
        raise MachineError(f"the guest's program failed: see {folder / 'guest.log'}")


def follow(machine: subprocess.Popen[bytes], console: Path, limit: float, disk: Path, copies: list[Path]) -> int:
    """Shows the guest's progress until it ends, or until it asks for a power cut and `copies` has no more entries.

    A copy has what a hard stop at that moment would leave on `disk`: the machine is held meanwhile.
    Returns how often the guest asked for a power cut. Raises MachineError.
    """
    begin = time.monotonic()
    shown = cuts = 0
    while machine.poll() is None:
        if stopping.is_set():
            raise MachineError("stopped")
        lines = [line for line in console.read_text(errors="replace").splitlines() if line.startswith("target: ")]
        for line in lines[shown:]:
            print(f"{console.parent.name:16} {time.monotonic() - begin:6.0f} s  {line[8:]}", flush=True)
        shown = len(lines)
        while cuts < lines.count(CUT):
            if cuts == len(copies):
                return cuts + 1
            os.kill(machine.pid, signal.SIGSTOP)
            copy_disk(disk, copies[cuts])
            os.kill(machine.pid, signal.SIGCONT)
            cuts += 1
        passed = time.monotonic() - begin
        if not lines and passed > BOOT_LIMIT:
            raise MachineError(f"the machine did not come up within {BOOT_LIMIT} s: see {console}")
        if passed > BOOT_LIMIT + limit:
            raise MachineError(f"the scenarios did not end within {BOOT_LIMIT + limit:.0f} s: see {console}")
        time.sleep(POLL)
    return cuts
