"""give-back, which runs after the service has ended, on stand-in tools; in its own process namespace here."""

import re
import shutil
import subprocess
import unittest

from bench.outcomes import CHECK_FAILED, ENDED_EARLY, UP_TO_DATE, UPDATED
from bench.panel import COLOR_CODES, FIRST_LED, LAST_LED, Panel
from tests.command_line import skip
from tests.service.stand_in import ROOT, StandInTest

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


class GiveBack(StandInTest):
    """A unit whose updater has just ended, with the stick still in use."""

    program = "give-back"
    tools = TOOLS
    changes = CHANGES

    def setUp(self) -> None:
        super().setUp()
        (self.unit / "mounts").write_text(MOUNT)
        (self.unit / "run/notes").write_text("1.00 prepared\n")
        (self.unit / "journal").write_text("first\nlast\n")
        (self.unit / "logs").mkdir()
        (self.unit / "uptime").write_text(f"{BEGIN}.50 0.00\n")
        self.environment |= {"ACTIVE": "deactivating", "RESULT": "signal", "I2CSET_STATUS": "0", "UMOUNT_STATUS": "32"}
        self.environment["ENDS"] = "never"
        # Copies of sleep(1) under the names of the programs that the updater may leave running.
        for name in ("apt", "apt-get", "dpkg", "i2cset", "scp", "ssh"):
            shutil.copy("/usr/bin/sleep", self.unit / name)

    def note(self, *notes: str, before: int = 0) -> None:
        """Writes notes of the run, made just now, or this many seconds before."""
        with (self.unit / "run/notes").open("a") as file:
            file.writelines(f"{BEGIN - before}.00 {note}\n" for note in notes)

    def started(self, what: str = "started") -> int:
        """When the application was started (s since the beginning), or the stick released."""
        return int(float((self.unit / what).read_text().split()[0])) - BEGIN

    def give_back(self, beside: str = ":", after: str = ":", at_work: tuple[str, ...] = (), status: int = 0) -> str:
        """Runs it once the processes of the shell line `beside` are `at_work`, then `after`; returns its output."""
        waits = "".join(f"until pgrep -x {name} >/dev/null; do /usr/bin/sleep 0.01; done\n" for name in at_work)
        line = f'cd "$UNIT"\n{beside}\n{waits}./give-back; status=$?\n{after}\nexit $status'
        command = [*NAMESPACES, "sh", "-c", line]
        self.environment["AT_WORK"] = " ".join(at_work)
        done = subprocess.run(command, env=self.environment, capture_output=True, text=True, check=False, timeout=60)
        self.assertEqual((done.stderr, done.returncode), ("", status))
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
        self.assertEqual(len(panel.faults), 1 if half_sent else 0)
        return panel.pattern(0)

    def assert_instrument_is_given_back(self) -> None:
        """The stick is released and the application started, in this order."""
        self.assertEqual((self.unit / "mounts").read_text(), "")
        last = self.calls("umount", "systemctl")
        self.assertEqual((last[0], last[-1]), ("umount /root/USB_MOUNT", START))

    def test_after_a_normal_end_nothing_is_left_to_do(self) -> None:
        self.note("lit 0x13 0x2 0")
        (self.unit / "mounts").write_text("")
        self.assertEqual(self.give_back(), "")
        self.assertEqual(self.calls(), [START, "journalctl --sync"])

    def test_end_before_the_outcome_shows_the_failure(self) -> None:
        said = self.give_back()
        ended = "Result=signal ExecMainCode=2 ExecMainStatus=15"
        self.assertIn(f"give-back: the updater ended ({ended}) before it had an outcome: showing the failure", said)
        self.assertEqual(self.panel(), ENDED_EARLY.panel)
        self.assertEqual(self.panel(half_sent=True), ENDED_EARLY.panel)
        self.assertEqual(self.calls("i2cset", "umount")[-1], "umount /root/USB_MOUNT")  # the outcome comes first
        self.assertEqual(self.started("released"), 0)
        self.assert_instrument_is_given_back()

    def test_end_after_the_outcome_leaves_the_panel_alone(self) -> None:
        cases: list[list[str]] = [["lit 0x14 0x8 0"], ["lit 0x12 0x2 0", "lit 0x15 0x2 0"]]
        for notes in cases:
            self.note(*notes)
            self.assertEqual(self.give_back(), "")
            self.assertEqual(self.calls("i2cset"), [])
            self.setUp()

    def test_outcome_that_was_not_shown_is_shown_again(self) -> None:
        for outcome, notes in (
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
        ):
            with self.subTest(notes=notes):
                self.note(*notes)
                said = self.give_back()
                self.assertIn("give-back: the outcome was not shown, or not all of it: showing it", said)
                self.assertEqual(self.panel(), outcome.panel)
            self.setUp()

    def test_outcome_stays_readable_before_the_application_starts(self) -> None:
        self.give_back()
        self.assertEqual(self.started(), READ)
        for before, left in ((0, READ), (9, READ - 9), (40, 0)):
            self.setUp()
            self.note("lit 0x13 0x2 0", before=before)
            self.give_back()
            self.assertEqual(self.started(), left)

    def test_without_notes_the_end_of_the_service_decides(self) -> None:
        for result, panel in (("success", {}), ("signal", ENDED_EARLY.panel)):
            (self.unit / "run/notes").unlink()
            self.environment["RESULT"] = result
            self.give_back()
            self.assertEqual({led: color for led, color in self.panel().items() if color != "blue"}, panel)
            self.setUp()

    def test_good_end_of_the_service_is_no_outcome(self) -> None:
        self.environment["RESULT"] = "success"
        self.give_back()
        self.assertEqual(self.panel(), ENDED_EARLY.panel)

    def test_second_time_does_nothing(self) -> None:
        self.give_back()
        calls = len(self.calls())
        self.assertEqual(self.give_back(), "")
        self.assertEqual(len(self.calls()), calls)

    def test_one_that_was_killed_goes_on_where_it_was(self) -> None:
        self.note("give-back", "shown")
        self.give_back()
        self.assertEqual(self.calls("i2cset"), [])
        self.assert_instrument_is_given_back()

    def test_it_does_nothing_while_the_updater_is_at_work(self) -> None:
        self.environment["ACTIVE"] = "active"
        process = subprocess.run([self.unit / "give-back"], env=self.environment, capture_output=True, check=True)
        self.assertIn(b"the updater is at work", process.stderr)
        self.assertEqual(self.calls(), [])

    def test_package_tools_are_waited_for(self) -> None:
        for tool in ("apt", "apt-get", "dpkg"):
            self.environment["ENDS"] = str(BEGIN + 3)
            said = self.give_back(f"./{tool} 60 &", at_work=(tool,))
            self.assertIn("give-back: a package tool is still at work, waiting for it", said)
            self.assertEqual(self.started(), 3 + READ)
            self.setUp()

    def test_package_tool_that_hangs_does_not_keep_the_instrument(self) -> None:
        self.change({"longest_wait=2100 ": "longest_wait=3 "})
        for before in (0, 1):
            self.note("give-back", before=before)
            said = self.give_back("./dpkg 60 &", 'kill -0 $! && echo "it lives"', at_work=("dpkg",))
            self.assertIn("give-back: a package tool is still at work, going on beside it", said)
            self.assertIn("it lives", said)
            self.assertEqual(self.calls("systemctl", "beside"), [START, "beside dpkg"])
            self.assertEqual(self.started(), 3 - before + READ)
            self.setUp()
            self.change({"longest_wait=2100 ": "longest_wait=3 "})

    def test_board_is_waited_for(self) -> None:
        for notes, ssh, waited in (
            (("began board-script",), 0, 4),  # its end could not be noted
            (("began board-script", "ended board-script 0"), 0, 4),
            (("began board-script",), 10, 14),
            (("began installation", "ended installation 0"), 0, 0),
            (("began board-script", "ended board-script 0", "sound pass"), 0, 0),  # the updater has waited
            (("began board-script", "ended board-script 0", "lit 0x13 0x2 0"), 0, 0),
        ):
            with self.subTest(notes=notes, ssh=ssh):
                self.change({"board_time=780 ": "board_time=4 "})
                self.note(*notes)
                self.environment["ENDS"] = str(BEGIN + ssh)
                (self.unit / "late").write_text(f"{BEGIN + ssh}.00 ended board-script 0\n")
                said = self.give_back("./ssh 60 &", at_work=("ssh",)) if ssh else self.give_back()
                self.assertEqual("give-back: the board is still at work, waiting for it" in said, waited > 0)
                self.assertEqual(self.started(), waited + READ)
            self.setUp()

    def test_byte_that_is_being_sent_is_waited_for(self) -> None:
        self.environment["ENDS"] = str(BEGIN + 3)
        (self.unit / "late").write_text(f"{BEGIN + 3}.00 lit 0x13 0x2 0\n")
        said = self.give_back("./i2cset 60 &", at_work=("i2cset",))
        self.assertEqual(said, "give-back: the panel is still at work, waiting for it\n")
        self.assertEqual(self.started(), 3 + READ)

    def test_notes_that_cannot_be_written(self) -> None:
        self.environment["RESULT"] = "success"
        notes = 'notes=$(cat run/notes); mount -t tmpfs notes run; mkdir run/give-back; echo "$notes" >run/notes'
        self.give_back(f"{notes}; mount -o remount,ro run")
        self.assertEqual(self.calls("i2cset"), [])

    def test_upload_is_ended_and_the_board_script_is_not(self) -> None:
        said = self.give_back(
            "./scp 30 & upload=$!; ./ssh 30 & board=$!",
            "/usr/bin/sleep 0.1; kill -0 $board && echo board lives; wait $upload; echo upload $?",
            at_work=("scp", "ssh"),
        )
        self.assertIn("board lives", said)
        self.assertIn("upload 143", said)

    def test_busy_stick_is_tried_again(self) -> None:
        for failures in (1, 4):
            self.note("lit 0x13 0x2 0", before=READ)
            (self.unit / "busy").write_text("busy\n" * failures)
            self.assertEqual(self.give_back(), "")
            self.assertEqual(len(self.calls("umount")), failures + 1)
            self.assertEqual(self.started(), failures)
            self.assert_instrument_is_given_back()
            self.setUp()

    def test_stick_that_stays_is_detached(self) -> None:
        for status, attempts in (("32", 5), ("124", 1)):
            self.note("lit 0x13 0x2 0", before=READ)
            (self.unit / "stuck").touch()
            self.environment["UMOUNT_STATUS"] = status
            self.assertEqual(self.give_back(), "give-back: the stick is in use, detaching it\n")
            detached = "umount --lazy --no-canonicalize /root/USB_MOUNT"
            self.assertEqual(self.calls("umount"), ["umount /root/USB_MOUNT"] * attempts + [detached])
            self.assertEqual(self.started(), attempts - 1)
            self.assert_instrument_is_given_back()
            self.setUp()

    def test_byte_that_is_lost_once(self) -> None:
        (self.unit / "lost").touch()
        self.assertNotIn("does not take", self.give_back())
        self.assertEqual(self.calls("i2cset")[1:3], ["i2cset -y 0 0x07 0x10 c", "i2cset -y 0 0x07 0x0 c"])
        self.assertEqual(self.started(), 1 + READ)

    def test_absent_or_hanging_panel_does_not_keep_the_application(self) -> None:
        for status, bytes_sent in (("1", 3), ("124", 1)):
            self.environment["I2CSET_STATUS"] = status
            self.assertIn("give-back: the panel does not take the outcome", self.give_back())
            self.assertEqual(len(self.calls("i2cset")), bytes_sent)
            self.assertEqual(self.started(), bytes_sent - 1)
            self.assert_instrument_is_given_back()
            self.setUp()

    def test_application_that_cannot_be_started_is_tried_again_by_the_manager(self) -> None:
        (self.unit / "no-systemctl").touch()
        self.assertIn("give-back: harl cannot be started", self.give_back(status=1))
        (self.unit / "no-systemctl").unlink()
        self.give_back()
        self.assertEqual(self.calls("systemctl"), [START, START])

    def test_its_tools_have_notes_of_their_own(self) -> None:
        self.give_back()
        self.assertTrue((self.unit / "run/give-back/note").exists())

    def kept_logs(self, cursor: str | None = "") -> dict[str, str]:
        """Runs it after a run that began behind `cursor`; returns the kept logs."""
        if cursor is not None:
            (self.unit / "run/cursor").write_text(cursor)
        self.give_back()
        return {path.name: path.read_text() for path in (self.unit / "logs").iterdir()}

    def test_log_is_kept_where_a_power_cut_loses_the_journal(self) -> None:
        for cursor, option in (("", ""), ("s=1;i=2\n", " --after-cursor=s=1;i=2")):
            ((name, text),) = self.kept_logs(cursor).items()
            self.assertRegex(name, r"^\d{4}(-\d\d){2}_\d\d(-\d\d){2}\.log$")
            self.assertEqual(text, "first\nlast\n")
            read = f"journalctl --quiet --identifier=harl-updater{option}"
            self.assertEqual(self.calls()[-3:], [START, "journalctl --sync", read])
            self.setUp()

    def test_log_is_left_to_a_journal_on_the_disk(self) -> None:
        (self.unit / "journals").mkdir()
        (self.unit / "journals/system.journal").touch()
        self.assertEqual(self.kept_logs(), {})
        self.assertEqual(self.calls("journalctl"), ["journalctl --sync"])

    def test_without_a_beginning_no_log_is_kept(self) -> None:
        self.assertEqual(self.kept_logs(cursor=None), {})

    def test_only_the_last_logs_are_kept_and_of_each_only_its_end(self) -> None:
        (self.unit / "journal").write_text("first\n" + "x" * 4_000_000)
        old = [f"2026-01-{day:02}_00-00-00.log" for day in range(1, 13)]
        for name in old:
            (self.unit / "logs" / name).touch()
        kept = self.kept_logs()
        self.assertEqual(sorted(kept)[:-1], old[3:])
        self.assertEqual(kept[max(kept)], "x" * 4_000_000)


