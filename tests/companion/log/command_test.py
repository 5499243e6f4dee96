"""Runs `harl-updater-tool log` as people do: what it prints, where it reads from, and what it says of bad input."""

import fcntl
import json
import os
import pty
import re
import resource
import select
import signal
import struct
import subprocess
import termios
import time
from collections.abc import Callable
from html.parser import HTMLParser
from pathlib import Path
from typing import IO, Any

import pytest

from bench import scenario
from bench.makers.files import write_script

ROOT = Path(__file__).resolve().parents[3]
GOLDEN = ROOT / "tests/companion/golden/log"
REMOTE = [name for name in scenario.names() if scenario.load(name).setup.updater.program == "remote"]


class LogTool:
    """`harl-updater-tool log`, and a folder for what it is given."""

    def __init__(self, tool: Path, folder: Path) -> None:
        self.tool = str(tool)
        self.folder = folder

    def run(self, *arguments: str, text: bytes = b"", **options: Any) -> subprocess.CompletedProcess[bytes]:
        """Runs it where the golden files lie, with `text` as its input."""
        command = [self.tool, "log", *arguments]
        return subprocess.run(command, cwd=GOLDEN, input=text, capture_output=True, timeout=60, check=False, **options)

    def program(self, name: str, script: str) -> str:
        """Makes an executable in a folder of its own; returns that folder."""
        write_script(self.folder / "bin" / name, script)
        return str(self.folder / "bin")

    def refused(self, *arguments: str, text: bytes = b"", **options: Any) -> str:
        """Its one line about bad input."""
        done = self.run(*arguments, text=text, **options)
        assert done.returncode == 2
        assert done.stderr.count(b"\n") == 1, done.stderr
        return done.stderr.decode()

    def lines_of(self, *arguments: str, columns: int = 0) -> list[str]:
        """What any command of the tool prints on a terminal of this width, or into a file."""
        master, slave = pty.openpty()
        fcntl.ioctl(slave, termios.TIOCSWINSZ, struct.pack("HHHH", 24, columns, 0, 0))
        text = b""
        with (self.folder / "output").open("wb+") as output:
            with subprocess.Popen([self.tool, *arguments], stdout=slave if columns else output, cwd=GOLDEN) as tool:
                os.close(slave)
                while columns and (some := read(master)):
                    text += some
                tool.wait()
            os.close(master)
            output.seek(0)
            return (text or output.read()).decode().splitlines()

    def follow(
        self, lines: list[bytes], *arguments: str, cut: int, terminal: tuple[int, int] | None = None
    ) -> tuple[int, bytes]:
        """Follows a file that holds the first `cut` lines; the rest comes once something of them has been shown.

        `terminal`, both sides of one, takes the output in place of a pipe.
        """
        file = self.folder / "growing.log"
        file.write_bytes(b"".join(lines[:cut]))
        ours, theirs = terminal or (None, None)
        command = [self.tool, "log", str(file), "--follow", *arguments]
        with subprocess.Popen(command, stdout=theirs or subprocess.PIPE) as tool:
            await_output(ours or tool.stdout)
            with file.open("ab") as log:
                log.write(b"".join(lines[cut:]))
            shown = output_of(tool)[0]
            return tool.returncode, shown

    def page(self, name: str, text: bytes = b"") -> str:
        file = self.folder / "page.html"
        assert self.run(name, "--html", str(file), text=text).returncode in (0, 1)
        return file.read_text(encoding="utf-8")


@pytest.fixture
def log_tool(tool: Path, tmp_path: Path) -> LogTool:
    return LogTool(tool, tmp_path)


def read(terminal: int) -> bytes:
    """What comes; nothing at the end, which a terminal tells by an error."""
    try:
        return os.read(terminal, 65536)
    except OSError:
        return b""


def await_output(output: int | IO[bytes] | None) -> None:
    """Waits until the tool has shown something."""
    assert select.select([output], [], [], 30)[0], "nothing is shown"


