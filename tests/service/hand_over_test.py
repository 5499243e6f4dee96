"""The hand-over, which is called in place of the updater's tools, with stand-in tools: what it passes on and ends."""

import contextlib
import os
import re
import shutil
import signal
import subprocess
import sys
import time
from collections.abc import Iterator
from pathlib import Path

import pytest

from bench.makers.files import write, write_script
from bench.makers.i2cset import NEWER, OLDER
from tests.commands import run_command

ROOT = Path(__file__).parents[2]
SHELLS = ("dash", "bash")
# Both kinds note each request for their usage text, keep the bytes that they get, and refuse one byte.
ASKED = '[ "$1" != -h ] || echo asked >>"$FOLDER/asked"\n'
SENT = 'echo "$*" >>"$FOLDER/sent"\n[ "$4" != "$REFUSED" ] || exit 1\n'
OLD = ASKED + OLDER + SENT
NEW = ASKED + NEWER + SENT

SYNCS = ["journalctl --sync", "sync --file-system /var/log/journal"]  # before the application starts
# What hangs at each limit, in docs/reliability.md.
DOCUMENTED = {
    "panel": "every byte",
    "sound": "the sound",
    "stick": "reading the stick",
    "detach": "detaching the stick",
    "services": "`systemctl stop harl`",
    "mirrors": "`apt update`",
    "versions": "`apt-cache policy`",
    "installation": "`apt install`, a maintainer script",
    "board-version": "reading the board's version",
    "upload": "the upload, one of its attempts or all",
    "board-script": "the board's script",
    "repair": "the same again before the next run",
    "verification": "verifying a signed stick",
    "journal": "writing the journal to the disk",
    "other": "any other tool",
}


class Unit:
    """A folder `bin` with the hand-over under each tool's name, one with real tools, one for the notes of a run."""

    def __init__(self, folder: Path, hand_over: Path) -> None:
        self.folder = folder
        for name in ("bin", "tools", "run"):
            (folder / name).mkdir()
        # As the package installs it.
        shutil.copy(hand_over, folder / "hand-over")
        for tool in ("i2cset", "aplay", "apt", "apt-cache", "ssh", "scp", "ls", "umount", "systemctl", "journalctl"):
            (folder / "bin" / tool).symlink_to("../hand-over")
        self.direct = {
            "PATH": f"{folder}/tools:/usr/sbin:/usr/bin:/sbin:/bin",
            "FOLDER": str(folder),
            "RUNTIME_DIRECTORY": str(folder / "run"),
            "REFUSED": "none",
        }
        self.environment = self.direct | {"PATH": f"{folder}/bin:{self.direct['PATH']}"}

    def running(self) -> list[int]:
        """The processes of the folder's tools, except those that have ended."""
        found = []
        for process in Path("/proc").glob("[0-9]*"):
            with contextlib.suppress(OSError):
                if f"FOLDER={self.folder}\0".encode() in (process / "environ").read_bytes():
                    found.append(int(process.name))
        return found

    def end_all(self) -> None:
        """Ends the processes that a tool has left running."""
        for process in self.running():
            with contextlib.suppress(OSError):
                os.kill(process, signal.SIGKILL)

    def tool(self, name: str, text: str) -> None:
        """Makes a real tool."""
        write_script(self.folder / "tools" / name, text)

    def shell(
        self, line: str, shell: str = "dash", direct: bool = False, read: bool = True
    ) -> "subprocess.CompletedProcess[str]":
        """Runs a line as the updater does: its output is read to its end, or goes to a file."""
        with open(self.folder / "output", "w+") as output, open(self.folder / "errors", "w+") as errors:
            done = subprocess.run(
                [shell, "-c", line],
                env=self.direct if direct else self.environment,
                stdin=subprocess.DEVNULL,
                stdout=subprocess.PIPE if read else output,
                stderr=errors,
                text=True,
                check=False,
                timeout=60,
            )
            output.seek(0)
            errors.seek(0)
            return subprocess.CompletedProcess(line, done.returncode, done.stdout or output.read(), errors.read())

    def notes(self) -> list[str]:
        """The notes of the run, without the times."""
        path = self.folder / "run/notes"
        return [line.split(maxsplit=1)[1] for line in path.read_text().splitlines()] if path.exists() else []

    def assert_same(self, line: str) -> None:
        """With and without the hand-over, in both shells."""
        for shell in SHELLS:
            for read in (True, False):
                direct = self.shell(line, shell, direct=True, read=read)
                there = self.shell(line, shell, read=read)
                assert (there.returncode, there.stdout) == (direct.returncode, direct.stdout), (line, shell)
                assert "hand-over: " not in there.stderr

    def assert_expires(self, line: str, seconds: float, left_over: int = 0) -> "subprocess.CompletedProcess[str]":
        """The line fails with 124 after about this many seconds; returns how many of its processes remain."""
        begin = time.monotonic()
        done = self.shell(line)
        assert done.returncode == 124, done.stderr
        took = time.monotonic() - begin
        assert took > seconds - 0.1
        assert took < seconds + 4  # a busy machine
        assert len(self.running()) == left_over
        return done

    @contextlib.contextmanager
    def frozen(self) -> Iterator[Path]:
        """A mount point whose every access hangs for ever."""
        if not Path("/dev/fuse").exists():
            pytest.skip("no FUSE here")
        folder = self.folder / "frozen"
        folder.mkdir()
        server = subprocess.Popen(
            [sys.executable, "-B", ROOT / "tests/service/frozen_mount.py", folder], stdout=subprocess.PIPE, text=True
        )
        assert server.stdout
        try:
            said = server.stdout.readline()
            if said != "mounted\n":
                pytest.skip(said)
            yield folder
        finally:
            server.kill()
            server.wait()
            server.stdout.close()
            subprocess.run(["umount", "--lazy", folder], check=False)

    def send(self, *values: str, refused: str = "none") -> int:
        """Sends bytes as the updater does; the status of the last."""
        self.environment["REFUSED"] = refused
        return self.shell(" ; ".join(f"i2cset -y 0 0x07 {value} c" for value in values)).returncode


