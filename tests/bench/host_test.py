"""The machine is the same before and after a run of the bench, however the run ends."""

import os
import signal
import subprocess
import sys
import time
from collections.abc import Callable
from pathlib import Path

import pytest

from bench.real.unit import forbidden
from bench.runner import CLEANUP
from tests.commands import run_command

ROOT = Path(__file__).parents[2]
NO_UNIT = forbidden()
INSTRUMENT = ["/root/USB_MOUNT", "/root/RESOURCES", "/unzipUpgrade.sh", "/opt/bench", "/run/harl"]
LONGEST_CLEARING = 60  # s


def machine(folder: str) -> dict[str, str]:
    """What a run with the temporary folder `folder` must leave unchanged on this machine."""
    return {
        "mounts": Path("/proc/self/mountinfo").read_text(),
        "links": run_command("ip", "-brief", "link").stdout,
        "addresses": run_command("ip", "-brief", "address").stdout,
        "routes": run_command("ip", "route", "show", "table", "all").stdout,
        "control groups": run_command("find", "/sys/fs/cgroup", "-name", f"{Path(folder).name}-*").stdout,
        "package": run_command("grep", "-c", "^Package: solvik4", "/var/lib/dpkg/status").stdout,
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


class Host:
    """This machine. The bench runs with the temporary folder `folder`, which must be empty and unused at the end."""

    def __init__(self, folder: Path, build: Path) -> None:
        self.folder = folder
        self._build = build
        self._before = machine(str(folder))

    def start(self, *arguments: str | Path) -> subprocess.Popen[str]:
        return subprocess.Popen(
            [sys.executable, "-B", "-m", "bench", "--build", self._build, *arguments],
            env=os.environ | {"TMPDIR": str(self.folder)},
            stdout=subprocess.PIPE,
            stderr=subprocess.STDOUT,
            text=True,
            start_new_session=True,
        )

    def users(self) -> list[str]:
        return users_of(str(self.folder))

    def wait_until(self, what: str, holds: Callable[[], object]) -> None:
        end = time.monotonic() + LONGEST_CLEARING
        while not holds():
            assert time.monotonic() < end, f"{what}: {os.listdir(self.folder)} {self.users()}"
            time.sleep(0.02)

    def check_untouched(self) -> None:
        self.wait_until("not cleared away", lambda: not os.listdir(self.folder) and not self.users())
        assert machine(str(self.folder)) == self._before


@pytest.fixture
def host(tmp_path_factory: pytest.TempPathFactory, build: Path) -> Host:
    return Host(tmp_path_factory.mktemp("bench-host-test-"), build)


@pytest.fixture(params=[pytest.param("real", marks=pytest.mark.skipif(bool(NO_UNIT), reason=NO_UNIT)), "stand-in"])
def kind(request: pytest.FixtureRequest) -> str:
    """The kind of unit."""
    return str(request.param)


def test_after_a_run(host: Host, kind: str) -> None:
    with host.start("--unit", kind, "up-to-date") as bench:
        text = bench.communicate()[0]
    assert bench.returncode == 0, text
    host.check_untouched()


def test_after_a_run_that_fails(host: Host, kind: str, tmp_path: Path) -> None:
    wrong = tmp_path / "wrong.toml"
    text = (ROOT / "bench/scenarios/up-to-date.toml").read_text()
    wrong.write_text(text.replace("marker = true", "marker = false"))
    with host.start("--unit", kind, wrong) as bench:
        text = bench.communicate()[0]
    assert bench.returncode == 1, text
    assert "DIFFERENCE: marker: expected False, not True" in text
    host.check_untouched()


@pytest.mark.parametrize("name, status", [("SIGINT", 130), ("SIGTERM", 143), ("SIGKILL", -9)])
def test_after_a_signal_while_the_updater_runs(host: Host, kind: str, name: str, status: int) -> None:
    with host.start("--unit", kind, "package-and-board", "--speed", "1") as bench:
        assert bench.stdout
        while "Running command: apt-cache" not in (line := bench.stdout.readline()):
            assert line != "", "the bench ended early"
        assert host.users()
        bench.send_signal(signal.Signals[name])
        bench.communicate()
        assert bench.returncode == status
        host.check_untouched()


def test_guard_needs_no_process(host: Host) -> None:
    folder = host.folder / "bench"
    folder.mkdir()
    with subprocess.Popen(["sleep", "60"], start_new_session=True) as left:
        (folder / "unit.pid").write_text(f"{left.pid}\n")
        guard: list[str | Path] = [sys.executable, "-I", "-S", CLEANUP, folder]
        # No program on its search path.
        subprocess.run(guard, env={"PATH": str(host.folder)}, stdin=subprocess.DEVNULL, check=True)
        assert left.wait() == -signal.SIGKILL
    assert not folder.exists()


@pytest.mark.parametrize("name", ["SIGINT", "SIGTERM", "SIGKILL"])
def test_after_a_signal_while_the_unit_is_made(host: Host, kind: str, name: str) -> None:
    with host.start("--unit", kind, "package-and-board") as bench:
        host.wait_until("no folder", host.users)
        bench.send_signal(signal.Signals[name])
        bench.communicate()
        assert bench.returncode != 0
        host.check_untouched()


@pytest.mark.parametrize("name", ["SIGINT", "SIGKILL"])
def test_after_a_signal_while_many_scenarios_run(host: Host, kind: str, name: str) -> None:
    with host.start("--unit", kind, "--all", "--jobs", "3") as bench:
        host.wait_until("no folders", lambda: len(os.listdir(host.folder)) == 3)
        time.sleep(0.5)
        bench.send_signal(signal.Signals[name])
        bench.communicate()
        assert bench.returncode != 0
        host.check_untouched()
