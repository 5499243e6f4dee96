"""What runs after the service has ended, on stand-in tools; it looks for processes, in a namespace of its own here."""

import re
import shutil
import subprocess
import tempfile
import unittest
from pathlib import Path

from bench.makers.files import write_script
from bench.outcomes import ENDED_EARLY
from bench.panel import COLOR_CODES, LED_CODES, Panel
from tests.command_line import skip

ROOT = Path(__file__).parents[2]


NAMESPACES = ["unshare", "--map-root-user", "--mount", "--pid", "--fork", "--kill-child", "--mount-proc"]
GIVE_BACK = ROOT / "service/give-back"
START = "systemctl --no-block start harl"
TOOLS = {
    "systemctl": 'for tool in apt dpkg; do ! pgrep -x $tool >/dev/null || echo "beside $tool" >>"$UNIT/calls"; done',
    "i2cset": '[ -z "$I2CSET_STATUS" ] || exit "$I2CSET_STATUS"',
    "umount": '[ ! -e "$UNIT/busy" ] || { rm "$UNIT/busy"; exit 32; }; [ -e "$UNIT/stuck" ] || rm "$UNIT/mounted"',
    "mountpoint": '[ -e "$UNIT/mounted" ]',
    "sleep": "exec /usr/bin/sleep 0.05",
}


