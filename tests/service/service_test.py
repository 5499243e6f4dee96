"""Ends the service of the built package in every way, and changes what is around it."""

import re
import shutil
from collections.abc import Iterator
from pathlib import Path

import pytest

from bench.machine.machine import Machine
from bench.makers.files import write, write_script
from bench.makers.i2cset import NEWER
from bench.makers.keys import make_key
from bench.makers.packages import Package, build, raise_version, write_index
from bench.makers.sticks import VERSIONS, zip_archive
from bench.observation import RECORD
from bench.outcomes import UP_TO_DATE, UPDATED, Outcome
from tests.commands import output_of
from tests.service.service import KEEP, STICK, TOOLS, Service, prepared, wait_for

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


class TestEnds:
    """One test for each end of the updater."""

    def test_normal_end(self, service: Service) -> None:
        service.offer()
        service.run()
        assert service.ended_as() == ("success", "2", "15")
        service.assert_given_back()
        assert service.panel() == {"PASS": "pass"}
        assert service.read("/var/log/sounds") == "SND_RESULT_PASS.wav\n"
        assert service.package_state() == "install ok installed 1.3.0"
        log = service.journal()
        assert "TavrenUpdater version: " in log
        last = list(RECORD.finditer(log))[-1]
        assert last["function"] == "static void UpdateManager::stopUpdater()"
        assert "give-back" not in log
        wait_for("the verification", lambda: "verify: the unit is well" in service.journal(), 30)

    def test_killed_during_the_installation(self, service: Service) -> None:
        # With the first of two packages not yet unpacked, most of the work is still to be done.
        build(Package("solvik4-data", "1.3.0", scripts={"preinst": SLOW_SCRIPT}), service.repository)
        service.offer("echo configured", "solvik4-data")
        service.start()
        service.wait_for_file("/run/package-installs")
        service.kill("KILL")
        service.wait_for_end()
        assert service.ended_as() == ("signal", "2", "9")
        service.assert_installation_ended_well()
        service.assert_given_back()
        assert service.panel() == {"FAIL": "fail"}
        assert "give-back: a package tool is still at work" in service.journal()

    def test_stopped_by_an_operator_during_the_installation(self, service: Service) -> None:
        service.offer(SLOW_SCRIPT)
        service.start()
        service.wait_for_file("/run/package-installs")
        service.inside("systemctl", "stop", "harl-updater")
        assert service.ended_as() == ("success", "2", "15")
        service.wait_for_end()
        service.assert_installation_ended_well()
        service.assert_given_back()
        assert service.panel() == {"FAIL": "fail"}

    def test_crash_during_the_upload(self, service: Service) -> None:
        service.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        service.offer()
        service.start()
        service.wait_for_file("/run/uploads")
        service.kill("SEGV")
        service.wait_for_end()
        assert service.ended_as()[0] in ("signal", "core-dump")
        service.assert_given_back()
        assert service.panel() == {"FAIL": "fail"}
        assert service.unit.status("pgrep", "--exact", "scp") != 0

    def test_journal_goes_away_during_the_installation(self, service: Service) -> None:
        # From then on the updater writes into a broken pipe: systemd ignores the signal for its services.
        service.offer(SLOW_SCRIPT)
        service.start()
        service.wait_for_file("/run/package-installs")
        parts = service.inside("systemctl", "list-units", "--plain", "--no-legend", "systemd-journald*").splitlines()
        units = [part.split()[0] for part in parts]
        service.later.callback(service.inside, "systemctl", "start", *units)
        service.inside("systemctl", "stop", *units)
        assert service.unit.status("systemctl", "is-active", "--quiet", "systemd-journald") != 0
        service.wait_for_end()
        assert service.ended_as() == ("success", "2", "15")
        service.assert_installation_ended_well()
        service.assert_given_back()
        assert service.panel() == {"PASS": "pass"}
        assert service.read("/var/log/sounds") == "SND_RESULT_PASS.wav\n"

    def test_no_memory_for_the_threads(self, service: Service) -> None:
        # The stack of the second thread, 8 MiB, no longer fits.
        service.put("etc/systemd/system/harl-updater.service.d/limit.conf", "[Service]\nLimitDATA=12M\n")
        service.inside("systemctl", "daemon-reload")
        service.offer()
        service.inside("systemctl", "stop", "harl")
        service.run()
        assert service.ended_as()[2] == "6"
        service.assert_given_back()
        assert service.panel() == {"FAIL": "fail"}
        assert service.package_state() == "install ok installed 1.2.0"

    def test_stopped_when_the_package_itself_has_started_the_application(self, service: Service) -> None:
        service.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        service.offer("systemctl start harl")
        service.start()
        service.wait_for_file("/run/uploads")
        service.inside("systemctl", "stop", "harl-updater")
        service.wait_for_end()
        service.assert_given_back()
        assert service.panel() == {"FAIL": "fail"}

    def test_crash_while_the_board_installs(self, service: Service) -> None:
        service.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        service.put_tool("scp", "exit 0")
        service.put_tool("ssh", TOOLS["ssh"] + BOARD_SCRIPT)
        service.offer()
        service.start()
        service.wait_for_file("/run/board-installs")
        service.kill("SEGV")
        service.wait_for_end()
        service.assert_given_back()
        assert "give-back: the board is still at work, waiting for it" in service.journal()
        started = service.inside("systemctl", "show", "--value", "--property=ActiveEnterTimestampMonotonic", "harl")
        assert int(started) / 1e6 > float(service.read("/run/board-ended").split()[0]) + 4
        assert service.panel() == {"FAIL": "fail"}