@pytest.fixture
def unit(tmp_path: Path, build: Path) -> Iterator[Unit]:
    unit = Unit(tmp_path, build / "service/hand-over")
    yield unit
    unit.end_all()


@pytest.fixture
def short(tmp_path: Path, build: Path) -> Iterator[Unit]:
    """With shortened limits."""
    unit = Unit(tmp_path, build / "tests/service/hand-over-short")
    yield unit
    unit.end_all()


class TestPassedOn:
    """Neither a tool that does not hang nor its caller notices anything."""

    @pytest.mark.parametrize("code", [0, 1, 2, 100, 124, 126, 127, 255])
    def test_exit_code(self, unit: Unit, code: int) -> None:
        unit.tool("apt", f"echo text; echo error >&2; exit {code}")
        for line in ("apt update", "apt update; apt update", "apt update && apt update", "apt update; exit $?"):
            unit.assert_same(line)

    @pytest.mark.parametrize("name", ["HUP", "INT", "KILL", "TERM", "PIPE", "SEGV", "ABRT", "ALRM", "USR1"])
    def test_signal(self, unit: Unit, name: str) -> None:
        unit.tool("apt", f"ulimit -c 0; echo text; kill -{name} $$")
        for line in ("apt update", "apt update; exit $?", "apt update && apt update"):
            unit.assert_same(line)

    def test_missing_tool_and_one_that_cannot_be_run(self, unit: Unit) -> None:
        unit.direct["PATH"] = f"{unit.folder}/tools"
        unit.environment["PATH"] = f"{unit.folder}/bin:{unit.folder}/tools"
        shells = {name: shutil.which(name) for name in SHELLS}
        for line in ("aplay x", "apt update; exit $?"):
            for shell in shells.values():
                codes = [unit.shell(line, shell or "", direct).returncode for direct in (False, True)]
                assert codes[0] == codes[1]
        said = f"hand-over: aplay: not found in {unit.folder}/tools\n"
        assert unit.shell("aplay x", shells["dash"] or "").stderr == said
        (unit.folder / "tools/apt").write_text("no program\n")
        done = unit.shell("apt update", shells["dash"] or "")
        assert done.returncode == 126
        assert done.stderr == f"hand-over: apt: not to be run in {unit.folder}/tools\n"

    def test_first_one_that_can_be_run_is_the_real_one(self, unit: Unit) -> None:
        for name in ("a", "b", "nib", "bin2"):
            (unit.folder / name).mkdir()
        (unit.folder / "a/apt").mkdir()
        (unit.folder / "b/apt").write_text("no program\n")
        for name in ("nib", "bin2"):
            write_script(unit.folder / name / "apt", f"echo {name}")
        for folders in (("a", "b", "nib", "bin2"), ("a", "bin2", "b", "nib")):
            search = ":".join(str(unit.folder / name) for name in folders)
            unit.direct["PATH"] = f"{search}:/usr/bin:/bin"
            unit.environment["PATH"] = f"{unit.folder}/bin:{unit.direct['PATH']}"
            unit.assert_same("apt update")

    @pytest.mark.parametrize("path", ["", "/nowhere:", "."])
    def test_empty_folder_of_the_path_is_the_present_one(self, unit: Unit, path: str) -> None:
        unit.tool("apt", 'echo "$PATH"')
        unit.environment["PATH"] = f"{unit.folder}/bin:{path}"
        done = unit.shell(f"cd {unit.folder}/tools; ../bin/apt update", "/bin/dash")
        assert (done.returncode, done.stdout) == (0, f"{path}\n")

    def test_script_without_a_first_line(self, unit: Unit) -> None:
        (unit.folder / "tools/apt").write_text('echo "$@"; exit 3\n')
        (unit.folder / "tools/apt").chmod(0o755)
        unit.assert_same("apt update")

    def test_arguments_environment_and_signals(self, unit: Unit) -> None:
        # The tool prints its arguments, from argv[0] on, its environment and its signals.
        shutil.copy("/usr/bin/cat", unit.folder / "tools/ls")
        files = "/proc/self/cmdline /proc/self/environ"
        status = " | sed -n '/^Sig[BI]/p;/^ShdPnd/p'"
        for before in ("", "trap '' TERM PIPE; "):
            for line in (f"{before}ls {files} -- 'a  b' '' '*'", f"{before}ls /proc/self/status{status}"):
                direct = unit.shell(line, direct=True)
                there = unit.shell(line)
                assert there.stdout.replace("\0OLDPWD", "\0") == direct.stdout.replace("\0OLDPWD", "\0")
        assert "ls\0/proc" in unit.shell(f"ls {files}").stdout

    def test_standard_input(self, unit: Unit) -> None:
        unit.tool("ssh", "cat")
        unit.assert_same("echo text | ssh board")

    def test_large_output_and_a_reader_that_goes_away(self, unit: Unit) -> None:
        unit.tool("apt", "yes line | head -c 3000000; echo end")
        assert len(unit.shell("apt update").stdout) == 3000004
        unit.tool("apt", "exec yes line")
        assert unit.shell("apt update | head -1").stdout == "line\n"
        assert unit.shell("{ apt update; echo $? >&2; } | head -1").stderr == "141\n"

    @pytest.mark.parametrize("path", ["{own}:{rest}", "{own}/:{own}:{rest}", "{own}/.:{rest}:{own}", "{rest}:{own}"])
    def test_no_child_meets_it(self, unit: Unit, path: str) -> None:
        own = str(unit.folder / "bin")
        unit.environment["PATH"] = path.format(own=own, rest=unit.direct["PATH"])
        unit.tool("apt", 'echo "$PATH"; command -v systemctl ls')
        done = run_command(f"{own}/apt", "update", environment=unit.environment)
        assert f"{own}" not in done.stdout
        assert done.stdout.splitlines()[0] == unit.direct["PATH"]

    @pytest.mark.parametrize("path", ["{own}", "{own}:{own}/", "{own}/.:{own}"])
    def test_it_never_takes_itself_for_the_real_one(self, unit: Unit, path: str) -> None:
        own = str(unit.folder / "bin")
        done = run_command(f"{own}/apt", "install", environment=unit.environment | {"PATH": path.format(own=own)})
        assert (done.returncode, done.stdout) == (127, "")
        assert unit.notes() == []  # not even once

    def test_successor_that_has_just_replaced_it_is_not_the_real_one(self, unit: Unit) -> None:
        # As after an upgrade, the file under the called path is another: a script whose interpreter runs.
        shutil.copy(unit.folder / "hand-over", unit.folder / "apt")
        (unit.folder / "bin/apt").unlink()
        write(unit.folder / "bin/apt", f"#!{unit.folder}/apt\n", 0o755)
        unit.tool("apt", 'echo "$PATH"')
        assert unit.shell("timeout 10 apt update").stdout == f"{unit.direct['PATH']}\n"

    def test_without_a_folder_for_notes(self, unit: Unit) -> None:
        del unit.environment["RUNTIME_DIRECTORY"]
        unit.tool("aplay", "exit 3")
        assert unit.shell("aplay SND_RESULT_PASS.wav").returncode == 3
        unit.environment["RUNTIME_DIRECTORY"] = "/nowhere"
        done = unit.shell("aplay SND_RESULT_PASS.wav")
        assert (done.returncode, done.stderr) == (3, "")

    def test_notes_that_cannot_be_written(self, unit: Unit) -> None:
        unit.tool("aplay", "exit 3")
        notes = unit.folder / "run/notes"
        notes.symlink_to("/dev/full")
        done = unit.shell("aplay SND_RESULT_PASS.wav")
        said = f"hand-over: cannot write {notes}: No space left on device\n"
        assert (done.returncode, done.stderr) == (3, said)

    def test_no_more_descriptors(self, unit: Unit) -> None:
        shutil.copy("/usr/bin/echo", unit.folder / "tools/apt")
        done = unit.shell("exec prlimit --nofile=4 apt update")
        assert (done.returncode, done.stdout) == (0, "update\n")

    def test_daemon_of_a_package_script_is_left_alone(self, unit: Unit) -> None:
        unit.tool("apt", "sleep 30 >/dev/null 2>&1 & echo done")
        assert unit.shell("apt update").stdout == "done\n"
        assert len(unit.running()) == 1


