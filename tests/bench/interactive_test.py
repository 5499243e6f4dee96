"""Usage: interactive_test.py UNIT BUILD_FOLDER [TEST...]

bench/run --interactive in a terminal, on a unit of the kind UNIT: each key, whole stories, and that the terminal is
given back however it ends.
"""

import re
import signal
import sys
import tempfile
import time
import unittest
from pathlib import Path

from bench.makers.files import replace_text
from tests.bench.terminal import ROOT, Terminal
from tests.command_line import take_path, take_word

KIND, BUILD = "stand-in", ROOT / "build/default"
# Shows the cursor and leaves the terminal's second screen: terminfo's cnorm and rmcup of xterm.
GIVEN_BACK = (b"\x1b[?12l\x1b[?25h", b"\x1b[?1049l")
OUTCOME = "updates again"  # shown at the end of each update


class Interactive(unittest.TestCase):
    """A terminal with the bench unit in it."""

    def setUp(self) -> None:
        holder = tempfile.TemporaryDirectory()
        self.addCleanup(holder.cleanup)
        self.folder = Path(holder.name) / "bench"
        self.folder.mkdir()
        self._held = Path(holder.name) / "held"

    def bench(self, scenario: str, speed: int = 600, columns: int = 80, lines: int = 24, **variables: str) -> Terminal:
        """Starts the bench; the stand-in unit's commands take a minute each, `speed` times shorter."""
        words = ["--build", str(BUILD), "--unit", KIND, "--speed", str(speed), "--interactive", scenario]
        command = [sys.executable, "-B", "-m", "bench", *words]
        variables |= {"TMPDIR": str(self.folder), "BENCH_HOLD": str(self._held)}
        terminal = Terminal(command, variables, columns, lines)
        self.addCleanup(self.assert_cleared)
        self.enterContext(terminal)
        return terminal

    def hold(self, calls: str) -> None:
        """Lets the stand-in tools' calls that match this pattern of the shell wait, and those held before go on."""
        replace_text(self._held, f"{calls}\n")

    def let_go(self) -> None:
        """Lets the held calls go on."""
        self._held.unlink()

    def assert_cleared(self) -> None:
        """The unit is gone."""
        end = time.monotonic() + 10
        while list(self.folder.iterdir()) and time.monotonic() < end:
            time.sleep(0.05)
        self.assertEqual(list(self.folder.iterdir()), [])


