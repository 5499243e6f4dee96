"""Usage: surroundings_test.py BUILD_FOLDER [TEST...]

Runs the updater's executable on the stand-in unit while the environment misbehaves: signals, limits, and a standard
output that accepts nothing. Where the updater does not survive, the test states how it ends.
"""

import os
import signal
import subprocess
import threading
import time
import unittest
from pathlib import Path

from bench import scenario
from bench.compare import differences
from bench.expected import COMMANDS, led_command
from bench.observation import Run
from bench.outcomes import CHECK_FAILED
from bench.panel import COLOR_CODES, LED_CODES
from bench.runner import Result, run_on, temporary_folder
from tests.command_line import take_path
from tests.reliability.disturbed import SPEED, DisturbedUnit

BUILD = Path()
PLAIN_USER = 60000 + os.getpid() % 5000  # an id without processes, and another in each run of this test
AS_PLAIN_USER = ["/usr/bin/setpriv", f"--reuid={PLAIN_USER}", f"--regid={PLAIN_USER}", "--clear-groups"]


class PlainUsersUnit(DisturbedUnit):
    """A unit whose files every user may change."""

    def _start_updater(self) -> None:
        for path in self._folder.rglob("*"):
            if not path.is_symlink():
                path.chmod(0o777)
        super()._start_updater()


