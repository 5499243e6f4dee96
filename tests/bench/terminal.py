"""A terminal with a program in it: what it shows, and the keys that are pressed."""

import contextlib
import os
import re
import signal
import termios
import time
from collections.abc import Mapping
from pathlib import Path

import pexpect  # of Debian's python3-pexpect
import pyte  # of Debian's python3-pyte

ROOT = Path(__file__).parents[2]
LONGEST_WAIT = 150  # s


class _Display(pyte.Screen):  # type: ignore[misc]
    """pyte 0.8 leaves a line as it was when a blank one that was never written moves there."""

    def delete_lines(self, count: int | None = None) -> None:
        """Deletes lines below the cursor."""
        for row in range(self.lines):
            self.buffer[row]
        super().delete_lines(count)


class Terminal:
    """Runs `command` in a terminal; in a `with`, whose end ends what still runs.

    The terminal is a Linux console: pyte does not know all that xterm does.
    """

    def __init__(self, command: list[str], variables: Mapping[str, str], columns: int = 80, lines: int = 24) -> None:
        plain = {name: value for name, value in os.environ.items() if name != "NO_COLOR"}
        self._display = _Display(columns, lines)
        self._stream = pyte.ByteStream(self._display)
        self.written = b""
        self.process = pexpect.spawn(
            command[0], command[1:], cwd=str(ROOT), dimensions=(lines, columns), timeout=LONGEST_WAIT,
            env=plain | {"TERM": "linux", "PYTHONPATH": str(ROOT)} | dict(variables),
        )
        self.before = self.modes()

    def __enter__(self) -> "Terminal":
        return self

    def __exit__(self, *_: object) -> None:
        if self.process.isalive():
            self.process.kill(signal.SIGTERM)  # it clears its unit away
            with contextlib.suppress(pexpect.EOF, pexpect.TIMEOUT):
                self.process.expect(pexpect.EOF)
        self.process.close(force=True)

    def press(self, *keys: str) -> None:
        """Presses the keys one after the other."""
        for key in keys:
            self.process.send(key)

    def text(self) -> str:
        """What the terminal shows."""
        return "\n".join(self._display.display)

    def wait_for(self, *texts: str) -> str:
        """Waits until the terminal shows all these texts at once. Returns what it shows."""
        return self.wait_until(*(re.escape(text) for text in texts))

    def wait_until(self, *patterns: str) -> str:
        """Waits until the terminal shows all these patterns at once. Returns what it shows."""
        end = time.monotonic() + LONGEST_WAIT
        ended = False
        while not all(re.search(pattern, self.text()) for pattern in patterns):
            if ended or time.monotonic() > end:
                raise AssertionError(f"never showed {patterns} at once:\n{self.text()}")
            ended = not self._read()
        return self.text()

    def wait_for_end(self) -> int:
        """Waits until the program ends. Returns its exit status, or minus the signal's number."""
        end = time.monotonic() + LONGEST_WAIT
        while self._read():
            if time.monotonic() > end:
                raise AssertionError(f"did not end:\n{self.text()}")
        self.process.wait()
        return int(-self.process.signalstatus if self.process.signalstatus else self.process.exitstatus)

    def modes(self) -> list[object]:
        """The terminal's modes, see termios(3)."""
        return termios.tcgetattr(self.process.child_fd)

    def colors(self) -> set[str]:
        """The colours of what is shown."""
        return {cell.fg for row in self._display.buffer.values() for cell in row.values()}

    def _read(self) -> bool:
        """Takes what the program has written. False at its end."""
        try:
            data = self.process.read_nonblocking(65536, timeout=0.05)
        except pexpect.TIMEOUT:
            return True
        except pexpect.EOF:
            return False
        self.written += data
        self._stream.feed(data)
        return True