def output_of(tool: subprocess.Popen[bytes]) -> tuple[bytes, bytes]:
    """Waits for the tool's end; ends one that does not come to it."""
    try:
        return tool.communicate(timeout=30)
    except subprocess.TimeoutExpired:
        tool.kill()
        raise


def await_read(tool: subprocess.Popen[bytes]) -> None:
    """Waits until the tool has read what was written to it."""
    assert tool.stdin
    deadline = time.monotonic() + 30
    while struct.unpack("i", fcntl.ioctl(tool.stdin, termios.FIONREAD, bytes(4))) != (0,):
        assert time.monotonic() < deadline
        time.sleep(0.01)


def golden_lines(name: str) -> list[bytes]:
    return (GOLDEN / f"{name}.log").read_bytes().splitlines(keepends=True)


# The bench knows what the panel showed: the tool must tell the same.
@pytest.mark.parametrize("name", REMOTE)
def test_panel_and_sound_are_those_of_the_scenario(log_tool: LogTool, name: str) -> None:
    expect = scenario.load(name).expect
    [run] = json.loads(log_tool.run(f"{name}.log", "--json").stdout)["runs"]
    assert run["panel"] == expect.panel
    assert run["sound"] == expect.sound


@pytest.mark.parametrize("name", scenario.names())
def test_versions_are_those_of_the_scenario(log_tool: LogTool, name: str) -> None:
    setup = scenario.load(name).setup
    [run] = json.loads(log_tool.run(f"{name}.log", "--json").stdout)["runs"]
    if run["package"]["read"]:
        assert run["package"]["from"] == setup.package.installed
        assert run["package"]["to"] == setup.package.offered
    if run["board"]["read"]:
        assert run["board"]["from"] == setup.board.installed
        assert run["board"]["to"] == min(setup.stick.directories)[5:]


def test_status_tells_whether_the_last_run_went_well(log_tool: LogTool) -> None:
    good, bad = "package-and-board.log", "mirrors-fail.log"
    assert log_tool.run(good).returncode == 0
    assert log_tool.run(bad).returncode == 1
    both = [(GOLDEN / name).read_bytes() for name in (bad, good)]
    assert log_tool.run(text=both[0] + both[1]).returncode == 0
    assert log_tool.run(text=both[1] + both[0]).returncode == 1


# The panel passes over units that are not well: the log says so of each.
def test_log_names_what_the_panel_passes_over(log_tool: LogTool, tell: Callable[[str], None]) -> None:
    record = b"verify: the unit is not well: package-version\n"  # by the service, of each such unit
    passed, named, left_open = 0, 0, []
    for name in REMOTE:
        what = scenario.load(name)
        setup, expect = what.setup, what.expect
        if "pass" not in expect.panel.values():
            continue
        passed += 1
        on_stick = min(setup.stick.directories, default="")[5:]
        if (expect.package, expect.board, expect.harl) == (setup.package.offered, on_stick, "active"):
            continue
        log = (GOLDEN / f"{name}.log").read_bytes()
        done = log_tool.run("--json", "--strict", text=log)
        [run] = json.loads(done.stdout)["runs"]
        if run["failure"] or run["besides"]:
            named += 1
            assert done.returncode == 1
        else:  # the updater was told that a command which was killed had done its work
            left_open.append(name)
            assert [text for text in run["cannot_tell"] if "really installed" in text]
        done = log_tool.run("--json", text=log + record)
        assert done.returncode == 1
        assert "not well: package-version" in json.loads(done.stdout)["runs"][0]["meaning"]
    tell(
        f"the panel passes in {passed} scenarios, in {named + len(left_open)} of them over a unit that is not "
        f"well: the log names what is wrong in {named}; left open: {left_open}, by the verification's record"
    )
    assert left_open == ["apt-killed"]


