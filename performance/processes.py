"""Usage: performance/processes [ROUNDS]

Runs whole updates on the stand-in unit without the waits, a run of each outcome, and compares them with the same
commands in a bare loop of system(3) calls and in a POSIX shell script. In each of the ROUNDS (9) all of them run in
turn. The figures are medians; ratios to the loop of the same round are given as median and, in brackets, lowest and
highest.
"""

import copy
import os
import subprocess
import sys
import time
from dataclasses import dataclass
from pathlib import Path
from statistics import median

from bench import scenario
from bench.observation import now
from bench.runner import temporary_folder
from bench.standin.unit import StandInUnit

ROOT = Path(__file__).resolve().parent.parent

BUILD = ROOT / "build/performance"
TARGETS = ["harl-updater", "call_recorder", "command-loop", "measured"]
OUTCOMES = ["up-to-date", "package-and-board", "mirrors-fail", "package-unknown", "package-install-fails",
            "board-upload-fails"]
PROGRAMS = ["updater", "loop", "script", "shells"]


@dataclass
class Cost:
    """The cost of one run: seconds, and KiB. `own` and `peak` are those of the program without its children."""

    wall: float
    cpu: float
    own: float
    peak: int


class MeasuredUnit(StandInUnit):
    """A stand-in unit in which any program takes the updater's place."""

    def __init__(self, name: str, folder: Path) -> None:
        what = copy.deepcopy(scenario.load(name))
        what.setup.updater.stopped = "never"  # every program ends by itself
        super().__init__(what, folder, 1, BUILD)
        self.environment = self._environment() | {"MEASURED": str(folder / "measured")}
        self.start()

    def _start_updater(self) -> None:
        pass

    def run(self, command: list[str | Path], *preloaded: str) -> Cost:
        """Runs `command` in the unit to its end."""
        libraries = " ".join(str(BUILD / library) for library in preloaded)
        with (self._folder / "log").open("wb") as log:
            begin = time.monotonic()
            process = subprocess.Popen(
                command, env=self.environment | {"LD_PRELOAD": libraries}, stdin=subprocess.DEVNULL,
                stdout=log, stderr=subprocess.DEVNULL, cwd=self._folder, start_new_session=True,
            )
            _, status, used = os.wait4(process.pid, 0)
            wall = time.monotonic() - begin
            process.returncode = status
        own, peak = (self._folder / "measured").read_text().split()
        return Cost(wall, used.ru_utime + used.ru_stime, float(own), int(peak))

    def commands(self) -> list[str]:
        """The command lines of the run, in the order in which they began."""
        return [line.split("\t")[5] for line in self.files.calls.read_text().splitlines() if "\tstart\t" in line]


def prepare(folder: Path, commands: list[str]) -> dict[str, list[str | Path]]:
    """The programs to compare, with the files that they run in `folder`."""
    lines = "".join(f"{command}\n" for command in commands)
    (folder / "commands").write_text(lines)
    (folder / "shells").write_text(":\n" * len(commands))
    (folder / "script").write_text(f"#!/bin/sh\n{lines}:\n")
    (folder / "script").chmod(0o755)
    return {
        "updater": [BUILD / "harl-updater"],
        "loop": [BUILD / "performance/command-loop", folder / "commands"],
        "script": ["/bin/sh", folder / "script"],
        "shells": [BUILD / "performance/command-loop", folder / "shells"],
    }


def recorded(name: str) -> tuple[list[str], float]:
    """The command lines of an update, and the time from the process's start to its first LED command, s."""
    with temporary_folder() as folder:
        unit = MeasuredUnit(name, folder)
        unit.environment["BENCH_CALLS"] = str(unit.files.calls)
        begin = now()
        unit.run([BUILD / "harl-updater"], "performance/measured.so", "bench/call_recorder.so")
        return unit.commands(), float(unit.files.calls.read_text().split("\t", 1)[0]) - begin


def processes_of(name: str, command: list[str | Path]) -> int:
    """How many processes and threads a run starts: a process namespace numbers them."""
    with temporary_folder() as folder:
        unit = MeasuredUnit(name, folder)
        counting = '"$@"; (exec /bin/sh -c \'echo $$ >"$UNIT/last"\'); :'
        inner = ["/usr/bin/env", f"LD_PRELOAD={BUILD}/performance/measured.so", *command]
        unit.run(["/usr/bin/unshare", "--map-root-user", "--pid", "--fork", "/bin/sh", "-c", counting, "sh", *inner])
        return int((folder / "last").read_text()) - 2  # without the counting shells


def spread(values: list[float]) -> str:
    """Median, lowest and highest."""
    return f"{median(values):5.2f} ({min(values):.2f}-{max(values):.2f})"


def compare(name: str, rounds: int) -> None:
    """Prints the rows of one outcome."""
    commands, _ = recorded(name)
    costs: dict[str, list[Cost]] = {program: [] for program in PROGRAMS}
    with temporary_folder() as kept:
        made = prepare(kept, commands)
        for number in range(rounds):
            for offset in range(len(PROGRAMS)):
                program = PROGRAMS[(number + offset) % len(PROGRAMS)]
                with temporary_folder() as folder:
                    costs[program].append(MeasuredUnit(name, folder).run(made[program], "performance/measured.so"))
        for program in PROGRAMS:
            own = costs[program]
            against = [cost.cpu / loop.cpu for cost, loop in zip(own, costs["loop"])]
            own_against = [cost.own / loop.own for cost, loop in zip(own, costs["loop"])]
            print(
                f"{name:22} {program:8} {len(commands):8} {processes_of(name, made[program]):9} "
                f"{median(c.wall for c in own) * 1000:8.0f} {median(c.cpu for c in own) * 1000:8.1f} "
                f"{median(c.own for c in own) * 1000:7.2f} {max(c.peak for c in own):8}  "
                f"{spread(against)}  {spread(own_against)}",
                flush=True,
            )


def main() -> None:
    """The command."""
    if len(sys.argv) > 2 or not all(text.isdigit() and int(text) > 0 for text in sys.argv[1:]):
        print("performance/processes: not a number of rounds. Usage: performance/processes [ROUNDS]", file=sys.stderr)
        sys.exit(2)
    rounds = int(sys.argv[1]) if len(sys.argv) == 2 else 9
    for command in (
        ["scripts/install-build-packages", "libbenchmark-dev", "util-linux"],
        ["cmake", "--preset", "performance"],
        ["cmake", "--build", "--preset", "performance", "--target", *TARGETS],
    ):
        subprocess.run(command, cwd=ROOT, stdout=subprocess.DEVNULL, check=True)
    first = [recorded("up-to-date")[1] * 1000 for _ in range(rounds)]
    print(f"from the start of the process to the first LED command, ms: {spread(first)}")
    print("outcome                program  commands processes  wall ms   CPU ms  own ms peak KiB  CPU to loop        "
          "own to loop")
    for name in OUTCOMES:
        compare(name, rounds)


if __name__ == "__main__":
    main()
