"""give-back, which runs after the service has ended, on stand-in tools; in its own process namespace here."""

import re
import shutil
import subprocess
from pathlib import Path

import pytest

from bench.outcomes import CHECK_FAILED, ENDED_EARLY, UP_TO_DATE, UPDATED, Outcome
from bench.panel import COLOR_CODES, FIRST_LED, LAST_LED, Panel
from tests.commands import run_command
from tests.service.stand_in import ROOT, StandIn

NAMESPACES = ["unshare", "--map-root-user", "--mount", "--pid", "--fork", "--kill-child", "--mount-proc"]
START = "systemctl --no-block start harl"
TOOLS = {
    "systemctl": """
[ "$1" = show ] || echo "systemctl $*" >>"$UNIT/calls"
case $* in
*--value*) echo "$ACTIVE" ;;
show*) printf 'Result=%s\\nExecMainCode=2\\nExecMainStatus=15\\n' "$RESULT" ;;
*) for tool in apt dpkg; do ! pgrep -x $tool >/dev/null || echo "beside $tool" >>"$UNIT/calls"; done
   cp "$UNIT/uptime" "$UNIT/started"
   [ ! -e "$UNIT/no-systemctl" ] || exit 1 ;;
esac
""",
    "i2cset": """
echo "i2cset $*" >>"$UNIT/calls"
[ ! -e "$UNIT/lost" ] || { rm "$UNIT/lost"; exit 1; }
exit "$I2CSET_STATUS"
""",
    "umount": """
echo "umount $*" >>"$UNIT/calls"
{ : >"$RUNTIME_DIRECTORY/note"; } 2>/dev/null
cp "$UNIT/uptime" "$UNIT/released"
[ ! -s "$UNIT/busy" ] || { sed -i 1d "$UNIT/busy"; exit 32; }
[ -e "$UNIT/stuck" ] && [ "$1" != --lazy ] && exit "$UMOUNT_STATUS"
: >"$UNIT/mounts"
""",
    "journalctl": """
echo "journalctl $*" >>"$UNIT/calls"
[ "$1" = --sync ] || cat "$UNIT/journal"
""",
    # Only it lets time pass. At ENDS, what is at work ends, of a signal that the shell does not mention, and its last
    # note is written.
    "sleep": """
read -r now _ <"$UNIT/uptime"
now=$((${now%.*} + $1))
echo "$now.00 0.00" >"$UNIT/uptime"
[ "$now" = "$ENDS" ] || exit 0
[ ! -e "$UNIT/late" ] || cat "$UNIT/late" >>"$UNIT/run/notes"
while pkill -PIPE -x "$AT_WORK"; do :; done
""",
}
PROBE = run_command(*NAMESPACES, "true")
pytestmark = pytest.mark.skipif(
    PROBE.returncode != 0, reason=f"this machine allows no process namespace: {PROBE.stderr.strip()}"
)
BEGIN = 1000  # s since boot
READ = 30  # s, the time of an outcome
MOUNT = "/dev/sda1 /root/USB_MOUNT vfat rw 0 0\n"
# The parts of the program that depend on the unit.
CHANGES = {
    r"'/harl-updater\(-give-back\)*\.service$'": "''",  # every process here is the updater's
    "/proc/self/mounts": '"$UNIT/mounts"',
    "/proc/uptime": '"$UNIT/uptime"',
    "logs=/var/lib/harl-updater\n": 'logs="$UNIT/logs"\n',
    "/var/log/journal/$(cat /etc/machine-id)/": "$UNIT/journals/",
}