class Keys(Interactive):
    """Each key, on a unit whose update has ended unless the key is for a running one."""

    def ended(self, speed: int = 3000) -> Terminal:
        """A terminal whose first update has ended."""
        terminal = self.bench("up-to-date", speed)
        terminal.wait_for("nothing to update", OUTCOME)
        return terminal

    def update_after(self, terminal: Terminal, key: str, word: str) -> str:
        """Presses the key, which is answered with `word`, updates again, and returns what is shown at the end."""
        terminal.press(key)
        terminal.wait_until(rf"(?m)^{word} *$")  # instead of the outcome
        terminal.press("u")
        return terminal.wait_for(OUTCOME)

    def test_stick(self) -> None:
        terminal = self.ended()
        shown = self.update_after(terminal, "s", "stick: out")
        self.assertRegex(shown, r"read the stick .* exit 2")
        self.update_after(terminal, "s", "stick: in")
        terminal.wait_for("nothing to update")

    def check_part(self, key: str, off: str, on: str, step: str, status: int) -> str:
        """The key takes a part away, which the step shows, and gives it back; the screen without the part."""
        terminal = self.ended()
        without = self.update_after(terminal, key, off)
        self.assertRegex(without, f"{step} .* exit {status}")
        self.assertRegex(self.update_after(terminal, key, on), rf"{step} +\d\.\d s(?!,)")
        return without

    def test_link(self) -> None:
        self.check_part("l", "link: down", "link: up", "read the board", 255)

    def test_board(self) -> None:
        self.check_part("b", "board: hangs", "board: works", "read the board", 255)

    def test_mirrors(self) -> None:
        without = self.check_part("m", "mirrors: down", "mirrors: up", "refresh the mirrors", 100)
        self.assertIn("the mirrors or a version could not be read", without)

    def test_sound(self) -> None:
        self.check_part("a", "sound: off", "sound: on", "play the pass sound", 1)

    def test_bus(self) -> None:
        terminal = self.ended()
        self.assertEqual(terminal.text().count("[P]"), 2)
        terminal.press("p", "p")  # the panel has been without power
        terminal.wait_for("power: on")
        self.assertNotIn("[P]", self.update_after(terminal, "i", "bus: down"))
        self.assertEqual(self.update_after(terminal, "i", "bus: up").count("[P]"), 2)

    def test_power(self) -> None:
        terminal = self.ended()
        terminal.press("p")
        shown = terminal.wait_for("everything on the head is dead", "harl inactive", "stick not mounted")
        self.assertNotIn("[P]", shown)
        terminal.press("u")
        terminal.wait_for("there is no power")
        terminal.press("p")
        terminal.wait_for("power on", "harl active", "stick mounted")

    def test_hang_and_kill_the_command(self) -> None:
        self.hold("apt update")
        terminal = self.bench("up-to-date", 3000)
        first = self.so_far(terminal, "refresh the mirrors")
        terminal.press("h")
        terminal.wait_for("hangs; h lets it continue")
        self.hold("apt-cache policy *")
        while self.so_far(terminal, "refresh the mirrors") < first + 1:
            pass
        terminal.press("h")
        terminal.wait_for("the command continues")
        self.so_far(terminal, "compare the package")
        terminal.press("k")
        terminal.wait_for("killed")
        terminal.wait_until(r"compare the package +\d+\.\d s, (signal 9|exit 137)")

    def so_far(self, terminal: Terminal, step: str) -> float:
        """How long the step has been running (s), as soon as that changes."""
        number = rf"{step} +(\d+\.\d) s so far"
        now = re.findall(number, terminal.wait_until(number))[0]
        return float(re.findall(number, terminal.wait_until(rf"{step} +(?!{re.escape(now)} )\d+\.\d s so far"))[0])

    def test_kill_the_updater(self) -> None:
        self.hold("apt update")
        terminal = self.bench("up-to-date")
        terminal.wait_until("refresh the mirrors .* so far")
        terminal.press("u")
        terminal.wait_for("the updater is already running")
        terminal.press("x")
        terminal.wait_until("The updater is not running", "skipped", "(signal 9|status 137): the panel shows no")
        self.let_go()
        for key, what in {"x": "the updater", "h": "no command", "k": "no command"}.items():
            terminal.press("+")
            terminal.wait_for("waits are")  # instead of the last answer
            terminal.press(key)
            terminal.wait_until(f"(?m)^{what} is (not )?running *$")
        terminal.press("u")
        terminal.wait_for("nothing to update")

    def test_speed(self) -> None:
        self.hold("ssh * /unzipUpgrade.sh")
        terminal = self.bench("board-only", 1000)
        terminal.wait_until("run the board's script .* so far")
        terminal.press(*"-------")  # seven times three times slower: 780 s take their time
        terminal.wait_for("waits are at full length")
        self.let_go()
        first, since = self.next_left(terminal), time.monotonic()
        passed = first - self.next_left(terminal)
        self.assertLessEqual(passed, 2 + 2 * (time.monotonic() - since))
        terminal.press(*"++++++++")
        terminal.wait_for("waits are 6561 times shorter")
        terminal.wait_for("updated", OUTCOME)

    def next_left(self, terminal: Terminal) -> int:
        """How many seconds of the wait are left, once it is another number than now."""
        number = r"wait for the board +(\d+) s left"
        now = re.findall(number, terminal.wait_until(number))[0]
        return int(re.findall(number, terminal.wait_until(rf"wait for the board +(?!{now} )\d+ s left"))[0])

    def test_shell(self) -> None:
        terminal = self.ended()
        terminal.press("!")
        terminal.wait_for("A shell on the head", "# ")
        terminal.press("echo $((6 * 7)) answers; apt-cache policy solvik4-rh\r")
        terminal.wait_for("42 answers", "Installed: 1.3.0")
        terminal.press("\x03")  # Ctrl-C is the shell's
        terminal.press("exit\r")
        terminal.wait_for("back from the shell", "The updater is not running")
        terminal.press("s")
        terminal.wait_for("stick: out")

    def test_end(self) -> None:
        terminal = self.ended()
        terminal.press("q")
        self.assertEqual(terminal.wait_for_end(), 0)
        self.assertRegex(terminal.text(), r"Update 1: (signal 15|status 143), panel REMOTE pass, MAIN pass")

    def test_other_keys_do_nothing(self) -> None:
        terminal = self.ended()
        terminal.press("z", "\x1b[A", "\x1b[15~", "ä", "\t", "s")
        terminal.wait_for("stick: out")


