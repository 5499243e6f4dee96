"""Usage: log_command_test.py TOOL

Runs `harl-updater-tool log` as people do: what it prints, where it reads from, and what it says of bad input.
"""

import fcntl
import json
import os
import pty
import resource
import select
import signal
import struct
import subprocess
import tempfile
import termios
import time
import unittest
from html.parser import HTMLParser
from pathlib import Path
from typing import IO, Any

from bench import scenario
from tests.command_line import take_path

ROOT = Path(__file__).resolve().parents[3]
GOLDEN = ROOT / "tests/companion/golden/log"
TOOL = ""


def run_tool(*arguments: str, text: bytes = b"", **options: Any) -> subprocess.CompletedProcess[bytes]:
    """Runs `harl-updater-tool log` where the golden files lie, with `text` as its input."""
    command = [TOOL, "log", *arguments]
    return subprocess.run(command, cwd=GOLDEN, input=text, capture_output=True, timeout=60, check=False, **options)


class Base(unittest.TestCase):
    """A folder for each test."""

    def setUp(self) -> None:
        folder = tempfile.TemporaryDirectory(prefix="log-test-")
        self.addCleanup(folder.cleanup)
        self.folder = Path(folder.name)

    def program(self, name: str, script: str) -> str:
        """Makes an executable in a folder of its own; returns that folder."""
        file = self.folder / "bin" / name
        file.parent.mkdir(exist_ok=True)
        file.write_text(f"#!/bin/sh\n{script}")
        file.chmod(0o755)
        return str(file.parent)


class Outcomes(Base):
    """The bench knows what the panel showed: the tool must tell the same."""

    def test_panel_and_sound_are_those_of_each_scenario(self) -> None:
        for name in scenario.names():
            what = scenario.load(name)
            if what.setup.updater.program != "remote":
                continue
            with self.subTest(name):
                [run] = json.loads(run_tool(f"{name}.log", "--json").stdout)["runs"]
                self.assertEqual(run["panel"], what.expect.panel)
                self.assertEqual(run["sound"], what.expect.sound)

    def test_versions_are_those_of_each_scenario(self) -> None:
        for name in scenario.names():
            what = scenario.load(name)
            [run] = json.loads(run_tool(f"{name}.log", "--json").stdout)["runs"]
            with self.subTest(name):
                if run["package"]["read"]:
                    self.assertEqual(run["package"]["from"], what.setup.package.installed)
                    self.assertEqual(run["package"]["to"], what.setup.package.offered)
                if run["board"]["read"]:
                    self.assertEqual(run["board"]["from"], what.setup.board.installed)
                    self.assertEqual(run["board"]["to"], min(what.setup.stick.directories)[5:])

    def test_status_tells_whether_the_last_run_went_well(self) -> None:
        good, bad = "package-and-board.log", "mirrors-fail.log"
        self.assertEqual(run_tool(good).returncode, 0)
        self.assertEqual(run_tool(bad).returncode, 1)
        both = [(GOLDEN / name).read_bytes() for name in (bad, good)]
        self.assertEqual(run_tool(text=both[0] + both[1]).returncode, 0)
        self.assertEqual(run_tool(text=both[1] + both[0]).returncode, 1)


class Blindness(Base):
    """The panel passes over units that are not well: the log says so of each."""

    def test_log_names_what_the_panel_passes_over(self) -> None:
        record = b"verify: the unit is not well: package-version\n"  # by the service, of each such unit
        passed, named, left_open = 0, 0, []
        for name in scenario.names():
            what = scenario.load(name)
            setup, expect = what.setup, what.expect
            if setup.updater.program != "remote" or "pass" not in expect.panel.values():
                continue
            passed += 1
            on_stick = min(setup.stick.directories, default="")[5:]
            if (expect.package, expect.board, expect.harl) == (setup.package.offered, on_stick, "active"):
                continue
            with self.subTest(name):
                log = (GOLDEN / f"{name}.log").read_bytes()
                done = run_tool("--json", "--strict", text=log)
                [run] = json.loads(done.stdout)["runs"]
                if run["failure"] or run["besides"]:
                    named += 1
                    self.assertEqual(done.returncode, 1)
                else:  # the updater was told that a command which was killed had done its work
                    left_open.append(name)
                    self.assertTrue([text for text in run["cannot_tell"] if "really installed" in text])
                done = run_tool("--json", text=log + record)
                self.assertEqual(done.returncode, 1)
                self.assertIn("not well: package-version", json.loads(done.stdout)["runs"][0]["meaning"])
        print(f"the panel passes in {passed} scenarios, in {named + len(left_open)} of them over a unit that is not "
              f"well: the log names what is wrong in {named}; left open: {left_open}, by the verification's record")
        self.assertEqual(left_open, ["apt-killed"])


