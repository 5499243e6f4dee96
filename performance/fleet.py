"""Usage: performance/fleet [UNITS...]

Makes the exports of fleets of UNITS (100, 1000 and 10000), three runs of each unit in the mixture of
bench/makers/exports.py, and measures `harl-updater-tool fleet --html`: with a file for each unit, with one file of all,
with the journal that systemd-journal-remote makes of that, as the server of docs/fleet.md keeps it, and with 200
journals of a unit each.

The times are the best of three, from the page cache. A further run reads from the disk, as root in a control group of
GOAL's memory, which counts the page cache too: its time, and the most memory that the tool and journalctl had of their
own and in mapped files, which the system takes back when it needs them. Ends with status 1 at a row that does not meet
GOAL.
"""

import contextlib
import os
import shutil
import subprocess
import sys
import tempfile
import time
from pathlib import Path

from bench.cleanup import remove_control_group
from bench.makers.exports import write_exports

TOOL = Path(__file__).resolve().parents[1] / "build/default/companion/harl-updater-tool"
REMOTE = "/lib/systemd/systemd-journal-remote"
FLEETS = [100, 1000, 10000]
JOURNALS = 200
ROUNDS = 3
MIB = 1024 * 1024  # bytes
GOAL = (30, 128)  # at most, s and MiB


def receive(export: Path, journal: Path) -> None:
    """Makes a journal of an export."""
    journal.parent.mkdir(exist_ok=True)
    subprocess.run([REMOTE, "--output", journal, export], stderr=subprocess.DEVNULL, check=True)


def limited_group() -> Path | None:
    """A control group whose processes, and the files that they read, have only the goal's memory; None where this
    process can make none."""
    for root, limit in (("/sys/fs/cgroup/memory", "memory.limit_in_bytes"), ("/sys/fs/cgroup", "memory.max")):
        group = Path(root) / f"fleet-{os.getpid()}"
        with contextlib.suppress(OSError):
            group.mkdir()
            (group / limit).write_text(str(GOAL[1] * MIB))
            return group
        remove_control_group(str(group))
    return None


def forget(files: list[Path]) -> None:
    """Takes the files out of the page cache: who reads them next is charged for them."""
    for path in files:
        with path.open("rb") as file:
            os.fsync(file.fileno())
            os.posix_fadvise(file.fileno(), 0, 0, os.POSIX_FADV_DONTNEED)


def memory_of(process: int) -> tuple[float, float]:
    """MiB that a process and its children have of their own, and in mapped files. proc(5)."""
    kinds = {"Pss_Anon:": 0, "Pss_File:": 0}
    with contextlib.suppress(OSError):  # it has just ended
        children = [path.read_text().split() for path in Path(f"/proc/{process}/task").glob("*/children")]
        for number in [str(process), *sum(children, [])]:
            for line in Path(f"/proc/{number}/smaps_rollup").read_text().splitlines()[1:]:
                name, kilobytes = line.split()[:2]
                kinds[name] = kinds.get(name, 0) + int(kilobytes)
    return kinds["Pss_Anon:"] / 1024, kinds["Pss_File:"] / 1024


def run(command: list[str | Path], watch: bool) -> tuple[float, float, float]:
    """How long the command takes, s, and with `watch` the most memory of both kinds, MiB."""
    own = mapped = 0.0
    begin = time.monotonic()
    process = subprocess.Popen(command, stdout=subprocess.DEVNULL)
    while watch and process.poll() is None:
        found = memory_of(process.pid)
        own, mapped = max(own, found[0]), max(mapped, found[1])
        time.sleep(0.005)
    assert process.wait() in (0, 1), process.returncode
    return time.monotonic() - begin, own, mapped


def measure(what: str, inputs: Path, page: Path, units: int) -> None:
    """Prints a row. Ends the command where the goal is not met."""
    files = [path for path in inputs.iterdir()] if inputs.is_dir() else [inputs]
    size = sum(path.stat().st_size for path in files)
    command: list[str | Path] = [TOOL, "fleet", "--html", page, inputs]
    best = min(run(command, False)[0] for _ in range(ROUNDS))
    forget(files)
    group = limited_group()
    enter = ["sh", "-c", f'echo $$ >{group}/cgroup.procs && exec "$@"', "sh"] if group else []
    limited, own, mapped = run([*enter, *command], True)
    remove_control_group(str(group))
    print(f"{what:24} {units:6} {len(files):6} {size / 1e6:8.1f} {best:7.2f} {best / units * 1e3:8.2f} "
          f"{own:7.1f} {mapped:10.1f} " + (f"{limited:12.2f}" if group else "           -"), flush=True)
    if max(best, limited) > GOAL[0] or own > GOAL[1]:
        sys.exit("performance/fleet: more than the goal of {} s and {} MiB".format(*GOAL))


def main() -> None:
    """The command."""
    if not all(word.isdigit() and int(word) > 0 for word in sys.argv[1:]):
        sys.exit("performance/fleet: not numbers of units. Usage: performance/fleet [UNITS...]")
    print("input                     units  files       MB       s  ms/unit own MiB mapped MiB s in 128 MiB")
    with tempfile.TemporaryDirectory(prefix="fleet-") as name:
        folder = Path(name)
        page = folder / "page.html"
        for units in [int(word) for word in sys.argv[1:]] or FLEETS:
            exports, stream = folder / f"exports-{units}", folder / f"stream-{units}"
            write_exports(exports, units)
            measure("a file for each unit", exports, page, units)
            with stream.open("wb") as all_units:
                for path in sorted(exports.iterdir()):
                    all_units.write(path.read_bytes())
            measure("one file", stream, page, units)
            server = folder / f"server-{units}"
            receive(stream, server / "remote-127.0.0.1.journal")
            measure("the server's journal", server, page, units)
            stream.unlink()
            shutil.rmtree(server)
        made = sorted(exports.iterdir())[:JOURNALS]
        for path in made:
            receive(path, folder / "journals" / f"{path.stem}.journal")
        measure("journals", folder / "journals", page, len(made))


if __name__ == "__main__":
    main()
