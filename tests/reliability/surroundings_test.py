"""Runs the updater's executable on the stand-in unit while the environment misbehaves: signals, limits, and a standard
output that accepts nothing. Where the updater does not survive, the test states how it ends.
"""

import os
import signal
import subprocess
import threading
import time
from collections.abc import Callable, Iterator
from functools import partial
from pathlib import Path

import pytest

from bench import scenario
from bench.compare import differences
from bench.expected import COMMANDS, led_command
from bench.observation import Run
from bench.outcomes import CHECK_FAILED
from bench.panel import COLOR_CODES, LED_CODES
from bench.runner import Result, run_on, temporary_folder
from tests.reliability.disturbed import SPEED, DisturbedUnit

WHAT = scenario.load("package-and-board")
HELD = 'echo >"$UNIT/held"\nwhile [ -e "$UNIT/held" ]; do /bin/sleep 0.02; done\nreal "$@"'
GONE_READER = '/usr/bin/mkfifo "$UNIT/pipe"\n/usr/bin/head -c 4000 <"$UNIT/pipe" >/dev/null &\n'
PLAIN_USER = 60000 + os.getpid() % 5000  # an id without processes, and another in each run of this test
AS_PLAIN_USER = ["/usr/bin/setpriv", f"--reuid={PLAIN_USER}", f"--regid={PLAIN_USER}", "--clear-groups"]


class PlainUsersUnit(DisturbedUnit):
    """A unit whose files every user may change."""

    def _start_updater(self) -> None:
        for path in self._folder.rglob("*"):
            if not path.is_symlink():
                path.chmod(0o777)
        super()._start_updater()


Maker = Callable[..., DisturbedUnit]  # with the circumstances


@pytest.fixture
def folder() -> Iterator[Path]:
    with temporary_folder() as folder:
        yield folder


@pytest.fixture
def make(build: Path, folder: Path) -> Maker:
    """Makes the unit, with the package and the board to be updated."""
    return partial(DisturbedUnit, WHAT, folder, build)


@pytest.fixture
def make_plain_users(build: Path, folder: Path) -> Maker:
    """Makes a unit whose updater runs, through `runner`, as a user for whom limits count."""
    if os.geteuid() != 0:
        pytest.skip("needs root, to run as a user without other processes")
    folder.chmod(0o777)
    return lambda runner="": PlainUsersUnit(WHAT, folder, build, runner=" ".join([runner, *AS_PLAIN_USER]))


def run_updater(unit: DisturbedUnit) -> Result:
    """One run to its end."""
    return run_on(unit, lambda run, log: None, SPEED)


def assert_complete(result: Result, without: tuple[str, ...] = ()) -> None:
    """The update has its usual result; differences that begin like one of `without` do not count."""
    assert [line for line in differences(WHAT, result) if not line.startswith(without)] == []


def assert_no_wait_was_shortened(result: Result) -> None:
    """Every wait that ended took its full time."""
    for call in result.run.calls:
        if call.call == "nanosleep" and call.end is not None:
            assert call.end - call.start >= call.real


def test_storm_of_signals_changes_nothing(make: Maker) -> None:
    unit = make()
    over = threading.Event()

    def storm() -> None:
        while not over.wait(0.001):
            for number in (signal.SIGCHLD, signal.SIGWINCH, signal.SIGURG, signal.SIGCONT):
                unit.signal(number)

    thread = threading.Thread(target=storm)
    thread.start()
    try:
        result = run_updater(unit)
    finally:
        over.set()
        thread.join()
    assert_complete(result)
    assert_no_wait_was_shortened(result)


def test_stop_and_continue_in_every_wait_changes_nothing(make: Maker, folder: Path) -> None:
    unit = make(circumstances="export BENCH_SHORTEST_WAIT=1")  # long enough to be stopped in
    held = folder / "held"
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
        unit.change_tool(tool, HELD)
    result = run_on(unit, stop_in_new_call, SPEED)
    assert_complete(result)
    assert_no_wait_was_shortened(result)
    assert stopped == {call.start for call in [*result.run.commands(), *result.run.waits()]}


def test_closed_output_changes_nothing(make: Maker) -> None:
    assert_complete(run_updater(make(redirection=">&-")), without=("log:",))


def test_full_output_changes_nothing(make: Maker) -> None:
    assert_complete(run_updater(make(redirection=">/dev/full")), without=("log:",))


def test_broken_pipe_ends_an_updater_started_by_hand(make: Maker) -> None:
    result = run_updater(make(circumstances=GONE_READER, redirection='>"$UNIT/pipe"'))
    assert result.status == -signal.SIGPIPE
    assert result.state.harl == "inactive"


def test_broken_pipe_changes_nothing_where_its_signal_is_ignored(make: Maker) -> None:
    lines = GONE_READER + "trap '' PIPE"
    assert_complete(run_updater(make(circumstances=lines, redirection='>"$UNIT/pipe"')), without=("log:",))


def test_without_descriptors_no_output_can_be_read_and_the_check_fails(
    make: Maker, make_plain_users: Maker, folder: Path
) -> None:
    result = run_updater(make(circumstances="ulimit -n 4"))
    commands = [call.text for call in result.run.commands()]
    names = ["stop-harl", "refresh-mirrors", "read-package", "release-stick", "start-harl", "stop-updater"]
    assert commands == [COMMANDS[name] for name in names]
    assert result.status == 0
    last = [call.text for call in result.run.calls if call.text.startswith("i2cset")][-2:]
    assert last == [led_command(LED_CODES[led], COLOR_CODES["fail"]) for led in CHECK_FAILED.leds]


def test_without_processes_the_run_ends_with_no_further_command_done(make_plain_users: Maker, folder: Path) -> None:
    unit = make_plain_users()
    unit.change_tool("systemctl", HELD)
    held = folder / "held"

    def take_processes_away(run: Run, _log: str) -> None:
        if held.exists() and any(call.seconds == 1 for call in run.calls):  # both threads run
            updater = (folder / "unit.pid").read_text().strip()
            subprocess.run([*AS_PLAIN_USER, "/usr/bin/prlimit", f"--pid={updater}", "--nproc=1:1"], check=True)
            held.unlink()

    result = run_on(unit, take_processes_away, SPEED)
    assert result.status == 0
    assert "AFTER UPDATE" in result.run.log
    names = ["stop-harl", "refresh-mirrors", "read-package", "release-stick", "start-harl", "stop-updater"]
    assert [call.text for call in result.run.commands()] == [COMMANDS[name] for name in names]
    # popen(3) fails; system(3) returns what a shell without the tool would return.
    assert [call.status for call in result.run.commands()] == [0, -1, -1, *[127 * 256] * 3]
    assert result.state.package == "1.2.0"
    assert result.state.harl == "inactive"


def test_without_threads_the_updater_aborts_before_anything_is_changed(make_plain_users: Maker) -> None:
    result = run_updater(make_plain_users("/usr/bin/prlimit --nproc=1"))
    assert result.status == -signal.SIGABRT
    assert result.run.commands() == []


def test_little_memory_is_enough(make: Maker) -> None:
    assert_complete(run_updater(make(circumstances="ulimit -v 65536")))


def test_output_larger_than_memory_aborts_the_updater(make: Maker) -> None:
    unit = make(circumstances="ulimit -v 65536")
    unit.change_tool("apt", "/usr/bin/tr '\\0' x </dev/zero | /usr/bin/head -c 100000000\nreal \"$@\"")
    result = run_updater(unit)
    assert result.status == -signal.SIGABRT
    assert result.state.harl == "inactive"
