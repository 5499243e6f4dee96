"""Usage: service_test.py BUILD_FOLDER PACKAGE SYSTEM [TEST...]

Runs the service of the built PACKAGE (harl-updater or harl-updater-static, from build/package/) under real systemd, apt
and dpkg of the root file system SYSTEM and ends it in every way. The board, the sound and the panel's bus are
stand-ins.
"""

import os
import re
import shutil
import subprocess
import tempfile
import time
import unittest
from collections.abc import Callable
from pathlib import Path
from typing import Any

from bench.machine.machine import Machine, MachineError, machine
from bench.makers.files import write, write_script
from bench.makers.i2cset import NEWER
from bench.makers.keys import make_key
from bench.makers.packages import DATABASE, SOURCES, Package, build, raise_version, write_index
from bench.makers.sticks import VERSIONS, version_file_archive, write_stick, zip_archive
from bench.observation import RECORD
from bench.outcomes import UP_TO_DATE, UPDATED
from bench.panel import Panel, panel_after
from tests.command_line import skip, take_path, take_word

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
SLOW_SCRIPT = """
touch /run/package-installs
sleep 10
echo "a script that goes on talking"
systemctl is-active harl >/run/harl-after || true
"""
BOARD_SCRIPT = """
case $* in
*unzipUpgrade*) touch /run/board-installs; sleep 5; cat /proc/uptime >/run/board-ended ;;
esac
"""
CONTRARY = """
DPkg::Options { "--force-confnew"; };
Acquire::Retries "0"; Acquire::http::Timeout "999"; DPkg::Lock::Timeout "0";
Binary::apt { Acquire::Retries "0"; Acquire::http::Timeout "999"; DPkg::Lock::Timeout "0"; };
"""
# The application reads from the disk when it starts.
JOURNAL_AT_START = """[Service]
ExecStartPre=/bin/sh -c 'journalctl --quiet --directory=/var/log/journal --identifier=harl-updater >/run/harl-journal'
"""
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
    tools = build(Package("tools", "1.0", {"Provides": ", ".join(f"{name} (= 9999)" for name in others)}),
                  unit.root() / "srv")
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


class ServiceTest(unittest.TestCase):
    """Every test is one run of the service, from a unit as a technician finds it."""

    unit: Machine
    package: str
    tool: Path  # the companion program, on this machine
    before: list[str] = []  # options that omit the journal before the run

    def setUp(self) -> None:
        self.maxDiff = None
        self.inside = self.unit.run
        left = "/run/package-installs /run/uploads /run/board-* /run/harl-[abjlp]* /var/log/panel /var/log/sounds"
        self.inside("sh", "-c", f"rm -rf {left}")
        self.inside("touch", "/root/RESOURCES/tavren1stboot", "/var/log/panel", "/var/log/sounds")
        self.inside("sh", "-c", "mount -t tmpfs stick /root/USB_MOUNT")
        self.fill_stick()
        self.inside("sh", "-c", "echo 2.2.0 >/srv/board; rm -rf /srv/repository/*")
        self.inside("dpkg", "--purge", "solvik4-rh", "solvik4-data")
        self.inside("dpkg", "--install", f"/srv/{build(Package('solvik4-rh', '1.2.0'), self.unit.root() / 'srv').name}")
        self.repository = self.unit.root() / "srv/repository"
        shorten(self.unit, outcome_time=3, board_time=4)
        self.set_speed(SPEED)
        self.inside("systemctl", "start", "harl")

    def tearDown(self) -> None:
        # It would look at the next test's unit.
        self.unit.status("systemctl", "stop", "harl-updater-verify")
        self.unit.status("umount", "-l", "/root/USB_MOUNT")
        self.unit.status("systemctl", "reset-failed")

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
        self.assertEqual(bool(shown.faults), faults)
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
        self.assertNotEqual(self.unit.status("mountpoint", "-q", "/root/USB_MOUNT"), 0)
        wait_for("harl", lambda: self.unit.status("systemctl", "is-active", "--quiet", "harl") == 0, 10)

    def assert_installation_ended_well(self) -> None:
        """The slow script could finish, and the application did not run meanwhile."""
        self.assertEqual(self.package_state(), "install ok installed 1.3.0")
        self.assertEqual(self.read("/run/harl-after"), "inactive\n")


