"""Compares the result of a scenario with the expected one: as the bench does, and in what only the unit shows."""

import math
import re

from bench.compare import differences, log_difference
from bench.expected import COMMANDS
from bench.observation import Call, now
from bench.outcomes import SOUND_FILES, UP_TO_DATE, UPDATED
from bench.panel import Panel, lit
from target.evidence import Evidence
from target.inputs import BOARD_VERSION
from target.plan import Plan

IDENTIFIER = "harl-updater"
LONGEST_PHASE = 1.2  # of the flashing: how many times as long with the hand-over as without
AFTER_START = ["startHARL: 0", "stopUpdater:"]  # the records after the command that starts the application


def same(what: str, expected: object, seen: object) -> list[str]:
    """The difference, if there is one."""
    return [] if expected == seen else [f"{what}: expected {expected!r}, not {seen!r}"]


def panel_bytes(calls: list[Call]) -> list[int]:
    """The bytes that the panel commands among `calls` send."""
    return [int(byte, 16) for call in calls for byte in re.findall(r"i2cset -y 0 0x07 (0x\w+) c", call.text)]


def check_bus(plan: Plan, evidence: Evidence) -> list[str]:
    """The bytes on the bus must be those of the updater's commands, in their order; no pair is split."""
    run = evidence.result.run
    ended = panel_bytes([call for call in run.calls if call.end is not None])
    sent = evidence.sent
    if sent != evidence.asked:
        return [f"bus: {len(sent)} bytes that are not the {len(evidence.asked)} bytes the kernel was asked to send"]
    if plan.settings.event == "nothing" or plan.settings.is_cut():
        if sent != ended:
            return [f"bus: {len(sent)} bytes that are not the {len(ended)} bytes of the commands"]
    elif sent[: len(ended)] != ended:  # give-back sends more after the updater
        return ["bus: does not begin with the bytes of the commands"]
    return []


def check_main_thread(evidence: Evidence) -> list[str]:
    """The records of the thread that waits for the update; the bench compares those of the others."""
    records = evidence.result.run.records()
    seen = [f"{record.operation}: {record.message}".strip() for record in records if record.thread == records[0].thread]
    banner = f"main: TavrenUpdater version: {evidence.before['updater']}"
    expected = [banner, "main: BEFORE UPDATE", "update:", "lockApp:"]
    return [] if seen == expected else [f"log of the main thread: expected {expected}, not {seen}"]


def check_sound(evidence: Evidence) -> list[str]:
    """The panel must flash blue before the sound, stay dark while it plays, and light the outcome after it."""
    run = evidence.result.run
    sound = next((call for call in run.calls if call.text.startswith("aplay ")), None)
    if sound is None or sound.end is None:
        return []  # the bench's comparison shows whether one was expected
    found = []
    flashed = [lit(change.leds) for change in run.changes if change.time < sound.start and lit(change.leds)]
    if flashed != [[{"REMOTE": "blue"}, {"MAIN": "blue"}][index % 2] for index in range(len(flashed))] or not flashed:
        found.append(f"panel: expected REMOTE and MAIN blue in turn before the sound, not {flashed}")
    moments = [change.time for change in run.changes if lit(change.leds)]
    if not any(moment > sound.end for moment in moments):
        found.append("panel: no outcome after the sound")
    if any(sound.start < moment < sound.end for moment in moments):
        found.append("panel: lit while the sound played")
    return found


