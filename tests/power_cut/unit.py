"""The unit that loses its power: the built package on a machine with a disk, a network, a stick and a board."""

import contextlib
import shutil
from collections.abc import Iterator
from dataclasses import dataclass
from pathlib import Path

from bench.machine.machine import Machine
from bench.makers.files import write, write_script
from bench.makers.packages import Package, build, raise_version, write_index
from bench.makers.sticks import version_file_archive, write_stick
from bench.outcomes import meaning_of
from tests.power_cut.view import package_states
from tests.service.service import BOARD_TOOLS, STICK, install, make_files, panel, states, wait_for

PACKAGE, UPDATER = "solvik4-rh", "harl-updater"
OLDER, NEWER = "1.2.0", "1.3.0"
NEWER_UPDATER = "9.0.0"
OLDER_BOARD, NEWER_BOARD = "2.1.0", "2.2.0"
MARKER = "root/RESOURCES/tavren1stboot"
FILES = 40  # of the package, beside its configuration
SPEED = 1000  # times shorter waits of the updater, each 0.2 s at least
LONGEST_RUN = 180  # s, on a busy machine
HARL_START = 10  # s

# Keeps the repository, the stick and the shortened settings in memory, so that they write nothing to the disk.
SOURCES = "deb [trusted=yes] http://127.0.0.1/ ./\n"
# An unreachable network counts as success for apt: it continues with the lists that it has.
NO_DELAY = 'Acquire::Retries::Delay "false";\n'
MIRROR = "python3 -m http.server --bind 127.0.0.1 --directory /srv/repository 80"
MIRROR_LISTENS = "0100007F:0050 00000000:0000 0A"  # proc(5), net/tcp
SETTINGS = f"[Service]\nEnvironment=LD_PRELOAD=/opt/call_recorder.so BENCH_SPEED={SPEED} BENCH_CALLS=/var/log/calls\n"
# In place of a program of the service: the one on the disk, with the changes of the sed `script`.
CHANGED = """[Service]
{line}=
{line}=/bin/sh -c 'sed "{script}" /usr/lib/harl-updater/{program} >/run/{program}; exec sh /run/{program}'
"""
NO_REPAIR = CHANGED.format(line="ExecStartPre", program="prepare", script="/^is_unfinished || exit/q")
SHORT_TIMES = CHANGED.format(
    line="ExecStart", program="give-back", script="s/^board_time=.*/board_time=1/; s/^outcome_time=.*/outcome_time=1/"
)


@dataclass(frozen=True)
class Situation:
    """What a run has besides the head and the board."""

    name: str
    network: bool = True
    stick: bool = True


WITH_ALL = Situation("with both")
SITUATIONS = [WITH_ALL, Situation("no network", network=False), Situation("no stick", stick=False)]


@dataclass(frozen=True)
class State:
    """The head's packages, and the board."""

    packages: str  # see package_states()
    board: str
    marker: bool
    database: str = ""  # what is wrong with the packages
    shown: str = ""  # the outcome, in words
    withheld: str = ""  # what was not given back


def make_repository(updater: Path | None, folder: Path) -> None:
    """Offers the newer package in `folder`; with an `updater`, also a newer one of that, on which it depends."""
    fields = {}
    if updater:
        raise_version(updater, NEWER_UPDATER, folder)
        fields["Depends"] = f"{UPDATER} (>= {NEWER_UPDATER})"
    build(Package(PACKAGE, NEWER, fields, files=_package_files(NEWER)), folder)
    write_index(folder)