class SignedStick(Service):
    """With the maker's keyring on the unit, only a stick signed by the maker is used."""

    def __init__(self, unit: Machine, package: str, tool: Path, maker: Path) -> None:
        super().__init__(unit, package)
        self.tool = tool
        self.maker = maker
        self.stick = unit.root() / STICK.lstrip("/")
        self.keyring = unit.root() / "usr/share/keyrings/harl-updater-stick.gpg"

    def prepare(self) -> None:
        super().prepare()
        make_key(self.maker / "keys", "maker", self.maker / "keys.gpg")
        self.later.callback(self.keyring.unlink, missing_ok=True)
        self.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        self.put_tool("scp", "touch /run/uploads")
        write_index(self.repository)

    def install_keyring(self) -> None:
        """From now on the unit knows the maker."""
        shutil.copy(self.maker / "keys.gpg", self.keyring)

    def sign(self) -> None:
        """Makes the stick again, signed by the maker."""
        (self.maker / "script").write_text("#!/bin/sh\n")
        (self.maker / "archive").write_bytes(zip_archive("2.2.0"))
        words = ["--archive", "archive", "--script", "script", "--version", "2.2.0", "--replace", "--sign", "maker"]
        output_of(self.tool, "stick", "make", *words, self.stick, folder=self.maker, GNUPGHOME=self.maker / "keys")

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
        assert self.unit.status("systemctl", "start", "harl-updater") != 0
        self.wait_for_end()
        self.assert_given_back()
        assert self.panel() == {"FAIL": "fail"}
        assert f"prepare: the stick is not as the maker signed it: {why}\n" in self.journal()
        assert "TavrenUpdater" not in self.journal()
        assert not (self.unit.root() / "run/uploads").exists()


