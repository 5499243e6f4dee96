"""Usage: performance/fleet [UNITS...]

Makes the exports of fleets of UNITS (100, 1000 and 10000), three runs of each unit in the mixture of
bench/makers/exports.py, and measures how long `harl-updater-tool fleet --html` takes, from the page
cache, and the most memory it takes: with a file for each unit, with one file of all, with the journal that
systemd-journal-remote makes of that, as the server of docs/fleet.md keeps it, and with 200 journals of a unit each. The
times are the best of three. Ends with status 1 at a row that does not meet GOAL.
"""

import os
import shutil
import subprocess
import sys
import tempfile
import time
from pathlib import Path

from bench.makers.exports import write_exports

TOOL = Path(__file__).resolve().parents[1] / "build/default/companion/harl-updater-tool"
REMOTE = "/lib/systemd/systemd-journal-remote"
FLEETS = [100, 1000, 10000]
JOURNALS = 200
ROUNDS = 3
GOAL = (30, 128)  # at most, s and MiB


def receive(export: Path, journal: Path) -> None:
    """Makes a journal of an export."""
    journal.parent.mkdir(exist_ok=True)
    subprocess.run([REMOTE, "--output", journal, export], stderr=subprocess.DEVNULL, check=True)


def measure(what: str, inputs: Path, page: Path, units: int) -> None:
    """Prints a row. Ends the command where the goal is not met."""
    files = [path for path in inputs.iterdir()] if inputs.is_dir() else [inputs]
    size = sum(path.stat().st_size for path in files)
    best, memory = 1e9, 0
    for _ in range(ROUNDS):
        begin = time.monotonic()
        process = subprocess.Popen([TOOL, "fleet", "--html", page, inputs], stdout=subprocess.DEVNULL)
        _, status, used = os.wait4(process.pid, 0)
        process.returncode = os.waitstatus_to_exitcode(status)
        assert process.returncode in (0, 1), process.returncode
        best = min(best, time.monotonic() - begin)
        memory = max(memory, used.ru_maxrss)
    print(f"{what:24} {units:6} {len(files):6} {size / 1e6:8.1f} {best:7.2f} {best / units * 1e3:8.2f} "
          f"{memory / 1024:7.1f}", flush=True)
    mapped = any(path.suffix == ".journal" for path in files)  # by journalctl: no memory that others lack
    if best > GOAL[0] or (memory / 1024 > GOAL[1] and not mapped):
        sys.exit("performance/fleet: more than the goal of {} s and {} MiB".format(*GOAL))


def main() -> None:
    """The command."""
    if not all(word.isdigit() and int(word) > 0 for word in sys.argv[1:]):
        sys.exit("performance/fleet: not numbers of units. Usage: performance/fleet [UNITS...]")
    print("input                     units  files       MB       s  ms/unit  peak MiB")
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
