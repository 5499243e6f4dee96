"""Exports of the journals of a fleet: its units ran what the recorded logs of the scenarios hold.

Nothing in them is left to chance: the same number of units gives the same bytes.
"""

import random
from collections.abc import Iterator
from datetime import datetime, timedelta, timezone
from functools import cache
from pathlib import Path

LOGS = Path(__file__).resolve().parents[2] / "tests/companion/golden/log"
FIRST_RUN = datetime(2026, 9, 1, 20, 0, tzinfo=timezone.utc)
RUNS = 3  # of each unit, a month between them
HEAD = "Updater | "
TIME = "%d-%m-%Y %H-%M-%S"
LONGEST_HEAD = len(HEAD) + 19
# How many of a thousand runs went as the scenario did, and what the unit's check said of it then; the other runs are
# spread over all scenarios of the remote head.
MIXTURE = [("package-and-board", 400), ("package-only", 150), ("up-to-date", 150), ("board-only", 50)]
WELL = "verify: the unit is well"
NOT_WELL = "verify: the unit is not well: application"


def scenarios() -> list[str]:
    """The names of the recorded logs of the remote head."""
    names = [path.stem for path in sorted(LOGS.glob("*.log"))]
    others = ("main-head-", "tools-", "journal-", "console-", "three-runs-")
    return [name for name in names if not name.startswith(others)]


@cache
def recorded(name: str) -> tuple[tuple[float, str], ...]:
    """The lines of a log as a journal keeps them, each with its time in the run, s."""
    lines: list[tuple[float, str]] = []
    begin = last = None
    for line in (LOGS / f"{name}.log").read_text(errors="replace").splitlines():
        if line.startswith(HEAD):
            last = datetime.strptime(line[len(HEAD) : LONGEST_HEAD], TIME)
            begin = begin or last
        if line.strip() and begin and last:  # a journal drops empty lines
            lines.append(((last - begin).total_seconds(), line.rstrip()))
    return tuple(lines)


def run_of(chance: random.Random) -> tuple[tuple[float, str], ...]:
    """The lines of some run, with the unit's check; of one in a hundred only what came before the power went."""
    point = chance.randrange(1000)
    for name, share in MIXTURE:
        if point < share:
            break
        point -= share
    else:
        name = chance.choice(scenarios())
    lines = recorded(name)
    if chance.randrange(100) == 0:
        return lines[: len(lines) // 2]
    return *lines, (lines[-1][0] + 3, NOT_WELL if chance.randrange(200) == 0 else WELL)


def entry(unit: int, boot: int, number: int, when: datetime, uptime: float, message: str) -> str:
    """An entry as `journalctl -o export` prints it."""
    stamp = int(when.timestamp() * 1_000_000)
    clock = int(uptime * 1_000_000)
    source = f"{unit:032x}"
    boot_id = f"{unit:024x}{boot:08x}"
    return (
        f"__CURSOR=s={source};i={number:x};b={boot_id};m={clock:x};t={stamp:x};x={number:x}\n"
        f"__REALTIME_TIMESTAMP={stamp}\n__MONOTONIC_TIMESTAMP={clock}\n_BOOT_ID={boot_id}\n"
        f"_MACHINE_ID={source}\n_HOSTNAME=unit-{unit:05}\nSYSLOG_IDENTIFIER=harl-updater\n_PID={800 + boot}\n"
        f"MESSAGE={message}\n\n"
    )


def runs(unit: int) -> Iterator[str]:
    """The entries of each run of the unit with this number, from 1."""
    chance = random.Random(unit)
    number = 0
    for boot in range(RUNS):
        begin = FIRST_RUN + timedelta(days=30 * boot + chance.randrange(14), seconds=chance.randrange(6 * 3600))
        text = []
        for seconds, line in run_of(chance):
            number += 1
            when = begin + timedelta(seconds=seconds, microseconds=number)
            if line.startswith(HEAD):
                line = f"{HEAD}{when:{TIME}}{line[LONGEST_HEAD:]}"
            text.append(entry(unit, boot, number, when, 60 + seconds + number / 1_000_000, line))
        yield "".join(text)


def write_exports(folder: Path, units: int) -> None:
    """Writes an export for each unit into the folder."""
    folder.mkdir(parents=True, exist_ok=True)
    for unit in range(1, units + 1):
        (folder / f"unit-{unit:05}.export").write_text("".join(runs(unit)))
