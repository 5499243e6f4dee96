"""Usage: tests/reliability/interruption_real [COMMAND...]

Kills the updater, or everything that runs on the head, at each command of an update of package and board in turn, right
before the command and right after it, on the bench unit with the real tools. Then the updater runs again on the unit
as it was left. That run must end as a first run on a unit with that package, board, marker and stick does, and dpkg
--audit must report nothing except where AUDITED expects it. Prints a line for each interruption, and fails at any
difference. COMMAND is one of the names in the lines.
"""

import contextlib
import os
import subprocess
import sys
from pathlib import Path

from bench.build import BUILD, build
from bench.makers.files import write_script
from bench.real.files import search_path
from bench.real.unit import RealUnit, forbidden
from bench.scenario import Scenario
from bench.unit import UnitError
from tests.reliability import interruption
from tests.reliability.disturbed import SPEED
from tests.reliability.interruption import HEADER, Aftermath, Interruption, interrupt_all, interruptions

AT_ONCE = 3

# The updater's own commands, then those of apt in the middle of the installation.
POINTS = interruption.POINTS | {"unpack": ("dpkg", "*--unpack*"), "configure": ("dpkg", "*--configure*")}
# Everything on the head has this root; the board and the bench have others.
KILLS = {
    "updater": 'read -r updater </run/unit.pid; kill -s KILL "$updater"',
    # The updater first: it must not continue once its command is gone.
    "unit": """read -r updater </run/unit.pid
kill -s KILL "$updater"
for process in /proc/[0-9]*; do
    [ "$(/usr/bin/readlink "$process/root")" = / ] && [ "${process#/proc/}" != $$ ] && kill -s KILL "${process#/proc/}"
done
kill -s KILL $$""",
}
# The package is unpacked but not configured. The next run finds its version installed and leaves it so.
AUDITED = {("unit", "unpack", "after"), ("unit", "configure", "before")}


class InterruptedReal(RealUnit):
    """A real unit that kills itself once, and on which the updater can run again."""

    def __init__(self, what: Scenario, folder: Path, planned: Interruption | None) -> None:
        super().__init__(what, folder, SPEED, BUILD, "the updater is killed and started again by the test")
        self._interruption = planned
        self._started = False

    def start(self) -> None:
        """Makes the unit the first time, and starts the updater."""
        if not self._started:
            self._started = True
            super().start()
            return
        self.update()

    def ended(self) -> int | None:
        """None while anything runs on the head, or on the board besides its server, then the updater's status."""
        status = super().ended()
        return None if status is None or self._running("head") > 0 or self._running("board") > 1 else status

    def close(self) -> None:
        """Keeps the unit for the next run."""

    def end(self) -> None:
        """Ends the unit."""
        super().close()

    def audit(self) -> str:
        """What dpkg finds wrong with the head's packages."""
        database = self._root() / "head/var/lib/dpkg"
        command = ["dpkg", f"--admindir={database}", "--audit"]
        return subprocess.run(command, capture_output=True, text=True, check=True).stdout

    def _running(self, root: str) -> int:
        """How many processes have `root`."""
        count = 0
        for process in Path("/proc").glob("[0-9]*"):
            with contextlib.suppress(OSError):  # has ended, or is somebody else's
                count += os.readlink(process / "root") == f"{self._folder}/unit/{root}"
        return count

    def _add_programs(self) -> str:
        command = super()._add_programs()
        if self._interruption is None:
            return command
        tools = self._folder / "head/opt/bench/interrupting"
        tools.mkdir()
        (tools / "armed").touch()
        tool, arguments = POINTS[self._interruption.point]
        kill = KILLS[self._interruption.killed]
        before, after = (kill, "") if self._interruption.moment == "before" else ("", kill)
        write_script(tools / tool, f"""
PATH={search_path(self._setup)}
case "$*" in
{arguments}) rm /opt/bench/interrupting/armed 2>/dev/null || exec {tool} "$@" ;;
*) exec {tool} "$@" ;;
esac
{before}
{tool} "$@"
status=$?
{after}
exit "$status"
""")
        if tool == "dpkg":
            configuration = self._folder / "head/etc/apt/apt.conf.d/70interrupting"
            configuration.write_text('Dir::Bin::dpkg "/opt/bench/interrupting/dpkg";\n')
        return command.replace(" PATH=", " PATH=/opt/bench/interrupting:", 1)


def report(aftermath: Aftermath) -> bool:
    """Prints the result of an interruption. True when it is as expected."""
    what, wrong = aftermath.interruption, aftermath.differences()
    if bool(aftermath.audit) != ((what.killed, what.point, what.moment) in AUDITED):
        wrong.append(f"dpkg --audit: {aftermath.audit!r}")
    print(aftermath.row(), *(f"\n  DIFFERENCE: {line}" for line in wrong), sep="", flush=True)
    return not wrong


def main() -> int:
    """The command."""
    points = sys.argv[1:] or list(POINTS)
    for name in points:
        if name not in POINTS:
            print(f"interruption_real: {name}: no such command. There are {', '.join(POINTS)}.", file=sys.stderr)
            return 2
    build()
    if reason := forbidden():
        sys.exit(f"interruption_real: this machine forbids namespaces: {reason}")
    cases = interruptions(KILLS, points)
    print(HEADER)
    try:
        as_due = [report(aftermath) for aftermath in interrupt_all(InterruptedReal, cases, AT_ONCE)]
    except UnitError as error:
        sys.exit(f"interruption_real: {error}")
    print(f"{len(as_due)} interruptions, {as_due.count(False)} with a difference")
    return 0 if all(as_due) else 1


if __name__ == "__main__":
    sys.exit(main())