class Ends(ServiceTest):
    """One test for each end of the updater."""

    def test_normal_end(self) -> None:
        self.offer()
        self.start()
        self.wait_for_end()
        self.assertEqual(self.ended_as(), ("success", "2", "15"))
        self.assert_given_back()
        self.assertEqual(self.panel(), {"PASS": "pass"})
        self.assertEqual(self.read("/var/log/sounds"), "SND_RESULT_PASS.wav\n")
        self.assertEqual(self.package_state(), "install ok installed 1.3.0")
        log = self.journal()
        self.assertIn("TavrenUpdater version: ", log)
        last = list(RECORD.finditer(log))[-1]
        self.assertEqual(last["function"], "static void UpdateManager::stopUpdater()")
        self.assertNotIn("give-back", log)
        wait_for("the verification", lambda: "verify: the unit is well" in self.journal(), 30)

    def test_killed_during_the_installation(self) -> None:
        # With the first of two packages not yet unpacked, most of the work is still to be done.
        build(Package("solvik4-data", "1.3.0", scripts={"preinst": SLOW_SCRIPT}), self.repository)
        self.offer("echo configured", "solvik4-data")
        self.start()
        self.wait_for_file("/run/package-installs")
        self.kill("KILL")
        self.wait_for_end()
        self.assertEqual(self.ended_as(), ("signal", "2", "9"))
        self.assert_installation_ended_well()
        self.assert_given_back()
        self.assertEqual(self.panel(), {"FAIL": "fail"})
        self.assertIn("give-back: a package tool is still at work", self.journal())

    def test_stopped_by_an_operator_during_the_installation(self) -> None:
        self.offer(SLOW_SCRIPT)
        self.start()
        self.wait_for_file("/run/package-installs")
        self.inside("systemctl", "stop", "harl-updater")
        self.assertEqual(self.ended_as(), ("success", "2", "15"))
        self.wait_for_end()
        self.assert_installation_ended_well()
        self.assert_given_back()
        self.assertEqual(self.panel(), {"FAIL": "fail"})

    def test_crash_during_the_upload(self) -> None:
        self.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        self.offer()
        self.start()
        self.wait_for_file("/run/uploads")
        self.kill("SEGV")
        self.wait_for_end()
        self.assertIn(self.ended_as()[0], ("signal", "core-dump"))
        self.assert_given_back()
        self.assertEqual(self.panel(), {"FAIL": "fail"})
        self.assertNotEqual(self.unit.status("pgrep", "--exact", "scp"), 0)

    def test_journal_goes_away_during_the_installation(self) -> None:
        # From then on the updater writes into a broken pipe: systemd ignores the signal for its services.
        self.offer(SLOW_SCRIPT)
        self.start()
        self.wait_for_file("/run/package-installs")
        parts = self.inside("systemctl", "list-units", "--plain", "--no-legend", "systemd-journald*").splitlines()
        units = [part.split()[0] for part in parts]
        self.addCleanup(self.inside, "systemctl", "start", *units)
        self.inside("systemctl", "stop", *units)
        self.assertNotEqual(self.unit.status("systemctl", "is-active", "--quiet", "systemd-journald"), 0)
        self.wait_for_end()
        self.assertEqual(self.ended_as(), ("success", "2", "15"))
        self.assert_installation_ended_well()
        self.assert_given_back()
        self.assertEqual(self.panel(), {"PASS": "pass"})
        self.assertEqual(self.read("/var/log/sounds"), "SND_RESULT_PASS.wav\n")

    def test_no_memory_for_the_threads(self) -> None:
        limit = self.unit.root() / "etc/systemd/system/harl-updater.service.d/limit.conf"
        write(limit, "[Service]\nLimitDATA=12M\n")  # the stack of the second thread, 8 MiB, no longer fits
        self.addCleanup(limit.unlink)
        self.inside("systemctl", "daemon-reload")
        self.offer()
        self.inside("systemctl", "stop", "harl")
        self.start()
        self.wait_for_end()
        self.assertEqual(self.ended_as()[2], "6")
        self.assert_given_back()
        self.assertEqual(self.panel(), {"FAIL": "fail"})
        self.assertEqual(self.package_state(), "install ok installed 1.2.0")

    def test_stopped_when_the_package_itself_has_started_the_application(self) -> None:
        self.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        self.offer("systemctl start harl")
        self.start()
        self.wait_for_file("/run/uploads")
        self.inside("systemctl", "stop", "harl-updater")
        self.wait_for_end()
        self.assert_given_back()
        self.assertEqual(self.panel(), {"FAIL": "fail"})

    def test_crash_while_the_board_installs(self) -> None:
        self.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        write_script(self.unit.root() / "usr/local/sbin/scp", "exit 0")
        self.addCleanup(write_script, self.unit.root() / "usr/local/sbin/scp", TOOLS["scp"])
        write_script(self.unit.root() / "usr/local/sbin/ssh", TOOLS["ssh"] + BOARD_SCRIPT)
        self.addCleanup(write_script, self.unit.root() / "usr/local/sbin/ssh", TOOLS["ssh"])
        self.offer()
        self.start()
        self.wait_for_file("/run/board-installs")
        self.kill("SEGV")
        self.wait_for_end()
        self.assert_given_back()
        self.assertIn("give-back: the board is still at work, waiting for it", self.journal())
        started = float(self.inside("systemctl", "show", "--value", "--property=ActiveEnterTimestampMonotonic", "harl"))
        self.assertGreater(started / 1e6, float(self.read("/run/board-ended").split()[0]) + 4)
        self.assertEqual(self.panel(), {"FAIL": "fail"})


