"""Usage: host_test.py BUILD_FOLDER

The machine is the same before and after a run of the bench, however the run ends."""

import os
import signal
import subprocess
import sys
import tempfile
import time
import unittest
from collections.abc import Callable
from pathlib import Path

from bench.real.unit import forbidden
from bench.runner import CLEANUP
from tests.command_line import take_path

ROOT = Path(__file__).parents[2]


KINDS = ["stand-in"] if forbidden() else ["real", "stand-in"]
BUILD = ROOT / "build/default"
COMMAND = [sys.executable, "-B", "-m", "bench"]
INSTRUMENT = ["/root/USB_MOUNT", "/root/RESOURCES", "/unzipUpgrade.sh", "/opt/bench", "/run/harl"]
LONGEST_CLEARING = 60  # s


def output(*command: str) -> str:
    """What `command` prints."""
    return subprocess.run(command, capture_output=True, text=True, check=False).stdout


def machine(folder: str) -> dict[str, str]:
    """What a run with the temporary folder `folder` must leave unchanged on this machine."""
    return {
        "mounts": Path("/proc/self/mountinfo").read_text(),
        "links": output("ip", "-brief", "link"),
        "addresses": output("ip", "-brief", "address"),
        "routes": output("ip", "route", "show", "table", "all"),
        "control groups": output("find", "/sys/fs/cgroup", "-name", f"{Path(folder).name}-*"),
        "package": output("grep", "-c", "^Package: solvik4", "/var/lib/dpkg/status"),
        "instrument": str([Path(path).exists() for path in INSTRUMENT if os.access("/root", os.X_OK)]),
        "users": Path("/etc/passwd").read_text(),
    }


def users_of(folder: str) -> list[str]:
    """The processes that use `folder`: in their command line, or as a mount in their namespace."""
    found = []
    for process in Path("/proc").glob("[0-9]*"):
        try:
            command = (process / "cmdline").read_bytes().replace(b"\0", b" ").decode()
            if folder in command or folder in (process / "mountinfo").read_text():
                found.append(f"{process.name} {command}")
        except OSError:  # it has ended, or is another user's
            continue
    return found


class HostTest(unittest.TestCase):
    """Each test runs the bench with its own temporary folder, which must be empty and unused at the end."""

    def setUp(self) -> None:
        holder = tempfile.TemporaryDirectory(prefix="bench-host-test-")
        self.addCleanup(holder.cleanup)
        self.folder = holder.name
        self.before = machine(self.folder)

    def start(self, *arguments: str) -> subprocess.Popen[str]:
        return subprocess.Popen(
            [*COMMAND, "--build", BUILD, *arguments],
            env=os.environ | {"TMPDIR": self.folder},
            stdout=subprocess.PIPE,
            stderr=subprocess.STDOUT,
            text=True,
            start_new_session=True,
        )

    def wait_until(self, what: str, holds: Callable[[], object]) -> None:
        end = time.monotonic() + LONGEST_CLEARING
        while not holds():
            self.assertLess(time.monotonic(), end, f"{what}: {os.listdir(self.folder)} {users_of(self.folder)}")
            time.sleep(0.02)

    def check_untouched(self) -> None:
        self.wait_until("not cleared away", lambda: not os.listdir(self.folder) and not users_of(self.folder))
        self.assertEqual(machine(self.folder), self.before)

    def test_after_a_run(self) -> None:
        for kind in KINDS:
            with self.subTest(kind):
                with self.start("--unit", kind, "up-to-date") as bench:
                    text = bench.communicate()[0]
                self.assertEqual(bench.returncode, 0, text)
                self.check_untouched()

    def test_after_a_run_that_fails(self) -> None:
        wrong = Path(self.folder).with_suffix(".toml")
        self.addCleanup(wrong.unlink)
        text = (ROOT / "bench/scenarios/up-to-date.toml").read_text()
        wrong.write_text(text.replace("marker = true", "marker = false"))
        for kind in KINDS:
            with self.subTest(kind):
                with self.start("--unit", kind, str(wrong)) as bench:
                    text = bench.communicate()[0]
                self.assertEqual(bench.returncode, 1, text)
                self.assertIn("DIFFERENCE: marker: expected False, not True", text)
                self.check_untouched()

    def test_after_a_signal_while_the_updater_runs(self) -> None:
        for kind in KINDS:
            for number, status in ((signal.SIGINT, 130), (signal.SIGTERM, 143), (signal.SIGKILL, -9)):
                arguments = ["--unit", kind, "package-and-board", "--speed", "1"]
                with self.subTest(kind, number=number), self.start(*arguments) as bench:
                    assert bench.stdout
                    while "Running command: apt-cache" not in (line := bench.stdout.readline()):
                        self.assertNotEqual(line, "", "the bench ended early")
                    self.assertTrue(users_of(self.folder))
                    bench.send_signal(number)
                    bench.communicate()
                    self.assertEqual(bench.returncode, status)
                    self.check_untouched()

    def test_guard_needs_no_process(self) -> None:
        folder = Path(self.folder) / "bench"
        folder.mkdir()
        with subprocess.Popen(["sleep", "60"], start_new_session=True) as left:
            (folder / "unit.pid").write_text(f"{left.pid}\n")
            guard: list[str | Path] = [sys.executable, "-I", "-S", CLEANUP, folder]
            # No program on its search path.
            subprocess.run(guard, env={"PATH": self.folder}, stdin=subprocess.DEVNULL, check=True)
            self.assertEqual(left.wait(), -signal.SIGKILL)
        self.assertFalse(folder.exists())

    def test_after_a_signal_while_the_unit_is_made(self) -> None:
        for kind in KINDS:
            for number in (signal.SIGINT, signal.SIGTERM, signal.SIGKILL):
                with self.subTest(kind, number=number), self.start("--unit", kind, "package-and-board") as bench:
                    self.wait_until("no folder", lambda: users_of(self.folder))
                    bench.send_signal(number)
                    bench.communicate()
                    self.assertNotEqual(bench.returncode, 0)
                    self.check_untouched()

    def test_after_a_signal_while_many_scenarios_run(self) -> None:
        for kind in KINDS:
            for number in (signal.SIGINT, signal.SIGKILL):
                with self.subTest(kind, number=number), self.start("--unit", kind, "--all", "--jobs", "3") as bench:
                    self.wait_until("no folders", lambda: len(os.listdir(self.folder)) == 3)
                    time.sleep(0.5)
                    bench.send_signal(number)
                    bench.communicate()
                    self.assertNotEqual(bench.returncode, 0)
                    self.check_untouched()


if __name__ == "__main__":
    BUILD = take_path()
    unittest.main()