def test_only_the_feedback_is_left(log_tool: LogTool) -> None:
    log = (GOLDEN / "aplay-missing.log").read_bytes()
    start = log.rindex(b"Updater |", 0, log.index(b"Failed to play a sound"))
    piece = log[start : log.index(b"\n", log.index(b"Failed to play a sound")) + 1]
    assert piece.count(b"Updater |") == 1
    done = log_tool.run(text=piece)
    assert done.returncode == 1
    assert b"Also: a step that is not in this log [sound-failed]" in done.stdout
    [problem] = json.loads(log_tool.run("--json", text=piece).stdout)["runs"][0]["besides"]
    assert (problem["name"], problem["step"], problem["line"]) == ("sound-failed", None, None)
    page = log_tool.folder / "page.html"
    assert log_tool.run("--html", str(page), text=piece).returncode == 1
    assert "a step that is not in this log [sound-failed]</b>" in page.read_text()


def test_each_record_alone(log_tool: LogTool) -> None:
    names = "journal-short-board-disk-full panel-absent services-killed main-head-all upload-not-waited-for"
    lines = [line for name in names.split() for line in golden_lines(name)]
    alone = {lines[index] + lines[index + 1] for index in range(len(lines) - 1) if b"Updater |" in lines[index]}
    kinds = {line[line.index(b"(") :] if b"(" in line else line: line for line in alone}
    for piece in kinds.values():
        assert log_tool.run(text=piece).returncode in (0, 1), piece


def test_missing_file(log_tool: LogTool) -> None:
    assert log_tool.refused("none.log") == "harl-updater-tool: none.log: No such file or directory\n"


def test_folder(log_tool: LogTool) -> None:
    assert "a folder; name a file in it" in log_tool.refused(".")


def test_name_is_shown_escaped(log_tool: LogTool) -> None:
    assert r"a\nb\x1b: No such file" in log_tool.refused("a\nb\x1b")


def test_no_record(log_tool: LogTool) -> None:
    assert "standard input: no record of the updater in 2 lines, 4 bytes" in log_tool.refused(text=b"a\nb\n")
    assert "no record of the updater in 0 lines" in log_tool.refused()


@pytest.mark.parametrize(
    "start, advice",
    [
        (b"LPKSHHRH", "journalctl --file"),
        (b"\x1f\x8b\x08", "zcat"),
        (b"\xfd7zXZ\0", "xzcat"),
        (b"\xff\xfeU\0", "UTF-16"),
    ],
    ids=["journal", "gzip", "xz", "utf-16"],
)
def test_other_format_is_named(log_tool: LogTool, start: bytes, advice: str) -> None:
    said = log_tool.refused(text=start)
    assert "byte 0, line 1: no log but " in said
    assert advice in said


def test_json_tells_it_too(log_tool: LogTool) -> None:
    done = log_tool.run("--json", text=b"a\n")
    assert json.loads(done.stdout)["runs"] == []
    assert "no record" in json.loads(done.stdout)["error"]


def test_missing_journalctl(log_tool: LogTool) -> None:
    message = log_tool.refused("--journal", env={"PATH": str(log_tool.folder)})
    assert "journalctl is not on the search path" in message


def test_failing_journalctl(log_tool: LogTool) -> None:
    message = log_tool.refused("--journal", env={"PATH": log_tool.program("journalctl", "exit 3")})
    assert "journalctl ended with status 3. Run it as root" in message


@pytest.mark.parametrize("arguments", ["--journal", "--journal --follow"])
def test_empty_journal(log_tool: LogTool, arguments: str) -> None:
    message = log_tool.refused(*arguments.split(), env={"PATH": log_tool.program("journalctl", "")})
    assert "the service has not run since the journal begins" in message
    assert "Run it as root" in message


@pytest.mark.parametrize("arguments", ["--journal a.log", "--follow --html x", "--nonsense", "a b"])
def test_wrong_usage(log_tool: LogTool, arguments: str) -> None:
    assert log_tool.run(*arguments.split()).returncode == 2


