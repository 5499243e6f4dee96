"""bench/run --interactive in a terminal, on a unit of the kind --unit: each key, whole stories, and that the terminal
is given back however it ends."""

import contextlib
import re
import signal
import sys
import time
from collections.abc import Iterator
from pathlib import Path

import pytest

from bench.makers.files import replace_text
from tests.bench.terminal import Terminal

# Shows the cursor and leaves the terminal's second screen: terminfo's cnorm and rmcup of xterm.
GIVEN_BACK = (b"\x1b[?12l\x1b[?25h", b"\x1b[?1049l")
OUTCOME = "updates again"  # shown at the end of each update


class Bench:
    """Terminals with a bench unit in them, in `folder`."""

    def __init__(self, folder: Path, arguments: list[str], terminals: contextlib.ExitStack) -> None:
        self.folder = folder / "bench"
        self.folder.mkdir()
        self._held = folder / "held"
        self._arguments = arguments
        self._terminals = terminals

    def start(self, scenario: str, speed: int = 600, columns: int = 80, lines: int = 24, **variables: str) -> Terminal:
        """Starts the bench; the stand-in unit's commands take a minute each, `speed` times shorter."""
        words = [*self._arguments, "--speed", str(speed), "--interactive", scenario]
        command = [sys.executable, "-B", "-m", "bench", *words]
        variables |= {"TMPDIR": str(self.folder), "BENCH_HOLD": str(self._held)}
        terminal = Terminal(command, variables, columns, lines)
        self._terminals.callback(self.check_cleared)
        return self._terminals.enter_context(terminal)

    def hold(self, calls: str) -> None:
        """Lets the stand-in tools' calls that match this pattern of the shell wait, and those held before go on."""
        replace_text(self._held, f"{calls}\n")

    def let_go(self) -> None:
        """Lets the held calls go on."""
        self._held.unlink()

    def check_cleared(self) -> None:
        """The unit is gone."""
        end = time.monotonic() + 10
        while list(self.folder.iterdir()) and time.monotonic() < end:
            time.sleep(0.05)
        assert list(self.folder.iterdir()) == []

    def ended(self, speed: int = 3000) -> Terminal:
        """A terminal whose first update has ended."""
        terminal = self.start("up-to-date", speed)
        terminal.wait_for("nothing to update", OUTCOME)
        return terminal

    def update_after(self, terminal: Terminal, key: str, word: str) -> str:
        """Presses the key, which is answered with `word`, updates again, and returns what is shown at the end."""
        terminal.press(key)
        terminal.wait_until(rf"(?m)^{word} *$")  # instead of the outcome
        terminal.press("u")
        return terminal.wait_for(OUTCOME)

    def check_part(self, key: str, off: str, on: str, step: str, status: int) -> str:
        """The key takes a part away, which the step shows, and gives it back; the screen without the part."""
        terminal = self.ended()
        without = self.update_after(terminal, key, off)
        assert re.search(f"{step} .* exit {status}", without)
        assert re.search(rf"{step} +\d\.\d s(?!,)", self.update_after(terminal, key, on))
        return without

    def running(self) -> Terminal:
        """A terminal, xterm, in which an update runs."""
        terminal = self.start("up-to-date", TERM="xterm")
        terminal.wait_for("so far")
        assert terminal.modes()[3] != terminal.before[3]
        return terminal


@pytest.fixture
def bench(tmp_path: Path, build: Path, pytestconfig: pytest.Config) -> Iterator[Bench]:
    """Ends what still runs after the test, and looks whether the units are gone."""
    with contextlib.ExitStack() as terminals:
        yield Bench(tmp_path, ["--build", str(build), "--unit", pytestconfig.getoption("unit")], terminals)


def so_far(terminal: Terminal, step: str) -> float:
    """How long the step has been running (s), as soon as that changes."""
    number = rf"{step} +(\d+\.\d) s so far"
    now = re.findall(number, terminal.wait_until(number))[0]
    return float(re.findall(number, terminal.wait_until(rf"{step} +(?!{re.escape(now)} )\d+\.\d s so far"))[0])


