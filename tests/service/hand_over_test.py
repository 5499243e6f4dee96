"""Usage: hand_over_test.py HAND_OVER HAND_OVER_SHORT [TEST...]

The hand-over, which is called in place of the updater's tools, with stand-in tools: what it passes on and what it ends.
"""

import contextlib
import os
import re
import shutil
import signal
import subprocess
import sys
import tempfile
import time
import unittest
from collections.abc import Iterator
from pathlib import Path

from bench.makers.files import write, write_script
from bench.makers.i2cset import NEWER, OLDER
from tests.command_line import take_path
from tests.mounts import separate_mounts

ROOT = Path(__file__).parents[2]
SHELLS = ("dash", "bash")
# Both kinds note each request for their usage text, keep the bytes that they get, and refuse one byte.
ASKED = '[ "$1" != -h ] || echo asked >>"$FOLDER/asked"\n'
SENT = 'echo "$*" >>"$FOLDER/sent"\n[ "$4" != "$REFUSED" ] || exit 1\n'
OLD = ASKED + OLDER + SENT
NEW = ASKED + NEWER + SENT

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


def running(marker: str) -> list[int]:
    """The processes whose environment has the marker, except those that have ended."""
    found = []
    for process in Path("/proc").glob("[0-9]*"):
        with contextlib.suppress(OSError):
            if marker.encode() in (process / "environ").read_bytes():
                found.append(int(process.name))
    return found


class HandOverTest(unittest.TestCase):
    """A folder `bin` with the hand-over under each tool's name, one with real tools, one for the notes of a run."""

    hand_over: Path
    short: Path

    def setUp(self) -> None:
        self.maxDiff = None
        folder = tempfile.TemporaryDirectory(prefix="hand-over-")
        self.addCleanup(folder.cleanup)
        self.folder = Path(folder.name)
        for name in ("bin", "tools", "run"):
            (self.folder / name).mkdir()
        self.use(self.hand_over)
        self.direct = {
            "PATH": f"{self.folder}/tools:/usr/sbin:/usr/bin:/sbin:/bin",
            "FOLDER": str(self.folder),
            "RUNTIME_DIRECTORY": str(self.folder / "run"),
            "REFUSED": "none",
        }
        self.environment = self.direct | {"PATH": f"{self.folder}/bin:{self.direct['PATH']}"}
        self.addCleanup(self.end_all)

    def end_all(self) -> None:
        """Ends the processes that a tool has left running."""
        for process in running(f"FOLDER={self.folder}"):
            with contextlib.suppress(OSError):
                os.kill(process, signal.SIGKILL)

    def use(self, program: Path) -> None:
        """Installs the hand-over, as the package does."""
        shutil.copy(program, self.folder / "hand-over")
        for tool in ("i2cset", "aplay", "apt", "apt-cache", "ssh", "scp", "ls", "umount", "systemctl", "journalctl"):
            (self.folder / "bin" / tool).unlink(missing_ok=True)
            (self.folder / "bin" / tool).symlink_to("../hand-over")

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