class Sticks(ServiceTest):
    """With the maker's keyring on the unit, only a stick signed by the maker is used."""

    def setUp(self) -> None:
        if not self.tool.exists():
            self.skipTest("harl-updater-tool, which signs, is not built")
        super().setUp()
        holder = tempfile.TemporaryDirectory(prefix="maker-")
        self.addCleanup(holder.cleanup)
        self.maker = Path(holder.name)
        self.stick = self.unit.root() / STICK.lstrip("/")
        self.keyring = self.unit.root() / "usr/share/keyrings/harl-updater-stick.gpg"
        make_key(self.maker / "keys", "maker", self.maker / "keys.gpg")
        self.addCleanup(self.keyring.unlink, missing_ok=True)
        self.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        write_script(self.unit.root() / "usr/local/sbin/scp", "touch /run/uploads")
        self.addCleanup(write_script, self.unit.root() / "usr/local/sbin/scp", TOOLS["scp"])
        write_index(self.repository)

    def install_keyring(self) -> None:
        """From now on the unit knows the maker."""
        shutil.copy(self.maker / "keys.gpg", self.keyring)

    def sign(self) -> None:
        """Makes the stick again, signed by the maker."""
        (self.maker / "script").write_text("#!/bin/sh\n")
        (self.maker / "archive").write_bytes(zip_archive("2.2.0"))
        words = ["--archive", "archive", "--script", "script", "--version", "2.2.0", "--replace", "--sign", "maker"]
        subprocess.run(
            [self.tool, "stick", "make", *words, self.stick],
            cwd=self.maker,
            env=os.environ | {"GNUPGHOME": str(self.maker / "keys")},
            stdout=subprocess.DEVNULL,
            check=True,
        )

    def assert_used(self) -> None:
        """The board's files are copied from the stick."""
        self.start()
        self.wait_for_file("/run/uploads")
        self.inside("systemctl", "stop", "harl-updater")
        self.wait_for_end()
        self.assert_given_back()

    def assert_refused(self, why: str) -> None:
        """The updater did not run, FAIL is shown, the log shows why, the instrument is given back."""
        self.note_journal()
        self.assertNotEqual(self.unit.status("systemctl", "start", "harl-updater"), 0)
        self.wait_for_end()
        self.assert_given_back()
        self.assertEqual(self.panel(), {"FAIL": "fail"})
        self.assertIn(f"prepare: the stick is not as the maker signed it: {why}\n", self.journal())
        self.assertNotIn("TavrenUpdater", self.journal())
        self.assertFalse((self.unit.root() / "run/uploads").exists())

    def test_signed_stick_is_used(self) -> None:
        self.sign()
        self.install_keyring()
        self.assert_used()

    def test_without_a_keyring_nothing_changes(self) -> None:
        self.assert_used()

    def test_stick_without_a_signature(self) -> None:
        self.install_keyring()
        self.assert_refused("not signed")

    def test_tampered_file(self) -> None:
        self.sign()
        self.install_keyring()
        path = f"{VERSIONS}/quorb2.2.0/unzipUpgrade.sh"
        (self.stick / path).write_text("#!/bin/sh\nreboot\n")
        self.assert_refused(f"changed: {path}")

    def test_tampered_manifest(self) -> None:
        self.sign()
        self.install_keyring()
        with (self.stick / "harl-updater.manifest").open("a") as manifest:
            manifest.write(" more\n")
        self.assert_refused("changed: the manifest")

    def test_other_key(self) -> None:
        self.sign()
        make_key(self.maker / "others", "other", self.maker / "keys.gpg")
        self.install_keyring()
        self.assert_refused("not signed by a known key")

    def test_keyring_that_cannot_be_read(self) -> None:
        self.sign()
        self.keyring.write_text("no keys")
        self.assert_refused("not signed by a known key")

    def test_verification_that_never_ends(self) -> None:
        self.sign()
        self.install_keyring()
        self.use_hand_over("hand-over-short")
        self.addCleanup(self.use_hand_over, "hand-over")
        gpgv = self.unit.root() / "usr/local/sbin/gpgv"
        write_script(gpgv, "sleep infinity")
        self.addCleanup(gpgv.unlink)
        self.assert_refused("it cannot be read")

    def test_stick_without_anything_for_the_board_is_nothing_to_verify(self) -> None:
        self.install_keyring()
        shutil.rmtree(self.stick / "debs")
        self.offer()
        self.start()
        self.wait_for_end()
        self.assert_given_back()
        self.assertIn("TavrenUpdater", self.journal())
        self.assertNotIn("prepare: the stick", self.journal())


