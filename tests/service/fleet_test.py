"""Units with the built packages harl-updater and harl-updater-fleet, --units of them, and a server as docs/fleet.md
sets it up, each a machine of its own with the services of both sides, TLS and client certificates. They share one
network, in which the server is `localhost`.
"""

import contextlib
import json
import os
import re
import shutil
import subprocess
from collections.abc import Callable, Iterator
from functools import partial
from pathlib import Path
from typing import Any

import pytest

from bench.machine.machine import Machine, MachineError, machine
from bench.makers.files import write, write_script
from bench.makers.packages import SOURCES, Package, build, write_index
from tests.commands import needs, output_of
from tests.service.service import TOOLS, Service, built_package, install, make_files, wait_for

ROOT = Path(__file__).parents[2]
PAGE = ROOT / "docs/fleet.md"
pytestmark = needs("stunnel", "openssl")
RECEIVED = "var/log/journal/remote"  # on the server
SERVICE = "harl-updater-fleet"
RETRY = "[Service]\nRestartSec=1\n"
SPEED = 300  # times shorter waits of the updater
RECEIVER = Path("/lib/systemd/systemd-journal-remote")
# What the unit's service says when it could not send.
CANNOT_COPY, CANNOT_SEND = "No space left on device", "upload failed"
# Where the maker's server can be, or not, when an update runs.
PLACES = (
    "none",
    "away",
    "silent",
    "there, the unit's disk full",
    "there, the unit's /run full",
    "there, its disk full",
    "there",
)
LAST = "fleet /var/log"  # in the page's command that answers
CHANGING = (r"\b[0-9a-f]{32}\b", r"\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d")
# What the maker's tool must say of each unit.
OUTCOMES = {
    "updated": ("updated", "well", None),
    "up-to-date": ("no-update", "well", None),
    "mirrors": ("mirrors-failed", "failed", "mirrors-not-read"),
    "package": ("package-failed", "failed", "package-script-failed"),
    "board": ("board-failed", "failed", "board-upload-failed"),
    "killed": ("none", "failed", "ended-early"),
    "not-well": ("updated", "not-well", None),
    "never-ended": ("none", "never-ended", "unfinished"),
}


class Unit(Service):
    """A unit that runs beside others."""

    def prepare_for(self, outcome: str) -> None:
        """Makes the unit such that its next run comes to this outcome."""
        self.prepare()
        self.set_speed(SPEED)
        tools = self.unit.root() / "usr/local/sbin"
        for name in ("ssh", "scp"):
            write_script(tools / name, TOOLS[name])
        write(self.unit.root() / "etc/apt/sources.list", SOURCES.format(folder="repository"))
        if outcome == "not-well":
            change = {"postinst": "echo changed >/opt/solvik4"}
            build(Package("solvik4-rh", "1.3.0", {}, change, {"opt/solvik4": "new\n"}), self.repository)
            write_index(self.repository)
        elif outcome == "up-to-date":
            write_index(self.repository)
        else:
            self.offer("exit 1" if outcome == "package" else "")
        if outcome == "mirrors":
            write(self.unit.root() / "etc/apt/sources.list", SOURCES.format(folder="nowhere"))
        if outcome in ("board", "killed", "never-ended"):
            self.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        if outcome == "board":
            write_script(tools / "scp", "exit 1")

    def run_to(self, outcome: str) -> None:
        """Starts the run; the outcome follows by itself, but for those that something from outside brings about."""
        self.start()
        if outcome in ("killed", "never-ended"):
            self.wait_for_file("/run/uploads")
        if outcome == "killed":
            self.kill("KILL")

    def given_back(self) -> bool:
        """The application runs again, and the updater does not."""
        return self.states() <= {"inactive", "failed"} and not self.unit.status("systemctl", "is-active", "-q", "harl")

    def time_of_run(self) -> float:
        """s from the start of the last run until the application ran again, by the clock of the service manager."""
        times = [
            self.inside("systemctl", "show", "--value", f"--property={name}TimestampMonotonic", unit)
            for unit, name in (("harl-updater", "InactiveExit"), ("harl", "ActiveEnter"))
        ]
        return (int(times[1]) - int(times[0])) / 1e6

    def says(self, text: str) -> bool:
        """The service that sends has said this since the start of the last run."""
        log = self.inside("journalctl", "--quiet", "--output=cat", f"--unit={SERVICE}", *self.before)
        return text in log

    def sent(self) -> bool:
        """All records are with the server."""
        state = self.inside("systemctl", "show", "--value", "--property=ActiveState", SERVICE).strip()
        return state == "inactive" and (self.unit.root() / f"var/lib/{SERVICE}/place").exists()


