"""Compares what a run showed with what its scenario says must come out."""

import re

from observe import Run, now
from scenario import COMMANDS, Scenario
from unit import State

# Records that open and close an update of the remote head on its thread, whatever its outcome.
OPENING = """
processUpdate:
setCallbacks:
init:
stopHARL:
stopHARL: 0
update:
updateRemoteHead:
"""
CLOSING = """
deinit:
deinitRemoteHead:
deinitRemoteHead: Giving users 30 Secs to view Pass/Fail LED status before completing update
startHARL:
startHARL: 0
startHARL: 0
stopUpdater:
"""


def expected_commands(scenario: Scenario) -> list[str]:
    """The command lines that a scenario expects, written out."""
    lines = []
    for entry in scenario.expect["commands"]:
        name, _, count = entry.partition(" x")
        lines += [COMMANDS.get(name, name)] * int(count or 1)
    return lines


def expected_log(scenario: Scenario) -> list[str]:
    """The records that a scenario expects of the update thread, written out."""
    text = scenario.expect["log"].replace("(opening)\n", OPENING).replace("(closing)\n", CLOSING)
    lines: list[str] = []
    for line in filter(None, text.splitlines()):
        line, _, count = line.partition(" (x")
        line = re.sub(r"\{([a-z-]+)\}", lambda match: COMMANDS.get(match[1], match[0]), line)
        lines += [line] * int(count.rstrip(")") or 1)
    return lines


def seen_log(run: Run) -> list[str]:
    """The records of the update thread: operation, colon, message; control characters as escapes."""
    records = run.records()
    threads = [record.thread for record in records if record.operation == "processUpdate"]
    lines = []
    for record in records:
        if record.thread in threads:
            message = record.message.replace("\r", "\\r").replace("\n", "\\n")
            lines.append(f"{record.operation}: {message}".rstrip("\n") if message else f"{record.operation}:")
    return lines


def log_difference(expected: list[str], seen: list[str]) -> str | None:
    """The first difference, or None. An expected "..." stands for any records, at a line's end for any rest of it."""
    position = 0
    skipping = False
    for line in expected:
        if line == "...":
            skipping = True
            continue
        matches = [
            found == line or (line.endswith("...") and found.startswith(line[:-3])) for found in seen[position:]
        ]
        if not any(matches if skipping else matches[:1]):
            found = seen[position] if position < len(seen) else "the end of the log"
            return f"log: expected {line!r}, not {found!r}"
        position += matches.index(True) + 1
        skipping = False
    if position < len(seen) and not skipping:
        return f"log: unexpected {seen[position]!r}"
    return None


def differences(scenario: Scenario, run: Run, state: State, status: int) -> list[str]:
    """One line for each difference; none when the run came out as the scenario says."""
    expect = scenario.expect
    found = []

    def same(what: str, expected: object, seen: object) -> None:
        if expected != seen:
            found.append(f"{what}: expected {expected!r}, not {seen!r}")

    if status not in expect["status"]:
        found.append(f"status: expected one of {expect['status']}, not {status}")
    commands = [call.text for call in run.commands()]
    expected = expected_commands(scenario)
    for index, (line, seen) in enumerate(zip(expected, commands), 1):
        same(f"command {index}", line, seen)
    same("number of commands", len(expected), len(commands))
    same("waits", expect["waits"], [call.seconds for call in run.waits()])
    if difference := log_difference(expected_log(scenario), seen_log(run)):
        found.append(difference)
    same("panel", expect["panel"], run.panel.pattern(now()))
    same("panel faults", [], run.panel.faults)
    sound = {"": [], "pass": ["SND_RESULT_PASS.wav"], "fail": ["SND_RESULT_FAIL.wav"]}[expect["sound"]]
    same("sound", sound, state.sounds)
    for key in ("package", "board", "marker", "stick", "harl"):
        same(key, expect[key], getattr(state, key))
    return found
