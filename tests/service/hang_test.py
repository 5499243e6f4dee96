"""Usage: hang_test.py BUILD_FOLDER PACKAGE SYSTEM [TEST...]

Lets every command of an update hang in every way, with the service of the built PACKAGE in a machine of its own (see
service_test.py), with shortened limits, and a few with the shipped ones. Each time the instrument must come back, the
panel must show the outcome of that failure, and the next run must end normally.
"""

import json
import time
from collections.abc import Iterable
from dataclasses import dataclass

from bench.makers.files import write, write_script
from bench.makers.packages import Package, build, write_index
from bench.outcomes import CHECK_FAILED, INSTALLATION_FAILED, UP_TO_DATE, UPDATED, Outcome
from tests.service.service_test import ROOT, TOOLS, ServiceTest, main, shorten, wait_for

FROZEN = "/run/frozen"
# What a hanging call does. The last one continues its work.
KINDS = {
    "never_ends": "exec sleep 600",
    "ignores_the_request_to_end": "trap '' TERM; while :; do sleep 600; done",
    "is_stopped": "kill -STOP $$",
    "is_uninterruptible": f"exec cat {FROZEN}/x",
    "leaves_its_output_open": "sleep 600 &",
}
# A call that does this kills the one who made it.
KILL_GIVE_BACK = "kill -s {} $(/usr/bin/systemctl show --value --property=MainPID harl-updater-give-back)"
SPEED = 200
LONGEST = 75  # s, from the start to the application, with shortened limits on a busy machine


@dataclass(frozen=True)
class Command:
    """A command of the updater, and the result when it fails."""

    tool: str
    arguments: str  # pattern of the shell
    outcome: Outcome
    once: bool = False  # the first call only


COMMANDS = {
    "panel_at_the_start": Command("i2cset", "*' 0x10 c'", UPDATED, once=True),
    "colour_of_the_outcome": Command("i2cset", "*' 0x2 c'", UPDATED, once=True),
    "stop_of_the_application": Command("systemctl", "'stop harl'", UPDATED),
    "mirrors": Command("apt", "update", CHECK_FAILED),
    "versions": Command("apt-cache", "*", CHECK_FAILED),
    "installation": Command("apt", "*install*", INSTALLATION_FAILED),
    "board_version": Command("ssh", "*version.txt*", CHECK_FAILED),
    "stick_version": Command("ls", "*", CHECK_FAILED),
    "upload": Command("scp", "*", INSTALLATION_FAILED),
    "board_script": Command("ssh", "*unzipUpgrade*", UPDATED),
    "sound": Command("aplay", "*", UPDATED),
    "release_of_the_stick": Command("umount", "/root/USB_MOUNT/", UPDATED),
    "start_of_the_application": Command("systemctl", "'start harl'", UPDATED),
    "stop_of_the_updater": Command("systemctl", "'stop harl-updater'", UPDATED),
}
BOARD_TOOLS = {
    "scp": "exit 0",
    "ssh": TOOLS["ssh"] + 'case $* in *unzipUpgrade*) echo 2.2.0 >/srv/board ;; esac',
}


