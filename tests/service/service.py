"""The service of the built package under real systemd, apt and dpkg, in a machine of its own: what its tests share.

The board, the sound and the panel's bus are stand-ins.
"""

import contextlib
import os
import re
import shutil
import subprocess
import time
from collections.abc import Callable, Iterator
from pathlib import Path
from typing import TypeVar

import pytest

from bench.machine.machine import Machine, MachineError, machine
from bench.makers.files import write, write_script
from bench.makers.i2cset import NEWER
from bench.makers.packages import DATABASE, SOURCES, Package, build, write_index
from bench.makers.sticks import VERSIONS, version_file_archive, write_stick
from bench.panel import Panel, panel_after

ROOT = Path(__file__).parents[2]
STICK = "/root/USB_MOUNT"
UNITS = ("harl-updater", "harl-updater-give-back")
SPEED = 10  # times shorter waits of the updater
KEEP = 'echo "$4" >>/var/log/panel'  # the panel keeps the bytes that it gets
TOOLS = {
    "i2cset": NEWER + KEEP,
    "aplay": 'sleep 0.2; echo "${1##*/}" >>/var/log/sounds',
    "ssh": r"""
case $* in
*version.txt*) printf 'Brimvale\t%s\r\n' "$(cat /srv/board)" ;;
esac
""",
    # Reads from the stick for as long as it takes.
    "scp": f"exec 3<{STICK}/{VERSIONS}/quorb2.2.0/OSUpgrade.zip; touch /run/uploads; exec /opt/scp 60",
}
# Of a board that is updated at once.
BOARD_TOOLS = {
    "scp": "exit 0",
    "ssh": TOOLS["ssh"] + "case $* in *unzipUpgrade*) echo 2.2.0 >/srv/board ;; esac",
}
# Ordered after the updater: its start must not wait for a service that waits for it.
HARL = "[Unit]\nAfter=harl-updater.service\n[Service]\nExecStart=/bin/sleep infinity\n"
FOLDERS = [*DATABASE, "var/log/journal", "opt", "root/RESOURCES/SOUNDS", "root/USB_MOUNT", "srv/repository"]


def built_package(name: str) -> Path | None:
    """The package of packaging/build for this machine."""
    architecture = subprocess.check_output(["dpkg", "--print-architecture"], text=True).strip()
    folder = ROOT / "build/package"
    found = sorted([*folder.glob(f"{name}_*_{architecture}.deb"), *folder.glob(f"{name}_*_all.deb")])
    return found[-1] if found else None


def make_files(unit: Machine, package: Path, programs: Path) -> None:
    """Writes the machine's files: tools, packages and the application."""
    files = unit.files
    for name, text in TOOLS.items():
        write_script(files / "usr/local/sbin" / name, text)
    write(files / "etc/systemd/system/harl.service", HARL)
    write(files / "etc/apt/sources.list", SOURCES.format(folder="repository"))
    write(files / "etc/apt/apt.conf.d/50test", 'APT::Sandbox::User "root";\n')
    (files / "etc/systemd/system/dbus.socket").symlink_to("/dev/null")  # else apt waits for a login manager
    write(files / "srv/board", "2.2.0\n")
    for folder in FOLDERS:
        (files / folder).mkdir(parents=True, exist_ok=True)
    write(files / "var/lib/dpkg/status", "")
    shutil.copy(package, files / "srv/updater.deb")
    shutil.copy(programs / "bench/call_recorder.so", files / "opt")
    for name in ("service/hand-over", "tests/service/hand-over-short"):
        shutil.copy(programs / name, files / "opt")
    shutil.copy(unit.system / "usr/bin/sleep", files / "opt/scp")


def install(unit: Machine, *more: str) -> None:
    """Installs the package under test and `more` packages, and one package in place of all their dependencies."""
    files = ["/srv/updater.deb", *more]
    depends = ",".join(unit.run("dpkg-deb", "--field", file, "Depends") for file in files)
    others = sorted({item.split()[0] for item in depends.split(",")} - {"harl-updater"})
    tools = build(
        Package("tools", "1.0", {"Provides": ", ".join(f"{name} (= 9999)" for name in others)}), unit.root() / "srv"
    )
    unit.run("dpkg", "--install", f"/srv/{tools.name}", *files)


def shorten(unit: Machine, **times: int) -> None:
    """Sets times of give-back (s)."""
    path = unit.root() / "usr/lib/harl-updater/give-back"
    text = path.read_text()
    for name, seconds in times.items():
        text, count = re.subn(rf"^{name}=\d+", f"{name}={seconds}", text, flags=re.MULTILINE)
        assert count == 1, name
    path.write_text(text)