class TestSticks:
    """A stick on a unit that knows its maker."""

    @pytest.fixture
    def service(self, unit: Machine, package: str, tool: Path, tmp_path: Path) -> Iterator[SignedStick]:
        if not tool.exists():
            pytest.skip("harl-updater-tool, which signs, is not built")
        yield from prepared(SignedStick(unit, package, tool, tmp_path))

    def test_signed_stick_is_used(self, service: SignedStick) -> None:
        service.sign()
        service.install_keyring()
        service.assert_used()

    def test_without_a_keyring_nothing_changes(self, service: SignedStick) -> None:
        service.assert_used()

    def test_stick_without_a_signature(self, service: SignedStick) -> None:
        service.install_keyring()
        service.assert_refused("not signed")

    def test_tampered_file(self, service: SignedStick) -> None:
        service.sign()
        service.install_keyring()
        path = f"{VERSIONS}/quorb2.2.0/unzipUpgrade.sh"
        (service.stick / path).write_text("#!/bin/sh\nreboot\n")
        service.assert_refused(f"changed: {path}")

    def test_tampered_manifest(self, service: SignedStick) -> None:
        service.sign()
        service.install_keyring()
        with (service.stick / "harl-updater.manifest").open("a") as manifest:
            manifest.write(" more\n")
        service.assert_refused("changed: the manifest")

    def test_other_key(self, service: SignedStick) -> None:
        service.sign()
        make_key(service.maker / "others", "other", service.maker / "keys.gpg")
        service.install_keyring()
        service.assert_refused("not signed by a known key")

    def test_keyring_that_cannot_be_read(self, service: SignedStick) -> None:
        service.sign()
        service.keyring.write_text("no keys")
        service.assert_refused("not signed by a known key")

    def test_verification_that_never_ends(self, service: SignedStick) -> None:
        service.sign()
        service.install_keyring()
        service.use_hand_over("hand-over-short")
        service.later.callback(service.use_hand_over, "hand-over")
        service.put_tool("gpgv", "sleep infinity")
        service.assert_refused("it cannot be read")

    def test_stick_without_anything_for_the_board_is_nothing_to_verify(self, service: SignedStick) -> None:
        service.install_keyring()
        shutil.rmtree(service.stick / "debs")
        service.offer()
        service.run()
        service.assert_given_back()
        assert "TavrenUpdater" in service.journal()
        assert "prepare: the stick" not in service.journal()


class TestOutcomes:
    """What the panel shows is true."""

    def test_failure_keeps_its_own_outcome(self, service: Service) -> None:
        service.offer("exit 1")
        service.run()
        assert service.ended_as() == ("success", "2", "15")
        service.assert_given_back()
        assert service.panel() == {"FAIL": "fail"}
        assert "give-back" not in service.journal()

    def test_crash_after_the_outcome_was_shown(self, service: Service) -> None:
        service.set_speed(3)  # time to act while the outcome is shown
        service.offer()
        service.start()
        wait_for("outcome", lambda: service.panel() == {"PASS": "pass"})
        service.kill("ABRT")
        service.wait_for_end()
        service.assert_given_back()
        assert service.panel() == {"PASS": "pass"}

    @pytest.mark.parametrize(
        "outcome, byte",
        [(UPDATED, "0x13"), (UPDATED, "0x2"), (UP_TO_DATE, "0x15")],
        ids=["led", "colour", "second-led"],
    )
    def test_outcome_whose_byte_failed_is_shown_again(self, service: Service, outcome: Outcome, byte: str) -> None:
        # The first time that the byte lights an outcome, after the sound, it does not arrive.
        broken = f'[ "$4" != {byte} ] || [ ! -s /var/log/sounds ] || [ -e /run/harl-lost ] || '
        broken += "{ touch /run/harl-lost; exit 1; }\n"
        service.put_tool("i2cset", NEWER + broken + KEEP)
        if outcome == UPDATED:
            service.offer()
        else:
            write_index(service.repository)
        service.run()
        assert (service.unit.root() / "run/harl-lost").exists()
        service.assert_given_back()
        assert service.panel(faults=True) == outcome.panel
        assert "give-back: the outcome was not shown, or not all of it: showing it" in service.journal()

    @pytest.mark.parametrize(
        "fill",
        ["head -c 100M /dev/zero >/run/harl-updater/fill || true", "mount -o remount,ro /run/harl-updater"],
        ids=["full", "read-only"],
    )
    def test_notes_that_cannot_be_written_leave_the_panel_alone(self, service: Service, fill: str) -> None:
        # Prepared as usual; only then the file system is full, or refuses writing.
        service.inside("sh", "-c", "mkdir -p /run/harl-updater; mount -t tmpfs -o size=64k run /run/harl-updater")
        service.later.callback(service.unit.status, "umount", "-l", "/run/harl-updater")
        service.offer(fill)
        service.run()
        service.assert_given_back()
        assert service.panel() == {"PASS": "pass"}