class HangTest(ServiceTest):
    """A unit with a package and a board to update."""

    passed = not_well = 0  # cases in which the panel passes, and passes over a unit that is not well

    @classmethod
    def tearDownClass(cls) -> None:
        if cls.passed:
            print(
                f"{cls.__name__}: the panel passes in {cls.passed} cases, in {cls.not_well} of them over a unit that "
                "is not well: the log says so each time"
            )

    def setUp(self) -> None:
        super().setUp()
        self.restore_tools()
        self.set_speed(SPEED)
        self.use_hand_over("hand-over-short")
        self.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        self.offer()

    def tearDown(self) -> None:
        self.restore_tools()
        # A hanging process is still in the updater's control group, and stays there if it is uninterruptible.
        self.unit.status("sh", "-c", "kill -9 $(cat /run/frozen.pid); umount -l /run/frozen; rm /run/frozen.pid")
        self.unit.status("pkill", "--signal", "KILL", "--full", "sleep 600")
        super().tearDown()

    def restore_tools(self) -> None:
        """No tool hangs any more."""
        for name in {command.tool for command in COMMANDS.values()} | {"journalctl"}:
            path = self.unit.root() / "usr/local/sbin" / name
            if name in TOOLS:
                write_script(path, BOARD_TOOLS.get(name, TOOLS[name]))
            else:
                path.unlink(missing_ok=True)
        self.inside("rm", "-f", "/run/hung")

    def hang(self, tool: str, arguments: str, how: str, once: bool = False) -> None:
        """Makes calls of the tool with these arguments hang."""
        path = self.unit.root() / "usr/local/sbin" / tool
        # A tool without a stand-in is the real one.
        rest = path.read_text().split("\n", 1)[1] if path.exists() else f'exec /usr/bin/{tool} "$@"'
        first = "[ -e /run/hung ] || { touch /run/hung; " if once else "{ "
        write_script(path, f"case $* in\n{arguments}) {first}{how}; }} ;;\nesac\n{rest}".replace("&; }", "& }"))

    def freeze(self) -> None:
        """Mounts the file system that never answers. Skips the test where there is none."""
        write(self.unit.root() / "opt/frozen_mount.py", (ROOT / "tests/service/frozen_mount.py").read_text())
        line = (
            f"[ -e /dev/fuse ] || mknod /dev/fuse c 10 229; mkdir -p {FROZEN}; setsid python3 /opt/frozen_mount.py"
            f" {FROZEN} >/run/frozen.log 2>&1 & echo $! >/run/frozen.pid"
        )
        self.inside("sh", "-c", line)
        wait_for("the frozen mount", lambda: self.read("/run/frozen.log") != "")
        if self.read("/run/frozen.log") != "mounted\n":
            self.skipTest(self.read("/run/frozen.log"))

    def run_to_the_end(self, longest: float = LONGEST) -> float:
        """One run; how long it takes until the application is active for good (s)."""
        self.inside("sh", "-c", ": >/var/log/panel; : >/var/log/sounds")
        begin = time.monotonic()
        self.note_journal()
        self.inside("systemctl", "start", "--no-block", "harl-updater")
        wait_for("start", lambda: self.states() != {"inactive", "failed"} and "activ" in self.show("ActiveState"), 20)
        wait_for("end", lambda: self.states() <= {"inactive", "failed"}, longest)
        wait_for("harl", lambda: self.unit.status("systemctl", "is-active", "--quiet", "harl") == 0, 10)
        return time.monotonic() - begin

    def check_next_run(self) -> None:
        """The next run is not blocked and does what is left to do."""
        self.restore_tools()
        self.unit.status("systemctl", "reset-failed")
        done = self.package_state().endswith("1.3.0") and self.read("/srv/board") == "2.2.0\n"
        self.assertNotEqual(self.unit.status("grep", "-q", " /root/USB_MOUNT ", "/proc/mounts"), 0)
        self.inside("mount", "-t", "tmpfs", "stick", "/root/USB_MOUNT")
        self.fill_stick()
        self.run_to_the_end()
        self.assertEqual(self.panel(), (UP_TO_DATE if done else UPDATED).panel)
        self.assertEqual(self.ended_as(), ("success", "2", "15"))
        self.assertEqual(self.package_state(), "install ok installed 1.3.0")

    def check_log(self) -> None:
        """The panel passes: the log says that the unit is not well if it is not, and only then."""
        wait_for("the verification", lambda: "verify: " in self.journal(), 90)
        found = (self.package_state(), self.read("/srv/board"), self.inside("systemctl", "is-active", "harl"))
        well = found == ("install ok installed 1.3.0", "2.2.0\n", "active\n")
        log = self.inside("sh", "-c", "harl-updater-tool log --journal --last --json; echo $?")
        said, status = log.rstrip().rsplit("\n", 1)
        meaning = json.loads(said)["runs"][0]["meaning"]
        self.assertEqual("not well" in meaning, not well, meaning)
        self.assertTrue(well or status == "1", f"status {status}: {meaning}")
        type(self).passed += 1
        type(self).not_well += not well

    def check(self, command: Command, how: str) -> None:
        """One case of the matrix."""
        outcome = UPDATED if how == KINDS["leaves_its_output_open"] else command.outcome
        if how == KINDS["is_uninterruptible"]:
            self.freeze()
        self.hang(command.tool, command.arguments, how, command.once)
        took = self.run_to_the_end()
        print(f"{took:.0f} s ", end="", flush=True)
        lost = command.once and how != KINDS["leaves_its_output_open"]  # one byte of a pair
        self.assertEqual(self.panel(faults=lost), outcome.panel)
        self.assertEqual(self.unit.status("systemctl", "is-active", "--quiet", "harl"), 0)
        if outcome == UPDATED:
            self.check_log()
        self.check_next_run()