def wait_for(what: str, condition: Callable[[], bool], seconds: float = 60) -> None:
    """Returns once the condition holds."""
    end = time.monotonic() + seconds
    while not condition():
        if time.monotonic() > end:
            raise AssertionError(f"not within {seconds} s: {what}")
        time.sleep(0.1)


def states(unit: Machine) -> set[str]:
    """The states of the service and of give-back; a number for a start that is still queued."""
    return set(unit.run("systemctl", "show", "--value", "--property=ActiveState,Job", *UNITS).split())


def panel(unit: Machine) -> Panel:
    """The panel after the bytes that it got."""
    return panel_after(int(byte, 16) for byte in (unit.root() / "var/log/panel").read_text().split())


class Service:
    """The service on a unit as a technician finds it. Every test is one run of it."""

    def __init__(self, unit: Machine, package: str) -> None:
        self.unit = unit
        self.package = package
        self.inside = unit.run
        self.repository = unit.root() / "srv/repository"
        self.before: list[str] = []  # options that omit the journal before the run
        self.later = contextlib.ExitStack()  # what is undone after the test

    def prepare(self) -> None:
        """Makes the unit as the tests find it."""
        left = "/run/package-installs /run/uploads /run/board-* /run/harl-[abjlp]* /var/log/panel /var/log/sounds"
        self.inside("sh", "-c", f"rm -rf {left}")
        self.inside("touch", "/root/RESOURCES/tavren1stboot", "/var/log/panel", "/var/log/sounds")
        self.inside("sh", "-c", "mount -t tmpfs stick /root/USB_MOUNT")
        self.fill_stick()
        self.inside("sh", "-c", "echo 2.2.0 >/srv/board; rm -rf /srv/repository/*")
        self.inside("dpkg", "--purge", "solvik4-rh", "solvik4-data")
        self.inside("dpkg", "--install", f"/srv/{build(Package('solvik4-rh', '1.2.0'), self.unit.root() / 'srv').name}")
        shorten(self.unit, outcome_time=3, board_time=4)
        self.set_speed(SPEED)
        self.inside("systemctl", "start", "harl")

    def clear(self) -> None:
        """Undoes what the test has changed."""
        # It would look at the next test's unit.
        self.unit.status("systemctl", "stop", "harl-updater-verify")
        self.unit.status("umount", "-l", "/root/USB_MOUNT")
        self.unit.status("systemctl", "reset-failed")
        self.later.close()

    def fill_stick(self) -> None:
        """Writes the board's version 2.2.0 onto the stick."""
        write_stick(self.unit.root() / STICK.lstrip("/"), ["quorb2.2.0"], "", version_file_archive)

    def set_speed(self, speed: int) -> None:
        """Shortens the updater's waits, not those of its children."""
        variables = f"LD_PRELOAD=/opt/call_recorder.so BENCH_SPEED={speed} BENCH_CALLS=/var/log/calls"
        text = f"[Service]\nEnvironment={variables}\n"
        folder = self.unit.root() / "etc/systemd/system/harl-updater.service.d"
        if self.package.endswith("-static"):  # which no library can be loaded into
            text = ""
        write(folder / "test.conf", text)
        self.inside("systemctl", "daemon-reload")

    def use_hand_over(self, name: str) -> None:
        """Puts one of the hand-overs in the place of the one that is there, which may still be running."""
        self.inside("cp", "--remove-destination", f"/opt/{name}", "/usr/lib/harl-updater/hand-over")

    def offer(self, script: str = "", depends: str = "") -> None:
        """Offers solvik4-rh 1.3.0, with a maintainer script of these lines, besides the repository's packages."""
        fields = {"Depends": depends} if depends else {}
        build(Package("solvik4-rh", "1.3.0", fields, {"postinst": script}), self.repository)
        write_index(self.repository)

    def put(self, path: str, text: str, mode: int = 0o644) -> None:
        """Writes a file in the machine, which is as before after the test."""
        file = self.unit.root() / path.lstrip("/")
        if file.exists():
            self.later.callback(write, file, file.read_text(), mode)
        else:
            self.later.callback(file.unlink, missing_ok=True)
        write(file, text, mode)

    def put_tool(self, name: str, lines: str) -> None:
        """Puts a shell script in the place of a tool, until the end of the test."""
        self.put(f"usr/local/sbin/{name}", f"#!/bin/sh\n{lines}\n", 0o755)

    def run(self) -> None:
        """Starts the service and waits for its end."""
        self.start()
        self.wait_for_end()

    def start(self) -> None:
        """Starts the service."""
        self.note_journal()
        self.inside("systemctl", "start", "harl-updater")
        self.main = int(self.show("MainPID"))

    def note_journal(self) -> None:
        """Begins the run's part of the journal."""
        # As in service/prepare.
        last = self.inside("sh", "-c", "journalctl --identifier=harl-updater --lines=0 --show-cursor || true")
        self.before = [f"--after-cursor={line[11:]}" for line in last.splitlines() if line.startswith("-- cursor: ")]

    def kill(self, signal: str) -> None:
        """Sends a signal to the updater."""
        self.inside("kill", "-s", signal, str(self.main))

    def show(self, name: str) -> str:
        """A property of the service."""
        return self.inside("systemctl", "show", "--value", f"--property={name}", "harl-updater").strip()

    def wait_for_file(self, path: str) -> None:
        """Waits for a file in the machine."""
        wait_for(path, lambda: (self.unit.root() / path.lstrip("/")).exists())

    def wait_for_end(self) -> None:
        """Waits until the service has ended, and has given the instrument back."""
        wait_for("end of the service", lambda: self.states() <= {"inactive", "failed"}, 90)

    def states(self) -> set[str]:
        """See states()."""
        return states(self.unit)

    def ended_as(self) -> tuple[str, str, str]:
        """Result of the service, and how the updater's process ended."""
        return self.show("Result"), self.show("ExecMainCode"), self.show("ExecMainStatus")

    def panel(self, faults: bool = False) -> dict[str, str]:
        """The lit LEDs; the panel must have understood every byte, or have had these `faults`."""
        shown = panel(self.unit)
        assert bool(shown.faults) == faults
        return shown.pattern(0)

    def read(self, path: str) -> str:
        """The text of a file in the machine."""
        return (self.unit.root() / path.lstrip("/")).read_text()

    def journal(self) -> str:
        """The messages of the service, of this run."""
        self.inside("journalctl", "--sync")
        return self.inside("journalctl", "--quiet", "--output=cat", "--identifier=harl-updater", *self.before)

    def package_state(self, name: str = "solvik4-rh") -> str:
        """State and version in the package database."""
        return self.inside("dpkg-query", "--show", "--showformat=${Status} ${Version}", name)

    def assert_given_back(self) -> None:
        """The stick is released and the application runs."""
        assert self.unit.status("mountpoint", "-q", "/root/USB_MOUNT") != 0
        wait_for("harl", lambda: self.unit.status("systemctl", "is-active", "--quiet", "harl") == 0, 10)

    def assert_installation_ended_well(self) -> None:
        """The slow script could finish, and the application did not run meanwhile."""
        assert self.package_state() == "install ok installed 1.3.0"
        assert self.read("/run/harl-after") == "inactive\n"


