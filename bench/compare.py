"""Compares what a run showed with what its scenario says must come out."""

import re

from observe import Run, now
from scenario import COMMANDS, Scenario
from session import Result

# Runs of records that many scenarios share, for `log` in their files: "(name)", with arguments for {1}, {2} behind the
# name. A line is an operation's name, a colon and the message.
BLOCKS = {
    # (opening STATUS): what stopping harl gave
    "opening": """
processUpdate:
setCallbacks:
init:
stopHARL:
stopHARL: {1}
update:
updateRemoteHead:
""",
    # (closing STATUS STATUS): what releasing the stick and starting harl gave
    "closing": """
deinit:
deinitRemoteHead:
deinitRemoteHead: Giving users 30 Secs to view Pass/Fail LED status before completing update
startHARL:
startHARL: {1}
startHARL: {2}
stopUpdater:
""",
    "mirrors-refreshed": """
updateMirrors:
runProcess: Running command: {refresh-mirrors}
runProcess: Exit code:0
updateMirrors: OK
""",
    # (versions-differ COMMAND PACKAGE INSTALLED OFFERED)
    "versions-differ": """
checkUpdate: {{1}}
runProcess: Running command: {{1}}
runProcess: Exit code:0
checkUpdate: {2}:
checkUpdate: {3}
checkUpdate: {4}
...
checkUpdate: {3}  {4}
checkUpdate: NWM_UM_UPDATE_FOUND: {3} -> {4}
""",
    # (versions-same COMMAND PACKAGE VERSION)
    "versions-same": """
checkUpdate: {{1}}
runProcess: Running command: {{1}}
runProcess: Exit code:0
checkUpdate: {2}:
checkUpdate: {3}
checkUpdate: {3}
...
checkUpdate: {3}  {3}
checkUpdate: NWM_UM_NO_UPDATES {3} == {3}
""",
    # (installed COMMAND)
    "installed": """
installUpdate:
runProcess: Running command: {{1}}
runProcess: Exit code:0
""",
    # (package-differs INSTALLED OFFERED), (package-same VERSION)
    "package-differs": "(versions-differ read-package solvik4-rh {1} {2})",
    "package-same": "(versions-same read-package solvik4-rh {1})",
    "package-installed": "(installed install-package)",
    "main-package-differs": "(versions-differ read-main-package solvik4-dh {1} {2})",
    "main-package-same": "(versions-same read-main-package solvik4-dh {1})",
    "main-package-installed": "(installed install-main-package)",
    # (board-not-read STATUS)
    "board-not-read": """
runProcess: Running command: {read-board}
runProcess: Exit code:{1}
checkQuorbUpdate: Failed to checkUpdate
""",
    # (board-read VERSION)
    "board-read": """
runProcess: Running command: {read-board}
runProcess: Exit code:0
checkQuorbUpdate: {1}\\r
""",
    "stick-listed": """
runProcess: Running command: {list-stick}
runProcess: Exit code:0
""",
    # (board-differs INSTALLED OFFERED)
    "board-differs": """
(board-read {1})
(stick-listed)
checkQuorbUpdate: {1}  {2}
checkQuorbUpdate: Update found: {1} -> {2}
""",
    # (board-same VERSION)
    "board-same": """
(board-read {1})
(stick-listed)
checkQuorbUpdate: {1}  {1}
checkQuorbUpdate: QUORB up to date
""",
    # (board-installed STATUS): what the install script gave
    "board-installed": """
installQuorbUpdate:
uploadQuorbFiles: {upload-board}
installQuorbUpdate: {install-board}
installQuorbUpdate: Install script ended with code: {1}
installQuorbUpdate: Starts sleeping for 13mins
installQuorbUpdate: Sleeping for 13mins ended up
""",
    "board-upload-failed": """
installQuorbUpdate:
uploadQuorbFiles: {upload-board}
uploadQuorbFiles: Uploading failed. Trying again.\x20
(19 more)
uploadQuorbFiles: Failed to upload QUORB with 20 tries. Closing
installQuorbUpdate: Failed inside uploadQuorbFiles
""",
    # The main head's.
    "main-opening": """
initMainHead:
stopHARL:
stopHARL: 0
""",
    # (main-closing STATUS STATUS): what releasing the stick and starting harl gave
    "main-closing": """
startHARL:
startHARL: {1}
startHARL: {2}
stopUpdater:
""",
    # (teamviewer-looked-for STATUS)
    "teamviewer-looked-for": """
runProcess: Running command: {find-teamviewer}
runProcess: Exit code:{1}
""",
    "teamviewer-required": """
(teamviewer-looked-for 0)
checkTVUpdate: Teamviewer path/root/USB_MOUNT/debs/installTV
checkTVUpdate: Teamviewer install is required
initMainHead: going to install TV
""",
    "teamviewer-directory": """
checkTVUpdate: Teamviewer path/root/USB_MOUNT/debs/installTV
checkTVUpdate: No need to install Teamviewer
""",
    "teamviewer-absent": """
(teamviewer-looked-for 2)
checkTVUpdate: install Teamviewer flag doesnot exist
""",
    # (main-component KIND NAME)
    "main-component": """
updateMainHead: now call install MAIN udate{1}
updateMainHead: now call install {2} udate
""",
    # (teamviewer-installed STATUS)
    "teamviewer-installed": """
installTVUpdate:
installTVUpdate: {install-teamviewer}
installTVUpdate: Install script ended with code: {1}
""",
    "updated": """
updateRemoteHead: removed{remove-marker}
resultCallback:
""",
}


def expected_commands(scenario: Scenario) -> list[str]:
    """The command lines that a scenario expects, written out."""
    lines = []
    for entry in scenario.expect["commands"]:
        name, _, count = entry.partition(" x")
        lines += [COMMANDS.get(name, name)] * int(count or 1)
    return lines


def expected_log(text: str) -> list[str]:
    """The records that the text of a scenario's `log` expects of the update's threads, written out."""
    lines: list[str] = []
    for line in filter(None, text.splitlines()):
        line = re.sub(r"\{([a-z][a-z-]+)\}", lambda match: COMMANDS.get(match[1], match[0]), line)
        if more := re.fullmatch(r"\((\d+) more\)", line):
            lines += lines[-1:] * int(more[1])
        elif block := re.fullmatch(r"\(([a-z-]+)((?: \S+)*)\)", line):
            content = BLOCKS[block[1]]
            for number, argument in enumerate(block[2].split(), 1):
                content = content.replace(f"{{{number}}}", argument)
            lines += expected_log(content)
        else:
            lines.append(line)
    return lines


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


def differences(scenario: Scenario, result: Result) -> list[str]:
    """One line for each difference; none when the run came out as the scenario says."""
    expect = scenario.expect
    run, state, status = result.run, result.state, result.status
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
    logs = [expected_log(expect["log"]), seen_log(run)]
    if not result.log_is_exact:
        logs = [[re.sub(r"(\s|\\r)+$", "", line) for line in log] for log in logs]
    if difference := log_difference(*logs):
        found.append(difference)
    pattern = run.panel.pattern(now())
    if "any" in expect["panel"]:  # ended while it flashed
        pattern = {"any": color for color in pattern.values()} or expect["panel"]
    same("panel", expect["panel"], pattern)
    same("panel faults", [], run.panel.faults)
    sound = {"": [], "pass": ["SND_RESULT_PASS.wav"], "fail": ["SND_RESULT_FAIL.wav"]}[expect["sound"]]
    same("sound", sound, state.sounds)
    for key in ("package", "board", "marker", "stick", "harl"):
        same(key, expect[key], getattr(state, key))
    return found