class Pieces(Base):
    """Logs of which next to nothing is left."""

    def test_only_the_feedback_is_left(self) -> None:
        log = (GOLDEN / "aplay-missing.log").read_bytes()
        start = log.rindex(b"Updater |", 0, log.index(b"Failed to play a sound"))
        piece = log[start : log.index(b"\n", log.index(b"Failed to play a sound")) + 1]
        self.assertEqual(piece.count(b"Updater |"), 1)
        done = run_tool(text=piece)
        self.assertEqual(done.returncode, 1)
        self.assertIn(b"Also: a step that is not in this log [sound-failed]", done.stdout)
        [problem] = json.loads(run_tool("--json", text=piece).stdout)["runs"][0]["besides"]
        self.assertEqual((problem["name"], problem["step"], problem["line"]), ("sound-failed", None, None))
        page = self.folder / "page.html"
        self.assertEqual(run_tool("--html", str(page), text=piece).returncode, 1)
        self.assertIn("a step that is not in this log [sound-failed]</b>", page.read_text())

    def test_each_record_alone(self) -> None:
        log = (GOLDEN / "journal-short-board-disk-full.log").read_bytes()
        lines = log.splitlines(keepends=True)
        for name in ("panel-absent", "services-killed", "main-head-all", "upload-not-waited-for"):
            lines += (GOLDEN / f"{name}.log").read_bytes().splitlines(keepends=True)
        alone = {lines[index] + lines[index + 1] for index in range(len(lines) - 1) if b"Updater |" in lines[index]}
        kinds = {line[line.index(b"(") :] if b"(" in line else line: line for line in alone}
        for piece in kinds.values():
            with self.subTest(piece):
                self.assertIn(run_tool(text=piece).returncode, (0, 1))