class GiveBack(unittest.TestCase):
    """A unit whose updater has just ended, with the stick still in use."""

    def setUp(self) -> None:
        folder = tempfile.TemporaryDirectory(prefix="give-back-")
        self.addCleanup(folder.cleanup)
        self.unit = Path(folder.name)
        (self.unit / "bin").mkdir()
        (self.unit / "run").mkdir()
        (self.unit / "mounted").touch()
        self.environment = {
            "PATH": f"{self.unit}/bin:/usr/bin:/bin",
            "UNIT": str(self.unit),
            "I2CSET_STATUS": "0",
            "RUNTIME_DIRECTORY": str(self.unit / "run"),
            "SERVICE_RESULT": "success",
            "EXIT_CODE": "killed",
            "EXIT_STATUS": "TERM",
        }
        for name, text in TOOLS.items():
            log = '[ "${0##*/}" = sleep ] || [ "${0##*/}" = mountpoint ] || echo "${0##*/} $*" >>"$UNIT/calls"'
            write_script(self.unit / "bin" / name, f"{log}\n{text}")
        # Copies of sleep(1) under the names of what the updater may leave at work.
        for name in ("apt", "dpkg", "scp", "ssh"):
            shutil.copy("/usr/bin/sleep", self.unit / name)
        shutil.copy(GIVE_BACK, self.unit / "give-back")

    def give_back(self, beside: str = ":", after: str = ":", at_work: tuple[str, ...] = ()) -> str:
        """Runs it once what the shell line `beside` starts is `at_work`, and `after` next; what it says."""
        waits = "".join(f"until pgrep -x {name} >/dev/null; do /usr/bin/sleep 0.01; done\n" for name in at_work)
        line = f'cd "$UNIT"\n{beside}\n{waits}./give-back\n{after}'
        command = [*NAMESPACES, "sh", "-c", line]
        done = subprocess.run(
            command, env=self.environment, capture_output=True, text=True, check=False, timeout=60
        )
        self.assertEqual(done.stderr, "")
        return done.stdout

    def calls(self, *tools: str) -> list[str]:
        """The calls of the named tools, or of all."""
        path = self.unit / "calls"
        lines = path.read_text().splitlines() if path.exists() else []
        return [line for line in lines if not tools or line.split()[0] in tools]

    def panel(self) -> dict[str, str]:
        """The LEDs that are lit after what was sent, had they flashed blue before."""
        panel = Panel()
        sent = [int(line.split()[4], 16) for line in self.calls("i2cset")]
        for byte in (LED_CODES["REMOTE"], COLOR_CODES["blue"], *sent):
            panel.send(byte, 0)
        self.assertEqual(panel.faults, [])
        return panel.pattern(0)

    def test_after_a_normal_end_nothing_is_left_to_do(self) -> None:
        (self.unit / "run/outcome").touch()
        (self.unit / "mounted").unlink()
        self.assertEqual(self.give_back(), "")
        self.assertEqual(self.calls(), [START])

    def test_end_before_the_outcome_shows_the_failure(self) -> None:
        said = self.give_back()
        self.assertIn("ended (success killed TERM) before it showed an outcome", said)
        self.assertEqual(self.panel(), ENDED_EARLY.panel)
        self.assertEqual(self.calls("umount", "systemctl"), ["umount /root/USB_MOUNT", START])
        # The operator sees the failure even if what follows should hang.
        self.assertEqual(self.calls()[-2:], ["umount /root/USB_MOUNT", START])

    def test_end_after_the_outcome_leaves_the_panel_alone(self) -> None:
        (self.unit / "run/outcome").touch()
        self.give_back()
        self.assertEqual(self.calls(), ["umount /root/USB_MOUNT", START])

    def test_outcome_whose_last_byte_is_still_under_way_is_left_alone(self) -> None:
        write_script(self.unit / "bin/sleep", ': >"$RUNTIME_DIRECTORY/outcome"')
        self.assertEqual(self.give_back(), "")
        self.assertEqual(self.calls("i2cset"), [])

    def test_package_tools_are_waited_for(self) -> None:
        for tool in ("apt", "dpkg"):
            said = self.give_back(f"./{tool} 2 &", at_work=(tool,))
            self.assertIn("still at work", said)
            self.assertEqual(self.calls()[-1], START)
            (self.unit / "calls").unlink()

    def test_package_tool_that_hangs_does_not_keep_the_instrument(self) -> None:
        text = GIVE_BACK.read_text()
        (self.unit / "give-back").write_text(text.replace("package_tools_wait=1800", "package_tools_wait=3"))
        self.assertNotEqual((self.unit / "give-back").read_text(), text)
        said = self.give_back("./dpkg 30 &", 'kill -0 $! && echo "it lives"', at_work=("dpkg",))
        self.assertIn("going on beside it", said)
        self.assertIn("it lives", said)
        self.assertEqual(self.calls()[-2:], [START, "beside dpkg"])

    def test_upload_is_ended_and_the_board_script_is_not(self) -> None:
        said = self.give_back(
            "./scp 30 & upload=$!; ./ssh 30 & board=$!",
            "/usr/bin/sleep 0.1; kill -0 $board && echo board lives; wait $upload; echo upload $?",
            at_work=("scp", "ssh"),
        )
        self.assertIn("board lives", said)
        self.assertIn("upload 143", said)

    def test_busy_stick_is_tried_again(self) -> None:
        (self.unit / "busy").touch()
        self.give_back()
        self.assertEqual(len(self.calls("umount")), 2)
        self.assertFalse((self.unit / "mounted").exists())

    def test_stick_that_stays_does_not_keep_the_application(self) -> None:
        (self.unit / "stuck").touch()
        self.assertIn("the stick stays mounted", self.give_back())
        self.assertEqual(self.calls()[-1], START)

    def test_absent_panel_does_not_keep_the_application(self) -> None:
        self.environment["I2CSET_STATUS"] = "1"
        self.give_back()
        self.assertEqual(self.calls("umount", "systemctl"), ["umount /root/USB_MOUNT", START])

    def test_hanging_panel_does_not_keep_the_application(self) -> None:
        text = GIVE_BACK.read_text()
        (self.unit / "give-back").write_text(text.replace("panel_wait=10 ", "panel_wait=1 "))
        self.assertNotEqual((self.unit / "give-back").read_text(), text)
        with (self.unit / "bin/i2cset").open("a") as tool:
            tool.write("exec /usr/bin/sleep 100\n")
        self.environment["I2CSET_STATUS"] = ""
        self.give_back()
        self.assertEqual(len(self.calls("i2cset")), 1)
        self.assertEqual(self.calls("umount", "systemctl"), ["umount /root/USB_MOUNT", START])

    def test_service_manager_that_tells_nothing(self) -> None:
        for name in ("RUNTIME_DIRECTORY", "SERVICE_RESULT", "EXIT_CODE", "EXIT_STATUS"):
            del self.environment[name]
        self.give_back()
        self.assertEqual(self.panel(), ENDED_EARLY.panel)
        self.assertEqual(self.calls()[-1], START)

    def test_unit_file_names_the_runtime_directory_for_an_old_service_manager(self) -> None:
        text = (ROOT / "service/harl-updater.service").read_text()
        folder = re.findall(r"^RuntimeDirectory=(\S+)$", text, re.MULTILINE)
        self.assertEqual(re.findall(r"^Environment=RUNTIME_DIRECTORY=/run/(\S+)$", text, re.MULTILINE), folder)
        self.assertEqual(len(folder), 1)


if __name__ == "__main__":
    probe = subprocess.run([*NAMESPACES, "true"], capture_output=True, text=True, check=False)
    if probe.returncode != 0:
        skip(f"this machine allows no process namespace: {probe.stderr.strip()}")
    unittest.main()
