"""The real unit: a head and a board with the real tools, in namespaces of their own on this machine.

On the host it has only one temporary folder: the roots are in a tmpfs, the network in namespaces, and all of it ends
with its first process.
"""

import contextlib
import os
import shlex
import shutil
import signal
import subprocess
import sys
import time
from pathlib import Path

from bench.cleanup import remove_control_group
from bench.makers import board as board_files
from bench.makers import sounds
from bench.makers.files import replace_text
from bench.processes import find
from bench.real import sshd, systemd
from bench.real.files import HERE, MIRROR_PORT, head_package, search_path, write_board, write_head, write_stick
from bench.scenario import Scenario, variables
from bench.unit import PARTS, PROGRAMS, Files, State, UnitError, parts_of, with_pid_file

NAMESPACES = ["unshare", "--mount", "--net", "--ipc", "--uts", "--pid", "--fork", "--kill-child", "--mount-proc"]
ONE_USER = "--map-root-user"  # needs no privilege; systemd does
# Everything in unit.sh that a machine may forbid.
PROBE = (
    "mount -t tmpfs probe /tmp && ip link add name probe0 type veth peer name probe1"
    " && unshare --user --map-user=1000 --map-group=1000 true"
)
LONGEST_SETUP = 60  # s


def forbidden() -> str:
    """Why this machine cannot have a real unit; "" when it can."""
    probe = subprocess.run([*NAMESPACES, ONE_USER, "sh", "-c", PROBE], capture_output=True, text=True, check=False)
    return "" if probe.returncode == 0 else (probe.stderr.strip().splitlines() or ["no reason given"])[-1]