class Unit(StandIn):
    """A unit whose updater has just ended, with the stick still in use."""

    def __init__(self, folder: Path) -> None:
        super().__init__(folder, "give-back", TOOLS, CHANGES)
        (folder / "mounts").write_text(MOUNT)
        (folder / "run/notes").write_text("1.00 prepared\n")
        (folder / "journal").write_text("first\nlast\n")
        (folder / "logs").mkdir()
        (folder / "uptime").write_text(f"{BEGIN}.50 0.00\n")
        self.environment |= {"ACTIVE": "deactivating", "RESULT": "signal", "I2CSET_STATUS": "0", "UMOUNT_STATUS": "32"}
        self.environment["ENDS"] = "never"
        # Copies of sleep(1) under the names of the programs that the updater may leave running.
        for name in ("apt", "apt-get", "dpkg", "i2cset", "scp", "ssh"):
            shutil.copy("/usr/bin/sleep", folder / name)

    def note(self, *notes: str, before: int = 0) -> None:
        """Writes notes of the run, made just now, or this many seconds before."""
        with (self.folder / "run/notes").open("a") as file:
            file.writelines(f"{BEGIN - before}.00 {note}\n" for note in notes)

    def started(self, what: str = "started") -> int:
        """When the application was started (s since the beginning), or the stick released."""
        return int(float((self.folder / what).read_text().split()[0])) - BEGIN

    def give_back(self, beside: str = ":", after: str = ":", at_work: tuple[str, ...] = (), status: int = 0) -> str:
        """Runs it once the processes of the shell line `beside` are `at_work`, then `after`; returns its output."""
        waits = "".join(f"until pgrep -x {name} >/dev/null; do /usr/bin/sleep 0.01; done\n" for name in at_work)
        line = f'cd "$UNIT"\n{beside}\n{waits}./give-back; status=$?\n{after}\nexit $status'
        self.environment["AT_WORK"] = " ".join(at_work)
        done = run_command(*NAMESPACES, "sh", "-c", line, environment=self.environment)
        assert (done.stderr, done.returncode) == ("", status)
        return done.stdout

    def panel(self, half_sent: bool = False) -> dict[str, str]:
        """The LEDs that are lit after the sent bytes; before, all were blue, or one even waited for its next colour."""
        panel = Panel()
        for led in range(FIRST_LED, LAST_LED + 1):
            panel.send(led, 0)
            panel.send(COLOR_CODES["blue"], 0)
        if half_sent:
            panel.send(FIRST_LED + 2, 0)
        for line in self.calls("i2cset"):
            panel.send(int(line.split()[4], 16), 0)
        assert len(panel.faults) == (1 if half_sent else 0)
        return panel.pattern(0)

    def assert_instrument_is_given_back(self) -> None:
        """The stick is released and the application started, in this order."""
        assert (self.folder / "mounts").read_text() == ""
        last = self.calls("umount", "systemctl")
        assert (last[0], last[-1]) == ("umount /root/USB_MOUNT", START)

    def kept_logs(self, cursor: str | None = "") -> dict[str, str]:
        """Runs it after a run that began behind `cursor`; returns the kept logs."""
        if cursor is not None:
            (self.folder / "run/cursor").write_text(cursor)
        self.give_back()
        return {path.name: path.read_text() for path in (self.folder / "logs").iterdir()}


@pytest.fixture
def unit(tmp_path: Path) -> Unit:
    return Unit(tmp_path)


def test_after_a_normal_end_nothing_is_left_to_do(unit: Unit) -> None:
    unit.note("lit 0x13 0x2 0")
    (unit.folder / "mounts").write_text("")
    assert unit.give_back() == ""
    assert unit.calls() == [START, "journalctl --sync"]


def test_end_before_the_outcome_shows_the_failure(unit: Unit) -> None:
    said = unit.give_back()
    ended = "Result=signal ExecMainCode=2 ExecMainStatus=15"
    assert f"give-back: the updater ended ({ended}) before it had an outcome: showing the failure" in said
    assert unit.panel() == ENDED_EARLY.panel
    assert unit.panel(half_sent=True) == ENDED_EARLY.panel
    assert unit.calls("i2cset", "umount")[-1] == "umount /root/USB_MOUNT"  # the outcome comes first
    assert unit.started("released") == 0
    unit.assert_instrument_is_given_back()


@pytest.mark.parametrize("notes", [["lit 0x14 0x8 0"], ["lit 0x12 0x2 0", "lit 0x15 0x2 0"]], ids=" ".join)
def test_end_after_the_outcome_leaves_the_panel_alone(unit: Unit, notes: list[str]) -> None:
    unit.note(*notes)
    assert unit.give_back() == ""
    assert unit.calls("i2cset") == []