class Unit:
    """The unit on the machine `inside`. `repository` is what its network offers."""

    def __init__(self, inside: Machine, repository: Path, repairs: bool = True) -> None:
        self._inside = inside
        self._repository = repository
        self._repairs = repairs

    def install(self, package: Path, programs: Path) -> None:
        """Installs the package under test, and the packages to update, on the empty disk."""
        make_files(self._inside, package, programs)
        files = self._inside.files
        for name, lines in BOARD_TOOLS.items():
            write_script(files / "usr/local/sbin" / name, lines)
        write(files / "etc/apt/sources.list", SOURCES)
        write(files / "etc/apt/apt.conf.d/60delay", NO_DELAY)
        write(files / MARKER, "")
        self.start(OLDER_BOARD, WITH_ALL)
        shutil.copy(package, self._root("srv/updater.deb"))
        install(self._inside)
        older = build(Package(PACKAGE, OLDER, files=_package_files(OLDER)), self._root("run"))
        self._inside.run("dpkg", "--install", f"/run/{older.name}")
        self._inside.run("apt-get", "update")

    def start(self, board: str, situation: Situation) -> None:
        """Boots the unit. Raises MachineError."""
        self._inside.start()
        for place in ("/srv", "/var/log"):
            self._inside.run("mount", "-t", "tmpfs", "tmpfs", place)
        write(self._root("srv/board"), f"{board}\n")
        units = self._root("run/systemd/system")
        write(units / "harl-updater.service.d/settings.conf", SETTINGS)
        write(units / "harl-updater-give-back.service.d/times.conf", SHORT_TIMES)
        if not self._repairs:
            write(units / "harl-updater.service.d/repair.conf", NO_REPAIR)
        self._inside.run("systemctl", "daemon-reload")
        self._inside.run("systemctl", "start", "harl")
        if situation.network:
            shutil.copytree(self._repository, self._root("srv/repository"))
            self._inside.run("systemd-run", "--quiet", "--unit=mirror", *MIRROR.split())
            wait_for("mirror", lambda: MIRROR_LISTENS in (self._root().parent / "net/tcp").read_text())

    def run_service(self, situation: Situation) -> None:
        """Plugs the stick in and runs the service to its end."""
        if situation.stick:
            self._inside.run("mount", "-t", "tmpfs", "stick", STICK)
            write_stick(self._root(STICK.lstrip("/")), [f"quorb{NEWER_BOARD}"], "", version_file_archive)
        write(self._root("var/log/panel"), "")
        self._inside.run("systemctl", "start", "--no-block", "harl-updater")
        wait_for("end of the service", self._has_ended, LONGEST_RUN)

    def state(self) -> State:
        """The state after a run of the service."""
        return State(
            packages=package_states(self._root(), [UPDATER, PACKAGE]),
            board=self._root("srv/board").read_text().strip(),
            marker=self._root(MARKER).exists(),
            shown=meaning_of(panel(self._inside).pattern(0)),
            database=self._output("dpkg", "--verify", UPDATER, PACKAGE) + self._output("dpkg", "--audit"),
            withheld=" ".join(self._withheld()),
        )

    def _has_ended(self) -> bool:
        """Whether the run and give-back have ended. Cheap as long as that has not been noted."""
        notes = self._root("run/harl-updater/notes")
        has_noted = notes.exists() and "given-back" in notes.read_text()
        return has_noted and states(self._inside) <= {"inactive", "failed"}

    def _withheld(self) -> Iterator[str]:
        """What of the instrument was not given back."""
        if self._inside.status("mountpoint", "-q", STICK) == 0:
            yield "the stick"
        with contextlib.suppress(AssertionError):
            wait_for("harl", lambda: self._inside.status("systemctl", "is-active", "--quiet", "harl") == 0, HARL_START)
            return
        yield "harl"

    def _output(self, *command: str) -> str:
        """What the command prints in the machine, whatever its status."""
        return self._inside.run("sh", "-c", '"$@" 2>&1 || :', "sh", *command)

    def _root(self, path: str = "") -> Path:
        return self._inside.root() / path


def _package_files(version: str) -> dict[str, str]:
    """Enough files that an installation is more than one write."""
    parts = {f"opt/{PACKAGE}/part{number}": f"part{number} {version}\n" * 200 for number in range(FILES)}
    return parts | {f"etc/{PACKAGE}.conf": f"version={version}\n"}