def test_page_is_kept_when_the_log_is_bad(log_tool: LogTool) -> None:
    page = log_tool.folder / "page.html"
    page.write_text("old")
    log_tool.refused("--html", str(page), text=b"no record\n")
    assert page.read_text() == "old"
    assert [file.name for file in log_tool.folder.iterdir()] == ["page.html"]


def test_page_in_the_place_of_the_log_is_refused(log_tool: LogTool) -> None:
    log = log_tool.folder / "u.log"
    text = (GOLDEN / "up-to-date.log").read_bytes()
    log.write_bytes(text)
    (log_tool.folder / "same").hardlink_to(log)
    (log_tool.folder / "link").symlink_to(log)
    for page in (log, log_tool.folder / "same"):
        assert "the log itself; name another file" in log_tool.refused("--html", str(page), str(log))
    with log.open("rb") as stream:
        command = [log_tool.tool, "log", "--html", str(log)]
        done = subprocess.run(command, stdin=stream, capture_output=True, check=False)
    assert done.returncode == 2
    for page in (log_tool.folder / "link", log_tool.folder):
        assert "not a plain file; name another" in log_tool.refused("--html", str(page), str(log))
    assert log.read_bytes() == text
    assert {file.name for file in log_tool.folder.iterdir()} == {"u.log", "same", "link"}


def test_page_replaces_no_other_file(log_tool: LogTool) -> None:
    page, part = log_tool.folder / "page.html", log_tool.folder / "page.html.part"
    part.write_text("mine")
    assert log_tool.run("up-to-date.log", "--html", str(page), umask=0o027).returncode == 0
    assert page.read_text().startswith("<!DOCTYPE html>")
    assert page.stat().st_mode & 0o777 == 0o640
    page.write_text("old" * 100_000)
    assert log_tool.run("up-to-date.log", "--html", str(page)).returncode == 0
    assert page.read_text().endswith("</html>\n")
    assert part.read_text() == "mine"
    assert {file.name for file in log_tool.folder.iterdir()} == {page.name, part.name}


@pytest.mark.parametrize("name", ["SIGHUP", "SIGINT", "SIGTERM", "SIGPIPE", "SIGKILL"])
def test_nothing_is_left_of_a_page_when_a_signal_ends_it(log_tool: LogTool, name: str) -> None:
    number = signal.Signals[name]
    command = [log_tool.tool, "log", "--html", str(log_tool.folder / "page.html")]
    with subprocess.Popen(
        command,
        stdin=subprocess.PIPE,
        stdout=subprocess.DEVNULL,
        env={"TMPDIR": str(log_tool.folder)},
        preexec_fn=None if number == signal.SIGKILL else lambda: signal.signal(number, signal.SIG_DFL),
    ) as tool:
        assert tool.stdin
        tool.stdin.write((GOLDEN / "up-to-date.log").read_bytes())
        tool.stdin.flush()
        await_read(tool)
        tool.send_signal(number)
        assert tool.wait(30) == -number
    assert list(log_tool.folder.iterdir()) == []


def test_page_that_cannot_be_written(log_tool: LogTool) -> None:
    done = log_tool.run("up-to-date.log", "--html", str(log_tool.folder / "none/page.html"))
    assert done.returncode == 2
    assert b"page.html: No such file or directory" in done.stderr


@pytest.mark.parametrize("name", ["package-and-board", "up-to-date"])
def test_panel_that_does_not_flash_any_more_is_not_asked_for(log_tool: LogTool, name: str) -> None:
    lines = golden_lines(name)
    shown = next(i for i, line in enumerate(lines) if b"resultCallback" in line)
    for length in range(2, len(lines)):
        said = b" ".join(log_tool.run(text=b"".join(lines[:length])).stdout.split())
        assert (b"still flashes blue" in said) == (length <= shown), f"{length} lines: {said!r}"


