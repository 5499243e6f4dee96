"""The meaning of the short names in the `commands` and the `log` of a scenario."""

import re

from bench.outcomes import SOUND_FILES

SSH_OPTIONS = "-o ServerAliveInterval=4 -o ServerAliveCountMax=10 -o ConnectTimeout=2 -o TCPKeepAlive=yes"
BOARD_FILES = "/root/USB_MOUNT/debs/QUORB/armhf"

# Short names, for the scenario files, of the complete command lines.
COMMANDS = {
    "stop-harl": "systemctl stop harl",
    "start-harl": "systemctl start harl",
    "stop-updater": "systemctl stop harl-updater",
    "refresh-mirrors": "apt update",
    "read-package": "apt-cache policy solvik4-rh",
    "install-package": "apt --assume-yes install solvik4-rh",
    "read-main-package": "apt-cache policy solvik4-dh",
    "install-main-package": "apt --assume-yes install solvik4-dh",
    "read-board": f"ssh  {SSH_OPTIONS} 192.168.9.2 \" cat /root/App/AppExe/version.txt | grep 'Brimvale'\"",
    "list-stick": f"ls {BOARD_FILES}/",
    "upload-board": f"scp  {SSH_OPTIONS} {BOARD_FILES}/*/OSUpgrade.zip 192.168.9.2:/root/"
    f" && scp  {SSH_OPTIONS} {BOARD_FILES}/*/unzipUpgrade.sh 192.168.9.2:/",
    "install-board": f'ssh  {SSH_OPTIONS} 192.168.9.2 "/unzipUpgrade.sh"',
    "find-teamviewer": "ls /root/USB_MOUNT/debs/installTV",
    "install-teamviewer": "/root/RESOURCES/teamviewer_updatescript.sh",
    "remove-marker": "rm /root/RESOURCES/tavren1stboot",
    "release-stick": "umount /root/USB_MOUNT/",
}

# The panel's and the sound's commands, which the scenarios do not name.
SOUND_FOLDER = "/root/RESOURCES/SOUNDS"


def led_command(led: int, color: int) -> str:
    """The command line that gives a LED a colour, both as the controller numbers them."""
    return f"i2cset -y 0 0x07 {led:#04x} c ; i2cset -y 0 0x07 {color:#x} c"


def sound_command(sound: str) -> str:
    """The command line that plays a sound of outcomes.py."""
    return f"aplay {SOUND_FOLDER}/{SOUND_FILES[sound]}"


# Blocks of records that many scenarios share, for `log` in their files: "(name)", with arguments for {1}, {2} after the
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
(main-closing {1} {2})
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


def expected_commands(entries: list[str]) -> list[str]:
    """The command lines that a scenario's `commands` expect, written out. Raises ValueError."""
    lines = []
    for entry in entries:
        name, _, count = entry.partition(" x")
        if count and not re.fullmatch(r"[1-9]\d{0,2}", count):
            raise ValueError(f"{entry!r}: no number after the x")
        lines += [_command(name)] * int(count or 1)
    return lines


def expected_log(text: str) -> list[str]:
    """The records that a scenario's `log` expects of the update's threads, written out. Raises ValueError."""
    lines: list[str] = []
    for line in filter(None, text.splitlines()):
        line = re.sub(r"\{([a-z][a-z-]+)\}", lambda match: _command(match[1]), line)
        if more := re.fullmatch(r"\((\d{1,3}) more\)", line):
            lines += lines[-1:] * int(more[1])
        elif block := re.fullmatch(r"\(([a-z-]+)((?: \S+)*)\)", line):
            lines += expected_log(_block(block[1], block[2].split()))
        else:
            lines.append(line)
    return lines


def _command(name: str) -> str:
    if name not in COMMANDS:
        raise ValueError(f"no command {name!r}; there are {', '.join(COMMANDS)}")
    return COMMANDS[name]


def _block(name: str, arguments: list[str]) -> str:
    if name not in BLOCKS:
        raise ValueError(f"no block {name!r}; there are {', '.join(BLOCKS)}")
    content = BLOCKS[name]
    wanted = len(set(re.findall(r"\{(\d)\}", content)))
    if len(arguments) != wanted:
        raise ValueError(f"block {name!r}: values after the name: must be {wanted}, not {len(arguments)}")
    for number, argument in enumerate(arguments, 1):
        content = content.replace(f"{{{number}}}", argument)
    return content