class SurroundingsTest(unittest.TestCase):
    """One run of the updater each."""

    def setUp(self) -> None:
        self.what = scenario.load("package-and-board")
        context = temporary_folder()
        self.folder = context.__enter__()
        self.addCleanup(context.__exit__, None, None, None)

    def run_updater(self, unit: DisturbedUnit) -> Result:
        """One run to its end."""
        return run_on(unit, lambda run, log: None, SPEED)

    HELD = 'echo >"$UNIT/held"\nwhile [ -e "$UNIT/held" ]; do /bin/sleep 0.02; done\nreal "$@"'

    def unit(self, **circumstances: str) -> DisturbedUnit:
        """A unit with the package and the board to be updated."""
        return DisturbedUnit(self.what, self.folder, BUILD, **circumstances)

    def assert_complete(self, result: Result, without: tuple[str, ...] = ()) -> None:
        """The update has its usual result; differences that begin like one of `without` do not count."""
        self.assertEqual([line for line in differences(self.what, result) if not line.startswith(without)], [])

    # Signals

    def test_storm_of_signals_changes_nothing(self) -> None:
        unit = self.unit()
        over = threading.Event()

        def storm() -> None:
            while not over.wait(0.001):
                for number in (signal.SIGCHLD, signal.SIGWINCH, signal.SIGURG, signal.SIGCONT):
                    unit.signal(number)

        thread = threading.Thread(target=storm)
        thread.start()
        try:
            result = self.run_updater(unit)
        finally:
            over.set()
            thread.join()
        self.assert_complete(result)
        self.assert_no_wait_was_shortened(result)

    def test_stop_and_continue_in_every_wait_changes_nothing(self) -> None:
        unit = self.unit(circumstances="export BENCH_SHORTEST_WAIT=1")  # long enough to be stopped in
        held = self.folder / "held"
        stopped: set[float] = set()

        def stop_in_new_call(run: Run, _log: str) -> None:
            is_held = held.exists()
            run.update()  # with the start of the command that is held
            for call in [*run.commands(), *run.waits()]:
                if call.end is None and call.start not in stopped and (is_held or call.call == "nanosleep"):
                    stopped.add(call.start)
                    unit.signal(signal.SIGSTOP)
                    time.sleep(0.1)
                    unit.signal(signal.SIGCONT)
            if is_held:
                held.unlink()

        # Holds every tool until the updater has been stopped and continued in its command.
        for tool in ("systemctl", "apt", "apt-cache", "ssh", "ls", "scp", "rm", "umount"):
            unit.change_tool(tool, self.HELD)
        result = run_on(unit, stop_in_new_call, SPEED)
        self.assert_complete(result)
        self.assert_no_wait_was_shortened(result)
        self.assertEqual(stopped, {call.start for call in [*result.run.commands(), *result.run.waits()]})

    def assert_no_wait_was_shortened(self, result: Result) -> None:
        """Every wait that ended took its full time."""
        for call in result.run.calls:
            if call.call == "nanosleep" and call.end is not None:
                self.assertGreaterEqual(call.end - call.start, call.real)

    # Standard output

    def test_closed_output_changes_nothing(self) -> None:
        self.assert_complete(self.run_updater(self.unit(redirection=">&-")), without=("log:",))

    def test_full_output_changes_nothing(self) -> None:
        self.assert_complete(self.run_updater(self.unit(redirection=">/dev/full")), without=("log:",))

    GONE_READER = '/usr/bin/mkfifo "$UNIT/pipe"\n/usr/bin/head -c 4000 <"$UNIT/pipe" >/dev/null &\n'

    def test_broken_pipe_ends_an_updater_started_by_hand(self) -> None:
        result = self.run_updater(self.unit(circumstances=self.GONE_READER, redirection='>"$UNIT/pipe"'))
        self.assertEqual(result.status, -signal.SIGPIPE)
        self.assertEqual(result.state.harl, "inactive")

    def test_broken_pipe_changes_nothing_where_its_signal_is_ignored(self) -> None:
        lines = self.GONE_READER + "trap '' PIPE"
        self.assert_complete(
            self.run_updater(self.unit(circumstances=lines, redirection='>"$UNIT/pipe"')), without=("log:",)
        )

    # Limits

    def test_without_descriptors_no_output_can_be_read_and_the_check_fails(self) -> None:
        result = self.run_updater(self.unit(circumstances="ulimit -n 4"))
        commands = [call.text for call in result.run.commands()]
        names = ["stop-harl", "refresh-mirrors", "read-package", "release-stick", "start-harl", "stop-updater"]
        self.assertEqual(commands, [COMMANDS[name] for name in names])
        self.assertEqual(result.status, 0)
        last = [call.text for call in result.run.calls if call.text.startswith("i2cset")][-2:]
        self.assertEqual(last, [led_command(LED_CODES[led], COLOR_CODES["fail"]) for led in CHECK_FAILED.leds])

    def plain_users_unit(self, runner: str = "") -> DisturbedUnit:
        """A unit whose updater runs, through `runner`, as a user for whom limits count."""
        if os.geteuid() != 0:
            self.skipTest("needs root, to run as a user without other processes")
        self.folder.chmod(0o777)
        return PlainUsersUnit(self.what, self.folder, BUILD, runner=" ".join([runner, *AS_PLAIN_USER]))

    def test_without_processes_the_run_ends_with_no_further_command_done(self) -> None:
        unit = self.plain_users_unit()
        unit.change_tool("systemctl", self.HELD)
        held = self.folder / "held"

        def take_processes_away(run: Run, _log: str) -> None:
            if held.exists() and any(call.seconds == 1 for call in run.calls):  # both threads run
                updater = (self.folder / "unit.pid").read_text().strip()
                subprocess.run([*AS_PLAIN_USER, "/usr/bin/prlimit", f"--pid={updater}", "--nproc=1:1"], check=True)
                held.unlink()

        result = run_on(unit, take_processes_away, SPEED)
        self.assertEqual(result.status, 0)
        self.assertIn("AFTER UPDATE", result.run.log)
        names = ["stop-harl", "refresh-mirrors", "read-package", "release-stick", "start-harl", "stop-updater"]
        self.assertEqual([call.text for call in result.run.commands()], [COMMANDS[name] for name in names])
        # popen(3) fails; system(3) returns what a shell without the tool would return.
        self.assertEqual([call.status for call in result.run.commands()], [0, -1, -1, *[127 * 256] * 3])
        self.assertEqual(result.state.package, "1.2.0")
        self.assertEqual(result.state.harl, "inactive")

    def test_without_threads_the_updater_aborts_before_anything_is_changed(self) -> None:
        result = self.run_updater(self.plain_users_unit("/usr/bin/prlimit --nproc=1"))
        self.assertEqual(result.status, -signal.SIGABRT)
        self.assertEqual(result.run.commands(), [])

    def test_little_memory_is_enough(self) -> None:
        self.assert_complete(self.run_updater(self.unit(circumstances="ulimit -v 65536")))

    def test_output_larger_than_memory_aborts_the_updater(self) -> None:
        unit = self.unit(circumstances="ulimit -v 65536")
        unit.change_tool("apt", "/usr/bin/tr '\\0' x </dev/zero | /usr/bin/head -c 100000000\nreal \"$@\"")
        result = self.run_updater(unit)
        self.assertEqual(result.status, -signal.SIGABRT)
        self.assertEqual(result.state.harl, "inactive")


if __name__ == "__main__":
    BUILD = take_path()
    unittest.main()