class Outcomes(ServiceTest):
    """What the panel shows is true."""

    def test_failure_keeps_its_own_outcome(self) -> None:
        self.offer("exit 1")
        self.start()
        self.wait_for_end()
        self.assertEqual(self.ended_as(), ("success", "2", "15"))
        self.assert_given_back()
        self.assertEqual(self.panel(), {"FAIL": "fail"})
        self.assertNotIn("give-back", self.journal())

    def test_crash_after_the_outcome_was_shown(self) -> None:
        self.set_speed(3)  # time to act while the outcome is shown
        self.offer()
        self.start()
        wait_for("outcome", lambda: self.panel() == {"PASS": "pass"})
        self.kill("ABRT")
        self.wait_for_end()
        self.assert_given_back()
        self.assertEqual(self.panel(), {"PASS": "pass"})

    def test_outcome_whose_byte_failed_is_shown_again(self) -> None:
        for offered, byte in ((True, "0x13"), (True, "0x2"), (False, "0x15")):
            with self.subTest(byte=byte):
                # The first time that the byte lights an outcome, after the sound, it does not arrive.
                broken = f'[ "$4" != {byte} ] || [ ! -s /var/log/sounds ] || [ -e /run/harl-lost ] || '
                broken += "{ touch /run/harl-lost; exit 1; }\n"
                write_script(self.unit.root() / "usr/local/sbin/i2cset", NEWER + broken + KEEP)
                self.addCleanup(write_script, self.unit.root() / "usr/local/sbin/i2cset", TOOLS["i2cset"])
                if offered:
                    self.offer()
                else:
                    write_index(self.repository)
                self.start()
                self.wait_for_end()
                self.assertTrue((self.unit.root() / "run/harl-lost").exists())
                self.assert_given_back()
                outcome = UPDATED if offered else UP_TO_DATE
                self.assertEqual(self.panel(faults=True), outcome.panel)
                self.assertIn("give-back: the outcome was not shown, or not all of it: showing it", self.journal())
                self.setUp()

    def test_notes_that_cannot_be_written_leave_the_panel_alone(self) -> None:
        # Prepared as usual; then the file system is full, or refuses writing.
        for fill in ("head -c 100M /dev/zero >/run/harl-updater/fill || true", "mount -o remount,ro /run/harl-updater"):
            with self.subTest(fill=fill):
                self.inside("sh", "-c", "mkdir -p /run/harl-updater; mount -t tmpfs -o size=64k run /run/harl-updater")
                self.addCleanup(self.unit.status, "umount", "-l", "/run/harl-updater")
                self.offer(fill)
                self.start()
                self.wait_for_end()
                self.assert_given_back()
                self.assertEqual(self.panel(), {"PASS": "pass"})
                self.setUp()