def next_left(terminal: Terminal) -> int:
    """How many seconds of the wait are left, once it is another number than now."""
    number = r"wait for the board +(\d+) s left"
    now = re.findall(number, terminal.wait_until(number))[0]
    return int(re.findall(number, terminal.wait_until(rf"wait for the board +(?!{now} )\d+ s left"))[0])


def check_given_back(terminal: Terminal, status: int) -> None:
    assert terminal.wait_for_end() == status
    for sequence in GIVEN_BACK:
        assert sequence in terminal.written
    # The modes of a pseudo-terminal stay when its program has ended.
    assert terminal.modes() == terminal.before


class TestKeys:
    """Each key, on a unit whose update has ended unless the key is for a running one."""

    def test_stick(self, bench: Bench) -> None:
        terminal = bench.ended()
        shown = bench.update_after(terminal, "s", "stick: out")
        assert re.search(r"read the stick .* exit 2", shown)
        bench.update_after(terminal, "s", "stick: in")
        terminal.wait_for("nothing to update")

    def test_link(self, bench: Bench) -> None:
        bench.check_part("l", "link: down", "link: up", "read the board", 255)

    def test_board(self, bench: Bench) -> None:
        bench.check_part("b", "board: hangs", "board: works", "read the board", 255)

    def test_mirrors(self, bench: Bench) -> None:
        without = bench.check_part("m", "mirrors: down", "mirrors: up", "refresh the mirrors", 100)
        assert "the mirrors or a version could not be read" in without

    def test_sound(self, bench: Bench) -> None:
        bench.check_part("a", "sound: off", "sound: on", "play the pass sound", 1)

    def test_bus(self, bench: Bench) -> None:
        terminal = bench.ended()
        assert terminal.text().count("[P]") == 2
        terminal.press("p", "p")  # the panel has been without power
        terminal.wait_for("power: on")
        assert "[P]" not in bench.update_after(terminal, "i", "bus: down")
        assert bench.update_after(terminal, "i", "bus: up").count("[P]") == 2

    def test_power(self, bench: Bench) -> None:
        terminal = bench.ended()
        terminal.press("p")
        shown = terminal.wait_for("everything on the head is dead", "harl inactive", "stick not mounted")
        assert "[P]" not in shown
        terminal.press("u")
        terminal.wait_for("there is no power")
        terminal.press("p")
        terminal.wait_for("power on", "harl active", "stick mounted")

    def test_hang_and_kill_the_command(self, bench: Bench) -> None:
        bench.hold("apt update")
        terminal = bench.start("up-to-date", 3000)
        first = so_far(terminal, "refresh the mirrors")
        terminal.press("h")
        terminal.wait_for("hangs; h lets it continue")
        bench.hold("apt-cache policy *")
        while so_far(terminal, "refresh the mirrors") < first + 1:
            pass
        terminal.press("h")
        terminal.wait_for("the command continues")
        so_far(terminal, "compare the package")
        terminal.press("k")
        terminal.wait_for("killed")
        terminal.wait_until(r"compare the package +\d+\.\d s, (signal 9|exit 137)")

    def test_kill_the_updater(self, bench: Bench) -> None:
        bench.hold("apt update")
        terminal = bench.start("up-to-date")
        terminal.wait_until("refresh the mirrors .* so far")
        terminal.press("u")
        terminal.wait_for("the updater is already running")
        terminal.press("x")
        terminal.wait_until("The updater is not running", "skipped", "(signal 9|status 137): the panel shows no")
        bench.let_go()
        for key, what in {"x": "the updater", "h": "no command", "k": "no command"}.items():
            terminal.press("+")
            terminal.wait_for("waits are")  # instead of the last answer
            terminal.press(key)
            terminal.wait_until(f"(?m)^{what} is (not )?running *$")
        terminal.press("u")
        terminal.wait_for("nothing to update")

    def test_speed(self, bench: Bench) -> None:
        bench.hold("ssh * /unzipUpgrade.sh")
        terminal = bench.start("board-only", 1000)
        terminal.wait_until("run the board's script .* so far")
        terminal.press(*"-------")  # seven times three times slower: 780 s take their time
        terminal.wait_for("waits are at full length")
        bench.let_go()
        first, since = next_left(terminal), time.monotonic()
        passed = first - next_left(terminal)
        assert passed <= 2 + 2 * (time.monotonic() - since)
        terminal.press(*"++++++++")
        terminal.wait_for("waits are 6561 times shorter")
        terminal.wait_for("updated", OUTCOME)

    def test_shell(self, bench: Bench) -> None:
        terminal = bench.ended()
        terminal.press("!")
        terminal.wait_for("A shell on the head", "# ")
        terminal.press("echo $((6 * 7)) answers; apt-cache policy solvik4-rh\r")
        terminal.wait_for("42 answers", "Installed: 1.3.0")
        terminal.press("\x03")  # Ctrl-C is the shell's
        terminal.press("exit\r")
        terminal.wait_for("back from the shell", "The updater is not running")
        terminal.press("s")
        terminal.wait_for("stick: out")

    def test_end(self, bench: Bench) -> None:
        terminal = bench.ended()
        terminal.press("q")
        assert terminal.wait_for_end() == 0
        assert re.search(r"Update 1: (signal 15|status 143), panel REMOTE pass, MAIN pass", terminal.text())

    def test_other_keys_do_nothing(self, bench: Bench) -> None:
        terminal = bench.ended()
        terminal.press("z", "\x1b[A", "\x1b[15~", "ä", "\t", "s")
        terminal.wait_for("stick: out")