class BadInput(Base):
    """One clear line on standard error, and status 2."""

    def refused(self, *arguments: str, text: bytes = b"", **options: Any) -> str:
        done = run_tool(*arguments, text=text, **options)
        self.assertEqual(done.returncode, 2)
        self.assertEqual(done.stderr.count(b"\n"), 1, done.stderr)
        return done.stderr.decode()

    def test_missing_file(self) -> None:
        self.assertEqual(self.refused("none.log"), "harl-updater-tool: none.log: No such file or directory\n")

    def test_folder(self) -> None:
        self.assertIn("a folder; name a file in it", self.refused("."))

    def test_name_is_shown_escaped(self) -> None:
        self.assertIn(r"a\nb\x1b: No such file", self.refused("a\nb\x1b"))

    def test_no_record(self) -> None:
        self.assertIn("standard input: no record of the updater in 2 lines, 4 bytes", self.refused(text=b"a\nb\n"))
        self.assertIn("no record of the updater in 0 lines", self.refused())

    def test_other_formats_are_named(self) -> None:
        for start, advice in ((b"LPKSHHRH", "journalctl --file"), (b"\x1f\x8b\x08", "zcat"), (b"\xfd7zXZ\0", "xzcat"),
                              (b"\xff\xfeU\0", "UTF-16")):
            self.assertIn("byte 0, line 1: no log but ", self.refused(text=start))
            self.assertIn(advice, self.refused(text=start))

    def test_json_tells_it_too(self) -> None:
        done = run_tool("--json", text=b"a\n")
        self.assertEqual(json.loads(done.stdout)["runs"], [])
        self.assertIn("no record", json.loads(done.stdout)["error"])

    def test_missing_journalctl(self) -> None:
        message = self.refused("--journal", env={"PATH": str(self.folder)})
        self.assertIn("journalctl is not on the search path", message)

    def test_failing_journalctl(self) -> None:
        message = self.refused("--journal", env={"PATH": self.program("journalctl", "exit 3")})
        self.assertIn("journalctl ended with status 3. Run it as root", message)

    def test_empty_journal(self) -> None:
        for arguments in (["--journal"], ["--journal", "--follow"]):
            message = self.refused(*arguments, env={"PATH": self.program("journalctl", "")})
            self.assertIn("the service has not run since the journal begins", message)
            self.assertIn("Run it as root", message)

    def test_wrong_usage(self) -> None:
        for arguments in (["--journal", "a.log"], ["--follow", "--html", "x"], ["--nonsense"], ["a", "b"]):
            self.assertEqual(run_tool(*arguments).returncode, 2, arguments)

    def test_page_is_kept_when_the_log_is_bad(self) -> None:
        page = self.folder / "page.html"
        page.write_text("old")
        self.refused("--html", str(page), text=b"no record\n")
        self.assertEqual(page.read_text(), "old")
        self.assertEqual([file.name for file in self.folder.iterdir()], ["page.html"])

    def test_page_in_the_place_of_the_log_is_refused(self) -> None:
        log = self.folder / "u.log"
        text = (GOLDEN / "up-to-date.log").read_bytes()
        log.write_bytes(text)
        (self.folder / "same").hardlink_to(log)
        (self.folder / "link").symlink_to(log)
        for page in (log, self.folder / "same"):
            self.assertIn("the log itself; name another file", self.refused("--html", str(page), str(log)))
        with log.open("rb") as stream:
            done = subprocess.run([TOOL, "log", "--html", str(log)], stdin=stream, capture_output=True, check=False)
        self.assertEqual(done.returncode, 2)
        for page in (self.folder / "link", self.folder):
            self.assertIn("not a plain file; name another", self.refused("--html", str(page), str(log)))
        self.assertEqual(log.read_bytes(), text)
        self.assertEqual({file.name for file in self.folder.iterdir()}, {"u.log", "same", "link"})

    def test_page_replaces_no_other_file(self) -> None:
        page, part = self.folder / "page.html", self.folder / "page.html.part"
        part.write_text("mine")
        self.assertEqual(run_tool("up-to-date.log", "--html", str(page), umask=0o027).returncode, 0)
        self.assertTrue(page.read_text().startswith("<!DOCTYPE html>"))
        self.assertEqual(page.stat().st_mode & 0o777, 0o640)
        page.write_text("old" * 100_000)
        self.assertEqual(run_tool("up-to-date.log", "--html", str(page)).returncode, 0)
        self.assertTrue(page.read_text().endswith("</html>\n"))
        self.assertEqual(part.read_text(), "mine")
        self.assertEqual({file.name for file in self.folder.iterdir()}, {page.name, part.name})

    def test_nothing_is_left_of_a_page_when_a_signal_ends_it(self) -> None:
        for number in (signal.SIGHUP, signal.SIGINT, signal.SIGTERM, signal.SIGPIPE, signal.SIGKILL):
            command = [TOOL, "log", "--html", str(self.folder / "page.html")]
            with subprocess.Popen(command, stdin=subprocess.PIPE, stdout=subprocess.DEVNULL,
                                  env={"TMPDIR": str(self.folder)},
                                  preexec_fn=None if number == signal.SIGKILL else
                                  lambda: signal.signal(number, signal.SIG_DFL)) as tool:
                assert tool.stdin
                tool.stdin.write((GOLDEN / "up-to-date.log").read_bytes())
                tool.stdin.flush()
                self.await_read(tool)
                tool.send_signal(number)
                self.assertEqual(tool.wait(30), -number)
            self.assertEqual(list(self.folder.iterdir()), [])

    def await_read(self, tool: subprocess.Popen[bytes]) -> None:
        """Waits until the tool has read what was written to it."""
        assert tool.stdin
        deadline = time.monotonic() + 30
        while struct.unpack("i", fcntl.ioctl(tool.stdin, termios.FIONREAD, bytes(4))) != (0,):
            self.assertLess(time.monotonic(), deadline)
            time.sleep(0.01)

    def test_page_that_cannot_be_written(self) -> None:
        done = run_tool("up-to-date.log", "--html", str(self.folder / "none/page.html"))
        self.assertEqual(done.returncode, 2)
        self.assertIn(b"page.html: No such file or directory", done.stderr)