class TestLimits:
    """Shortened limits: nothing delays the caller longer."""

    def test_tool_that_never_ends(self, short: Unit) -> None:
        short.tool("aplay", "echo text; exec sleep 60")
        done = short.assert_expires("aplay x", 2)
        assert "hand-over: aplay: no end within 2 s; ended\n" in done.stderr
        assert done.stdout == "text\n"
        for shell in SHELLS:
            (short.folder / "run/notes").unlink()
            assert short.shell("aplay x; exit $?", shell).returncode == 124

    def test_tool_that_ignores_the_request_to_end(self, short: Unit) -> None:
        short.tool("aplay", "trap '' TERM; sleep 60; sleep 60; sleep 60")
        short.assert_expires("aplay x", 2)

    def test_stopped_tool(self, short: Unit) -> None:
        short.tool("aplay", "kill -STOP $$")
        short.assert_expires("aplay x", 2)

    def test_descendants_in_sessions_of_their_own(self, short: Unit) -> None:
        short.tool("aplay", "setsid sh -c 'trap \"\" TERM; setsid sleep 60 & sleep 60; sleep 60' & sleep 60")
        short.assert_expires("aplay x", 2)

    def test_one_that_multiplies(self, short: Unit) -> None:
        short.tool("aplay", "trap '' TERM; while :; do setsid sh -c 'sleep 60 & sleep 60' & sleep 0.05; done")
        short.assert_expires("aplay x", 2)

    def test_output_that_another_process_holds_open(self, short: Unit) -> None:
        short.tool("apt", "sleep 60 & echo text; exit 3")
        begin = time.monotonic()
        done = short.shell("apt update")
        assert (done.returncode, done.stdout) == (3, "text\n")
        assert "hand-over: apt: its output is held open by another process; cut\n" in done.stderr
        assert time.monotonic() - begin < 4

    def test_output_that_another_process_goes_on_filling(self, short: Unit) -> None:
        short.tool("ls", "(while :; do echo more; sleep 0.1; done) & exit 0")
        begin = time.monotonic()
        short.shell("ls x")
        assert time.monotonic() - begin < 6

    @pytest.mark.parametrize("tool", ["ls", "umount"])
    @pytest.mark.usefixtures("own_mounts")
    def test_uninterruptible_tool_is_left_behind(self, short: Unit, tool: str) -> None:
        with short.frozen() as frozen:
            shutil.copy("/usr/bin/stat", short.folder / "tools" / tool)
            begin = time.monotonic()
            done = short.shell(f"{tool} {frozen}/x")
            assert done.returncode == 124
            assert "cannot be ended; left behind" in done.stderr
            assert time.monotonic() - begin < 8

    def test_signal_reaches_all_descendants(self, short: Unit) -> None:
        short.tool("apt", "setsid sh -c 'setsid sleep 60 & sleep 60' & sleep 60")
        process = subprocess.Popen([short.folder / "bin/apt", "update"], env=short.environment, stdout=subprocess.PIPE)
        while len(short.running()) < 6:
            time.sleep(0.05)
        process.terminate()
        process.communicate(timeout=5)
        assert process.returncode == -signal.SIGTERM
        time.sleep(0.2)
        assert short.running() == []

    def test_signal_that_the_tool_handles(self, short: Unit) -> None:
        short.tool("apt", "trap 'exit 7' TERM; touch $FOLDER/ready; while :; do sleep 0.1; done")
        process = subprocess.Popen([short.folder / "bin/apt", "update"], env=short.environment)
        while not (short.folder / "ready").exists():
            time.sleep(0.05)
        process.terminate()
        assert process.wait(10) == 7

    def test_signal_that_the_caller_ignores(self, short: Unit) -> None:
        dies = "import signal, time; signal.signal(signal.SIGTERM, signal.SIG_DFL); open('ready', 'w'); time.sleep(0.5)"
        short.tool("apt", f'exec python3 -c "{dies}"')
        line = "trap '' TERM; exec bin/apt update"
        process = subprocess.Popen(["dash", "-c", line], cwd=short.folder, env=short.environment)
        while not (short.folder / "ready").exists():
            time.sleep(0.05)
        process.terminate()
        assert process.wait(10) == 0

    def test_budget(self, short: Unit) -> None:
        short.tool("i2cset", "echo called >>$FOLDER/called; [ $1 != -h ] || exit 1; exec sleep 60")
        used_up = []
        for limit in (1, 1, 1, 0, 0):
            begin = time.monotonic()
            done = short.shell("i2cset -y 0 0x07 0x12 c")
            assert done.returncode == 124
            assert time.monotonic() - begin < limit + 0.9
            used_up.append("hand-over: panel: 3 s are used up; further calls fail at once\n" in done.stderr)
        assert used_up == [False, False, True, False, False]
        assert len((short.folder / "called").read_text().split()) == 4  # one of them asks for the usage text
        assert done.stderr == ""
        assert [note.split()[:2] for note in short.notes()[1:]] == [["spent", "panel"]] * 3
        short.tool("aplay", "exit 0")
        assert short.shell("aplay x").returncode == 0  # it has its own budget

    def test_uploads_are_counted_whole(self, short: Unit) -> None:
        short.tool("scp", "sleep 2.5; exit 1")
        codes = [short.shell("scp a b").returncode for _ in range(4)]
        assert codes == [1, 1, 124, 124]

    def test_calls_of_one_tool_have_limits_of_their_own(self, short: Unit) -> None:
        for tool in ("apt", "ssh"):
            short.tool(tool, "exec sleep 60")
        short.assert_expires("apt update", 12)
        short.assert_expires('ssh -o ConnectTimeout=2 192.168.9.2 " cat /root/App/AppExe/version.txt"', 6)
        spent = [note.split()[:2] for note in short.notes()]
        assert spent == [["spent", "mirrors"], ["spent", "board-version"]]

    def test_installation_and_board_script_are_noted(self, short: Unit) -> None:
        short.tool("apt", "exit 1")
        short.tool("ssh", "exit 0")
        short.shell("apt update; apt --assume-yes install solvik4-rh; ssh 192.168.9.2 /unzipUpgrade.sh")
        expected = ["began installation", "ended installation 256", "began board-script", "ended board-script 0"]
        assert short.notes() == expected

    @pytest.mark.parametrize(
        "line, calls",
        [
            ("systemctl stop harl", ["systemctl stop harl"]),
            ("systemctl start other", ["systemctl start other"]),
            ("systemctl harl", ["systemctl harl"]),
            ("systemctl start harl", [*SYNCS, "systemctl start harl"]),
            ("env --unset RUNTIME_DIRECTORY systemctl start harl", ["systemctl start harl"]),
        ],
    )
    def test_journal_is_synced_before_the_application_starts(self, short: Unit, line: str, calls: list[str]) -> None:
        for tool in ("journalctl", "sync"):
            short.tool(tool, f'echo "{tool} $*" >>$FOLDER/calls; echo text; echo error >&2')
        short.tool("systemctl", 'echo "systemctl $*" >>$FOLDER/calls')
        done = short.shell(line)
        assert (done.returncode, done.stdout, done.stderr) == (0, "", "")
        assert (short.folder / "calls").read_text().splitlines() == calls

    def test_journal_that_cannot_be_synced(self, short: Unit) -> None:
        short.tool("systemctl", "exit 0")
        for tool in ("journalctl", "sync"):
            short.tool(tool, "exec sleep 60")
        begin = time.monotonic()
        assert short.shell("systemctl start harl").returncode == 0
        assert time.monotonic() - begin < 8