# What was noted, and the outcome that it stands for.
NOT_SHOWN = [
    (UPDATED, ["lit 0x13 0x2 1"]),
    (ENDED_EARLY, ["lit 0x14 0x8 1"]),
    (UP_TO_DATE, ["lit 0x12 0x2 1", "lit 0x15 0x2 0"]),
    (UP_TO_DATE, ["lit 0x12 0x2 0"]),  # the updater ended before the second
    (CHECK_FAILED, ["lit 0x12 0x8 0", "lit 0x15 0x8 1"]),
    (CHECK_FAILED, ["lit 0x12 0x8 0"]),
    (CHECK_FAILED, ["lit unknown 0x8 1", "lit 0x15 0x8 0"]),
    (UPDATED, ["began installation", "ended installation 0", "sound pass"]),
    (UPDATED, ["began installation", "sound pass", "lit unknown 0x2 1"]),
    (UPDATED, ["began installation", "lit unknown 0x2 1"]),
    (UP_TO_DATE, ["sound pass"]),
    (ENDED_EARLY, ["sound fail"]),
]


@pytest.mark.parametrize("outcome, notes", NOT_SHOWN, ids=[", ".join(notes) for _, notes in NOT_SHOWN])
def test_outcome_that_was_not_shown_is_shown_again(unit: Unit, outcome: Outcome, notes: list[str]) -> None:
    unit.note(*notes)
    assert "give-back: the outcome was not shown, or not all of it: showing it" in unit.give_back()
    assert unit.panel() == outcome.panel


def test_outcome_of_its_own_stays_readable_before_the_application_starts(unit: Unit) -> None:
    unit.give_back()
    assert unit.started() == READ


@pytest.mark.parametrize("before, left", [(0, READ), (9, READ - 9), (40, 0)])
def test_outcome_stays_readable_before_the_application_starts(unit: Unit, before: int, left: int) -> None:
    unit.note("lit 0x13 0x2 0", before=before)
    unit.give_back()
    assert unit.started() == left


@pytest.mark.parametrize("result, panel", [("success", {}), ("signal", ENDED_EARLY.panel)], ids=["success", "signal"])
def test_without_notes_the_end_of_the_service_decides(unit: Unit, result: str, panel: dict[str, str]) -> None:
    (unit.folder / "run/notes").unlink()
    unit.environment["RESULT"] = result
    unit.give_back()
    assert {led: color for led, color in unit.panel().items() if color != "blue"} == panel


def test_good_end_of_the_service_is_no_outcome(unit: Unit) -> None:
    unit.environment["RESULT"] = "success"
    unit.give_back()
    assert unit.panel() == ENDED_EARLY.panel


def test_second_time_does_nothing(unit: Unit) -> None:
    unit.give_back()
    calls = len(unit.calls())
    assert unit.give_back() == ""
    assert len(unit.calls()) == calls


def test_one_that_was_killed_goes_on_where_it_was(unit: Unit) -> None:
    unit.note("give-back", "shown")
    unit.give_back()
    assert unit.calls("i2cset") == []
    unit.assert_instrument_is_given_back()


def test_it_does_nothing_while_the_updater_is_at_work(unit: Unit) -> None:
    unit.environment["ACTIVE"] = "active"
    process = subprocess.run([unit.folder / "give-back"], env=unit.environment, capture_output=True, check=True)
    assert b"the updater is at work" in process.stderr
    assert unit.calls() == []


@pytest.mark.parametrize("tool", ["apt", "apt-get", "dpkg"])
def test_package_tool_is_waited_for(unit: Unit, tool: str) -> None:
    unit.environment["ENDS"] = str(BEGIN + 3)
    said = unit.give_back(f"./{tool} 60 &", at_work=(tool,))
    assert "give-back: a package tool is still at work, waiting for it" in said
    assert unit.started() == 3 + READ