class TestGivenBack:
    """The terminal is as before however the program ends, and the unit is gone."""

    @pytest.mark.parametrize("name, status", [("SIGTERM", 143), ("SIGHUP", 129), ("SIGINT", 130)])
    def test_after_signal(self, bench: Bench, name: str, status: int) -> None:
        terminal = bench.running()
        terminal.process.kill(signal.Signals[name])
        check_given_back(terminal, status)

    def test_after_control_c(self, bench: Bench) -> None:
        terminal = bench.running()
        terminal.press("\x03")
        check_given_back(terminal, 130)

    def test_after_an_exception(self, bench: Bench) -> None:
        terminal = bench.running()
        [calls] = bench.folder.glob("bench-*/calls")
        with calls.open("a") as file:
            file.write("no call\n")
        check_given_back(terminal, 1)
        assert "ValueError" in terminal.text()

    def test_with_a_closed_terminal(self, bench: Bench) -> None:
        terminal = bench.running()
        terminal.process.ptyproc.fileobj.close()
        terminal.process.wait()
        assert terminal.process.exitstatus == 129

    def test_from_the_shell(self, bench: Bench) -> None:
        terminal = bench.running()
        terminal.press("!")
        terminal.wait_for("A shell on the head", "# ")
        terminal.process.kill(signal.SIGTERM)
        assert terminal.wait_for_end() == 143
        assert terminal.modes()[3] == terminal.before[3]


class TestTerminals:
    """Different terminals."""

    def test_colors(self, bench: Bench) -> None:
        bench.hold("apt update")
        terminal = bench.start("up-to-date", 3000)
        terminal.wait_for("[B]")
        bench.let_go()
        terminal.wait_for("[P]", OUTCOME)
        assert {"default", "green"} <= terminal.colors()

    @pytest.mark.parametrize("name, value", [("NO_COLOR", "1"), ("TERM", "vt100")])
    def test_without_colors(self, bench: Bench, name: str, value: str) -> None:
        terminal = bench.start("up-to-date", 3000, 80, 24, **{name: value})
        terminal.wait_for("[P]", OUTCOME)
        assert terminal.colors() == {"default"}
        assert not re.search(rb"\x1b\[[0-9;]*3[0-7][;m]", terminal.written)
        terminal.press("q")
        assert terminal.wait_for_end() == 0

    def test_everything_fits(self, bench: Bench) -> None:
        text = bench.start("up-to-date", 3000).wait_for(OUTCOME, "updater inactive")
        rows = text.splitlines()
        for row, begin in (
            (0, " up-to-date: "),
            (5, "harl active  updater inactive  stick not mounted  package 1.3.0  board "),
            (6, "power on  stick in  board works  link up  mirrors up  sound on  bus up"),
            (7, "The updater is not running: 0 of 11 steps skipped"),
            (22, "p power"),
            (23, "u update"),
        ):
            assert rows[row].startswith(begin), text
        assert "q end" in rows[23]
        assert "stopUpdater:" in text

    @pytest.mark.parametrize("columns, lines", [(40, 10), (200, 60)])
    def test_small_or_large_terminal(self, bench: Bench, columns: int, lines: int) -> None:
        terminal = bench.start("up-to-date", 3000, columns, lines)
        terminal.wait_for("[P]")
        terminal.press("q")
        assert terminal.wait_for_end() == 0

    @pytest.mark.parametrize("name", ["dumb", "unknown-to-all"])
    def test_refused(self, bench: Bench, name: str) -> None:
        terminal = bench.start("up-to-date", TERM=name)
        assert terminal.wait_for_end() == 1
        assert f"a terminal of the type '{name}' is not known, or cannot move its cursor" in " ".join(
            terminal.text().split()
        )