class Fleet:
    """A server, set up by the commands of the page, and units."""

    def __init__(self, server: Machine, units: list[Unit]) -> None:
        self.server = server
        self.units = units

    def prepare(self) -> None:
        """Leaves no record on any of them."""
        self.serve(True)
        for unit in self.units:
            unit.inside("sh", "-c", f"systemctl stop {SERVICE}; rm -rf /var/lib/{SERVICE}")
            unit.inside("sh", "-c", "systemctl start harl; journalctl --rotate; journalctl --vacuum-time=1us -q")
        self.server.run("sh", "-c", f"systemctl stop systemd-journal-remote; rm -rf /{RECEIVED}/*")

    def serve(self, there: bool) -> None:
        """Lets the server be there, or away."""
        self.server.run("systemctl", "start" if there else "stop", "stunnel@fleet")

    def answer(self) -> tuple[dict[str, Any], dict[str, dict[str, Any]]]:
        """What the maker's tool says of the server's journal: of the fleet, and of each unit by its host name."""
        lines = self.server.run("sh", "-c", f"harl-updater-tool fleet --json /{RECEIVED} || true").splitlines()
        facts, *units = map(json.loads, lines)
        return facts, {unit["unit"]: unit for unit in units}

    def expect_all_records(self, units: list[Unit]) -> None:
        """The server has every record of these units' runs, and no other of theirs."""
        own = ("harl-updater", "harl-updater-give-back", "harl-updater-verify")
        for unit in units:
            unit.inside("journalctl", "--sync")
            wanted = records(unit.unit, *(f"--unit={name}" for name in own))
            there = records(self.server, f"--directory=/{RECEIVED}", f"_HOSTNAME={unit.inside('hostname').strip()}")
            assert len(wanted) > 10
            # What the service manager says of the verification says nothing of the run.
            assert {
                record
                for record in wanted - there
                if "Look whether the unit" not in record[2] and "harl-updater-verify.service" not in record[2]
            } == set()
            assert there - wanted == set()

    @contextlib.contextmanager
    def place(self, unit: Unit, place: str) -> Iterator[None]:
        """The server is there, or not, as PLACES says, until the end of the block."""
        with contextlib.ExitStack() as after:
            if place == "none":
                (unit.unit.root() / f"etc/{SERVICE}/server").rename(unit.unit.root() / "root/server")
                after.callback(unit.inside, "mv", "/root/server", f"/etc/{SERVICE}")
            elif not place.startswith("there"):
                self.serve(False)
                after.callback(self.serve, True)
            if place == "silent":  # it takes connections, and never answers
                listener = ["systemd-socket-activate", "--listen=19532", "sleep", "infinity"]
                self.server.run("systemd-run", "--quiet", "--unit=silent", *listener)
                after.callback(self.server.run, "systemctl", "stop", "silent")
            elif place.endswith("the unit's disk full"):
                after.enter_context(full_disk(unit.unit, f"/var/lib/{SERVICE}"))
            elif place.endswith("the unit's /run full"):
                after.enter_context(full_run(unit.unit))
            elif place.endswith("its disk full"):
                self.server.run("systemctl", "stop", "systemd-journal-remote")
                after.callback(self.server.run, "systemctl", "stop", "systemd-journal-remote")  # its files are there
                after.enter_context(full_disk(self.server, f"/{RECEIVED}"))
            yield
            unit.inside("systemctl", "stop", SERVICE)

    def tried(self, unit: Unit, place: str) -> bool:
        """The unit has tried to send, with the end that this place of the server lets it have."""
        if place == "silent":
            return unit.unit.status("pgrep", "--full", "systemd-journal-upload --follow") == 0
        said = {"away": CANNOT_SEND, "there, the unit's disk full": CANNOT_COPY, "there, its disk full": CANNOT_SEND}
        return place == "none" or unit.says(said.get(place, "Deactivated successfully"))

    def expect_nothing_lost_on(self, unit: Unit, full: Machine, folder: str, says: str) -> None:
        """An update ends well and its records arrive later, when this folder is on a full disk meanwhile."""
        with full_disk(full, folder):
            unit.prepare_for("updated")
            unit.run_to("updated")
            wait_for("the instrument", unit.given_back)
            wait_for("an attempt", lambda: unit.says(says))
            assert unit.panel() == {"PASS": "pass"}
            full.run("mount", "-o", "remount,size=64m", folder)
            wait_for("the records", unit.sent)
            self.expect_all_records([unit])
            assert self.answer()[1]["unit-0001"]["state"] == "well"
            unit.inside("systemctl", "stop", SERVICE)


