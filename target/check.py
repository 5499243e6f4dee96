"""Compares what a scenario left with what must come out: all that the bench compares, and what only the unit shows."""

import math
import re

from bench.compare import differences
from bench.observation import Call
from bench.panel import Panel, lit
from target.evidence import Evidence
from target.plan import Plan

IDENTIFIER = "harl-updater"


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
    if plan.settings.event in ("nothing", "power-cut"):
        if sent != ended:
            return [f"bus: {len(sent)} bytes that are not the {len(ended)} bytes of the commands"]
    elif sent[: len(ended)] != ended:  # what runs after the updater sends more
        return ["bus: does not begin with the bytes of the commands"]
    return []


def check_main_thread(evidence: Evidence) -> list[str]:
    """The records of the thread that waits for the update; the bench's comparison is of the others."""
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
        return []  # the bench's comparison tells whether one was expected
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
    """One line for each difference; none when the run came out as `plan` says."""
    before, after = evidence.before, evidence.after
    found = differences(plan.like, evidence.result) + check_main_thread(evidence)
    found += check_bus(plan, evidence) + check_sound(evidence)

    def same(what: str, expected: object, seen: object) -> None:
        if expected != seen:
            found.append(f"{what}: expected {expected!r}, not {seen!r}")

    setup = plan.like.setup
    cut = plan.settings.event == "power-cut"
    same("package before", setup.package.offered if cut else setup.package.installed, before["package"])
    same("board before", setup.board.installed, before["board"])
    same("marker before", "yes" if setup.head.marker else "no", before["marker"])
    same("stick before", "yes", before["stick"])
    same("journal identifiers", {IDENTIFIER}, evidence.identifiers)
    same("result of the unit", plan.expect.result, after["Result"])
    same("package status", plan.expect.package_status, after["package_status"])
    same("harl-updater", plan.expect.updater, "same" if before["updater"] == after["updater"] else "newer")
    same("harl-updater starts at boot", False, after["enabled"] == "enabled")
    same("harl was started again", True, int(after["harl_since"]) > int(before["harl_since"]))
    if plan.settings.script_seconds:
        same("package's maintainer script", ["began", "ended"], list(evidence.package_script))
        ended = evidence.package_script.get("ended", math.inf)
        same("harl was started after the package's maintainer script", True, int(after["harl_since"]) / 1e6 > ended)
    if cut:
        same("harl after the boot", "active", before["harl"])
        same("package status after the boot", "half-configured", before["package_status"])
    return found


def check_cut(panel: Panel) -> list[str]:
    """What the panel showed when the machine was stopped: the blue flashing of an update at work."""
    pattern = panel.pattern(0)
    if set(pattern.values()) - {"blue"}:
        return [f"panel at the power cut: expected the blue flashing, not {pattern!r}"]
    return []