class Advice(Base):
    """What is said of a run that was cut."""

    def test_panel_that_does_not_flash_any_more_is_not_asked_for(self) -> None:
        for name in ("package-and-board", "up-to-date"):
            lines = (GOLDEN / f"{name}.log").read_bytes().splitlines(keepends=True)
            shown = next(i for i, line in enumerate(lines) if b"resultCallback" in line)
            for length in range(2, len(lines)):
                with self.subTest(name, length=length):
                    said = b" ".join(run_tool(text=b"".join(lines[:length])).stdout.split())
                    self.assertEqual(b"still flashes blue" in said, length <= shown, said)


class Unit(Base):
    """The journal of the service, through journalctl."""

    def test_journal_is_explained(self) -> None:
        script = f'echo "$@" >"{self.folder}/arguments"; /bin/cat "{GOLDEN}/up-to-date.log"\n'
        folder = self.program("journalctl", script)
        done = run_tool("--journal", env={"PATH": folder})
        self.assertEqual(done.returncode, 0)
        self.assertIn(b"Run 1 of the journal of harl-updater, lines 1 to ", done.stdout)
        self.assertIn("--unit=harl-updater", (self.folder / "arguments").read_text())

    def test_follow_ends_journalctl(self) -> None:
        log = (GOLDEN / "up-to-date.log").read_text().splitlines(keepends=True)
        (self.folder / "a").write_text("".join(log[:60]))
        (self.folder / "b").write_text("".join(log[60:]))
        script = f'/bin/cat "{self.folder}/a"; /bin/sleep 1; /bin/cat "{self.folder}/b"; exec /bin/sleep 100\n'
        folder = self.program("journalctl", script)
        done = run_tool("--journal", "--follow", env={"PATH": folder})
        self.assertEqual(done.returncode, 0)
        self.assertTrue(done.stdout.decode().splitlines()[-1].startswith("Ended at "), done.stdout)


class Width(Base):
    """Lines are as long as the terminal is wide, and 100 columns at most where there is none."""

    def lines(self, *arguments: str, columns: int = 0) -> list[str]:
        master, slave = pty.openpty()
        fcntl.ioctl(slave, termios.TIOCSWINSZ, struct.pack("HHHH", 24, columns, 0, 0))
        text = b""
        with (self.folder / "output").open("wb+") as output:
            with subprocess.Popen([TOOL, *arguments], stdout=slave if columns else output, cwd=GOLDEN) as tool:
                os.close(slave)
                while columns and (some := self.read(master)):
                    text += some
                tool.wait()
            os.close(master)
            output.seek(0)
            return (text or output.read()).decode().splitlines()

    def read(self, terminal: int) -> bytes:
        """What comes; nothing at the end, which a terminal tells by an error."""
        try:
            return os.read(terminal, 65536)
        except OSError:
            return b""

    def test_every_command_wraps(self) -> None:
        (self.folder / "debs").mkdir()
        commands = [("explain",), ("log", "board-upload-fails.log"), ("verify",)]
        commands += [(name, str(self.folder)) for name in ("stick", "check")]
        for command in commands:
            for columns in (0, 60, 140):
                with self.subTest(command, columns=columns):
                    lines = self.lines(*command, columns=columns)
                    self.assertTrue(lines)
                    for line in lines:
                        longest_word = max(len(word) for word in line.split() or [""])
                        self.assertLessEqual(len(line), max(columns or 100, longest_word + 15), line)