class PassedOn(HandOverTest):
    """Neither a tool that does not hang nor its caller notices anything."""

    def assert_same(self, line: str) -> None:
        """With and without the hand-over, in both shells."""
        for shell in SHELLS:
            for read in (True, False):
                direct = self.shell(line, shell, direct=True, read=read)
                there = self.shell(line, shell, read=read)
                self.assertEqual((there.returncode, there.stdout), (direct.returncode, direct.stdout), (line, shell))
                self.assertNotIn("hand-over: ", there.stderr)

    def test_exit_codes(self) -> None:
        for code in (0, 1, 2, 100, 124, 126, 127, 255):
            self.tool("apt", f"echo text; echo error >&2; exit {code}")
            for line in ("apt update", "apt update; apt update", "apt update && apt update", "apt update; exit $?"):
                self.assert_same(line)

    def test_signals(self) -> None:
        for name in ("HUP", "INT", "KILL", "TERM", "PIPE", "SEGV", "ABRT", "ALRM", "USR1"):
            self.tool("apt", f"ulimit -c 0; echo text; kill -{name} $$")
            for line in ("apt update", "apt update; exit $?", "apt update && apt update"):
                self.assert_same(line)

    def test_missing_tool_and_one_that_cannot_be_run(self) -> None:
        self.direct["PATH"] = f"{self.folder}/tools"
        self.environment["PATH"] = f"{self.folder}/bin:{self.folder}/tools"
        shells = {name: shutil.which(name) for name in SHELLS}
        for line in ("aplay x", "apt update; exit $?"):
            for shell in shells.values():
                codes = [self.shell(line, shell or "", direct).returncode for direct in (False, True)]
                self.assertEqual(codes[0], codes[1])
        said = f"hand-over: aplay: not found in {self.folder}/tools\n"
        self.assertEqual(self.shell("aplay x", shells["dash"] or "").stderr, said)
        (self.folder / "tools/apt").write_text("no program\n")
        done = self.shell("apt update", shells["dash"] or "")
        self.assertEqual(done.returncode, 126)
        self.assertEqual(done.stderr, f"hand-over: apt: not to be run in {self.folder}/tools\n")

    def test_first_one_that_can_be_run_is_the_real_one(self) -> None:
        for name in ("a", "b", "nib", "bin2"):
            (self.folder / name).mkdir()
        (self.folder / "a/apt").mkdir()
        (self.folder / "b/apt").write_text("no program\n")
        for name in ("nib", "bin2"):
            write_script(self.folder / name / "apt", f"echo {name}")
        for folders in (("a", "b", "nib", "bin2"), ("a", "bin2", "b", "nib")):
            search = ":".join(str(self.folder / name) for name in folders)
            self.direct["PATH"] = f"{search}:/usr/bin:/bin"
            self.environment["PATH"] = f"{self.folder}/bin:{self.direct['PATH']}"
            self.assert_same("apt update")

    def test_empty_folder_of_the_path_is_the_present_one(self) -> None:
        self.tool("apt", 'echo "$PATH"')
        for path in ("", "/nowhere:", "."):
            self.environment["PATH"] = f"{self.folder}/bin:{path}"
            done = self.shell(f"cd {self.folder}/tools; ../bin/apt update", "/bin/dash")
            self.assertEqual((done.returncode, done.stdout), (0, f"{path}\n"))

    def test_script_without_a_first_line(self) -> None:
        (self.folder / "tools/apt").write_text('echo "$@"; exit 3\n')
        (self.folder / "tools/apt").chmod(0o755)
        self.assert_same("apt update")

    def test_arguments_environment_and_signals(self) -> None:
        # The tool prints its arguments, from argv[0] on, its environment and its signals.
        shutil.copy("/usr/bin/cat", self.folder / "tools/ls")
        files = "/proc/self/cmdline /proc/self/environ"
        status = " | sed -n '/^Sig[BI]/p;/^ShdPnd/p'"
        for before in ("", "trap '' TERM PIPE; "):
            for line in (f"{before}ls {files} -- 'a  b' '' '*'", f"{before}ls /proc/self/status{status}"):
                direct = self.shell(line, direct=True)
                there = self.shell(line)
                self.assertEqual(there.stdout.replace("\0OLDPWD", "\0"), direct.stdout.replace("\0OLDPWD", "\0"))
        self.assertIn("ls\0/proc", self.shell(f"ls {files}").stdout)

    def test_standard_input(self) -> None:
        self.tool("ssh", "cat")
        self.assert_same("echo text | ssh board")

    def test_large_output_and_a_reader_that_goes_away(self) -> None:
        self.tool("apt", "yes line | head -c 3000000; echo end")
        self.assertEqual(len(self.shell("apt update").stdout), 3000004)
        self.tool("apt", "exec yes line")
        self.assertEqual(self.shell("apt update | head -1").stdout, "line\n")
        self.assertEqual(self.shell("{ apt update; echo $? >&2; } | head -1").stderr, "141\n")

    def test_no_child_meets_it(self) -> None:
        own = str(self.folder / "bin")
        for path in ("{own}:{rest}", "{own}/:{own}:{rest}", "{own}/.:{rest}:{own}", "{rest}:{own}"):
            self.environment["PATH"] = path.format(own=own, rest=self.direct["PATH"])
            self.tool("apt", 'echo "$PATH"; command -v systemctl ls')
            done = subprocess.run(
                [f"{own}/apt", "update"], env=self.environment, capture_output=True, text=True, check=True
            )
            self.assertNotIn(f"{own}", done.stdout)
            self.assertEqual(done.stdout.splitlines()[0], self.direct["PATH"])

    def test_it_never_takes_itself_for_the_real_one(self) -> None:
        own = str(self.folder / "bin")
        for path in (own, f"{own}:{own}/", f"{own}/.:{own}"):
            done = subprocess.run(
                [f"{own}/apt", "install"],
                env=self.environment | {"PATH": path},
                capture_output=True,
                text=True,
                check=False,
                timeout=10,
            )
            self.assertEqual((done.returncode, done.stdout), (127, ""))
            self.assertEqual(self.notes(), [])  # not even once

    def test_successor_that_has_just_replaced_it_is_not_the_real_one(self) -> None:
        # As after an upgrade, the file under the called path is another: a script whose interpreter runs.
        shutil.copy(self.folder / "hand-over", self.folder / "apt")
        (self.folder / "bin/apt").unlink()
        write(self.folder / "bin/apt", f"#!{self.folder}/apt\n", 0o755)
        self.tool("apt", 'echo "$PATH"')
        self.assertEqual(self.shell("timeout 10 apt update").stdout, f"{self.direct['PATH']}\n")

    def test_without_a_folder_for_notes(self) -> None:
        del self.environment["RUNTIME_DIRECTORY"]
        self.tool("aplay", "exit 3")
        self.assertEqual(self.shell("aplay SND_RESULT_PASS.wav").returncode, 3)
        self.environment["RUNTIME_DIRECTORY"] = "/nowhere"
        done = self.shell("aplay SND_RESULT_PASS.wav")
        self.assertEqual((done.returncode, done.stderr), (3, ""))

    def test_notes_that_cannot_be_written(self) -> None:
        self.tool("aplay", "exit 3")
        notes = self.folder / "run/notes"
        notes.symlink_to("/dev/full")
        done = self.shell("aplay SND_RESULT_PASS.wav")
        said = f"hand-over: cannot write {notes}: No space left on device\n"
        self.assertEqual((done.returncode, done.stderr), (3, said))

    def test_no_more_descriptors(self) -> None:
        shutil.copy("/usr/bin/echo", self.folder / "tools/apt")
        done = self.shell("exec prlimit --nofile=4 apt update")
        self.assertEqual((done.returncode, done.stdout), (0, "update\n"))

    def test_daemon_of_a_package_script_is_left_alone(self) -> None:
        self.tool("apt", "sleep 30 >/dev/null 2>&1 & echo done")
        self.assertEqual(self.shell("apt update").stdout, "done\n")
        self.assertEqual(len(running(f"FOLDER={self.folder}")), 1)


