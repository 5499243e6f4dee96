"""Compares what a run showed with what its scenario expects."""

import re

from bench.expected import expected_commands, expected_log
from bench.observation import Run, now
from bench.outcomes import SOUND_FILES
from bench.runner import Result
from bench.scenario import Scenario


def seen_log(run: Run) -> list[str]:
    """The records of the update's threads: operation, colon, message; control characters as escapes."""
    records = run.records()
    threads = {record.thread for record in records if record.operation == "processUpdate"}
    if not threads:  # a main head: all but the thread that calls the engine
        threads = {record.thread for record in records} - {record.thread for record in records[:1]}
    lines = []
    for record in records:
        if record.thread in threads:
            message = record.message.replace("\r", "\\r").replace("\n", "\\n")
            lines.append(f"{record.operation}: {message}".rstrip("\n") if message else f"{record.operation}:")
    return lines


def log_difference(expected: list[str], seen: list[str]) -> str | None:
    """The first difference, or None. An expected "..." matches any records, or at a line's end any rest of it."""
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


def differences(scenario: Scenario, result: Result) -> list[str]:
    """One line for each difference; none when the run was as the scenario expects."""
    expect = scenario.expect
    run, state, status = result.run, result.state, result.status
    found = []

    def same(what: str, expected: object, seen: object) -> None:
        if expected != seen:
            found.append(f"{what}: expected {expected!r}, not {seen!r}")

    if status not in expect.status:
        found.append(f"status: expected one of {expect.status}, not {status}")
    commands = [call.text for call in run.commands()]
    expected = expected_commands(expect.commands)
    for index, (line, seen) in enumerate(zip(expected, commands), 1):
        same(f"command {index}", line, seen)
    same("number of commands", len(expected), len(commands))
    same("waits", expect.waits, [call.seconds for call in run.waits()])
    logs = [expected_log(expect.log), seen_log(run)]
    if not result.log_is_exact:
        logs = [[re.sub(r"(\s|\\r)+$", "", line) for line in log] for log in logs]
    if difference := log_difference(*logs):
        found.append(difference)
    pattern = run.panel.pattern(now())
    if "any" in expect.panel:  # ended while it flashed
        pattern = {"any": color for color in pattern.values()} or expect.panel
    same("panel", expect.panel, pattern)
    same("panel faults", [], run.panel.faults)
    same("sound", [SOUND_FILES[expect.sound]] if expect.sound else [], state.sounds)
    for key in ("package", "board", "marker", "stick", "harl"):
        same(key, getattr(expect, key), getattr(state, key))
    return found