class TestTable:
    """The limits themselves."""

    def test_every_command_of_the_updater_has_a_limit(self) -> None:
        limits = (ROOT / "service/limits.h").read_text()
        tools = set(re.findall(r'^    \{"[\w-]+", "([\w-]+)"', limits, re.MULTILINE))
        sources = "".join(path.read_text() for path in [*ROOT.glob("common/src/*.cpp"), *ROOT.glob("remote/*.cpp")])
        called = set(re.findall(r'[("]((?:[a-z0-9-]+))  ?(?:-|/root|update|install|policy|stop|start|192)', sources))
        assert called > {"apt", "apt-cache", "ssh", "scp", "ls", "systemctl", "umount", "i2cset"}
        assert called - tools - {"rm"} == set()

    def test_shortened_table_has_the_same_calls(self) -> None:
        row = r'\{("[\w-]+", (?:"[\w-]+"|nullptr), (?:"[^"]+"|nullptr)), \d+, \d+, (\w+, \w+)\}'
        tables = ("service/limits.h", "tests/service/short_limits.h")
        rows = [re.findall(row, (ROOT / path).read_text()) for path in tables]
        assert rows[0] == rows[1]
        assert len(rows[0]) > 10

    def test_documented_limits_are_those_of_the_table(self) -> None:
        units = {"s": 1, "min": 60}
        documented = {}
        for line in (ROOT / "docs/reliability.md").read_text().splitlines():
            if line.startswith("| ") and line.count(" | ") == 3:
                row, bound = line.split(" | ")[:2]
                amounts = re.findall(r"(\d+) (?:(s|min)\b|in all)", bound.removesuffix(" the usual 13 min"))
                documented[row[2:]] = [int(amount) * units[unit or "min"] for amount, unit in amounts]
        text = (ROOT / "service/limits.h").read_text()
        limits = re.findall(r'^    \{"([\w-]+)", .*, (\d+), (\d+), \w+, \w+\}', text, re.MULTILINE)
        for name, *seconds in limits:
            assert set(documented[DOCUMENTED[name]]) == {int(amount) for amount in seconds}, name
        assert {name for name, *_ in limits} == set(DOCUMENTED)
        said = " ".join((ROOT / "docs/packaging.md").read_text().split())
        times = re.findall(r"SIGKILL (\d+) seconds later|is cut (\d+) second after", said)
        grace, silence = re.findall(r"constexpr double \w+ = (\d+);", text)
        assert times == [(grace, ""), ("", silence)]