@contextlib.contextmanager
def full_disk(where: Machine, folder: str) -> Iterator[None]:
    """A disk at this folder on which no journal has room, until the end of the block."""
    where.run("sh", "-c", f"mkdir -p {folder}; mount -t tmpfs -o size=300k,mode=777 full {folder}")
    try:
        yield
    finally:
        where.run("umount", "-l", folder)


@contextlib.contextmanager
def full_run(where: Machine) -> Iterator[None]:
    """A /run on which no file can grow, until the end of the block."""
    size, used = where.run("df", "-k", "--output=size,used", "/run").splitlines()[1].split()
    where.run("mount", "-o", f"remount,size={used}k", "/run")
    assert where.status("sh", "-c", "echo word >/run/file") != 0
    try:
        yield
    finally:
        where.run("mount", "-o", f"remount,size={size}k", "/run")


def records(where: Machine, *options: str) -> set[tuple[str, str, str]]:
    """The records of a journal: time, program, message."""
    lines = where.run("journalctl", "--quiet", "--all", "--output=json", *options).splitlines()
    names = ("__MONOTONIC_TIMESTAMP", "SYSLOG_IDENTIFIER", "MESSAGE")
    return {tuple(str(json.loads(line)[name]) for name in names) for line in lines}  # type: ignore[misc]


def commands() -> list[tuple[str, str, str]]:
    """The page's commands, each with its prompt and what it prints."""
    blocks = re.findall(r"^    .*\n(?:    .*\n|\n(?=    ))*", PAGE.read_text(), re.MULTILINE)
    found = []
    for block in blocks:
        for text in re.split(r"^    (?=\$ |server# |unit# )", block, flags=re.MULTILINE)[1:]:
            prompt, _, rest = re.sub("^    ", "", text, flags=re.MULTILINE).partition(" ")
            lines = 1 if LAST in rest else None  # the others print nothing
            command = rest.splitlines(keepends=True)
            found.append((prompt, "".join(command[:lines]), "".join(command[1:]) if lines else ""))
    return found


def run_page(work: Path, fleet: Fleet) -> None:
    """Runs the page's commands for the first unit, up to its first run, and gives the others the maker's files."""
    first, *others = (unit.unit.root() for unit in fleet.units)
    for prompt, command, _ in commands():
        if prompt == "$":
            subprocess.run(["sh", "-ec", command], cwd=work, check=True)
        elif LAST not in command:
            where = fleet.server if prompt == "server#" else fleet.units[0].unit
            for file in work.iterdir():
                shutil.copy(file, where.root() / "root" / file.name)
            where.run("sh", "-ec", f"cd /root\n{command}")
    for root in others:
        shutil.copytree(first / f"etc/{SERVICE}", root / f"etc/{SERVICE}")


def make_unit(unit: Machine, name: str, fleet: Path) -> None:
    """Installs both packages on a machine that runs."""
    unit.run("sh", "-c", f"hostname {name}")
    shutil.copy(fleet, unit.root() / "srv/fleet.deb")
    install(unit, "/srv/fleet.deb")
    write(unit.root() / f"etc/systemd/system/{SERVICE}.service.d/test.conf", RETRY)
    unit.run("systemctl", "daemon-reload")