@pytest.mark.parametrize("before", [0, 1])
def test_package_tool_that_hangs_does_not_keep_the_instrument(unit: Unit, before: int) -> None:
    unit.change({"longest_wait=2100 ": "longest_wait=3 "})
    unit.note("give-back", before=before)
    said = unit.give_back("./dpkg 60 &", 'kill -0 $! && echo "it lives"', at_work=("dpkg",))
    assert "give-back: a package tool is still at work, going on beside it" in said
    assert "it lives" in said
    assert unit.calls("systemctl", "beside") == [START, "beside dpkg"]
    assert unit.started() == 3 - before + READ


# What was noted, for how long ssh lives (s), and how long it waits (s).
BOARD_AT_WORK = [
    (("began board-script",), 0, 4),  # its end could not be noted
    (("began board-script", "ended board-script 0"), 0, 4),
    (("began board-script",), 10, 14),
    (("began installation", "ended installation 0"), 0, 0),
    (("began board-script", "ended board-script 0", "sound pass"), 0, 0),  # the updater has waited
    (("began board-script", "ended board-script 0", "lit 0x13 0x2 0"), 0, 0),
]


@pytest.mark.parametrize(
    "notes, ssh, waited", BOARD_AT_WORK, ids=[f"{', '.join(notes)}-{ssh}" for notes, ssh, _ in BOARD_AT_WORK]
)
def test_board_is_waited_for(unit: Unit, notes: tuple[str, ...], ssh: int, waited: int) -> None:
    unit.change({"board_time=780 ": "board_time=4 "})
    unit.note(*notes)
    unit.environment["ENDS"] = str(BEGIN + ssh)
    (unit.folder / "late").write_text(f"{BEGIN + ssh}.00 ended board-script 0\n")
    said = unit.give_back("./ssh 60 &", at_work=("ssh",)) if ssh else unit.give_back()
    assert ("give-back: the board is still at work, waiting for it" in said) == (waited > 0)
    assert unit.started() == waited + READ


def test_byte_that_is_being_sent_is_waited_for(unit: Unit) -> None:
    unit.environment["ENDS"] = str(BEGIN + 3)
    (unit.folder / "late").write_text(f"{BEGIN + 3}.00 lit 0x13 0x2 0\n")
    said = unit.give_back("./i2cset 60 &", at_work=("i2cset",))
    assert said == "give-back: the panel is still at work, waiting for it\n"
    assert unit.started() == 3 + READ


def test_notes_that_cannot_be_written(unit: Unit) -> None:
    unit.environment["RESULT"] = "success"
    notes = 'notes=$(cat run/notes); mount -t tmpfs notes run; mkdir run/give-back; echo "$notes" >run/notes'
    unit.give_back(f"{notes}; mount -o remount,ro run")
    assert unit.calls("i2cset") == []


def test_upload_is_ended_and_the_board_script_is_not(unit: Unit) -> None:
    said = unit.give_back(
        "./scp 30 & upload=$!; ./ssh 30 & board=$!",
        "/usr/bin/sleep 0.1; kill -0 $board && echo board lives; wait $upload; echo upload $?",
        at_work=("scp", "ssh"),
    )
    assert "board lives" in said
    assert "upload 143" in said


@pytest.mark.parametrize("failures", [1, 4])
def test_busy_stick_is_tried_again(unit: Unit, failures: int) -> None:
    unit.note("lit 0x13 0x2 0", before=READ)
    (unit.folder / "busy").write_text("busy\n" * failures)
    assert unit.give_back() == ""
    assert len(unit.calls("umount")) == failures + 1
    assert unit.started() == failures
    unit.assert_instrument_is_given_back()


@pytest.mark.parametrize("status, attempts", [("32", 5), ("124", 1)])
def test_stick_that_stays_is_detached(unit: Unit, status: str, attempts: int) -> None:
    unit.note("lit 0x13 0x2 0", before=READ)
    (unit.folder / "stuck").touch()
    unit.environment["UMOUNT_STATUS"] = status
    assert unit.give_back() == "give-back: the stick is in use, detaching it\n"
    detached = "umount --lazy --no-canonicalize /root/USB_MOUNT"
    assert unit.calls("umount") == ["umount /root/USB_MOUNT"] * attempts + [detached]
    assert unit.started() == attempts - 1
    unit.assert_instrument_is_given_back()