def check(plan: Plan, evidence: Evidence) -> list[str]:
    """One line for each difference; none when the run was as `plan` expects."""
    before, after = evidence.before, evidence.after
    found = differences(plan.like, evidence.result) + check_main_thread(evidence)
    found += check_bus(plan, evidence) + check_sound(evidence)

    setup = plan.like.setup
    cut = plan.settings.is_cut()
    done = plan.settings.event == "power-cut-before-application"
    found += same("package before", setup.package.offered if cut else setup.package.installed, before["package"])
    found += same("board before", BOARD_VERSION if done else setup.board.installed, before["board"])
    found += same("marker before", "yes" if setup.head.marker and not done else "no", before["marker"])
    found += same("stick before", "yes", before["stick"])
    found += same("journal identifiers", {IDENTIFIER}, evidence.identifiers)
    found += same("result of the unit", plan.expect.result, after["Result"])
    found += same("package status", plan.expect.package_status, after["package_status"])
    found += same("harl-updater", plan.expect.updater, "same" if before["updater"] == after["updater"] else "newer")
    found += same("harl-updater starts at boot", False, after["enabled"] == "enabled")
    found += same("harl was started again", True, int(after["harl_since"]) > int(before["harl_since"]))
    killed = plan.settings.event == "give-back-killed"
    found += same("give-back was killed and started again", killed, int(after["rescuer_restarts"]) > 0)
    starved = plan.settings.event.endswith("out-of-memory")
    killed_by_kernel = int(after["killed_out_of_memory"]) > int(before["killed_out_of_memory"])
    found += same("the kernel killed a process because it was out of memory", starved, killed_by_kernel)
    if plan.settings.script_seconds:
        found += same("package's maintainer script", ["began", "ended"], list(evidence.package_script))
        ended = evidence.package_script.get("ended", math.inf)
        later = int(after["harl_since"]) / 1e6 > ended
        found += same("harl was started after the package's maintainer script", True, later)
    if cut:
        found += same("harl after the boot", "active", before["harl"])
        status = "installed" if done else "half-configured"
        found += same("package status after the boot", status, before["package_status"])
    if plan.settings.times_flashing and evidence.flashing_ratio() > LONGEST_PHASE:
        found.append(f"flashing: {evidence.flashing_ratio():.2f} times as long with the hand-over")
    return found + check_whole(evidence)


def check_whole(evidence: Evidence) -> list[str]:
    """The package database has nothing unfinished, no file is damaged, and the disk had no error."""
    names = ("damaged_files", "audit", "disk_errors")
    return [line for name in names for line in same(name, "0", evidence.after[name])]


def check_cut(plan: Plan, panel: Panel, evidence: Evidence) -> list[str]:
    """What the panel showed when the machine stopped, and which records of the interrupted run the journal has.

    Right before the application starts: the outcome, and every record up to that command. Earlier: the blue flashing of
    a running update, and the first records, as far as the journal had written them.
    """
    found = []
    pattern = panel.pattern(0)
    if plan.settings.event == "power-cut-before-application":
        wanted = pattern == UPDATED.panel
        ends = [len(plan.whole_log) - len(AFTER_START)]
    else:
        wanted = set(pattern.values()) <= {"blue"}
        ends = list(range(len(plan.whole_log)))
    if not wanted:
        found.append(f"panel at the power cut: {pattern!r}")
    kept = evidence.before_cut or []
    if all(log_difference(plan.whole_log[:end], kept) for end in ends):
        found.append(f"journal of the run before the power cut: {log_difference(plan.whole_log[: ends[-1]], kept)}")
    return found


def check_next_run(plan: Plan, evidence: Evidence) -> list[str]:
    """The run after a power cut, with network and stick: it does what is left to do and shows that."""
    state, before, after = evidence.result.state, evidence.before, evidence.after
    done = {call.text for call in evidence.result.run.commands()}
    outcome = UPDATED if done & {COMMANDS["install-package"], COMMANDS["install-board"]} else UP_TO_DATE
    found = check_main_thread(evidence) + check_bus(plan, evidence) + check_sound(evidence) + check_whole(evidence)
    pairs = {
        "panel": (outcome.panel, evidence.result.run.panel.pattern(now())),
        "sound": ([SOUND_FILES[outcome.sound]], state.sounds),
        "package": (plan.like.setup.package.offered, state.package),
        "package status": ("installed", after["package_status"]),
        "board": (BOARD_VERSION, state.board),
        "stick": (False, state.stick),
        "harl": ("active", state.harl),
        "harl after the boot": ("active", before["harl"]),
        "harl was started again": (True, int(after["harl_since"]) > int(before["harl_since"])),
        "result of the unit": ("success", after["Result"]),
        "status": (True, evidence.result.status in plan.like.expect.status),
    }
    return found + [line for what, (wanted, seen) in pairs.items() for line in same(what, wanted, seen)]