def test_journal_is_explained(log_tool: LogTool) -> None:
    script = f'echo "$@" >"{log_tool.folder}/arguments"; /bin/cat "{GOLDEN}/up-to-date.log"\n'
    folder = log_tool.program("journalctl", script)
    done = log_tool.run("--journal", env={"PATH": folder})
    assert done.returncode == 0
    assert b"Run 1 of the journal of harl-updater, lines 1 to " in done.stdout
    assert "--unit=harl-updater" in (log_tool.folder / "arguments").read_text()


def test_follow_ends_journalctl(log_tool: LogTool) -> None:
    log = (GOLDEN / "up-to-date.log").read_text().splitlines(keepends=True)
    (log_tool.folder / "a").write_text("".join(log[:60]))
    (log_tool.folder / "b").write_text("".join(log[60:]))
    script = f'/bin/cat "{log_tool.folder}/a"; /bin/sleep 1; /bin/cat "{log_tool.folder}/b"; exec /bin/sleep 100\n'
    folder = log_tool.program("journalctl", script)
    done = log_tool.run("--journal", "--follow", env={"PATH": folder})
    assert done.returncode == 0
    assert done.stdout.decode().splitlines()[-1].startswith("Ended at "), done.stdout


@pytest.mark.parametrize("columns", [0, 60, 140])
@pytest.mark.parametrize("command", ["explain", "log board-upload-fails.log", "verify", "stick FOLDER", "check FOLDER"])
def test_lines_are_as_long_as_the_terminal_is_wide(log_tool: LogTool, command: str, columns: int) -> None:
    (log_tool.folder / "debs").mkdir()
    lines = log_tool.lines_of(*command.replace("FOLDER", str(log_tool.folder)).split(), columns=columns)
    assert lines
    for line in lines:
        longest_word = max(len(word) for word in line.split() or [""])
        assert len(line) <= max(columns or 100, longest_word + 15), line


def test_wait_for_a_terminal_is_told(log_tool: LogTool) -> None:
    master, slave = pty.openpty()
    with subprocess.Popen([log_tool.tool, "log"], stdin=slave, stdout=subprocess.PIPE, stderr=subprocess.PIPE) as tool:
        os.close(slave)
        assert tool.stderr
        assert tool.stderr.readline() == (
            b"harl-updater-tool: reading the log from the terminal; end it with Ctrl-D.\n"
        )
        os.write(master, b"\x04")
        assert tool.wait(30) == 2
    os.close(master)


def test_changes_are_told_until_the_end(log_tool: LogTool) -> None:
    lines = golden_lines("package-and-board")
    cut = 1 + next(i for i, line in enumerate(lines) if b"Starts sleeping" in line)
    status, shown = log_tool.follow(lines, cut=cut)
    assert status == 0
    first, last = shown.decode().splitlines()
    # The golden log's run is long past.
    assert re.search(
        r"^\d\d:\d\d:\d\d  Leave the board 13 minutes, 13 min 0 s expected; no record for .*, "
        r"longer than this step takes: the updater has most likely ended. Do now: leave the ",
        first,
    )
    assert re.search(r"^Ended at \d\d:\d\d:\d\d: PASSED: updated \(PASS lit in pass colour; pass sound\)\.$", last)


def test_json_has_an_object_for_each_change(log_tool: LogTool) -> None:
    lines = golden_lines("board-upload-fails")
    cut = 1 + next(i for i, line in enumerate(lines) if b"Uploading failed" in line)
    status, shown = log_tool.follow(lines, "--json", cut=cut)
    assert status == 1
    first, last = map(json.loads, shown.splitlines())
    assert (first["state"], first["step"], first["failed_attempts"]) == ("overdue", "upload-board", 1)
    assert (first["next"], first["next_if_versions_differ"]) == ("run-board-script", False)
    assert (last["state"], last["outcome"]) == ("ended", "board-failed")
    assert last["failure"]["name"] == "board-upload-failed"