class GivenBack(Interactive):
    """The terminal is as before however the program ends, and the unit is gone."""

    def check(self, terminal: Terminal, status: int) -> None:
        self.assertEqual(terminal.wait_for_end(), status)
        for sequence in GIVEN_BACK:
            self.assertIn(sequence, terminal.written)
        # The modes of a pseudo-terminal stay when its program has ended.
        self.assertEqual(terminal.modes(), terminal.before)

    def running(self) -> Terminal:
        """A terminal, xterm, in which an update runs."""
        terminal = self.bench("up-to-date", TERM="xterm")
        terminal.wait_for("so far")
        self.assertNotEqual(terminal.modes()[3], terminal.before[3])
        return terminal

    def test_after_signals(self) -> None:
        for number, status in ((signal.SIGTERM, 143), (signal.SIGHUP, 129), (signal.SIGINT, 130)):
            with self.subTest(number):
                terminal = self.running()
                terminal.process.kill(number)
                self.check(terminal, status)

    def test_after_control_c(self) -> None:
        terminal = self.running()
        terminal.press("\x03")
        self.check(terminal, 130)

    def test_after_an_exception(self) -> None:
        terminal = self.running()
        [calls] = self.folder.glob("bench-*/calls")
        with calls.open("a") as file:
            file.write("no call\n")
        self.check(terminal, 1)
        self.assertIn("ValueError", terminal.text())

    def test_with_a_closed_terminal(self) -> None:
        terminal = self.running()
        terminal.process.ptyproc.fileobj.close()
        terminal.process.wait()
        self.assertEqual(terminal.process.exitstatus, 129)

    def test_from_the_shell(self) -> None:
        terminal = self.running()
        terminal.press("!")
        terminal.wait_for("A shell on the head", "# ")
        terminal.process.kill(signal.SIGTERM)
        self.assertEqual(terminal.wait_for_end(), 143)
        self.assertEqual(terminal.modes()[3], terminal.before[3])


class Terminals(Interactive):
    """Different terminals."""

    def test_colors(self) -> None:
        self.hold("apt update")
        terminal = self.bench("up-to-date", 3000)
        terminal.wait_for("[B]")
        self.let_go()
        terminal.wait_for("[P]", OUTCOME)
        self.assertLessEqual({"default", "green"}, terminal.colors())

    def test_without_colors(self) -> None:
        for name, value in (("NO_COLOR", "1"), ("TERM", "vt100")):
            with self.subTest(name):
                terminal = self.bench("up-to-date", 3000, 80, 24, **{name: value})
                terminal.wait_for("[P]", OUTCOME)
                self.assertEqual(terminal.colors(), {"default"})
                self.assertNotRegex(terminal.written, rb"\x1b\[[0-9;]*3[0-7][;m]")
                terminal.press("q")
                self.assertEqual(terminal.wait_for_end(), 0)

    def test_everything_fits(self) -> None:
        text = self.bench("up-to-date", 3000).wait_for(OUTCOME, "updater inactive")
        rows = text.splitlines()
        for row, begin in (
            (0, " up-to-date: "),
            (5, "harl active  updater inactive  stick not mounted  package 1.3.0  board "),
            (6, "power on  stick in  board works  link up  mirrors up  sound on  bus up"),
            (7, "The updater is not running: 0 of 11 steps skipped"),
            (22, "p power"),
            (23, "u update"),
        ):
            self.assertTrue(rows[row].startswith(begin), text)
        self.assertIn("q end", rows[23])
        self.assertIn("stopUpdater:", text)

    def test_small_and_large_terminals(self) -> None:
        for columns, lines in ((40, 10), (200, 60)):
            with self.subTest(columns):
                terminal = self.bench("up-to-date", 3000, columns, lines)
                terminal.wait_for("[P]")
                terminal.press("q")
                self.assertEqual(terminal.wait_for_end(), 0)

    def test_refused(self) -> None:
        for name in ("dumb", "unknown-to-all"):
            terminal = self.bench("up-to-date", TERM=name)
            self.assertEqual(terminal.wait_for_end(), 1)
            self.assertIn(f"a terminal of the type '{name}' is not known, or cannot move its cursor",
                          " ".join(terminal.text().split()))