AnyService = TypeVar("AnyService", bound=Service)


@pytest.fixture(scope="session")
def package(pytestconfig: pytest.Config) -> str:
    """The name of the package under test."""
    return str(pytestconfig.getoption("package"))


@pytest.fixture(scope="session")
def unit(pytestconfig: pytest.Config, build: Path, package: str) -> Iterator[Machine]:
    """A machine with the programs of the root file system --system, on which the package is installed."""
    file = built_package(package)
    if not file:
        pytest.skip("there is no package for this machine: packaging/build")
    if os.geteuid() != 0:
        pytest.skip("systemd as the first process of a machine of its own needs root")
    with machine(pytestconfig.getoption("system").resolve()) as made:
        make_files(made, file, build)
        try:
            made.start()
        except MachineError as error:
            pytest.skip(f"this machine allows no machine of its own: {error}")
        install(made)
        yield made


@pytest.fixture
def service(unit: Machine, package: str) -> Iterator[Service]:
    yield from prepared(Service(unit, package))


def prepared(service: AnyService) -> Iterator[AnyService]:
    """The service, as a test finds and leaves it."""
    service.prepare()
    try:
        yield service
    finally:
        service.clear()


def pytest_exception_interact(node: pytest.Item, report: pytest.TestReport) -> None:
    """Shows the journal of a run that did not end as expected."""
    for fixture in getattr(node, "funcargs", {}).values():
        if isinstance(fixture, Service):
            report.sections.append(("journal", fixture.journal()))