class Limits(HandOverTest):
    """Shortened limits: nothing delays the caller longer."""

    def setUp(self) -> None:
        super().setUp()
        self.use(self.short)

    def assert_expires(self, line: str, seconds: float, left_over: int = 0) -> "subprocess.CompletedProcess[str]":
        """The line fails with 124 after about this many seconds; returns how many of its processes remain."""
        begin = time.monotonic()
        done = self.shell(line)
        self.assertEqual(done.returncode, 124, done.stderr)
        took = time.monotonic() - begin
        self.assertGreater(took, seconds - 0.1)
        self.assertLess(took, seconds + 4)  # a busy machine
        self.assertEqual(len(running(f"FOLDER={self.folder}")), left_over)
        return done

    def test_tool_that_never_ends(self) -> None:
        self.tool("aplay", "echo text; exec sleep 60")
        done = self.assert_expires("aplay x", 2)
        self.assertIn("hand-over: aplay: no end within 2 s; ended\n", done.stderr)
        self.assertEqual(done.stdout, "text\n")
        for shell in SHELLS:
            (self.folder / "run/notes").unlink()
            self.assertEqual(self.shell("aplay x; exit $?", shell).returncode, 124)

    def test_tool_that_ignores_the_request_to_end(self) -> None:
        self.tool("aplay", "trap '' TERM; sleep 60; sleep 60; sleep 60")
        self.assert_expires("aplay x", 2)

    def test_stopped_tool(self) -> None:
        self.tool("aplay", "kill -STOP $$")
        self.assert_expires("aplay x", 2)

    def test_descendants_in_sessions_of_their_own(self) -> None:
        self.tool("aplay", "setsid sh -c 'trap \"\" TERM; setsid sleep 60 & sleep 60; sleep 60' & sleep 60")
        self.assert_expires("aplay x", 2)

    def test_one_that_multiplies(self) -> None:
        self.tool("aplay", "trap '' TERM; while :; do setsid sh -c 'sleep 60 & sleep 60' & sleep 0.05; done")
        self.assert_expires("aplay x", 2)

    def test_output_that_another_process_holds_open(self) -> None:
        self.tool("apt", "sleep 60 & echo text; exit 3")
        begin = time.monotonic()
        done = self.shell("apt update")
        self.assertEqual((done.returncode, done.stdout), (3, "text\n"))
        self.assertIn("hand-over: apt: its output is held open by another process; cut\n", done.stderr)
        self.assertLess(time.monotonic() - begin, 4)

    def test_output_that_another_process_goes_on_filling(self) -> None:
        self.tool("ls", "(while :; do echo more; sleep 0.1; done) & exit 0")
        begin = time.monotonic()
        self.shell("ls x")
        self.assertLess(time.monotonic() - begin, 6)

    def test_uninterruptible_tool_is_left_behind(self) -> None:
        with self.frozen() as frozen:
            shutil.copy("/usr/bin/stat", self.folder / "tools/ls")
            for line in (f"ls {frozen}/x", f"umount {frozen}/x"):
                if line.startswith("umount"):
                    shutil.copy("/usr/bin/stat", self.folder / "tools/umount")
                (self.folder / "run/notes").unlink(missing_ok=True)
                begin = time.monotonic()
                done = self.shell(line)
                self.assertEqual(done.returncode, 124)
                self.assertIn("cannot be ended; left behind", done.stderr)
                self.assertLess(time.monotonic() - begin, 8)

    @contextlib.contextmanager
    def frozen(self) -> Iterator[Path]:
        """A mount point whose every access hangs for ever."""
        if os.geteuid() != 0 or not Path("/dev/fuse").exists():
            self.skipTest("no root or no FUSE here")
        separate_mounts()
        folder = self.folder / "frozen"
        folder.mkdir()
        server = subprocess.Popen(
            [sys.executable, "-B", ROOT / "tests/service/frozen_mount.py", folder], stdout=subprocess.PIPE, text=True
        )
        assert server.stdout
        try:
            said = server.stdout.readline()
            if said != "mounted\n":
                self.skipTest(said)
            yield folder
        finally:
            server.kill()
            server.wait()
            server.stdout.close()
            subprocess.run(["umount", "--lazy", folder], check=False)

    def test_signal_reaches_all_descendants(self) -> None:
        self.tool("apt", "setsid sh -c 'setsid sleep 60 & sleep 60' & sleep 60")
        process = subprocess.Popen([self.folder / "bin/apt", "update"], env=self.environment, stdout=subprocess.PIPE)
        while len(running(f"FOLDER={self.folder}")) < 6:
            time.sleep(0.05)
        process.terminate()
        process.communicate(timeout=5)
        self.assertEqual(process.returncode, -signal.SIGTERM)
        time.sleep(0.2)
        self.assertEqual(running(f"FOLDER={self.folder}"), [])

    def test_signal_that_the_tool_handles(self) -> None:
        self.tool("apt", "trap 'exit 7' TERM; touch $FOLDER/ready; while :; do sleep 0.1; done")
        process = subprocess.Popen([self.folder / "bin/apt", "update"], env=self.environment)
        while not (self.folder / "ready").exists():
            time.sleep(0.05)
        process.terminate()
        self.assertEqual(process.wait(10), 7)

    def test_signal_that_the_caller_ignores(self) -> None:
        dies = "import signal, time; signal.signal(signal.SIGTERM, signal.SIG_DFL); open('ready', 'w'); time.sleep(0.5)"
        self.tool("apt", f'exec python3 -c "{dies}"')
        line = "trap '' TERM; exec bin/apt update"
        process = subprocess.Popen(["dash", "-c", line], cwd=self.folder, env=self.environment)
        while not (self.folder / "ready").exists():
            time.sleep(0.05)
        process.terminate()
        self.assertEqual(process.wait(10), 0)

    def test_budget(self) -> None:
        self.tool("i2cset", "echo called >>$FOLDER/called; [ $1 != -h ] || exit 1; exec sleep 60")
        used_up = []
        for limit in (1, 1, 1, 0, 0):
            begin = time.monotonic()
            done = self.shell("i2cset -y 0 0x07 0x12 c")
            self.assertEqual(done.returncode, 124)
            self.assertLess(time.monotonic() - begin, limit + 0.9)
            used_up.append("hand-over: panel: 3 s are used up; further calls fail at once\n" in done.stderr)
        self.assertEqual(used_up, [False, False, True, False, False])
        self.assertEqual(len((self.folder / "called").read_text().split()), 4)  # one of them asks for the usage text
        self.assertEqual(done.stderr, "")
        self.assertEqual([note.split()[:2] for note in self.notes()[1:]], [["spent", "panel"]] * 3)
        self.tool("aplay", "exit 0")
        self.assertEqual(self.shell("aplay x").returncode, 0)  # it has its own budget

    def test_uploads_are_counted_whole(self) -> None:
        self.tool("scp", "sleep 2.5; exit 1")
        codes = [self.shell("scp a b").returncode for _ in range(4)]
        self.assertEqual(codes, [1, 1, 124, 124])

    def test_calls_of_one_tool_have_limits_of_their_own(self) -> None:
        for tool in ("apt", "ssh"):
            self.tool(tool, "exec sleep 60")
        self.assert_expires("apt update", 12)
        self.assert_expires('ssh -o ConnectTimeout=2 192.168.9.2 " cat /root/App/AppExe/version.txt"', 6)
        spent = [note.split()[:2] for note in self.notes()]
        self.assertEqual(spent, [["spent", "mirrors"], ["spent", "board-version"]])

    def test_installation_and_board_script_are_noted(self) -> None:
        self.tool("apt", "exit 1")
        self.tool("ssh", "exit 0")
        self.shell("apt update; apt --assume-yes install solvik4-rh; ssh 192.168.9.2 /unzipUpgrade.sh")
        expected = ["began installation", "ended installation 256", "began board-script", "ended board-script 0"]
        self.assertEqual(self.notes(), expected)

    def test_journal_is_synced_before_the_application_starts(self) -> None:
        for tool in ("journalctl", "sync"):
            self.tool(tool, f'echo "{tool} $*" >>$FOLDER/calls; echo text; echo error >&2')
        self.tool("systemctl", 'echo "systemctl $*" >>$FOLDER/calls')
        synced = ["journalctl --sync", "sync --file-system /var/log/journal", "systemctl start harl"]
        for line, calls in (
            ("systemctl stop harl", ["systemctl stop harl"]),
            ("systemctl start other", ["systemctl start other"]),
            ("systemctl harl", ["systemctl harl"]),
            ("systemctl start harl", synced),
            ("env --unset RUNTIME_DIRECTORY systemctl start harl", synced[2:]),
        ):
            done = self.shell(line)
            self.assertEqual((done.returncode, done.stdout, done.stderr), (0, "", ""))
            self.assertEqual((self.folder / "calls").read_text().splitlines(), calls)
            (self.folder / "calls").unlink()
        for tool in ("journalctl", "sync"):
            self.tool(tool, "exec sleep 60")
        begin = time.monotonic()
        self.assertEqual(self.shell("systemctl start harl").returncode, 0)
        self.assertLess(time.monotonic() - begin, 8)