class Matrix(HangTest):
    """Each command hanging in each way; the tests are made below."""


class ShippedLimits(HangTest):
    """One command hanging in each way, with the limits that are shipped; the tests are made below."""

    def setUp(self) -> None:
        super().setUp()
        self.use_hand_over("hand-over")


def add_cases(tests: type[HangTest], commands: Iterable[str]) -> None:
    """One test for each command and each way to hang."""
    for name in commands:
        for kind, how in KINDS.items():

            def case(self: HangTest, command: Command = COMMANDS[name], how: str = how) -> None:
                self.check(command, how)

            setattr(tests, f"test_{name}_{kind}", case)


class Others(HangTest):
    """Hangs outside the commands."""

    def test_maintainer_script(self) -> None:
        self.offer("sleep 600")
        self.run_to_the_end()
        self.assertEqual(self.panel(), INSTALLATION_FAILED.panel)
        # The package stays half-configured, and its script hangs again before each later run.
        self.mount_stick()
        self.run_to_the_end()
        self.assertIn("prepare: solvik4-rh cannot be finished", self.journal())
        self.assertEqual(self.panel(), INSTALLATION_FAILED.panel)
        # Another version ends this.
        build(Package("solvik4-rh", "1.4.0"), self.repository)
        write_index(self.repository)
        self.mount_stick()
        self.run_to_the_end()
        self.assertEqual(self.package_state(), "install ok installed 1.4.0")

    def test_everything_on_the_panel(self) -> None:
        self.hang("i2cset", "*", KINDS["never_ends"])
        self.run_to_the_end()
        self.assertIn("hand-over: panel: 3 s are used up; further calls fail at once", self.journal())
        self.check_next_run()

    def test_all_of_systemctl(self) -> None:
        # Then not even give-back can start the application: the service manager does.
        self.inside("sh", "-c", "systemctl stop harl")
        self.hang("systemctl", "*harl*", KINDS["never_ends"])
        self.run_to_the_end()
        self.assertEqual(self.panel(), UPDATED.panel)

    def test_stick_that_hangs_itself(self) -> None:
        self.unit.status("umount", "/root/USB_MOUNT")
        self.freeze()
        self.inside("mount", "--bind", FROZEN, "/root/USB_MOUNT")
        self.run_to_the_end()
        self.assertEqual(self.panel(), CHECK_FAILED.panel)
        self.check_next_run()

    def mount_stick(self) -> None:
        """Plugs the stick in again."""
        self.inside("mount", "-t", "tmpfs", "stick", "/root/USB_MOUNT")
        self.fill_stick()
        self.unit.status("systemctl", "reset-failed")