def test_terminal_gets_a_progress_bar(log_tool: LogTool) -> None:
    lines = golden_lines("package-and-board")
    cut = 1 + next(i for i, line in enumerate(lines) if b"Starts sleeping" in line)
    begin = time.strftime("%d-%m-%Y %H-%M-%S", time.localtime(time.time() - 390)).encode()
    lines = [b"Updater | " + begin + line[29:] if line.startswith(b"Updater | ") else line for line in lines]
    master, slave = pty.openpty()
    log_tool.follow(lines, cut=cut, terminal=(master, slave))
    os.close(slave)
    shown = os.read(master, 65536).decode()
    os.close(master)
    assert "\r\x1b[K  [###############---------------] 6 min 3" in shown
    assert " of 13 min 0 s" in shown


def test_earlier_runs_are_not_shown_but_tell_how_long_steps_take(log_tool: LogTool) -> None:
    lines = golden_lines("package-and-board")
    cut = 1 + next(i for i, line in enumerate(lines) if b"resultCallback" in line)
    status, shown = log_tool.follow(lines + lines, "--json", cut=len(lines) + cut + 1)
    first = json.loads(shown.splitlines()[0])
    assert (status, first["run"], first["step"], first["expected_s"]) == (0, 2, "show-outcome", 0)


def test_ended_run_is_told_and_the_next_one_awaited(log_tool: LogTool) -> None:
    lines = golden_lines("up-to-date")
    status, shown = log_tool.follow(lines + lines[:20] + golden_lines("mirrors-fail"), cut=len(lines))
    assert status == 1
    assert shown.startswith(b"No update is going on. The last one ended at "), shown


def test_run_that_goes_on_is_running_and_a_failed_end_is_explained(log_tool: LogTool) -> None:
    lines = golden_lines("mirrors-fail")
    begin = time.strftime("%d-%m-%Y %H-%M-%S").encode()
    lines = [b"Updater | " + begin + line[29:] if line.startswith(b"Updater | ") else line for line in lines]
    cut = 1 + next(i for i, line in enumerate(lines) if b"Running command: apt update" in line)
    status, shown = log_tool.follow(lines, cut=cut)
    assert status == 1
    first, ended, *rest = shown.decode().splitlines()
    assert re.search(
        "Refresh the package mirrors; then: Compare the package's versions; " "in all at least 14 min more$", first
    )
    assert re.search("^Ended at .*: FAILED: the package mirrors could not be read", ended)
    assert re.search(r"^Failed: Refresh the package mirrors \(line \d+\) \[mirrors-unreachable\]$", rest[0])
    assert "  Do now:  Connect the network" in "\n".join(rest)


def test_file_made_shorter_is_refused(log_tool: LogTool) -> None:
    file = log_tool.folder / "growing.log"
    file.write_bytes(b"".join(golden_lines("stopped-in-install")))
    command = [log_tool.tool, "log", str(file), "--follow"]
    with subprocess.Popen(command, stdout=subprocess.PIPE, stderr=subprocess.PIPE) as tool:
        await_output(tool.stdout)
        file.write_bytes(b"")
        errors = output_of(tool)[1]
        assert tool.returncode == 2
    assert b"the file was made shorter while it was read" in errors


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


@pytest.mark.parametrize("name", sorted(file.name for file in GOLDEN.glob("*.log")))
def test_page_is_whole_and_needs_nothing_from_outside(log_tool: LogTool, name: str) -> None:
    text = log_tool.page(name)
    parser = Nesting()
    parser.feed(text)
    parser.close()
    assert (parser.opened, parser.wrong) == ([], [])
    for outside in ("src=", "href=", "url(", "@import", "<script"):
        assert outside not in text


def test_text_of_the_log_is_no_markup(log_tool: LogTool) -> None:
    log = (GOLDEN / "package-and-board.log").read_bytes().replace(b"1.3.0", b'<b>&"1.3.0')
    assert "&lt;b&gt;&amp;" in log_tool.page("-", log)
    assert "<b>&" not in log_tool.page("-", log)