class Input(Base):
    """Standard input."""

    def test_wait_for_a_terminal_is_told(self) -> None:
        master, slave = pty.openpty()
        with subprocess.Popen([TOOL, "log"], stdin=slave, stdout=subprocess.PIPE, stderr=subprocess.PIPE) as tool:
            os.close(slave)
            assert tool.stderr
            self.assertEqual(tool.stderr.readline(), b"harl-updater-tool: reading the log from the terminal; end it "
                                                     b"with Ctrl-D.\n")
            os.write(master, b"\x04")
            self.assertEqual(tool.wait(30), 2)
        os.close(master)


class Follow(Base):
    """A run that goes on."""

    def follow(
        self, lines: list[bytes], *arguments: str, cut: int, terminal: tuple[int, int] | None = None
    ) -> tuple[int, bytes]:
        """Follows a file that holds the first `cut` lines; the rest comes once something of them has been shown.

        `terminal`, both sides of one, takes the output in place of a pipe.
        """
        file = self.folder / "growing.log"
        file.write_bytes(b"".join(lines[:cut]))
        ours, theirs = terminal or (None, None)
        command = [TOOL, "log", str(file), "--follow", *arguments]
        with subprocess.Popen(command, stdout=theirs or subprocess.PIPE) as tool:
            self.await_output(ours or tool.stdout)
            with file.open("ab") as log:
                log.write(b"".join(lines[cut:]))
            shown = self.output_of(tool)[0]
            return tool.returncode, shown

    def await_output(self, output: int | IO[bytes] | None) -> None:
        """Waits until the tool has shown something."""
        self.assertTrue(select.select([output], [], [], 30)[0], "nothing is shown")

    def output_of(self, tool: subprocess.Popen[bytes]) -> tuple[bytes, bytes]:
        """Waits for the tool's end; ends one that does not come to it."""
        try:
            return tool.communicate(timeout=30)
        except subprocess.TimeoutExpired:
            tool.kill()
            raise

    def lines(self, name: str) -> list[bytes]:
        return (GOLDEN / f"{name}.log").read_bytes().splitlines(keepends=True)

    def test_changes_are_told_until_the_end(self) -> None:
        lines = self.lines("package-and-board")
        cut = 1 + next(i for i, line in enumerate(lines) if b"Starts sleeping" in line)
        status, shown = self.follow(lines, cut=cut)
        self.assertEqual(status, 0)
        first, last = shown.decode().splitlines()
        # The golden log's run is long past.
        self.assertRegex(first, r"^\d\d:\d\d:\d\d  Leave the board 13 minutes, 13 min 0 s expected; no record for .*, "
                                r"longer than this step takes: the updater has most likely ended. Do now: leave the ")
        self.assertRegex(last, r"^Ended at \d\d:\d\d:\d\d: PASSED: updated \(PASS lit in pass colour; pass sound\)\.$")

    def test_json_has_an_object_for_each_change(self) -> None:
        lines = self.lines("board-upload-fails")
        cut = 1 + next(i for i, line in enumerate(lines) if b"Uploading failed" in line)
        status, shown = self.follow(lines, "--json", cut=cut)
        self.assertEqual(status, 1)
        first, last = map(json.loads, shown.splitlines())
        self.assertEqual((first["state"], first["step"], first["failed_attempts"]), ("overdue", "upload-board", 1))
        self.assertEqual((first["next"], first["next_if_versions_differ"]), ("run-board-script", False))
        self.assertEqual((last["state"], last["outcome"]), ("ended", "board-failed"))
        self.assertEqual(last["failure"]["name"], "board-upload-failed")

    def test_terminal_gets_a_progress_bar(self) -> None:
        lines = self.lines("package-and-board")
        cut = 1 + next(i for i, line in enumerate(lines) if b"Starts sleeping" in line)
        begin = time.strftime("%d-%m-%Y %H-%M-%S", time.localtime(time.time() - 390)).encode()
        lines = [b"Updater | " + begin + line[29:] if line.startswith(b"Updater | ") else line for line in lines]
        master, slave = pty.openpty()
        self.follow(lines, cut=cut, terminal=(master, slave))
        os.close(slave)
        shown = os.read(master, 65536).decode()
        os.close(master)
        self.assertIn("\r\x1b[K  [###############---------------] 6 min 3", shown)
        self.assertIn(" of 13 min 0 s", shown)

    def test_earlier_runs_are_not_shown_but_tell_how_long_steps_take(self) -> None:
        lines = self.lines("package-and-board")
        cut = 1 + next(i for i, line in enumerate(lines) if b"resultCallback" in line)
        status, shown = self.follow(lines + lines, "--json", cut=len(lines) + cut + 1)
        first = json.loads(shown.splitlines()[0])
        self.assertEqual((status, first["run"], first["step"], first["expected_s"]), (0, 2, "show-outcome", 0))

    def test_ended_run_is_told_and_the_next_one_awaited(self) -> None:
        lines = self.lines("up-to-date")
        status, shown = self.follow(lines + lines[:20] + self.lines("mirrors-fail"), cut=len(lines))
        self.assertEqual(status, 1)
        self.assertTrue(shown.startswith(b"No update is going on. The last one ended at "), shown)

    def test_run_that_goes_on_is_running_and_a_failed_end_is_explained(self) -> None:
        lines = self.lines("mirrors-fail")
        begin = time.strftime("%d-%m-%Y %H-%M-%S").encode()
        lines = [b"Updater | " + begin + line[29:] if line.startswith(b"Updater | ") else line for line in lines]
        cut = 1 + next(i for i, line in enumerate(lines) if b"Running command: apt update" in line)
        status, shown = self.follow(lines, cut=cut)
        self.assertEqual(status, 1)
        first, ended, *rest = shown.decode().splitlines()
        self.assertRegex(first, "Refresh the package mirrors; then: Compare the package's versions; "
                                "in all at least 14 min more$")
        self.assertRegex(ended, "^Ended at .*: FAILED: the package mirrors could not be read")
        self.assertRegex(rest[0], r"^Failed: Refresh the package mirrors \(line \d+\) \[mirrors-unreachable\]$")
        self.assertIn("  Do now:  Connect the network", "\n".join(rest))

    def test_file_made_shorter_is_refused(self) -> None:
        file = self.folder / "growing.log"
        file.write_bytes(b"".join(self.lines("stopped-in-install")))
        command = [TOOL, "log", str(file), "--follow"]
        with subprocess.Popen(command, stdout=subprocess.PIPE, stderr=subprocess.PIPE) as tool:
            self.await_output(tool.stdout)
            file.write_bytes(b"")
            errors = self.output_of(tool)[1]
            self.assertEqual(tool.returncode, 2)
        self.assertIn(b"the file was made shorter while it was read", errors)


