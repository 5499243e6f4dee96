"""Usage: display_test.py BUILD_FOLDER

What bench/run shows of a run: on a terminal, on one without colours, and in a pipe."""

import os
import re
import subprocess
import sys
import unittest

from tests.bench.terminal import ROOT, Terminal
from tests.command_line import take_path

BUILD = ROOT / "build/default"
COLOR = re.compile(r"\x1b\[[0-9;]*3[0-7][0-9;]*m")


def command(*arguments: str) -> list[str]:
    return [sys.executable, "-B", "-m", "bench", "--build", str(BUILD), "--unit", "stand-in", *arguments]


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

    def on_terminal(self, *texts: str, **variables: str) -> str:
        """What a run writes that shows all these texts at once."""
        with Terminal(command("package-and-board"), variables) as terminal:
            terminal.wait_for(*texts)
            terminal.wait_for_end()
        return terminal.written.decode().replace("\r\n", "\n")

    def test_terminal(self) -> None:
        services = "harl inactive  updater active  stick mounted  package 1.3.0  board 2.2.0"
        text = self.on_terminal("[B]", services, "wait for the board", "s left")
        self.check_summary(re.sub(r"\x1b\[[0-9;]*m", "", text))
        self.assertRegex(text, COLOR)
        self.assertIn("\n\t\t\tBEFORE UPDATE\n", text)  # the log stays on the terminal

    def test_terminal_without_colors(self) -> None:
        text = self.on_terminal("[P]", NO_COLOR="1")
        self.check_summary(text)
        self.assertNotRegex(text, COLOR)

    def test_terminal_that_cannot_move_its_cursor(self) -> None:
        for name in ("dumb", "unknown-to-all"):
            text = self.on_terminal("Wall time", TERM=name)
            self.check_summary(text)
            self.assertNotIn("\x1b", text)

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
