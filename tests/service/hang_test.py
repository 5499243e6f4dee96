"""Lets every command of an update hang in every way, with the service of the built package, with shortened limits, and
a few with the shipped ones. Each time the instrument must come back, the panel must show the outcome of that failure,
and the next run must end normally.
"""

import json
import time
from collections.abc import Callable, Iterator
from dataclasses import dataclass, field

import pytest

from bench.machine.machine import Machine
from bench.makers.files import write, write_script
from bench.makers.packages import Package, build, write_index
from bench.outcomes import CHECK_FAILED, INSTALLATION_FAILED, UP_TO_DATE, UPDATED, Outcome
from tests.service.service import BOARD_TOOLS, ROOT, TOOLS, Service, prepared, shorten, wait_for

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


@dataclass
class Tally:
    """What the cases of a class come to."""

    times: list[float] = field(default_factory=list)  # s, from the start to the application
    passed: int = 0  # cases in which the panel passes
    not_well: int = 0  # and of these, those over a unit that is not well


class Hanging(Service):
    """A unit with a package and a board to update, and commands that hang."""

    def __init__(self, unit: Machine, package: str, tally: Tally) -> None:
        super().__init__(unit, package)
        self.tally = tally

    def prepare(self) -> None:
        super().prepare()
        self.restore_tools()
        self.set_speed(SPEED)
        self.use_hand_over("hand-over-short")
        self.inside("sh", "-c", "echo 2.1.0 >/srv/board")
        self.offer()

    def clear(self) -> None:
        self.restore_tools()
        # A hanging process is still in the updater's control group, and stays there if it is uninterruptible.
        self.unit.status("sh", "-c", "kill -9 $(cat /run/frozen.pid); umount -l /run/frozen; rm /run/frozen.pid")
        self.unit.status("pkill", "--signal", "KILL", "--full", "sleep 600")
        super().clear()

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
            pytest.skip(self.read("/run/frozen.log"))

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
        assert self.unit.status("grep", "-q", " /root/USB_MOUNT ", "/proc/mounts") != 0
        self.inside("mount", "-t", "tmpfs", "stick", "/root/USB_MOUNT")
        self.fill_stick()
        self.run_to_the_end()
        assert self.panel() == (UP_TO_DATE if done else UPDATED).panel
        assert self.ended_as() == ("success", "2", "15")
        assert self.package_state() == "install ok installed 1.3.0"

    def check_log(self) -> None:
        """The panel passes: the log says that the unit is not well if it is not, and only then."""
        wait_for("the verification", lambda: "verify: " in self.journal(), 90)
        found = (self.package_state(), self.read("/srv/board"), self.inside("systemctl", "is-active", "harl"))
        well = found == ("install ok installed 1.3.0", "2.2.0\n", "active\n")
        log = self.inside("sh", "-c", "harl-updater-tool log --journal --last --json; echo $?")
        said, status = log.rstrip().rsplit("\n", 1)
        meaning = json.loads(said)["runs"][0]["meaning"]
        assert ("not well" in meaning) == (not well), meaning
        assert well or status == "1", f"status {status}: {meaning}"
        self.tally.passed += 1
        self.tally.not_well += not well

    def check(self, command: Command, how: str) -> None:
        """A command that hangs, and the run after it."""
        outcome = UPDATED if how == KINDS["leaves_its_output_open"] else command.outcome
        if how == KINDS["is_uninterruptible"]:
            self.freeze()
        self.hang(command.tool, command.arguments, how, command.once)
        self.tally.times.append(self.run_to_the_end())
        lost = command.once and how != KINDS["leaves_its_output_open"]  # one byte of a pair
        assert self.panel(faults=lost) == outcome.panel
        assert self.unit.status("systemctl", "is-active", "--quiet", "harl") == 0
        if outcome == UPDATED:
            self.check_log()
        self.check_next_run()

    def mount_stick(self) -> None:
        """Plugs the stick in again."""
        self.inside("mount", "-t", "tmpfs", "stick", "/root/USB_MOUNT")
        self.fill_stick()
        self.unit.status("systemctl", "reset-failed")

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
        assert self.unit.status("systemctl", "is-active", "--quiet", "harl") == 0

    def kill_at(self, tool: str, arguments: str, signal: str = "KILL") -> None:
        """Kills give-back while it calls the tool."""
        self.hang(tool, arguments, f"{KILL_GIVE_BACK.format(signal)}; sleep 1", once=True)
        self.crash()
        self.assert_given_back_at_last()
        assert (self.unit.root() / "run/hung").exists(), "give-back was not killed"
        assert self.unit.status("grep", "-q", " /root/USB_MOUNT ", "/proc/mounts") != 0


@pytest.fixture(scope="class")
def tally(request: pytest.FixtureRequest, tell: Callable[[str], None]) -> Iterator[Tally]:
    tally = Tally()
    yield tally
    if tally.times:
        tell(
            f"{request.node.name}: the application is back {min(tally.times):.0f} to {max(tally.times):.0f} s after "
            f"the start; the panel passes in {tally.passed} of {len(tally.times)} cases, in {tally.not_well} of them "
            "over a unit that is not well: the log says so each time"
        )


@pytest.fixture
def service(unit: Machine, package: str, tally: Tally) -> Iterator[Hanging]:
    yield from prepared(Hanging(unit, package, tally))