class Repairs(ServiceTest):
    """What comes before the updater: other package tools, and an installation that a power cut interrupted."""

    def test_installation_that_a_power_cut_left_behind_is_finished(self) -> None:
        self.offer("touch /run/package-installs")
        self.inside("dpkg", "--unpack", "/srv/repository/solvik4-rh_1.3.0_all.deb")
        self.start()
        self.wait_for_end()
        self.assertTrue((self.unit.root() / "run/package-installs").exists())
        self.assertEqual(self.package_state(), "install ok installed 1.3.0")
        self.assertEqual(self.panel(), {"REMOTE": "pass", "MAIN": "pass"})  # up to date

    def test_unpacking_that_a_power_cut_broke_off_is_done_again(self) -> None:
        self.offer()
        # dpkg's journal of its steps stays in this folder until dpkg ends; apt installs nothing as long as it exists.
        self.inside(
            "sh",
            "-c",
            "cd /var/lib/dpkg && sed -n '/^Package: solvik4-rh$/,/^$/p' status |"
            " sed 's/^Status: .*/Status: install reinstreq half-installed/' >updates/0000",
        )
        self.assertEqual(self.package_state(), "install reinstreq half-installed 1.2.0")
        self.start()
        self.wait_for_end()
        self.assertEqual(self.package_state(), "install ok installed 1.3.0")
        self.assertEqual(self.panel(), {"PASS": "pass"})

    def test_stopped_while_an_installation_that_a_power_cut_left_behind_is_finished(self) -> None:
        self.offer(SLOW_SCRIPT)
        self.inside("dpkg", "--unpack", "/srv/repository/solvik4-rh_1.3.0_all.deb")
        self.inside("systemctl", "start", "--no-block", "harl-updater")
        self.wait_for_file("/run/package-installs")
        self.inside("systemctl", "stop", "harl-updater")
        self.wait_for_end()
        self.assertTrue((self.unit.root() / "run/harl-after").exists(), "the script was broken off")
        self.assertEqual(self.package_state(), "install ok installed 1.3.0")
        self.assert_given_back()
        self.assertEqual(self.panel(), {"FAIL": "fail"})

    def test_broken_package_is_not_shown_as_up_to_date(self) -> None:
        self.offer("exit 1")
        self.inside("dpkg", "--unpack", "/srv/repository/solvik4-rh_1.3.0_all.deb")
        self.note_journal()
        self.assertNotEqual(self.unit.status("systemctl", "start", "harl-updater"), 0)
        self.wait_for_end()
        self.assertEqual(self.show("Result"), "exit-code")
        self.assert_given_back()
        self.assertEqual(self.panel(), {"FAIL": "fail"})
        self.assertIn("prepare: solvik4-rh cannot be finished and no other version of it is offered", self.journal())
        self.assertNotIn("TavrenUpdater", self.journal())

    def test_broken_package_of_which_another_version_is_offered(self) -> None:
        self.offer("exit 1")
        self.inside("dpkg", "--unpack", "/srv/repository/solvik4-rh_1.3.0_all.deb")
        build(Package("solvik4-rh", "1.4.0"), self.repository)
        write_index(self.repository)
        self.start()
        self.wait_for_end()
        self.assert_given_back()
        self.assertEqual(self.package_state(), "install ok installed 1.4.0")
        self.assertIn(self.panel(), ({"PASS": "pass"}, {"REMOTE": "pass", "MAIN": "pass"}))

    def test_other_package_that_stays_broken_does_not_keep_the_updater(self) -> None:
        self.offer()
        build(Package("solvik4-data", "1.0", scripts={"postinst": "exit 1"}), self.repository)
        write_index(self.repository)
        self.inside("dpkg", "--unpack", "/srv/repository/solvik4-data_1.0_all.deb")
        self.start()
        self.wait_for_end()
        self.assertEqual(self.ended_as(), ("success", "2", "15"))
        self.assertIn("prepare: still unfinished, left to the updater: solvik4-data", self.journal())
        self.assert_given_back()

    def test_missing_dependency_is_installed_first(self) -> None:
        self.offer(depends="solvik4-data")
        build(Package("solvik4-data", "1.0"), self.repository)
        write_index(self.repository)
        self.unit.status("dpkg", "--unpack", "/srv/repository/solvik4-rh_1.3.0_all.deb")
        self.start()
        self.wait_for_end()
        self.assertEqual(self.package_state(), "install ok installed 1.3.0")
        self.assertIn("prepare: the installation is finished", self.journal())
        self.assertEqual(self.panel(), {"REMOTE": "pass", "MAIN": "pass"})

    def test_jobs_of_apts_own_timers_are_waited_for(self) -> None:
        job = "[Service]\nType=oneshot\nExecStart=/bin/sleep 8\nExecStart=/bin/touch /run/harl-job\n"
        write(self.unit.root() / "etc/systemd/system/apt-daily.service", job)
        self.addCleanup(self.inside, "rm", "/etc/systemd/system/apt-daily.service")
        self.inside("systemctl", "daemon-reload")
        self.offer()
        self.inside("systemctl", "start", "--no-block", "apt-daily")
        self.assertFalse((self.unit.root() / "run/harl-job").exists())
        self.start()
        self.assertTrue((self.unit.root() / "run/harl-job").exists())
        self.wait_for_end()
        self.assertEqual(self.panel(), {"PASS": "pass"})
        self.assertIn("prepare: a job of apt's own timers is at work, waiting for it", self.journal())


