"""The stand-in unit: the updater runs on this machine, with a search path that holds only the tools of tools.sh."""

import os
import re
import signal
import subprocess
from pathlib import Path

from bench.makers import board, sticks
from bench.makers.files import replace_text
from bench.makers.packages import candidate
from bench.makers.sounds import FOLDER as SOUND_FOLDER
from bench.makers.sounds import SOUNDS
from bench.scenario import TOOLS, Scenario, variables
from bench.unit import PROGRAMS, Files, State, parts_of, with_pid_file

HERE = Path(__file__).parent
TOOLS_FOLDER = HERE.parent / "makers/tools"
LONGEST_PACE = 3  # s, that a tool takes where a user watches
UNPACK = f"/bin/cp root/OSUpgrade.zip {board.VERSION_FILE}\n"  # where there is no unzip


def sanitizers(program: Path) -> list[str]:
    """The sanitizers that `program` was built with: they must be loaded before anything else."""
    # A script in the program's place has none: ldd fails.
    libraries = subprocess.run(["ldd", program], capture_output=True, text=True, check=False).stdout
    return re.findall(r"^\s*(lib[at]san\.so\.\d+) ", libraries, re.MULTILINE)


class StandInUnit:
    """A unit (see unit.py) whose state is a few files, changed by the stand-in tools."""

    kind = "stand-in"
    name = "stand-ins for all tools"
    log_is_exact = True

    def __init__(self, scenario: Scenario, folder: Path, speed: float, build: Path) -> None:
        self._setup = scenario.setup
        self._folder = folder
        self._speed = speed
        self._build = build
        self._updater: subprocess.Popen[bytes] | None = None
        self._parts = parts_of(scenario.setup)
        self._speed_file = folder / "speed"  # where the speed may change
        self.files = Files(log=folder / "log", calls=folder / "calls", panel=folder / "panel")

    def start(self) -> None:
        """Makes the unit and starts the updater."""
        self._make_head()
        self._make_board()
        self._make_stick()
        self.update()

    def update(self) -> None:
        """Starts the updater, again once it has ended; `files` begin anew."""
        for file in (self.files.log, self.files.calls, self.files.panel, self._folder / "sounds"):
            file.write_text("")
        self._start_updater()

    def ended(self) -> int | None:
        """None while the updater runs, then its status."""
        return self._updater.poll() if self._updater else None

    def parts(self) -> dict[str, bool]:
        """Which of the PARTS are in order."""
        return dict(self._parts)

    def switch(self, part: str) -> None:
        """Puts a part into its other state."""
        on = self._parts[part] = not self._parts[part]
        if part == "power":
            self.close()
            (self._folder / "harl").write_text("active\n" if on else "inactive\n")
        if part in ("power", "stick"):
            self._mount_stick(self._parts["power"] and self._parts["stick"])
        self._tell_tools()

    def set_speed(self, speed: float) -> None:
        """How many times faster the updater's clock and waits run from now on; the tools take their time, too."""
        self._speed = speed
        replace_text(self._speed_file, f"{speed}\n")
        self._tell_tools()

    def updater(self) -> int | None:
        """The process id of the updater, None when it does not run."""
        if not self._updater or self._updater.poll() is not None:
            return None
        return self._updater.pid

    def shell(self) -> tuple[list[str], dict[str, str]]:
        """A command that runs a shell with the stand-in tools, and its environment."""
        return ["/bin/sh", "-i"], self._environment() | {"PS1": "stand-in# ", "TERM": os.environ.get("TERM", "dumb")}

    def state(self) -> State:
        """The unit as it is now."""
        known = self._setup.head.harl == "known"
        is_service = self._setup.updater.stopped != "never"
        return State(
            package=self._read("package") if self._setup.package.known else "(none)",
            board=board.read_version(self._folder / "board"),
            marker=(self._folder / "head/RESOURCES/tavren1stboot").exists(),
            stick=(self._folder / "head/USB_MOUNT").is_symlink(),
            harl=self._read("harl") if known else "unknown",
            updater="active" if is_service and self.updater() else "inactive",
            sounds=(self._folder / "sounds").read_text().split(),
        )

    def close(self) -> None:
        """Ends the updater and its children; the folder's owner removes the folder."""
        if self._updater:
            try:
                os.killpg(self._updater.pid, signal.SIGKILL)
            except ProcessLookupError:
                pass
            self._updater.wait()
            self._updater = None

    def _read(self, name: str) -> str:
        return (self._folder / name).read_text().strip()

    def _make_head(self) -> None:
        (self._folder / "package").write_text(self._setup.package.installed + "\n")
        (self._folder / "harl").write_text("active\n")
        sounds = self._folder / SOUND_FOLDER.replace("root", "head", 1)
        sounds.mkdir(parents=True)
        for name in SOUNDS:
            (sounds / name).touch()
        if self._setup.head.marker:
            (self._folder / "head/RESOURCES/tavren1stboot").touch()
        tools = self._folder / "bin"
        tools.mkdir()
        for tool in TOOLS:
            if tool not in self._setup.tools.missing:
                (tools / tool).symlink_to(HERE / "tools.sh")

    def _make_board(self) -> None:
        wanted = self._setup.board
        board.write_version(self._folder / "board", wanted.installed, wanted.version_file)

    def _make_stick(self) -> None:
        stick = self._setup.stick
        script = "exit 3\n" if self._setup.board.script == "fails" else UNPACK
        sticks.write_stick(
            self._folder / "stick", stick.directories, script, sticks.version_file_archive, stick.teamviewer
        )
        (self._folder / "head/USB_MOUNT").mkdir()
        self._mount_stick(stick.inserted)

    def _mount_stick(self, mounted: bool) -> None:
        mount = self._folder / "head/USB_MOUNT"
        if mounted and not mount.is_symlink():
            mount.rmdir()
            mount.symlink_to(self._folder / "stick")
        elif not mounted and mount.is_symlink():
            mount.unlink()
            mount.mkdir()

    def _environment(self) -> dict[str, str]:
        """What the tools need."""
        package = self._setup.package
        return {
            **variables(self._setup),
            "PATH": str(self._folder / "bin"),
            "UNIT": str(self._folder),
            "BENCH_TOOLS": str(TOOLS_FOLDER),
            "PACKAGE_OFFERED": candidate(package.installed, package.offered, package.downgrades),
            "BENCH_HOLD": os.environ.get("BENCH_HOLD", ""),
        }

    def _tell_tools(self) -> None:
        """What the tools need to know of changes while they run."""
        setup, parts = self._setup, self._parts
        usual = setup.board.link if setup.board.link not in ("down", "hangs") else "up"
        refresh = setup.mirrors.refresh if setup.mirrors.refresh != "unreachable" else "works"
        values = {
            "BOARD_LINK": "down" if not parts["link"] else usual if parts["board"] else "hangs",
            "MIRRORS_REFRESH": refresh if parts["mirrors"] else "unreachable",
            "HEAD_SOUND": "present" if parts["sound"] else "absent",
            "HEAD_PANEL": "present" if parts["bus"] else "absent",
            "BENCH_PACE": f"{min(60 / self._speed, LONGEST_PACE):.3f}",
        }
        replace_text(self._folder / "changes", "".join(f"{name}={value}\n" for name, value in values.items()))

    def _start_updater(self) -> None:
        environment = self._environment() | {
            "BENCH_CALLS": str(self.files.calls),
            "BENCH_SPEED": str(self._speed_file if self._speed_file.exists() else self._speed),
        }
        env = ["/usr/bin/env"]
        if self._setup.updater.children == "ignored":
            env.append("--ignore-signal=CHLD")
        program = self._build / PROGRAMS[self._setup.updater.program]
        env.append("LD_PRELOAD=" + ":".join([*sanitizers(program), str(self._build / "bench/call_recorder.so")]))
        answer = self._folder / "input"
        answer.write_text(self._setup.updater.input)
        with self.files.log.open("wb") as log, (self._folder / "errors").open("wb") as errors, answer.open() as typed:
            self._updater = subprocess.Popen(
                with_pid_file(self._folder, [*env, program, *self._setup.updater.arguments]),
                env=environment,
                cwd=self._folder,
                stdin=typed,
                stdout=log,
                stderr=errors,
                start_new_session=True,
            )
