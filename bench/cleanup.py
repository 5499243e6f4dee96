"""Usage: cleanup.py FOLDER

Waits until the owner of the other end of standard input has ended, then ends what still runs in the temporary folder of
a unit and removes the folder. Starts no process for that, so that it works where none can be created.
"""

import contextlib
import os
import shutil
import signal
import sys
import time

TRIES = 200
PAUSE = 0.05  # s


def remove_control_group(group: str) -> None:
    """Removes the group and those within it, once no process is left in them."""
    for directory, _, _ in os.walk(group, topdown=False):
        with contextlib.suppress(OSError):
            os.rmdir(directory)


def clear_away(folder: str) -> None:
    """Ends the session whose leader is in `unit.pid`, removes the group in `control-group` and the folder itself."""
    for _ in range(TRIES):
        with contextlib.suppress(OSError, ValueError):
            os.killpg(int(_read(folder, "unit.pid")), signal.SIGKILL)
        group = _read(folder, "control-group")
        remove_control_group(group)
        if not os.path.exists(group):
            shutil.rmtree(folder, ignore_errors=True)
        if not os.path.exists(folder):
            return
        time.sleep(PAUSE)


def _read(folder: str, name: str) -> str:
    """The text of a file, "" when there is none."""
    with contextlib.suppress(OSError), open(f"{folder}/{name}", encoding="utf-8") as file:
        return file.read().strip()
    return ""


if __name__ == "__main__":
    sys.stdin.buffer.read()
    clear_away(sys.argv[1])