class Rescuer(HangTest):
    """give-back is killed, hangs or cannot be run."""

    def setUp(self) -> None:
        super().setUp()
        shorten(self.unit, outcome_time=4)

    def crash(self) -> None:
        """Ends the updater early, in the wait of the board."""
        self.set_speed(20)
        self.start()
        wait_for("board", lambda: self.read("/srv/board") == "2.2.0\n")
        self.kill("KILL")

    def main_of_give_back(self) -> int:
        """The process of give-back, or 0."""
        return int(self.inside("systemctl", "show", "--value", "--property=MainPID", "harl-updater-give-back"))

    def assert_given_back_at_last(self, longest: float = LONGEST) -> None:
        """The application is active, and the stick released."""
        wait_for("harl", lambda: self.unit.status("systemctl", "is-active", "--quiet", "harl") == 0, longest)
        wait_for("end", lambda: self.states() <= {"inactive", "failed"}, longest)
        self.assertEqual(self.unit.status("systemctl", "is-active", "--quiet", "harl"), 0)

    def kill_at(self, tool: str, arguments: str, signal: str = "KILL") -> None:
        """Kills give-back while it calls the tool."""
        self.hang(tool, arguments, f"{KILL_GIVE_BACK.format(signal)}; sleep 1", once=True)
        self.crash()
        self.assert_given_back_at_last()
        self.assertTrue((self.unit.root() / "run/hung").exists(), "give-back was not killed")
        self.assertNotEqual(self.unit.status("grep", "-q", " /root/USB_MOUNT ", "/proc/mounts"), 0)

    def test_killed_before_its_first_step(self) -> None:
        self.kill_at("systemctl", "*ActiveState*harl-updater")

    def test_killed_while_it_shows_the_outcome(self) -> None:
        kill = f"touch /run/hung; {KILL_GIVE_BACK.format('KILL')}; sleep 0.7"
        self.hang("i2cset", "*' 0x14 c'", f"[ ! -d /run/harl-updater/give-back ] || [ -e /run/hung ] || {{ {kill}; }}")
        self.crash()
        self.assert_given_back_at_last()
        self.assertTrue((self.unit.root() / "run/hung").exists(), "give-back was not killed")
        # After the interrupted pair, the controller gets one byte that it does not understand.
        self.assertEqual(self.panel(faults=True), INSTALLATION_FAILED.panel)

    def test_killed_while_it_releases_the_stick(self) -> None:
        self.kill_at("umount", "/root/USB_MOUNT")

    def test_stopped_while_it_releases_the_stick(self) -> None:
        self.kill_at("umount", "/root/USB_MOUNT", "TERM")

    def test_killed_while_it_starts_the_application(self) -> None:
        self.kill_at("systemctl", "*no-block*harl")

    def test_killed_again_and_again(self) -> None:
        self.crash()
        for _ in range(8):
            wait_for("give-back", lambda: self.main_of_give_back() != 0 or "failed" in self.states(), 20)
            if process := self.main_of_give_back():
                self.unit.status("kill", "-s", "KILL", str(process))
        self.assert_given_back_at_last()

    def test_program_that_cannot_be_run(self) -> None:
        self.inside("mv", "/usr/lib/harl-updater/give-back", "/srv/give-back")
        self.addCleanup(self.inside, "mv", "/srv/give-back", "/usr/lib/harl-updater/give-back")
        self.crash()
        self.assert_given_back_at_last()

    def test_its_start_fails(self) -> None:
        # Neither a crash nor a stop may depend on the command that starts give-back.
        drop_in = self.unit.root() / "etc/systemd/system/harl-updater.service.d/start.conf"
        for command in ("/bin/false", "/bin/sh -c 'kill -9 $$$$'", "/bin/sleep 600"):
            with self.subTest(command=command):
                write(drop_in, f"[Service]\nExecStopPost=\nExecStopPost={command}\nTimeoutStopSec=3\n")
                self.addCleanup(drop_in.unlink, True)
                self.crash()
                self.assert_given_back_at_last()
                self.setUp()

    def test_every_tool_of_its_own_hangs(self) -> None:
        for tool in ("i2cset", "umount", "systemctl", "journalctl"):
            with self.subTest(tool=tool):
                self.crash()
                wait_for("end of the updater", lambda: self.show("ActiveState") not in ("active", "activating"))
                self.hang(tool, "*", KINDS["ignores_the_request_to_end"])
                self.assert_given_back_at_last()
                self.tearDown()
                self.setUp()


if __name__ == "__main__":
    add_cases(Matrix, COMMANDS)
    add_cases(ShippedLimits, ["colour_of_the_outcome"])
    main()