class TestRepairs:
    """What comes before the updater: other package tools, and an installation that a power cut interrupted."""

    def test_installation_that_a_power_cut_left_behind_is_finished(self, service: Service) -> None:
        service.offer("touch /run/package-installs")
        service.inside("dpkg", "--unpack", "/srv/repository/solvik4-rh_1.3.0_all.deb")
        service.run()
        assert (service.unit.root() / "run/package-installs").exists()
        assert service.package_state() == "install ok installed 1.3.0"
        assert service.panel() == {"REMOTE": "pass", "MAIN": "pass"}  # up to date

    def test_unpacking_that_a_power_cut_broke_off_is_done_again(self, service: Service) -> None:
        service.offer()
        # dpkg's journal of its steps stays in this folder until dpkg ends; apt installs nothing as long as it exists.
        service.inside(
            "sh",
            "-c",
            "cd /var/lib/dpkg && sed -n '/^Package: solvik4-rh$/,/^$/p' status |"
            " sed 's/^Status: .*/Status: install reinstreq half-installed/' >updates/0000",
        )
        assert service.package_state() == "install reinstreq half-installed 1.2.0"
        service.run()
        assert service.package_state() == "install ok installed 1.3.0"
        assert service.panel() == {"PASS": "pass"}

    def test_stopped_while_an_installation_that_a_power_cut_left_behind_is_finished(self, service: Service) -> None:
        service.offer(SLOW_SCRIPT)
        service.inside("dpkg", "--unpack", "/srv/repository/solvik4-rh_1.3.0_all.deb")
        service.inside("systemctl", "start", "--no-block", "harl-updater")
        service.wait_for_file("/run/package-installs")
        service.inside("systemctl", "stop", "harl-updater")
        service.wait_for_end()
        assert (service.unit.root() / "run/harl-after").exists(), "the script was broken off"
        assert service.package_state() == "install ok installed 1.3.0"
        service.assert_given_back()
        assert service.panel() == {"FAIL": "fail"}

    def test_broken_package_is_not_shown_as_up_to_date(self, service: Service) -> None:
        service.offer("exit 1")
        service.inside("dpkg", "--unpack", "/srv/repository/solvik4-rh_1.3.0_all.deb")
        service.note_journal()
        assert service.unit.status("systemctl", "start", "harl-updater") != 0
        service.wait_for_end()
        assert service.show("Result") == "exit-code"
        service.assert_given_back()
        assert service.panel() == {"FAIL": "fail"}
        assert "prepare: solvik4-rh cannot be finished and no other version of it is offered" in service.journal()
        assert "TavrenUpdater" not in service.journal()

    def test_broken_package_of_which_another_version_is_offered(self, service: Service) -> None:
        service.offer("exit 1")
        service.inside("dpkg", "--unpack", "/srv/repository/solvik4-rh_1.3.0_all.deb")
        build(Package("solvik4-rh", "1.4.0"), service.repository)
        write_index(service.repository)
        service.run()
        service.assert_given_back()
        assert service.package_state() == "install ok installed 1.4.0"
        assert service.panel() in ({"PASS": "pass"}, {"REMOTE": "pass", "MAIN": "pass"})

    def test_other_package_that_stays_broken_does_not_keep_the_updater(self, service: Service) -> None:
        service.offer()
        build(Package("solvik4-data", "1.0", scripts={"postinst": "exit 1"}), service.repository)
        write_index(service.repository)
        service.inside("dpkg", "--unpack", "/srv/repository/solvik4-data_1.0_all.deb")
        service.run()
        assert service.ended_as() == ("success", "2", "15")
        assert "prepare: still unfinished, left to the updater: solvik4-data" in service.journal()
        service.assert_given_back()

    def test_missing_dependency_is_installed_first(self, service: Service) -> None:
        service.offer(depends="solvik4-data")
        build(Package("solvik4-data", "1.0"), service.repository)
        write_index(service.repository)
        service.unit.status("dpkg", "--unpack", "/srv/repository/solvik4-rh_1.3.0_all.deb")
        service.run()
        assert service.package_state() == "install ok installed 1.3.0"
        assert "prepare: the installation is finished" in service.journal()
        assert service.panel() == {"REMOTE": "pass", "MAIN": "pass"}

    def test_jobs_of_apts_own_timers_are_waited_for(self, service: Service) -> None:
        job = "[Service]\nType=oneshot\nExecStart=/bin/sleep 8\nExecStart=/bin/touch /run/harl-job\n"
        service.put("etc/systemd/system/apt-daily.service", job)
        service.inside("systemctl", "daemon-reload")
        service.offer()
        service.inside("systemctl", "start", "--no-block", "apt-daily")
        assert not (service.unit.root() / "run/harl-job").exists()
        service.start()
        assert (service.unit.root() / "run/harl-job").exists()
        service.wait_for_end()
        assert service.panel() == {"PASS": "pass"}
        assert "prepare: a job of apt's own timers is at work, waiting for it" in service.journal()