class Stories(Interactive):
    """What a technician may try, from the beginning to the end."""

    def test_stick_pulled_in_the_upload_and_plugged_in_again(self) -> None:
        self.hold("scp *")
        terminal = self.bench("board-slow", 300)
        terminal.wait_until("upload to the board .* so far", "run the board's script")
        terminal.press("s")
        terminal.wait_for("stick: out")
        self.let_go()
        terminal.wait_until(r"try ([3-9]|1\d) of 20")
        self.hold("scp *")
        terminal.press("s")
        terminal.wait_for("stick: in")
        self.let_go()
        shown = terminal.wait_for("updated", OUTCOME)
        self.assertRegex(shown, r"upload, try ([3-9]|1\d) of 20 +\d+\.\d s ")
        self.assertIn("board 2.2.0", shown)
        self.assertIn("[P]", shown)

    def test_power_cut_in_the_installation_then_the_next_run(self) -> None:
        self.hold("apt --assume-yes install *")
        terminal = self.bench("package-database-locked", 300)
        terminal.wait_until("install the package .* so far")
        terminal.press("p")
        shown = terminal.wait_for("is dead", "harl inactive", "updater inactive", "stick not mounted")
        self.assertRegex(shown, r"install the package +cut short")
        self.assertNotIn("[B]", shown)
        [found] = re.findall(r"package (1\.[23]\.0)", shown)  # a package that is unpacked counts as installed
        terminal.press("p")
        terminal.wait_for("power on", "harl active", "stick mounted", "updater inactive")
        self.let_go()
        terminal.press("u")
        shown = terminal.wait_for(OUTCOME)
        if "could not be installed" in shown:  # the real dpkg knows that it was interrupted
            self.assertRegex(shown, r"install the package .* exit 100")
            terminal.press("!")
            terminal.wait_for("A shell on the head", "# ")
            terminal.press("dpkg --configure -a; exit\r")
            terminal.wait_for("back from the shell")
            terminal.press("s", "s", "u")  # the failed update has released the stick
            shown = terminal.wait_for(OUTCOME)
        self.assertIn("package 1.3.0", shown)
        self.assertIn("updated" if found == "1.2.0" else "nothing to update", shown)
        self.assertEqual("install the package" in shown, found == "1.2.0")
        self.assertIn("[P]", shown)
        terminal.press("q")
        terminal.wait_for_end()
        self.assertRegex(terminal.text(), "Update 1: power cut, panel (dark|REMOTE blue|MAIN blue)")
        self.assertRegex(terminal.text(), "Update [23]: (signal 15|status 143), panel (PASS|REMOTE pass, MAIN) pass")

    def test_board_that_hangs_then_its_link_is_cut(self) -> None:
        self.hold("scp *")
        terminal = self.bench("board-slow", 60)
        terminal.wait_until(r"upload to the board +([1-9]|\d\d)\.\d s so far")  # in a real unit's first copy
        terminal.press("b")
        terminal.wait_for("board: hangs")
        self.let_go()
        terminal.wait_until(r"upload to the board +([6-9]|\d\d)\.\d s so far")  # takes less without that
        terminal.press("l", "+", "+", "+")
        terminal.wait_for("link down")
        shown = terminal.wait_for("try 20 of 20", "the package or the board could not be installed", OUTCOME)
        self.assertRegex(shown, r"upload, try 20 of 20 +\d+\.\d s, exit ")
        self.assertRegex(shown, r"run the board's script +skipped")
        self.assertIn("play the fail sound", shown)
        self.assertIn("[F]", shown)
        self.assertIn("harl active", shown)


if __name__ == "__main__":
    KIND, BUILD = take_word(), take_path()
    unittest.main()