class Nesting(HTMLParser):
    """The elements that are open, and the ends that are not theirs."""

    VOID = {"meta", "br"}

    def __init__(self) -> None:
        super().__init__()
        self.opened: list[str] = []
        self.wrong: list[str] = []

    def handle_starttag(self, tag: str, attributes: list[tuple[str, str | None]]) -> None:
        if tag not in self.VOID:
            self.opened.append(tag)

    def handle_endtag(self, tag: str) -> None:
        if not self.opened or self.opened.pop() != tag:
            self.wrong.append(tag)


class Page(Base):
    """The page with the timelines."""

    def page(self, name: str, text: bytes = b"") -> str:
        file = self.folder / "page.html"
        self.assertIn(run_tool(name, "--html", str(file), text=text).returncode, (0, 1))
        return file.read_text(encoding="utf-8")

    def test_it_is_whole_and_needs_nothing_from_outside(self) -> None:
        for file in sorted(GOLDEN.glob("*.log")):
            text = self.page(file.name)
            parser = Nesting()
            parser.feed(text)
            parser.close()
            self.assertEqual((parser.opened, parser.wrong), ([], []), file.name)
            for outside in ("src=", "href=", "url(", "@import", "<script"):
                self.assertNotIn(outside, text)

    def test_text_of_the_log_is_no_markup(self) -> None:
        log = (GOLDEN / "package-and-board.log").read_bytes().replace(b"1.3.0", b"<b>&\"1.3.0")
        self.assertIn("&lt;b&gt;&amp;", self.page("-", log))
        self.assertNotIn("<b>&", self.page("-", log))

    def test_lanes_are_there(self) -> None:
        text = self.page("package-and-board.log")
        lanes = ["Time", "Main thread", "Update thread", "Commands and waits", "Flashing thread", "LED pattern",
                 "Sound"]
        for lane in lanes:
            self.assertIn(f"<th>{lane}</th>", text)
        self.assertNotIn("Main thread", self.page("main-head-all.log"))
        self.assertIn("wait 780 s", text)

    def test_attempts_that_came_out_alike_are_one_line(self) -> None:
        command = "scp: OSUpgrade.zip and unzipUpgrade.sh"
        text = self.page("board-upload-fails.log")
        self.assertEqual(text.count(command), 1)
        self.assertIn("failed (20 times)", text)
        text = self.page("board-upload-succeeds-at-last.log")
        self.assertEqual(text.count(command), 2)
        self.assertIn("failed (19 times)", text)