class TestStories:
    """What a technician may try, from the beginning to the end."""

    def test_stick_pulled_in_the_upload_and_plugged_in_again(self, bench: Bench) -> None:
        bench.hold("scp *")
        terminal = bench.start("board-slow", 300)
        terminal.wait_until("upload to the board .* so far", "run the board's script")
        terminal.press("s")
        terminal.wait_for("stick: out")
        bench.let_go()
        terminal.wait_until(r"try ([3-9]|1\d) of 20")
        bench.hold("scp *")
        terminal.press("s")
        terminal.wait_for("stick: in")
        bench.let_go()
        shown = terminal.wait_for("updated", OUTCOME)
        assert re.search(r"upload, try ([3-9]|1\d) of 20 +\d+\.\d s ", shown)
        assert "board 2.2.0" in shown
        assert "[P]" in shown

    def test_power_cut_in_the_installation_then_the_next_run(self, bench: Bench) -> None:
        bench.hold("apt --assume-yes install *")
        terminal = bench.start("package-database-locked", 300)
        terminal.wait_until("install the package .* so far")
        terminal.press("p")
        shown = terminal.wait_for("is dead", "harl inactive", "updater inactive", "stick not mounted")
        assert re.search(r"install the package +cut short", shown)
        assert "[B]" not in shown
        [found] = re.findall(r"package (1\.[23]\.0)", shown)  # a package that is unpacked counts as installed
        terminal.press("p")
        terminal.wait_for("power on", "harl active", "stick mounted", "updater inactive")
        bench.let_go()
        terminal.press("u")
        shown = terminal.wait_for(OUTCOME)
        if "could not be installed" in shown:  # the real dpkg knows that it was interrupted
            assert re.search(r"install the package .* exit 100", shown)
            terminal.press("!")
            terminal.wait_for("A shell on the head", "# ")
            terminal.press("dpkg --configure -a; exit\r")
            terminal.wait_for("back from the shell")
            terminal.press("s", "s", "u")  # the failed update has released the stick
            shown = terminal.wait_for(OUTCOME)
        assert "package 1.3.0" in shown
        assert ("updated" if found == "1.2.0" else "nothing to update") in shown
        assert ("install the package" in shown) == (found == "1.2.0")
        assert "[P]" in shown
        terminal.press("q")
        terminal.wait_for_end()
        assert re.search("Update 1: power cut, panel (dark|REMOTE blue|MAIN blue)", terminal.text())
        assert re.search("Update [23]: (signal 15|status 143), panel (PASS|REMOTE pass, MAIN) pass", terminal.text())

    def test_board_that_hangs_then_its_link_is_cut(self, bench: Bench) -> None:
        bench.hold("scp *")
        terminal = bench.start("board-slow", 60)
        terminal.wait_until(r"upload to the board +([1-9]|\d\d)\.\d s so far")  # in a real unit's first copy
        terminal.press("b")
        terminal.wait_for("board: hangs")
        bench.let_go()
        terminal.wait_until(r"upload to the board +([6-9]|\d\d)\.\d s so far")  # takes less without that
        terminal.press("l", "+", "+", "+")
        terminal.wait_for("link down")
        shown = terminal.wait_for("try 20 of 20", "the package or the board could not be installed", OUTCOME)
        assert re.search(r"upload, try 20 of 20 +\d+\.\d s, exit ", shown)
        assert re.search(r"run the board's script +skipped", shown)
        assert "play the fail sound" in shown
        assert "[F]" in shown
        assert "harl active" in shown
