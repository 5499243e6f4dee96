"""Usage: fleet_test.py BUILD_FOLDER [TEST...]

Units with the built packages harl-updater and harl-updater-fleet, and a server as docs/fleet.md sets it up, each a
machine of its own (see service_test.py) with the services of both sides, TLS and client certificates. They share one
network, in which the server is `localhost`.
"""

import contextlib
import json
import re
import shutil
import subprocess
import tempfile
import time
import unittest
from pathlib import Path
from typing import Any

from bench.machine.machine import Machine, machine
from bench.makers.files import write, write_script
from bench.makers.packages import SOURCES, Package, build, write_index
from tests.command_line import skip, take_path
from tests.service.service_test import TOOLS, ServiceTest, built_package, install, make_files, wait_for

ROOT = Path(__file__).parents[2]
PAGE = ROOT / "docs/fleet.md"
RECEIVED = "var/log/journal/remote"  # on the server
SERVICE = "harl-updater-fleet"
RETRY = "[Service]\nRestartSec=1\n"
SPEED = 300  # times shorter waits of the updater
PROGRAMS = Path()
LAST = "fleet /var/log"  # in the page's command that answers
CHANGING = (r"\b[0-9a-f]{32}\b", r"\d\d-\d\d-\d{4} \d\d:\d\d:\d\d")
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


class Unit(ServiceTest):
    """A unit that runs beside others."""

    def __init__(self, unit: Machine, package: str) -> None:
        super().__init__("note_journal")
        self.unit, self.package = unit, package
        self.inside = unit.run

    def prepare(self, outcome: str) -> None:
        """Makes the unit such that its next run comes to this outcome."""
        self.setUp()
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

    def sent(self) -> bool:
        """All records are with the server."""
        state = self.inside("systemctl", "show", "--value", "--property=ActiveState", SERVICE).strip()
        return state == "inactive" and (self.unit.root() / f"var/lib/{SERVICE}/place").exists()


class FleetTest(unittest.TestCase):
    """A server, set up by the commands of the page, and units."""

    server: Machine
    units: list[Unit]
    work: Path

    def setUp(self) -> None:
        self.maxDiff = None
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

    def test_eight_units_while_the_server_is_away(self) -> None:
        self.serve(False)
        for unit, outcome in zip(self.units, OUTCOMES):
            unit.prepare(outcome)
        for unit, outcome in zip(self.units, OUTCOMES):
            unit.run_to(outcome)
        for unit, outcome in zip(self.units, OUTCOMES):
            if outcome != "never-ended":
                wait_for(outcome, unit.given_back, 120)
        failed = "systemctl show --value --property=NRestarts harl-updater-fleet"
        wait_for("an attempt without the server", lambda: self.units[0].inside("sh", "-c", failed).strip() != "0", 60)
        self.assertEqual(list((self.server.root() / RECEIVED).glob("*")), [])
        self.serve(True)
        self.units[-1].inside("systemctl", "start", SERVICE)
        for unit, outcome in zip(self.units, OUTCOMES):
            wait_for(f"records of {outcome}", unit.sent, 120)
        facts, units = self.answer()
        found = {name: (unit["outcome"], unit["state"], unit["failure"]) for name, unit in units.items()}
        self.assertEqual(found, {f"unit-{number:04}": told for number, told in enumerate(OUTCOMES.values(), 1)})
        self.assertEqual(facts["runs"], len(OUTCOMES))
        self.assertEqual(facts["packages"]["solvik4-rh 1.3.0"], 5)
        print(f"{facts['repeated_lines']} records came twice")

    def test_update_is_not_held_up(self) -> None:
        [unit] = self.units[:1]
        took = {}
        for server in ("none", "away", "there"):
            (unit.unit.root() / "etc/harl-updater-fleet/server").unlink(missing_ok=True)
            if server != "none":
                write(unit.unit.root() / "etc/harl-updater-fleet/server", "https://localhost:19532\n")
            self.serve(server == "there")
            times = []
            for _ in range(3):
                unit.prepare("up-to-date")
                begin = time.monotonic()
                unit.start()
                wait_for(server, unit.given_back)
                times.append(time.monotonic() - begin)
                unit.inside("systemctl", "stop", SERVICE)
            took[server] = min(times)
        print(", ".join(f"{server}: {seconds:.1f} s" for server, seconds in took.items()))
        self.assertLess(max(took.values()) - took["none"], 1)

    def test_full_disk_of_the_unit(self) -> None:
        [unit] = self.units[:1]
        unit.inside("sh", "-c", f"mkdir -p /var/lib/{SERVICE}; mount -t tmpfs -o size=300k full /var/lib/{SERVICE}")
        self.addCleanup(unit.unit.status, "umount", "-l", f"/var/lib/{SERVICE}")
        unit.prepare("updated")
        unit.run_to("updated")
        wait_for("the instrument", unit.given_back)
        said = f"journalctl -q --unit={SERVICE} | grep -q 'the disk is full'"
        wait_for("an attempt", lambda: unit.unit.status("sh", "-c", said) == 0)
        self.assertEqual(unit.panel(), {"PASS": "pass"})
        unit.inside("mount", "-o", "remount,size=64m", f"/var/lib/{SERVICE}")
        wait_for("the records", unit.sent)
        self.assertEqual(self.answer()[1]["unit-0001"]["state"], "well")

    def test_full_disk_of_the_server(self) -> None:
        [unit] = self.units[:1]
        self.server.run("systemctl", "stop", "systemd-journal-remote")
        self.server.run("mount", "-t", "tmpfs", "-o", "size=300k,mode=777", "full", f"/{RECEIVED}")
        self.addCleanup(self.server.status, "umount", "-l", f"/{RECEIVED}")
        unit.prepare("updated")
        unit.run_to("updated")
        wait_for("the instrument", unit.given_back)
        said = f"journalctl -q --unit={SERVICE} | grep -q 'upload failed'"
        wait_for("an attempt", lambda: unit.unit.status("sh", "-c", said) == 0)
        self.server.run("mount", "-o", "remount,size=64m", f"/{RECEIVED}")
        wait_for("the records", unit.sent)
        self.assertEqual(self.answer()[1]["unit-0001"]["state"], "well")

    def test_nobody_without_a_certificate(self) -> None:
        unit = self.units[0].unit
        subprocess.run(
            ["openssl", "req", "-x509", "-newkey", "rsa:2048", "-nodes", "-subj", "/CN=stranger", "-keyout",
             unit.root() / "root/stranger.key", "-out", unit.root() / "root/stranger.pem"],
            stderr=subprocess.DEVNULL, check=True,
        )
        upload = (f"journalctl -o export -n 5 | curl --silent --fail --cacert /etc/{SERVICE}/authority.pem "
                  "-H 'Content-Type: application/vnd.fdo.journal' --data-binary @- https://localhost:19532/upload ")
        own = f"--key /etc/{SERVICE}/key.pem --cert /etc/{SERVICE}/certificate.pem"
        self.assertNotEqual(unit.status("sh", "-c", upload), 0)
        self.assertNotEqual(unit.status("sh", "-c", f"{upload} --key /root/stranger.key --cert /root/stranger.pem"), 0)
        self.assertEqual(list((self.server.root() / RECEIVED).glob("*")), [])
        self.assertEqual(unit.status("sh", "-c", upload + own), 0)

    def test_first_answer(self) -> None:
        for unit, outcome in zip(self.units, ("updated", "package")):
            unit.prepare(outcome)
            unit.run_to(outcome)
        for unit in self.units[:2]:
            wait_for("the instrument", unit.given_back)
            wait_for("the records", unit.sent)
        for _, command, wanted in commands():
            if LAST in command:
                printed = self.server.run("sh", "-c", f"{command.strip()} || true")
                for pattern in CHANGING:
                    printed = re.sub(pattern, "...", printed)
                self.assertEqual(printed.strip(), wanted.strip())


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