class Memory(Base):
    """Memory is bounded whatever the log."""

    def test_large_logs_of_all_kinds(self) -> None:
        log = (GOLDEN / "package-and-board.log").read_bytes()
        head = log[: log.index(b"BEFORE")]
        kinds = {
            "many runs": log * 5000,
            "one long line": log + b"x" * 100_000_000,
            "lines of other programs": head + b"\t\t\tx\n" + b"E: foreign line of a tool\n" * 3_000_000,
            "steps without end": head + b"\t\t\tx\n" + log[log.index(b"Updater", 900) : 6000] * 10000,
        }
        limit = 100 * 1024 * 1024  # bytes of address space
        for kind, text in kinds.items():
            with self.subTest(kind), (self.folder / "log").open("wb+") as file:
                file.write(text)
                done = subprocess.run([TOOL, "log", file.name], stdout=subprocess.DEVNULL, timeout=100, check=False,
                                      preexec_fn=lambda: resource.setrlimit(resource.RLIMIT_AS, (limit, limit)))
                self.assertIn(done.returncode, (0, 1))

    def test_too_little_memory_is_told(self) -> None:
        told = 0
        for limit in range(2 << 20, 128 << 20, 64 << 10):  # the program, its libraries, and less than one block of log
            done = run_tool("package-and-board.log",
                            preexec_fn=lambda: resource.setrlimit(resource.RLIMIT_AS, (limit, limit)))
            if done.returncode == 0:
                break
            if done.returncode == 2:
                self.assertRegex(done.stderr, rb"^harl-updater-tool: there is not enough memory\. .*again\.\n$")
                told += 1
        self.assertEqual(done.returncode, 0)
        self.assertGreater(told, 0)


class Output(Base):
    """What cannot be printed."""

    def test_full_disk_is_told_whatever_was_asked(self) -> None:
        log = str(GOLDEN / "package-and-board.log")
        for arguments in (["--help"], ["log", log], ["log", "--json", log], ["log", "--follow", log],
                          ["stick", str(self.folder)], ["stick", "--json", str(self.folder)]):
            with self.subTest(arguments), open("/dev/full", "wb") as full:
                done = subprocess.run([TOOL, *arguments], stdout=full, stderr=subprocess.PIPE, timeout=60, check=False)
                self.assertEqual(done.returncode, 2)
                self.assertRegex(done.stderr,
                                 rb"^harl-updater-tool: the output cannot be written: No space left on device\. .*\n$")

    def test_output_that_nobody_reads_needs_no_room(self) -> None:
        done = subprocess.run(["sh", "-c", '"$0" explain >&-', TOOL], capture_output=True, timeout=60, check=False)
        self.assertEqual((done.returncode, done.stderr), (2, b"harl-updater-tool: the output cannot be written: Bad "
                                                             b"file descriptor. Nobody reads it.\n"))


if __name__ == "__main__":
    TOOL = str(take_path())
    unittest.main()