class Table(unittest.TestCase):
    """The limits themselves."""

    def test_every_command_of_the_updater_has_a_limit(self) -> None:
        limits = (ROOT / "service/limits.h").read_text()
        tools = set(re.findall(r'^    \{"[\w-]+", "([\w-]+)"', limits, re.MULTILINE))
        sources = "".join(path.read_text() for path in [*ROOT.glob("common/src/*.cpp"), *ROOT.glob("remote/*.cpp")])
        called = set(re.findall(r'[("]((?:[a-z0-9-]+))  ?(?:-|/root|update|install|policy|stop|start|192)', sources))
        self.assertGreater(called, {"apt", "apt-cache", "ssh", "scp", "ls", "systemctl", "umount", "i2cset"})
        self.assertEqual(called - tools - {"rm"}, set())

    def test_shortened_table_has_the_same_calls(self) -> None:
        row = r'\{("[\w-]+", (?:"[\w-]+"|nullptr), (?:"[^"]+"|nullptr)), \d+, \d+, (\w+, \w+)\}'
        tables = ("service/limits.h", "tests/service/short_limits.h")
        rows = [re.findall(row, (ROOT / path).read_text()) for path in tables]
        self.assertEqual(*rows)
        self.assertGreater(len(rows[0]), 10)

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
            with self.subTest(name=name):
                expected = sorted({int(amount) for amount in seconds})
                self.assertEqual(sorted(set(documented[DOCUMENTED[name]])), expected)
        self.assertEqual({name for name, *_ in limits}, set(DOCUMENTED))
        said = " ".join((ROOT / "docs/packaging.md").read_text().split())
        times = re.findall(r"SIGKILL (\d+) seconds later|is cut (\d+) second after", said)
        grace, silence = re.findall(r"constexpr double \w+ = (\d+);", text)
        self.assertEqual(times, [(grace, ""), ("", silence)])


