"""Usage: display_test.py BUILD_FOLDER

What bench/run shows of a run: on a terminal, on one without colours, and in a pipe."""

import contextlib
import io
import os
import pty
import re
import subprocess
import sys
import tempfile
import unittest
from pathlib import Path

from bench.observation import Run
from bench.show.terminal import LiveDisplay
from bench.unit import Files, State
from tests.command_line import take_path

ROOT = Path(__file__).parents[2]


BUILD = ROOT / "build/default"
COLOR = re.compile(r"\x1b\[[0-9;]*m")


def command(*arguments: str) -> list[str]:
    return [sys.executable, "-B", "-m", "bench", "--build", str(BUILD), "--unit", "stand-in", *arguments]


def on_terminal(scenario: str, **variables: str) -> str:
    """What the run of `scenario` writes to a terminal."""
    plain = {name: value for name, value in os.environ.items() if name != "NO_COLOR"}
    ours, theirs = pty.openpty()
    with subprocess.Popen(
        command(scenario), env=plain | {"TERM": "xterm"} | variables, stdin=theirs, stdout=theirs, stderr=theirs
    ):
        os.close(theirs)
        text = b""
        while True:
            try:
                data = os.read(ours, 65536)
            except OSError:  # EIO: the other side is closed, see pty(7)
                break
            if not data:
                break
            text += data
    os.close(ours)
    return text.decode().replace("\r\n", "\n")


class HalfUnit:
    """A unit that has only a state."""

    def state(self) -> State:
        return State(package="1.2.0", board="", marker=True, stick=False, harl="unknown", updater="inactive")


class Display(unittest.TestCase):
    """The scenario has both waits, both services' changes and each colour except red."""

    def check_summary(self, text: str) -> None:
        summary = text[text.index("\nCommands\n"):]
        for line in (
            "Waits: 780 s in 2.6 s, 30 s in 0.2 s, 10 s in 0.2 s",
            "Outcome: updated",
            "Panel: PASS pass",
            "Sound: SND_RESULT_PASS.wav",
            "Package: 1.2.0 -> 1.3.0",
            "Board: 2.1.0 -> 2.2.0",
            "First-boot marker: gone",
            "Stick: released",
            "harl: active",
        ):
            self.assertIn(f"\n{line}\n", summary)
        self.assertRegex(summary, r"\n +\d+\.\d\d s +\d+\.\d\d s  apt --assume-yes install solvik4-rh\n")
        self.assertRegex(summary, r"\n +\d+\.\d\d s +ended  systemctl stop harl-updater\n")
        self.assertRegex(summary, r"\nUpdater: .+\nWall time: \d+\.\d s, set-up included\n$")

    def test_terminal(self) -> None:
        text = on_terminal("package-and-board")
        plain = COLOR.sub("", text)
        self.check_summary(plain)
        for seen in (
            "\x1b[1;34m", "\x1b[1;32m", "\x1b[2m", " REMOTE ", " PASS ", " FAIL ", " MAIN ", " 10 ", " 1d ", "●", "○"
        ):
            self.assertTrue(seen in text, seen)
        services = "harl: inactive   harl-updater: active   stick: mounted   board: 2.2.0   package: 1.3.0"
        self.assertTrue(services in plain)
        left = [int(found) for found in re.findall(r"waits 780 s, (\d+) s remain", plain)]
        self.assertGreater(len(left), 3)
        self.assertEqual(left, sorted(left, reverse=True))
        self.assertGreater(left[0], left[-1])
        # The part below the log is removed at the end.
        self.assertNotIn("│", plain[plain.rindex("\x1b[J"):])

    def test_terminal_without_colors(self) -> None:
        text = on_terminal("package-and-board", NO_COLOR="1")
        self.check_summary(text)
        self.assertIsNone(COLOR.search(text))
        self.assertRegex(text, r"│ +○ +○ +B")
        self.assertRegex(text, r"│ +○ +○ +○ +P ")

    def test_stick_released_and_board_not_read(self) -> None:
        shown = io.StringIO()
        with tempfile.TemporaryDirectory() as folder, contextlib.redirect_stdout(shown):
            nothing = Path(folder) / "none"
            LiveDisplay(HalfUnit()).show(Run(Files(nothing, nothing, nothing)), "")
        services = "harl: unknown   harl-updater: inactive   stick: not mounted   board: (cannot be read)   package: 1"
        self.assertIn(f"\n{services}.2.0\nThe updater between two commands\n", shown.getvalue())

    def test_dumb_terminal(self) -> None:
        self.assertNotIn("\x1b", on_terminal("up-to-date", TERM="dumb"))

    def test_pipe(self) -> None:
        variables = os.environ | {"TERM": "xterm"}
        done = subprocess.run(command("package-and-board"), env=variables, capture_output=True, text=True, check=False)
        self.assertEqual((done.returncode, done.stderr), (0, ""))
        self.check_summary(done.stdout)
        self.assertNotIn("\x1b", done.stdout)
        self.assertIn("    panel: REMOTE blue\n", done.stdout)
        self.assertIn("    panel: PASS pass\n", done.stdout)
        self.assertIn("Running command: ssh  -o ServerAliveInterval=4", done.stdout)


if __name__ == "__main__":
    BUILD = take_path()
    unittest.main()