class TestMatrix:
    """Each command hanging in each way."""

    @pytest.mark.parametrize("kind", KINDS)
    @pytest.mark.parametrize("command", COMMANDS)
    def test_hangs(self, service: Hanging, command: str, kind: str) -> None:
        service.check(COMMANDS[command], KINDS[kind])


class TestShippedLimits:
    """One command hanging in each way, with the limits that are shipped."""

    @pytest.mark.parametrize("kind", KINDS)
    def test_hangs(self, service: Hanging, kind: str) -> None:
        service.use_hand_over("hand-over")
        service.check(COMMANDS["colour_of_the_outcome"], KINDS[kind])


class TestOthers:
    """Hangs outside the commands."""

    def test_maintainer_script(self, service: Hanging) -> None:
        service.offer("sleep 600")
        service.run_to_the_end()
        assert service.panel() == INSTALLATION_FAILED.panel
        # The package stays half-configured, and its script hangs again before each later run.
        service.mount_stick()
        service.run_to_the_end()
        assert "prepare: solvik4-rh cannot be finished" in service.journal()
        assert service.panel() == INSTALLATION_FAILED.panel
        # Another version ends this.
        build(Package("solvik4-rh", "1.4.0"), service.repository)
        write_index(service.repository)
        service.mount_stick()
        service.run_to_the_end()
        assert service.package_state() == "install ok installed 1.4.0"

    def test_everything_on_the_panel(self, service: Hanging) -> None:
        service.hang("i2cset", "*", KINDS["never_ends"])
        service.run_to_the_end()
        assert "hand-over: panel: 3 s are used up; further calls fail at once" in service.journal()
        service.check_next_run()

    def test_all_of_systemctl(self, service: Hanging) -> None:
        # Then not even give-back can start the application: the service manager does.
        service.inside("sh", "-c", "systemctl stop harl")
        service.hang("systemctl", "*harl*", KINDS["never_ends"])
        service.run_to_the_end()
        assert service.panel() == UPDATED.panel

    def test_stick_that_hangs_itself(self, service: Hanging) -> None:
        service.unit.status("umount", "/root/USB_MOUNT")
        service.freeze()
        service.inside("mount", "--bind", FROZEN, "/root/USB_MOUNT")
        service.run_to_the_end()
        assert service.panel() == CHECK_FAILED.panel
        service.check_next_run()


class TestRescuer:
    """give-back is killed, hangs or cannot be run."""

    @pytest.fixture
    def service(self, service: Hanging) -> Hanging:
        shorten(service.unit, outcome_time=4)
        return service

    def test_killed_before_its_first_step(self, service: Hanging) -> None:
        service.kill_at("systemctl", "*ActiveState*harl-updater")

    def test_killed_while_it_shows_the_outcome(self, service: Hanging) -> None:
        kill = f"touch /run/hung; {KILL_GIVE_BACK.format('KILL')}; sleep 0.7"
        service.hang(
            "i2cset", "*' 0x14 c'", f"[ ! -d /run/harl-updater/give-back ] || [ -e /run/hung ] || {{ {kill}; }}"
        )
        service.crash()
        service.assert_given_back_at_last()
        assert (service.unit.root() / "run/hung").exists(), "give-back was not killed"
        # After the interrupted pair, the controller gets one byte that it does not understand.
        assert service.panel(faults=True) == INSTALLATION_FAILED.panel

    def test_killed_while_it_releases_the_stick(self, service: Hanging) -> None:
        service.kill_at("umount", "/root/USB_MOUNT")

    def test_stopped_while_it_releases_the_stick(self, service: Hanging) -> None:
        service.kill_at("umount", "/root/USB_MOUNT", "TERM")

    def test_killed_while_it_starts_the_application(self, service: Hanging) -> None:
        service.kill_at("systemctl", "*no-block*harl")

    def test_killed_again_and_again(self, service: Hanging) -> None:
        service.crash()
        for _ in range(8):
            wait_for("give-back", lambda: service.main_of_give_back() != 0 or "failed" in service.states(), 20)
            if process := service.main_of_give_back():
                service.unit.status("kill", "-s", "KILL", str(process))
        service.assert_given_back_at_last()

    def test_program_that_cannot_be_run(self, service: Hanging) -> None:
        service.inside("mv", "/usr/lib/harl-updater/give-back", "/srv/give-back")
        service.later.callback(service.inside, "mv", "/srv/give-back", "/usr/lib/harl-updater/give-back")
        service.crash()
        service.assert_given_back_at_last()

    # Neither a crash nor a stop may depend on the command that starts give-back.
    @pytest.mark.parametrize("command", ["/bin/false", "/bin/sh -c 'kill -9 $$$$'", "/bin/sleep 600"])
    def test_its_start_fails(self, service: Hanging, command: str) -> None:
        text = f"[Service]\nExecStopPost=\nExecStopPost={command}\nTimeoutStopSec=3\n"
        service.put("etc/systemd/system/harl-updater.service.d/start.conf", text)
        service.crash()
        service.assert_given_back_at_last()

    @pytest.mark.parametrize("tool", ["i2cset", "umount", "systemctl", "journalctl"])
    def test_every_tool_of_its_own_hangs(self, service: Hanging, tool: str) -> None:
        service.crash()
        wait_for("end of the updater", lambda: service.show("ActiveState") not in ("active", "activating"))
        service.hang(tool, "*", KINDS["ignores_the_request_to_end"])
        service.assert_given_back_at_last()