class Units(unittest.TestCase):
    """Values on which the unit files and the programs must agree."""

    def test_times_make_the_four_hours(self) -> None:
        found = {}
        for name in ("harl-updater", "harl-updater-give-back"):
            text = (ROOT / f"service/{name}.service").read_text()
            for setting, minutes in re.findall(r"^(\w+)=(\d+)min$", text, re.MULTILINE):
                found[name, setting] = int(minutes)
        self.assertEqual(
            found,
            {
                ("harl-updater", "TimeoutStartSec"): 30,
                ("harl-updater", "RuntimeMaxSec"): 165,
                ("harl-updater-give-back", "TimeoutStartSec"): 45,
            },
        )
        self.assertLessEqual(sum(found.values()), 240)

    def test_environment_of_both_units_is_the_same(self) -> None:
        paths = {
            re.findall(r"^Environment=(PATH=.*)$", (ROOT / f"service/{name}.service").read_text(), re.MULTILINE)[0]
            for name in ("harl-updater", "harl-updater-give-back")
        }
        self.assertEqual(len(paths), 1)


if __name__ == "__main__":
    probe = subprocess.run([*NAMESPACES, "true"], capture_output=True, text=True, check=False)
    if probe.returncode != 0:
        skip(f"this machine allows no process namespace: {probe.stderr.strip()}")
    unittest.main()