def start_all(stack: contextlib.ExitStack, package: Path, sender: Path, programs: Path, units: int) -> Fleet:
    """Starts the server and the units."""
    server = stack.enter_context(machine(Path("/")))
    shutil.copy(programs / "companion/harl-updater-tool", server.files)
    (server.files / "etc/stunnel").mkdir(parents=True)
    (server.files / RECEIVED).mkdir(parents=True)
    server.start()
    server.run("sh", "-c", f"ip link set lo up; cp /harl-updater-tool /usr/bin; chmod 777 /{RECEIVED}")
    server.run("sh", "-c", "echo systemd-journal-remote:x:995:995::/:/bin/false >>/etc/passwd")
    fleet = Fleet(server, [])
    for number in range(1, units + 1):
        unit = stack.enter_context(machine(Path("/"), None, server))
        make_files(unit, package, programs)
        unit.start()
        make_unit(unit, f"unit-{number:04}", sender)
        fleet.units.append(Unit(unit, "harl-updater"))
    return fleet


@pytest.fixture(scope="module")
def machines(build: Path, pytestconfig: pytest.Config, tmp_path_factory: pytest.TempPathFactory) -> Iterator[Fleet]:
    package, sender = built_package("harl-updater"), built_package("harl-updater-fleet")
    if not package or not sender:
        pytest.skip("there is no package for this machine: packaging/build")
    if os.geteuid() != 0:
        pytest.skip("systemd as the first process of a machine of its own needs root")
    if not RECEIVER.exists():
        pytest.skip("systemd-journal-remote is missing: tests/run installs it")
    with contextlib.ExitStack() as stack:
        try:
            fleet = start_all(stack, package, sender, build, pytestconfig.getoption("units"))
        except MachineError as error:
            pytest.skip(f"this machine allows no machine of its own: {error}")
        run_page(tmp_path_factory.mktemp("maker"), fleet)
        yield fleet


@pytest.fixture
def fleet(machines: Fleet) -> Fleet:
    machines.prepare()
    return machines


def test_eight_units_while_the_server_is_away(fleet: Fleet) -> None:
    fleet.serve(False)
    for unit, outcome in zip(fleet.units, OUTCOMES):
        unit.prepare_for(outcome)
    for unit, outcome in zip(fleet.units, OUTCOMES):
        unit.run_to(outcome)
    for unit, outcome in zip(fleet.units, OUTCOMES):
        if outcome != "never-ended":
            wait_for(outcome, unit.given_back, 120)
    wait_for("attempts without the server", lambda: fleet.units[0].says(CANNOT_SEND), 60)
    assert list((fleet.server.root() / RECEIVED).glob("*")) == []
    fleet.serve(True)
    fleet.units[-1].inside("systemctl", "start", SERVICE)
    for unit, outcome in zip(fleet.units, OUTCOMES):
        wait_for(f"records of {outcome}", unit.sent, 120)
    fleet.expect_all_records(fleet.units[: len(OUTCOMES) - 1])  # the last one's run goes on
    facts, units = fleet.answer()
    found = {name: (unit["outcome"], unit["state"], unit["failure"]) for name, unit in units.items()}
    assert found == {f"unit-{number:04}": told for number, told in enumerate(OUTCOMES.values(), 1)}
    assert facts["runs"] == len(OUTCOMES)
    packages = {row["name"]: row["units"] for row in facts["packages"]}
    assert packages["solvik4-rh 1.3.0"] == 5
    assert facts["unread"] == []


def test_update_is_not_held_up(fleet: Fleet, tell: Callable[[str], None]) -> None:
    [unit] = fleet.units[:1]
    least = dict.fromkeys(PLACES, 1e9)
    for attempt in range(6):  # a machine that others use gets further ones
        for place in PLACES:
            unit.prepare_for("up-to-date")
            with fleet.place(unit, place):
                unit.start()
                wait_for(place, unit.given_back)
                least[place] = min(least[place], unit.time_of_run())
                wait_for(place, partial(fleet.tried, unit, place))
        if attempt > 0 and max(least.values()) - least["none"] < 1:
            break
    tell("; ".join(f"{place}: {seconds:.2f} s" for place, seconds in least.items()))
    assert max(least.values()) - least["none"] < 1


def test_full_disk_of_the_unit(fleet: Fleet) -> None:
    [unit] = fleet.units[:1]
    fleet.expect_nothing_lost_on(unit, unit.unit, f"/var/lib/{SERVICE}", CANNOT_COPY)


