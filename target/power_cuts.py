"""target/run --power-cuts: cuts the power at random moments of an update and checks the next run each time.

The update runs once to learn how long it takes up to the start of the application, and once more for the power cuts. At
each moment the machine is held and its disk copied: the copy has, byte for byte, what a hard stop would leave. Then
each copy is booted and the updater runs to its end.
"""

import os
import random
import time
from collections import Counter
from collections.abc import Iterator
from concurrent.futures import ThreadPoolExecutor
from dataclasses import replace
from pathlib import Path

from bench.show.text import panel_line
from target.check import check_next_run
from target.evidence import Evidence
from target.machine import copy_disk, stop_machines
from target.plan import Plan, Settings, load
from target.runner import WORK, Emulation, read_all

SEED = 1
# A maintainer script and an unpacking that take a few seconds each on the emulated unit.
SETTINGS = Settings(script_seconds=3, package_files=100)


def moments(count: int) -> list[float]:
    """Random parts of the length of an update, in order: one in each of `count` equal stretches."""
    source = random.Random(SEED)
    return [round((index + source.random()) / count, 4) for index in range(count)]


def command_at(evidence: Evidence, moment: float) -> str:
    """What the updater was doing at the moment (s since the boot): the command or the wait of the update's thread."""
    run = evidence.result.run
    calls = [call for call in [*run.commands(), *run.waits()] if call.start <= moment]
    calls += [call for call in run.calls if call.text.startswith("aplay ") and call.start <= moment]
    if not calls:
        return "before the first command"
    last = max(calls, key=lambda call: call.start)
    name = last.text or f"wait of {last.seconds} s"
    return name if last.end is None or last.end > moment else f"after {name}"


def short(command: str) -> str:
    """A command line for a table."""
    command = command.split(" && ")[0]
    return command if len(command) <= 40 else f"{command[:18]} … {command[-18:]}"


def found_in(evidence: Evidence) -> str:
    """The state of the unit after the boot."""
    before = evidence.before
    marker = "marker" if before["marker"] == "yes" else "no marker"
    return f"{before['package']} {before['package_status']}, board {before['board']}, {marker}"


def cut_update(unit: Emulation, count: int, disks: list[Path]) -> tuple[Plan, Evidence]:
    """Runs the update once, then once more with power cuts; `disks` are what those leave. Raises MachineError."""
    usual = load("package-and-board")
    plan = replace(usual, name="power-cuts", settings=replace(SETTINGS, power_cuts=moments(count)))
    plans = [replace(usual, name="uninterrupted", settings=SETTINGS), plan]
    disk = WORK / "disk.ext4"
    copy_disk(unit.image / "root.ext4", disk)
    try:
        unit.boot(unit.write_input(plans), plans, WORK / "power-cuts/update", disk, copies=disks)
    finally:
        disk.unlink(missing_ok=True)
    return plan, read_all(plans, WORK / "power-cuts/update")[1]


def run_next(unit: Emulation, plan: Plan, disks: list[Path]) -> Iterator[Evidence]:
    """Boots each of `disks` and runs the update, as many at a time as there are processors. Raises MachineError."""
    inputs = unit.write_input([plan], again=True)

    def run_on(disk: Path) -> Evidence:
        folder = WORK / "power-cuts" / disk.stem
        unit.boot(inputs, [plan], folder, disk)
        disk.unlink()
        return read_all([plan], folder)[0]

    with ThreadPoolExecutor(os.cpu_count()) as pool:
        try:
            yield from pool.map(run_on, disks)
        finally:
            pool.shutdown(wait=False, cancel_futures=True)
            stop_machines()


def run(unit: Emulation, count: int) -> int:
    """Cuts the power `count` times and shows the result of each. Returns the status of the command.

    Raises MachineError.
    """
    begin = time.monotonic()
    disks = [WORK / f"cut-{number}.ext4" for number in range(1, count + 1)]
    differences: list[str] = []
    states: Counter[str] = Counter()
    failed = 0
    try:
        plan, cut = cut_update(unit, count, disks)
        rows = ["| Power cut | During | Found after the boot | Next run |", "|---|---|---|---|"]
        for number, (moment, evidence) in enumerate(zip(cut.power_cuts, run_next(unit, plan, disks)), 1):
            found = check_next_run(plan, evidence)
            failed += bool(found)
            differences += [f"DIFFERENCE: power cut {number}: {line}" for line in found]
            states[f"{evidence.before['package']} {evidence.before['package_status']}"] += 1
            after = moment - float(cut.before["uptime"])
            shown = panel_line(evidence.result.run.panel.shown(0))
            rows.append(f"| {after:.1f} s | {short(command_at(cut, moment))} | {found_in(evidence)} | {shown} |")
            print(rows[-1], flush=True)
    finally:
        for disk in disks:
            disk.unlink(missing_ok=True)
    print("", *rows, "", sep="\n")
    print("Package found:", ", ".join(f"{state} {number}" for state, number in states.most_common()))
    print("\n".join(differences))
    print(f"{count - failed} of {count} power cuts as expected, {time.monotonic() - begin:.0f} s")
    return 1 if failed else 0