class TestPanel:
    """Bytes for the panel, with both kinds of the real tool."""

    @pytest.mark.parametrize("real, option", [(OLD, "none"), (NEW, "-a")], ids=["old", "new"])
    def test_both_kinds_get_the_same_bytes(self, unit: Unit, real: str, option: str) -> None:
        unit.tool("i2cset", real)
        assert unit.send("0x12", "0x1") == 0
        assert (unit.folder / "sent").read_text() == "-y 0 0x07 0x12 c\n-y 0 0x07 0x1 c\n"
        assert (unit.folder / "asked").read_text() == "asked\n"  # once in a run
        assert unit.notes() == [f"option {option}"]

    @pytest.mark.parametrize("real", [OLD, NEW], ids=["old", "new"])
    def test_status_is_the_real_one(self, unit: Unit, real: str) -> None:
        unit.tool("i2cset", real)
        assert unit.send("0x12", refused="0x12") == 1

    def test_without_a_folder_for_notes(self, unit: Unit) -> None:
        del unit.environment["RUNTIME_DIRECTORY"]
        unit.tool("i2cset", NEW)
        assert unit.send("0x13", "0x2") == 0
        assert (unit.folder / "sent").read_text() == "-y 0 0x07 0x13 c\n-y 0 0x07 0x2 c\n"

    def test_outcome_is_noted_with_its_led(self, unit: Unit) -> None:
        unit.tool("i2cset", NEW)
        os.umask(0o022)
        unit.send("0x12", "0x0", "0x13", "0x2", "0x12", "0x8")
        assert (unit.folder / "run/select").stat().st_mode & 0o777 == 0o644
        assert unit.notes()[1:] == ["lit 0x13 0x2 0", "lit 0x12 0x8 0"]

    def test_outcome_of_which_a_byte_failed_is_noted_as_such(self, unit: Unit) -> None:
        unit.tool("i2cset", NEW)
        unit.send("0x13", "0x2", refused="0x2")
        unit.send("0x13", "0x2", refused="0x13")
        assert unit.notes()[1:] == ["lit 0x13 0x2 1", "lit 0x13 0x2 1"]

    def test_outcome_belongs_to_the_led_before_it(self, unit: Unit) -> None:
        unit.tool("i2cset", NEW)
        unit.send("0x2", "0x10", "0x2", "0xf", "0x8", "0x1d", "0x2", "0x1e", "0x8")
        lit = ["unknown 0x2 1", "0x10 0x2 0", "0x10 0x8 0", "0x1d 0x2 0", "0x1d 0x8 0"]
        assert unit.notes()[1:] == [f"lit {each}" for each in lit]

    def test_selected_led_that_cannot_be_noted(self, unit: Unit) -> None:
        unit.tool("i2cset", NEW)
        (unit.folder / "run/select").symlink_to("/dev/full")
        done = unit.shell("i2cset -y 0 0x07 0x13 c")
        said = f"hand-over: cannot write {unit.folder}/run/select: No space left on device\n"
        assert (done.returncode, done.stderr) == (0, said)

    def test_nothing_else_is_noted(self, unit: Unit) -> None:
        unit.tool("i2cset", NEW)
        unit.send("0x12", "0x14", "0x0", "0x1", "0x40", "0x80", "0xC0", "0xc2", "0x1f", "0x19")
        assert unit.notes() == ["option -a"]

    def test_sound_is_noted(self, unit: Unit) -> None:
        unit.tool("aplay", "exit 1")
        os.umask(0o022)
        sounds = "/root/RESOURCES/SOUNDS/SND_RESULT"
        unit.shell(f"aplay {sounds}_PASS.wav; aplay {sounds}_FAIL.wav")
        assert unit.notes() == ["sound pass", "sound fail"]
        assert (unit.folder / "run/notes").stat().st_mode & 0o777 == 0o644
        assert unit.shell("aplay").returncode == 1
        assert len(unit.notes()) == 2

    def test_installed_tool_accepts_the_address(self, unit: Unit) -> None:
        real = Path("/usr/sbin/i2cset")
        if not real.exists():
            pytest.skip("no i2c-tools here")
        # A bus that does not exist: the tool checks its arguments before it opens the bus.
        done = unit.shell("i2cset -y 9999 0x07 0x12 c")
        assert "No such file or directory" in done.stderr