def test_full_disk_of_the_server(fleet: Fleet) -> None:
    [unit] = fleet.units[:1]
    fleet.server.run("systemctl", "stop", "systemd-journal-remote")
    fleet.expect_nothing_lost_on(unit, fleet.server, f"/{RECEIVED}", CANNOT_SEND)


def test_full_run_of_the_unit(fleet: Fleet) -> None:
    [unit] = fleet.units[:1]
    unit.prepare_for("updated")
    with full_run(unit.unit):
        unit.run_to("updated")
        wait_for("the instrument", unit.given_back)
        assert unit.panel() == {"PASS": "pass"}
        wait_for("the records", unit.sent)
    fleet.expect_all_records([unit])
    assert fleet.answer()[1]["unit-0001"]["state"] == "well"


def test_sending_is_cut_off(fleet: Fleet) -> None:
    [unit] = fleet.units[:1]
    with fleet.place(unit, "silent"):
        unit.prepare_for("updated")
        unit.run_to("updated")
        wait_for("an upload", lambda: fleet.tried(unit, "silent"))
        unit.inside("systemctl", "kill", "--signal=KILL", SERVICE)
    unit.inside("systemctl", "start", SERVICE)
    fleet.expect_all_records([unit])
    unit.inside("sh", "-c", f"rm /var/lib/{SERVICE}/place; systemctl start {SERVICE}")  # as if it were not noted
    facts, units = fleet.answer()
    assert (facts["units"], facts["runs"], units["unit-0001"]["state"]) == (1, 1, "well")
    assert facts["repeated_lines"] > 10


def test_first_start_sends_what_is_left(fleet: Fleet, request: pytest.FixtureRequest) -> None:
    [unit] = fleet.units[:1]
    unit.prepare_for("updated")
    with fleet.place(unit, "away"):
        unit.run_to("updated")
        wait_for("the instrument", unit.given_back)
        wait_for("an attempt", lambda: unit.says(CANNOT_SEND))
    assert f"{SERVICE}.timer" in unit.inside("systemctl", "show", "--property=Wants", "timers.target")
    write(unit.unit.root() / f"etc/systemd/system/{SERVICE}.timer.d/test.conf", "[Timer]\nOnActiveSec=1\n")
    request.addfinalizer(lambda: unit.inside("rm", "-r", f"/etc/systemd/system/{SERVICE}.timer.d"))
    unit.inside("systemctl", "daemon-reload")
    unit.inside("systemctl", "start", f"{SERVICE}.timer")
    wait_for("the records", lambda: any((fleet.server.root() / RECEIVED).iterdir()) and unit.sent())
    fleet.expect_all_records([unit])


def test_nobody_without_a_certificate(fleet: Fleet) -> None:
    unit = fleet.units[0].unit
    key, certificate = (unit.root() / f"root/stranger.{kind}" for kind in ("key", "pem"))
    words = "req -x509 -newkey rsa:2048 -nodes -subj /CN=stranger"
    output_of("openssl", *words.split(), "-keyout", key, "-out", certificate)
    upload = (
        f"journalctl -o export -n 5 | curl --silent --fail --cacert /etc/{SERVICE}/authority.pem "
        "-H 'Content-Type: application/vnd.fdo.journal' --data-binary @- https://localhost:19532/upload "
    )
    own = f"--key /etc/{SERVICE}/key.pem --cert /etc/{SERVICE}/certificate.pem"
    assert unit.status("sh", "-c", upload) != 0
    assert unit.status("sh", "-c", f"{upload} --key /root/stranger.key --cert /root/stranger.pem") != 0
    assert list((fleet.server.root() / RECEIVED).glob("*")) == []
    assert unit.status("sh", "-c", upload + own) == 0


def test_first_answer(fleet: Fleet) -> None:
    for unit, outcome in zip(fleet.units, ("updated", "package")):
        unit.prepare_for(outcome)
        unit.run_to(outcome)
    for unit in fleet.units[:2]:
        wait_for("the instrument", unit.given_back)
        wait_for("the records", unit.sent)
    for _, command, wanted in commands():
        if LAST in command:
            printed = fleet.server.run("sh", "-c", f"{command.strip()} || true")
            for pattern in CHANGING:
                printed = re.sub(pattern, "...", printed)
            assert printed.strip() == wanted.strip()