class RealUnit:
    """A unit (see unit.py) made of real tools."""

    kind = "real"

    def __init__(self, scenario: Scenario, folder: Path, speed: float, build: Path, no_systemd: str) -> None:
        self.name = "real tools and systemd"
        if no_systemd:
            self.name = f"real tools, but a stand-in for systemd: {no_systemd}"
        self.log_is_exact = bool(no_systemd)
        self.errors = "errors"  # file beside the log that gets the standard error; without systemd "log" is possible
        self._has_systemd = not no_systemd
        self._setup = scenario.setup
        self._folder = folder
        self._speed = speed
        self._build = build
        self._namespaces: subprocess.Popen[bytes] | None = None
        self._out = folder / "out"
        self._speed_file = self._out / "speed"  # where the speed may change
        self._control_group: Path | None = None
        self._parts = parts_of(scenario.setup)
        self.files = Files(log=self._out / "log", calls=self._out / "calls", panel=self._out / "panel")
        self._journal = systemd.Journal(self._out / "journal", self.files.log)

    def start(self) -> None:
        """Makes the unit and starts the updater. Raises UnitError."""
        server = sshd.find(self._build / "bench")
        for name in ("out", "unit"):
            (self._folder / name).mkdir(exist_ok=True)
        if self._has_systemd:
            self._control_group = systemd.make_control_group(self._folder)
        write_head(self._folder / "head", self._setup, self._build / "bench/packages", self._has_systemd)
        write_board(self._folder / "board", self._setup, self._folder / "head")
        write_stick(self._folder / "stick", self._setup)
        command = self._add_programs()
        if self._has_systemd:
            systemd.write_services(self._folder / "head", self._setup, command)
        self._write_variables(server, command)
        users = [] if self._has_systemd else [ONE_USER]
        with (self._out / "setup").open("wb") as messages:
            self._namespaces = subprocess.Popen(
                with_pid_file(self._folder, [*NAMESPACES, *users, HERE / "unit.sh", self._folder]),
                stdin=subprocess.DEVNULL,
                stdout=messages,
                stderr=messages,
                start_new_session=True,
            )
        begin = time.monotonic()
        while not (self._out / "started").exists():
            self._check_alive()
            if time.monotonic() - begin > LONGEST_SETUP:
                raise UnitError(f"the unit was not ready after {LONGEST_SETUP} s")
            time.sleep(0.01)

    def ended(self) -> int | None:
        """None while the updater runs, then its status."""
        if self._has_systemd:
            self._journal.update()
            ended = self._journal.ended
        else:
            ended = (self._out / "status").read_text() if (self._out / "status").exists() else ""
        if not ended:
            self._check_alive()
            return None
        how, value = ended.split()
        return int(value) if how == "exited" else -signal.Signals[f"SIG{value}"]

    def parts(self) -> dict[str, bool]:
        """Which of the PARTS are in order."""
        return dict(self._parts)

    def switch(self, part: str) -> None:
        """Puts a part into its other state. Raises UnitError."""
        on = not self._parts[part]
        if part != "stick" or self._parts["power"]:  # without power it is not mounted
            self._act(f"{part}_{PARTS[part][0 if on else 1]}")
        self._parts[part] = on
        if part == "power" and on and self._parts["stick"]:
            self._act("stick_in")

    def set_speed(self, speed: float) -> None:
        """How many times faster the updater's clock and waits run from now on."""
        self._speed = speed
        self._speed_file.parent.mkdir(exist_ok=True)
        replace_text(self._speed_file, f"{speed}\n")

    def update(self) -> None:
        """Starts the updater again, once it has ended; `files` begin anew. Raises UnitError."""
        (self._out / "status").unlink(missing_ok=True)
        for played in self._out.glob("played-*"):
            played.unlink()
        for file in (self.files.calls, self.files.panel):
            file.write_text("")
        self._journal.begin_again()
        self._act("update_again")

    def updater(self) -> int | None:
        """The process id of the updater, as this machine numbers it; None when it does not run."""
        return find(self._first_process(), PROGRAMS[self._setup.updater.program].name)

    def shell(self) -> tuple[list[str], dict[str, str]]:
        """A command that runs a shell on the head, and its environment."""
        return self._action("in_head", f"TERM={os.environ.get('TERM', 'dumb')}", "PS1=head# ", "sh", "-i"), {}

    def state(self) -> State:
        """The unit as it is now."""
        head, board = self._root() / "head", self._root() / "board"
        stick = f"{self._folder}/unit/head/root/USB_MOUNT "
        return State(
            package=self._package_version(head / "var/lib/dpkg/status"),
            board=board_files.read_version(board),
            marker=(head / "root/RESOURCES/tavren1stboot").exists(),
            stick=stick in Path(f"/proc/{self._first_process()}/mountinfo").read_text(),
            harl=self._harl_state(),
            updater="active" if self._updater_active() else "inactive",
            sounds=self._sounds_played(),
        )

    def close(self) -> None:
        """Ends every process of the unit, and with them its mounts and networks; the owner removes its folder."""
        if not self._namespaces:
            return
        # The kernel ends all processes of a process namespace before the first one disappears.
        with contextlib.suppress(UnitError, ProcessLookupError):
            os.kill(self._first_process(), signal.SIGKILL)
        self._namespaces.kill()
        self._namespaces.wait()
        self._namespaces = None
        if self._control_group:
            remove_control_group(str(self._control_group))

    def _add_programs(self) -> str:
        """Puts the programs on the head. Returns the command that runs the updater there."""
        program = PROGRAMS[self._setup.updater.program]
        for file in (program, Path("bench/call_recorder.so"), Path("bench/i2c_bus.so")):
            shutil.copy(self._build / file, self._folder / "head/opt/bench")
        (self._folder / "head/opt/bench/input").write_text(self._setup.updater.input)
        words = ["/usr/bin/env", "-i"]
        if self._setup.updater.children == "ignored":
            words.append("--ignore-signal=CHLD")
        words += ["HOME=/root", "LANG=C.UTF-8", f"PATH={search_path(self._setup)}"]
        words += ["LD_PRELOAD=/opt/bench/call_recorder.so", "BENCH_CALLS=/opt/bench/out/calls"]
        speed = "/opt/bench/out/speed" if self._speed_file.exists() else self._speed
        words += [f"BENCH_SPEED={speed}", "BENCH_PANEL=/opt/bench/bus/panel"]
        return " ".join([*words, f"/opt/bench/{program.name}", *self._setup.updater.arguments])

    def _write_variables(self, server: sshd.Server, command: str) -> None:
        if server.files:
            shutil.copytree(server.files, self._folder / "board/opt/bench", dirs_exist_ok=True)
        values = variables(self._setup) | {
            "BENCH_COMMAND": command,
            "BENCH_CONTROL_GROUP": str(self._control_group or ""),
            "BENCH_ERRORS": self.errors,
            "BENCH_MIRROR_PORT": str(MIRROR_PORT),
            "BENCH_PACKAGE": head_package(self._setup),
            "BENCH_PYTHON": sys.executable,
            "BENCH_SERVICE": systemd.updater_service(self._setup),
            "BENCH_SFTP_SERVER": server.sftp_server,
            "BENCH_SOUND_LENGTH": f"{sounds.SECONDS / self._speed:.3f}",
            "BENCH_SSHD": server.sshd,
        }
        text = "".join(f"{name}={shlex.quote(value)}\n" for name, value in values.items())
        for folder in (self._folder, self._folder / "head/opt/bench", self._folder / "board/opt/bench"):
            (folder / "variables").write_text(text)

    def _harl_state(self) -> str:
        if self._setup.head.harl == "unknown":
            return "unknown"
        if self._control_group:
            return "active" if systemd.service_active(self._control_group, "harl") else "inactive"
        harl = self._root() / "head/run/harl"
        return harl.read_text().strip() if harl.exists() else "inactive"

    def _updater_active(self) -> bool:
        if self._control_group:
            # What a killed updater has started stays in the control group.
            return not self._journal.ended and systemd.service_active(self._control_group, "harl-updater")
        return self._setup.updater.stopped != "never" and not (self._out / "status").exists()

    def _action(self, *words: str) -> list[str]:
        """The command that runs an action of unit.sh."""
        # Without its own user's namespace there is none to enter, and no credentials to keep.
        enter = ["nsenter", "--all", "--preserve-credentials", f"--target={self._first_process()}"]
        return [*enter, str(HERE / "unit.sh"), str(self._folder), *words]

    def _act(self, *words: str) -> None:
        # A file, not a pipe: what an action leaves running would keep that open.
        with (self._out / "action").open("w+") as said:
            done = subprocess.run(self._action(*words), stdin=subprocess.DEVNULL, stdout=said, stderr=said, check=False)
            said.seek(0)
            if done.returncode != 0:
                raise UnitError(f"{words[0]}: {(said.read().strip().splitlines() or ['no reason given'])[-1]}")

    def _check_alive(self) -> None:
        assert self._namespaces
        if self._namespaces.poll() is not None:
            raise UnitError(f"the unit cannot be made: {(self._out / 'setup').read_text().strip() or 'it ended'}")

    def _first_process(self) -> int:
        """The first process in the unit's namespaces, as the host numbers it."""
        assert self._namespaces
        pid = self._namespaces.pid
        try:
            return int(Path(f"/proc/{pid}/task/{pid}/children").read_text().split()[0])
        except (OSError, IndexError) as error:
            raise UnitError("the unit has ended") from error

    def _root(self) -> Path:
        """The folder of the unit's roots, seen from the host."""
        return Path(f"/proc/{self._first_process()}/root{self._folder}/unit")

    def _package_version(self, status: Path) -> str:
        for paragraph in status.read_text().split("\n\n"):
            fields = dict(line.split(": ", 1) for line in paragraph.splitlines() if ": " in line)
            if fields.get("Package") == head_package(self._setup) and not fields["Status"].endswith("not-installed"):
                return fields["Version"]
        return "(none)"

    def _sounds_played(self) -> list[str]:
        """The sounds of which every sample reached the sound device, followed only by silence."""
        found = []
        for played in sorted(self._out.glob("played-*.raw"), key=lambda path: path.stat().st_mtime):
            heard = played.read_bytes()
            for name in sounds.SOUNDS:
                samples = sounds.samples(name)
                if heard.startswith(samples) and not heard[len(samples) :].strip(b"\0"):
                    found.append(name)
        return found