def run_page(work: Path, server: Machine, unit: Machine) -> None:
    """Runs the page's commands for the first unit, up to its first run. The maker's files are copied to the others."""
    for prompt, command, _ in commands():
        if prompt == "$":
            subprocess.run(["sh", "-ec", command], cwd=work, check=True)
        elif LAST not in command:
            where = server if prompt == "server#" else unit
            for file in work.iterdir():
                shutil.copy(file, where.root() / "root" / file.name)
            where.run("sh", "-ec", f"cd /root\n{command}")


def make_unit(unit: Machine, name: str, fleet: Path) -> None:
    """Installs both packages on a machine that runs."""
    unit.run("sh", "-c", f"hostname {name}")
    shutil.copy(fleet, unit.root() / "srv/fleet.deb")
    install(unit, "/srv/fleet.deb")
    write(unit.root() / f"etc/systemd/system/{SERVICE}.service.d/test.conf", RETRY)
    unit.run("systemctl", "daemon-reload")


def main() -> None:
    """Runs the tests of the program, as its usage says."""
    global PROGRAMS
    PROGRAMS = take_path()
    package, fleet = built_package("harl-updater"), built_package("harl-updater-fleet")
    if not package or not fleet:
        skip("there is no package for this machine: packaging/build")
    with contextlib.ExitStack() as stack:
        work = Path(stack.enter_context(tempfile.TemporaryDirectory(prefix="fleet-")))
        server = stack.enter_context(machine(Path("/")))
        shutil.copy(PROGRAMS / "companion/harl-updater-tool", server.files)
        (server.files / "etc/stunnel").mkdir(parents=True)
        (server.files / RECEIVED).mkdir(parents=True)
        server.start()
        server.run("sh", "-c", "ip link set lo up; cp /harl-updater-tool /usr/bin; chmod 777 /var/log/journal/remote")
        server.run("sh", "-c", "echo systemd-journal-remote:x:995:995::/:/bin/false >>/etc/passwd")
        FleetTest.server, FleetTest.work, FleetTest.units = server, work, []
        for number in range(1, len(OUTCOMES) + 1):
            unit = stack.enter_context(machine(Path("/"), None, server))
            make_files(unit, package, PROGRAMS)
            unit.start()
            make_unit(unit, f"unit-{number:04}", fleet)
            FleetTest.units.append(Unit(unit, "harl-updater"))
        run_page(work, server, FleetTest.units[0].unit)
        settings = FleetTest.units[0].unit.root() / f"etc/{SERVICE}"
        for one in FleetTest.units[1:]:
            shutil.copytree(settings, one.unit.root() / f"etc/{SERVICE}")
        unittest.main(verbosity=2)


if __name__ == "__main__":
    main()