def test_lanes_are_there(log_tool: LogTool) -> None:
    text = log_tool.page("package-and-board.log")
    lanes = ["Time", "Main thread", "Update thread", "Commands and waits", "Flashing thread", "LED pattern", "Sound"]
    for lane in lanes:
        assert f"<th>{lane}</th>" in text
    assert "Main thread" not in log_tool.page("main-head-all.log")
    assert "wait 780 s" in text


def test_attempts_that_came_out_alike_are_one_line(log_tool: LogTool) -> None:
    command = "scp: OSUpgrade.zip and unzipUpgrade.sh"
    text = log_tool.page("board-upload-fails.log")
    assert text.count(command) == 1
    assert "failed (20 times)" in text
    text = log_tool.page("board-upload-succeeds-at-last.log")
    assert text.count(command) == 2
    assert "failed (19 times)" in text


# From a whole log and what comes before its first run.
LARGE_LOGS: dict[str, Callable[[bytes, bytes], bytes]] = {
    "many-runs": lambda log, head: log * 5000,
    "one-long-line": lambda log, head: log + b"x" * 100_000_000,
    "lines-of-other-programs": lambda log, head: head + b"\t\t\tx\n" + b"E: foreign line of a tool\n" * 3_000_000,
    "steps-without-end": lambda log, head: head + b"\t\t\tx\n" + log[log.index(b"Updater", 900) : 6000] * 10000,
}


@pytest.mark.parametrize("kind", LARGE_LOGS)
def test_large_log_needs_no_more_memory(log_tool: LogTool, kind: str) -> None:
    whole = (GOLDEN / "package-and-board.log").read_bytes()
    file = log_tool.folder / "log"
    file.write_bytes(LARGE_LOGS[kind](whole, whole[: whole.index(b"BEFORE")]))
    limit = 100 * 1024 * 1024  # bytes of address space
    done = subprocess.run(
        [log_tool.tool, "log", file],
        stdout=subprocess.DEVNULL,
        timeout=100,
        check=False,
        preexec_fn=lambda: resource.setrlimit(resource.RLIMIT_AS, (limit, limit)),
    )
    assert done.returncode in (0, 1)


def test_too_little_memory_is_told(log_tool: LogTool) -> None:
    told = 0
    for limit in range(2 << 20, 128 << 20, 64 << 10):  # the program, its libraries, and less than one block of log
        done = log_tool.run(
            "package-and-board.log", preexec_fn=lambda: resource.setrlimit(resource.RLIMIT_AS, (limit, limit))
        )
        if done.returncode == 0:
            break
        if done.returncode == 2:
            assert re.search(rb"^harl-updater-tool: there is not enough memory\. .*again\.\n$", done.stderr)
            told += 1
    assert done.returncode == 0
    assert told > 0


@pytest.mark.parametrize(
    "words", ["--help", "log LOG", "log --json LOG", "log --follow LOG", "stick FOLDER", "stick --json FOLDER"]
)
def test_full_disk_is_told(log_tool: LogTool, words: str) -> None:
    words = words.replace("LOG", "up-to-date.log").replace("FOLDER", str(log_tool.folder))
    with open("/dev/full", "wb") as full:
        command = [log_tool.tool, *words.split()]
        done = subprocess.run(command, cwd=GOLDEN, stdout=full, stderr=subprocess.PIPE, timeout=60, check=False)
    assert done.returncode == 2
    said = rb"^harl-updater-tool: the output cannot be written: No space left on device\. .*\n$"
    assert re.search(said, done.stderr)


def test_output_that_nobody_reads_needs_no_room(log_tool: LogTool) -> None:
    done = subprocess.run(["sh", "-c", '"$0" explain >&-', log_tool.tool], capture_output=True, timeout=60, check=False)
    said = b"harl-updater-tool: the output cannot be written: Bad file descriptor. Nobody reads it.\n"
    assert (done.returncode, done.stderr) == (2, said)