class Surroundings(ServiceTest):
    """Settings, logs and packages around a run, its own among them."""

    def test_changed_configuration_file_is_kept(self) -> None:
        folder = self.unit.root() / "srv"
        for version, text in (("1.2.1", "old"), ("1.3.0", "new")):
            tree = folder / "tree"
            write(tree / "etc/solvik4.conf", f"{text}\n")
            write(tree / "DEBIAN/conffiles", "/etc/solvik4.conf\n")
            control = f"Package: solvik4-rh\nVersion: {version}\nArchitecture: all\nMaintainer: T <t@localhost>\n"
            write(tree / "DEBIAN/control", control + "Description: test\n")
            write_script(tree / "DEBIAN/postinst", "grep -qx changed /etc/solvik4.conf || [ $2 != 1.2.1 ]")
            self.inside("dpkg-deb", "--build", "/srv/tree", f"/srv/repository/solvik4-rh_{version}_all.deb")
        write_index(self.repository)
        self.inside("dpkg", "--install", "/srv/repository/solvik4-rh_1.2.1_all.deb")
        self.inside("sh", "-c", "echo changed >/etc/solvik4.conf")
        write(self.unit.root() / "etc/apt/apt.conf.d/99contrary", 'DPkg::Options { "--force-confnew"; };\n')
        self.addCleanup(self.inside, "rm", "-f", "/etc/apt/apt.conf.d/99contrary", "/etc/solvik4.conf")
        self.start()
        self.wait_for_end()
        self.assertEqual(self.package_state(), "install ok installed 1.3.0")
        self.assertEqual(self.read("/etc/solvik4.conf"), "changed\n")
        self.assertEqual(self.panel(), {"PASS": "pass"})

    def test_settings_of_the_service_win_over_those_in_etc(self) -> None:
        write(self.unit.root() / "etc/apt/apt.conf.d/99contrary", CONTRARY)
        write(self.unit.root() / "etc/apt/apt.conf", CONTRARY + 'Test::Own "kept";\n')
        self.addCleanup(self.inside, "rm", "-f", "/etc/apt/apt.conf.d/99contrary", "/etc/apt/apt.conf")
        self.offer()
        self.start()
        self.wait_for_end()
        settings = self.inside("env", "APT_CONFIG=/usr/lib/harl-updater/apt-first.conf", "apt-config", "dump")
        for prefix in ("", "Binary::apt::"):
            for setting in ('Acquire::Retries "3"', 'Acquire::http::Timeout "20"', 'DPkg::Lock::Timeout "600"'):
                lines = [line for line in settings.splitlines() if line.startswith(prefix + setting.split()[0] + " ")]
                self.assertEqual(lines, [f"{prefix}{setting};"])
        self.assertIn('Test::Own "kept";', settings)
        options = [line.split('"')[1] for line in settings.splitlines() if line.startswith("DPkg::Options:: ")]
        self.assertEqual(options[-4:], ["--refuse-confnew", "--refuse-confask", "--force-confdef", "--force-confold"])
        self.assertEqual(self.panel(), {"PASS": "pass"})

    def test_no_package_script_meets_the_private_folder(self) -> None:
        self.offer('echo "$PATH" >/run/harl-path; command -v systemctl dpkg ls >>/run/harl-path')
        self.start()
        self.wait_for_end()
        self.assertNotIn("harl-updater", self.read("/run/harl-path"))
        self.assertIn("systemctl\n", self.read("/run/harl-path"))

    def test_journal_is_synced_before_the_application_starts(self) -> None:
        self.offer()
        self.inside("systemctl", "stop", "harl")
        write(self.unit.root() / "etc/systemd/system/harl.service.d/test.conf", JOURNAL_AT_START)
        self.addCleanup(self.inside, "rm", "-r", "/etc/systemd/system/harl.service.d")
        self.inside("systemctl", "daemon-reload")
        self.start()
        self.wait_for_end()
        self.assertIn("Running command: apt --assume-yes install", self.read("/run/harl-journal"))

    def test_logs_are_kept_where_the_journal_is_volatile(self) -> None:
        settings = self.unit.root() / "etc/systemd/journald.conf.d/test.conf"
        write(settings, "[Journal]\nStorage=volatile\n")
        self.inside("sh", "-c", "mv /var/log/journal /var/log/journal.kept; systemctl restart systemd-journald")
        self.addCleanup(self.inside, "systemctl", "restart", "systemd-journald")
        self.addCleanup(self.inside, "mv", "/var/log/journal.kept", "/var/log/journal")
        self.addCleanup(settings.unlink)
        self.inside("mkdir", "-p", "/var/lib/harl-updater")
        self.inside("bash", "-c", "cd /var/lib/harl-updater; rm -f *; touch 200{0..9}-01-01_00-00-00.log")
        self.offer()
        self.start()
        self.wait_for_end()
        kept = sorted(path.name for path in (self.unit.root() / "var/lib/harl-updater").iterdir())
        self.assertEqual(len(kept), 10)
        self.assertEqual(kept[0], "2001-01-01_00-00-00.log")
        log = self.read(f"/var/lib/harl-updater/{kept[-1]}")
        self.assertRegex(log, r"Updater \| .*int main\(int, char\*\*\)\n.*TavrenUpdater version: ")
        self.assertIn("static void UpdateManager::stopUpdater()", log)

    def test_upgrade_of_the_updater_in_its_own_run(self) -> None:
        service = "lib/systemd/system/harl-updater.service"
        newer = "[Unit]\nDescription=newer\n"
        raise_version(self.unit.root() / "srv/updater.deb", "9.0.0", self.repository, {service: newer})
        self.offer("touch /run/package-installs\n", f"{self.package} (>= 9.0.0)")
        self.start()
        self.wait_for_file("/run/package-installs")
        self.assertEqual(int(self.show("MainPID")), self.main)
        self.wait_for_end()
        self.assertEqual(self.ended_as(), ("success", "2", "15"))
        self.assertEqual(self.package_state(self.package), "install ok installed 9.0.0")
        self.assertEqual(self.show("Description"), "newer")  # takes effect with the next run
        self.assert_given_back()
        self.assertEqual(self.panel(), {"PASS": "pass"})
        self.inside("dpkg", "--purge", "solvik4-rh")
        self.inside("dpkg", "--install", "--force-downgrade", "/srv/updater.deb")

    def test_removal_leaves_the_run_alone(self) -> None:
        self.set_speed(3)  # time for the removal while the outcome is shown
        self.offer()
        self.start()
        wait_for("outcome", lambda: self.panel() == {"PASS": "pass"})
        self.inside("dpkg", "--remove", self.package)
        self.assertEqual(int(self.show("MainPID")), self.main)
        self.wait_for_end()
        self.assertEqual(self.ended_as()[1:], ("2", "15"))
        self.assert_given_back()
        self.inside("dpkg", "--install", "/srv/updater.deb")
        self.assertNotEqual(self.show("ActiveState"), "active")


class Result(unittest.TextTestResult):
    """Prints the journal of a run that did not end as expected."""

    def addFailure(self, test: unittest.TestCase, err: Any) -> None:  # noqa: N802
        super().addFailure(test, err)
        if isinstance(test, ServiceTest):
            self.stream.write(test.journal())


def main() -> None:
    """Runs the tests of the program, as its usage says."""
    programs, package, system = take_path(), take_word(), take_path()
    file = built_package(package)
    if not file:
        skip("there is no package for this machine: packaging/build")
    if os.geteuid() != 0:
        skip("systemd as the first process of a machine of its own needs root")
    with machine(system) as made:
        make_files(made, file, programs)
        try:
            made.start()
        except MachineError as error:
            skip(f"this machine allows no machine of its own: {error}")
        ServiceTest.unit, ServiceTest.package = made, package
        ServiceTest.tool = programs / "companion/harl-updater-tool"
        install(made)
        unittest.main(verbosity=2, testRunner=unittest.TextTestRunner(resultclass=Result, verbosity=2))


if __name__ == "__main__":
    main()