class Panel(HandOverTest):
    """Bytes for the panel, with both kinds of the real tool."""

    def send(self, *values: str, refused: str = "none") -> int:
        """Sends bytes as the updater does; the status of the last."""
        self.environment["REFUSED"] = refused
        return self.shell(" ; ".join(f"i2cset -y 0 0x07 {value} c" for value in values)).returncode

    def test_both_kinds_get_the_same_bytes(self) -> None:
        for real, option in ((OLD, "none"), (NEW, "-a")):
            self.tool("i2cset", real)
            self.assertEqual(self.send("0x12", "0x1"), 0)
            self.assertEqual((self.folder / "sent").read_text(), "-y 0 0x07 0x12 c\n-y 0 0x07 0x1 c\n")
            self.assertEqual((self.folder / "asked").read_text(), "asked\n")  # once in a run
            self.assertEqual(self.notes(), [f"option {option}"])
            for name in ("sent", "asked", "run/notes"):
                (self.folder / name).unlink()

    def test_status_is_the_real_one(self) -> None:
        for real in (OLD, NEW):
            self.tool("i2cset", real)
            (self.folder / "run/notes").unlink(missing_ok=True)
            self.assertEqual(self.send("0x12", refused="0x12"), 1)

    def test_without_a_folder_for_notes(self) -> None:
        del self.environment["RUNTIME_DIRECTORY"]
        self.tool("i2cset", NEW)
        self.assertEqual(self.send("0x13", "0x2"), 0)
        self.assertEqual((self.folder / "sent").read_text(), "-y 0 0x07 0x13 c\n-y 0 0x07 0x2 c\n")

    def test_outcome_is_noted_with_its_led(self) -> None:
        self.tool("i2cset", NEW)
        os.umask(0o022)
        self.send("0x12", "0x0", "0x13", "0x2", "0x12", "0x8")
        self.assertEqual((self.folder / "run/select").stat().st_mode & 0o777, 0o644)
        self.assertEqual(self.notes()[1:], ["lit 0x13 0x2 0", "lit 0x12 0x8 0"])

    def test_outcome_of_which_a_byte_failed_is_noted_as_such(self) -> None:
        self.tool("i2cset", NEW)
        self.send("0x13", "0x2", refused="0x2")
        self.send("0x13", "0x2", refused="0x13")
        self.assertEqual(self.notes()[1:], ["lit 0x13 0x2 1", "lit 0x13 0x2 1"])

    def test_outcome_belongs_to_the_led_before_it(self) -> None:
        self.tool("i2cset", NEW)
        self.send("0x2", "0x10", "0x2", "0xf", "0x8", "0x1d", "0x2", "0x1e", "0x8")
        lit = ["unknown 0x2 1", "0x10 0x2 0", "0x10 0x8 0", "0x1d 0x2 0", "0x1d 0x8 0"]
        self.assertEqual(self.notes()[1:], [f"lit {each}" for each in lit])

    def test_selected_led_that_cannot_be_noted(self) -> None:
        self.tool("i2cset", NEW)
        (self.folder / "run/select").symlink_to("/dev/full")
        done = self.shell("i2cset -y 0 0x07 0x13 c")
        said = f"hand-over: cannot write {self.folder}/run/select: No space left on device\n"
        self.assertEqual((done.returncode, done.stderr), (0, said))

    def test_nothing_else_is_noted(self) -> None:
        self.tool("i2cset", NEW)
        self.send("0x12", "0x14", "0x0", "0x1", "0x40", "0x80", "0xC0", "0xc2", "0x1f", "0x19")
        self.assertEqual(self.notes(), ["option -a"])

    def test_sound_is_noted(self) -> None:
        self.tool("aplay", "exit 1")
        os.umask(0o022)
        sounds = "/root/RESOURCES/SOUNDS/SND_RESULT"
        self.shell(f"aplay {sounds}_PASS.wav; aplay {sounds}_FAIL.wav")
        self.assertEqual(self.notes(), ["sound pass", "sound fail"])
        self.assertEqual((self.folder / "run/notes").stat().st_mode & 0o777, 0o644)
        self.assertEqual(self.shell("aplay").returncode, 1)
        self.assertEqual(len(self.notes()), 2)

    def test_installed_tool_accepts_the_address(self) -> None:
        real = Path("/usr/sbin/i2cset")
        if not real.exists():
            self.skipTest("no i2c-tools here")
        # A bus that does not exist: the tool checks its arguments before it opens the bus.
        done = self.shell("i2cset -y 9999 0x07 0x12 c")
        self.assertIn("No such file or directory", done.stderr)


if __name__ == "__main__":
    HandOverTest.hand_over, HandOverTest.short = take_path(), take_path()
    unittest.main()