class TestSurroundings:
    """Settings, logs and packages around a run, its own among them."""

    def test_changed_configuration_file_is_kept(self, service: Service) -> None:
        folder = service.unit.root() / "srv"
        for version, text in (("1.2.1", "old"), ("1.3.0", "new")):
            tree = folder / "tree"
            write(tree / "etc/solvik4.conf", f"{text}\n")
            write(tree / "DEBIAN/conffiles", "/etc/solvik4.conf\n")
            control = f"Package: solvik4-rh\nVersion: {version}\nArchitecture: all\nMaintainer: T <t@localhost>\n"
            write(tree / "DEBIAN/control", control + "Description: test\n")
            write_script(tree / "DEBIAN/postinst", "grep -qx changed /etc/solvik4.conf || [ $2 != 1.2.1 ]")
            service.inside("dpkg-deb", "--build", "/srv/tree", f"/srv/repository/solvik4-rh_{version}_all.deb")
        write_index(service.repository)
        service.inside("dpkg", "--install", "/srv/repository/solvik4-rh_1.2.1_all.deb")
        service.inside("sh", "-c", "echo changed >/etc/solvik4.conf")
        service.later.callback(service.inside, "rm", "/etc/solvik4.conf")
        service.put("etc/apt/apt.conf.d/99contrary", 'DPkg::Options { "--force-confnew"; };\n')
        service.run()
        assert service.package_state() == "install ok installed 1.3.0"
        assert service.read("/etc/solvik4.conf") == "changed\n"
        assert service.panel() == {"PASS": "pass"}

    def test_settings_of_the_service_win_over_those_in_etc(self, service: Service) -> None:
        service.put("etc/apt/apt.conf.d/99contrary", CONTRARY)
        service.put("etc/apt/apt.conf", CONTRARY + 'Test::Own "kept";\n')
        service.offer()
        service.run()
        settings = service.inside("env", "APT_CONFIG=/usr/lib/harl-updater/apt-first.conf", "apt-config", "dump")
        for prefix in ("", "Binary::apt::"):
            for setting in ('Acquire::Retries "3"', 'Acquire::http::Timeout "20"', 'DPkg::Lock::Timeout "600"'):
                lines = [line for line in settings.splitlines() if line.startswith(prefix + setting.split()[0] + " ")]
                assert lines == [f"{prefix}{setting};"]
        assert 'Test::Own "kept";' in settings
        options = [line.split('"')[1] for line in settings.splitlines() if line.startswith("DPkg::Options:: ")]
        assert options[-4:] == ["--refuse-confnew", "--refuse-confask", "--force-confdef", "--force-confold"]
        assert service.panel() == {"PASS": "pass"}

    def test_no_package_script_meets_the_private_folder(self, service: Service) -> None:
        service.offer('echo "$PATH" >/run/harl-path; command -v systemctl dpkg ls >>/run/harl-path')
        service.run()
        assert "harl-updater" not in service.read("/run/harl-path")
        assert "systemctl\n" in service.read("/run/harl-path")

    def test_journal_is_synced_before_the_application_starts(self, service: Service) -> None:
        service.offer()
        service.inside("systemctl", "stop", "harl")
        service.put("etc/systemd/system/harl.service.d/test.conf", JOURNAL_AT_START)
        service.inside("systemctl", "daemon-reload")
        service.run()
        assert "Running command: apt --assume-yes install" in service.read("/run/harl-journal")

    def test_logs_are_kept_where_the_journal_is_volatile(self, service: Service) -> None:
        service.later.callback(service.inside, "systemctl", "restart", "systemd-journald")
        service.later.callback(service.inside, "mv", "/var/log/journal.kept", "/var/log/journal")
        service.put("etc/systemd/journald.conf.d/test.conf", "[Journal]\nStorage=volatile\n")
        service.inside("sh", "-c", "mv /var/log/journal /var/log/journal.kept; systemctl restart systemd-journald")
        service.inside("mkdir", "-p", "/var/lib/harl-updater")
        service.inside("bash", "-c", "cd /var/lib/harl-updater; rm -f *; touch 200{0..9}-01-01_00-00-00.log")
        service.offer()
        service.run()
        kept = sorted(path.name for path in (service.unit.root() / "var/lib/harl-updater").iterdir())
        assert len(kept) == 10
        assert kept[0] == "2001-01-01_00-00-00.log"
        log = service.read(f"/var/lib/harl-updater/{kept[-1]}")
        assert re.search(r"Updater \| .*int main\(int, char\*\*\)\n.*TavrenUpdater version: ", log)
        assert "static void UpdateManager::stopUpdater()" in log

    def test_upgrade_of_the_updater_in_its_own_run(self, service: Service) -> None:
        description = "lib/systemd/system/harl-updater.service"
        newer = "[Unit]\nDescription=newer\n"
        raise_version(service.unit.root() / "srv/updater.deb", "9.0.0", service.repository, {description: newer})
        service.offer("touch /run/package-installs\n", f"{service.package} (>= 9.0.0)")
        service.start()
        service.wait_for_file("/run/package-installs")
        assert int(service.show("MainPID")) == service.main
        service.wait_for_end()
        assert service.ended_as() == ("success", "2", "15")
        assert service.package_state(service.package) == "install ok installed 9.0.0"
        assert service.show("Description") == "newer"  # takes effect with the next run
        service.assert_given_back()
        assert service.panel() == {"PASS": "pass"}
        service.inside("dpkg", "--purge", "solvik4-rh")
        service.inside("dpkg", "--install", "--force-downgrade", "/srv/updater.deb")

    def test_removal_leaves_the_run_alone(self, service: Service) -> None:
        service.set_speed(3)  # time for the removal while the outcome is shown
        service.offer()
        service.start()
        wait_for("outcome", lambda: service.panel() == {"PASS": "pass"})
        service.inside("dpkg", "--remove", service.package)
        assert int(service.show("MainPID")) == service.main
        service.wait_for_end()
        assert service.ended_as()[1:] == ("2", "15")
        service.assert_given_back()
        service.inside("dpkg", "--install", "/srv/updater.deb")
        assert service.show("ActiveState") != "active"