def test_byte_that_is_lost_once(unit: Unit) -> None:
    (unit.folder / "lost").touch()
    assert "does not take" not in unit.give_back()
    assert unit.calls("i2cset")[1:3] == ["i2cset -y 0 0x07 0x10 c", "i2cset -y 0 0x07 0x0 c"]
    assert unit.started() == 1 + READ


@pytest.mark.parametrize("status, bytes_sent", [("1", 3), ("124", 1)], ids=["absent", "hanging"])
def test_absent_or_hanging_panel_does_not_keep_the_application(unit: Unit, status: str, bytes_sent: int) -> None:
    unit.environment["I2CSET_STATUS"] = status
    assert "give-back: the panel does not take the outcome" in unit.give_back()
    assert len(unit.calls("i2cset")) == bytes_sent
    assert unit.started() == bytes_sent - 1
    unit.assert_instrument_is_given_back()


def test_application_that_cannot_be_started_is_tried_again_by_the_manager(unit: Unit) -> None:
    (unit.folder / "no-systemctl").touch()
    assert "give-back: harl cannot be started" in unit.give_back(status=1)
    (unit.folder / "no-systemctl").unlink()
    unit.give_back()
    assert unit.calls("systemctl") == [START, START]


def test_its_tools_have_notes_of_their_own(unit: Unit) -> None:
    unit.give_back()
    assert (unit.folder / "run/give-back/note").exists()


@pytest.mark.parametrize(
    "cursor, option", [("", ""), ("s=1;i=2\n", " --after-cursor=s=1;i=2")], ids=["without-cursor", "with-cursor"]
)
def test_log_is_kept_where_a_power_cut_loses_the_journal(unit: Unit, cursor: str, option: str) -> None:
    ((name, text),) = unit.kept_logs(cursor).items()
    assert re.search(r"^\d{4}(-\d\d){2}_\d\d(-\d\d){2}\.log$", name)
    assert text == "first\nlast\n"
    read = f"journalctl --quiet --identifier=harl-updater{option}"
    assert unit.calls()[-3:] == [START, "journalctl --sync", read]


def test_log_is_left_to_a_journal_on_the_disk(unit: Unit) -> None:
    (unit.folder / "journals").mkdir()
    (unit.folder / "journals/system.journal").touch()
    assert unit.kept_logs() == {}
    assert unit.calls("journalctl") == ["journalctl --sync"]


def test_without_a_beginning_no_log_is_kept(unit: Unit) -> None:
    assert unit.kept_logs(cursor=None) == {}


def test_only_the_last_logs_are_kept_and_of_each_only_its_end(unit: Unit) -> None:
    (unit.folder / "journal").write_text("first\n" + "x" * 4_000_000)
    old = [f"2026-01-{day:02}_00-00-00.log" for day in range(1, 13)]
    for name in old:
        (unit.folder / "logs" / name).touch()
    kept = unit.kept_logs()
    assert sorted(kept)[:-1] == old[3:]
    assert kept[max(kept)] == "x" * 4_000_000


def test_times_make_the_four_hours() -> None:
    found = {}
    for name in ("harl-updater", "harl-updater-give-back"):
        text = (ROOT / f"service/{name}.service").read_text()
        for setting, minutes in re.findall(r"^(\w+)=(\d+)min$", text, re.MULTILINE):
            found[name, setting] = int(minutes)
    assert found == {
        ("harl-updater", "TimeoutStartSec"): 30,
        ("harl-updater", "RuntimeMaxSec"): 165,
        ("harl-updater-give-back", "TimeoutStartSec"): 45,
    }
    assert sum(found.values()) <= 240


def test_environment_of_both_units_is_the_same() -> None:
    paths = {
        re.findall(r"^Environment=(PATH=.*)$", (ROOT / f"service/{name}.service").read_text(), re.MULTILINE)[0]
        for name in ("harl-updater", "harl-updater-give-back")
    }
    assert len(paths) == 1
