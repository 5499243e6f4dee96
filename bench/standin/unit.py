"""The stand-in unit: the updater runs on this machine, with a search path that holds only the tools of tools.sh."""

import os
import re
import signal
import subprocess
from pathlib import Path

from bench.makers import board, sticks
from bench.makers.sounds import FOLDER as SOUND_FOLDER
from bench.makers.sounds import SOUNDS
from bench.scenario import TOOLS, Scenario, variables
from bench.unit import PROGRAMS, Files, State, with_pid_file

HERE = Path(__file__).parent
TOOLS_FOLDER = HERE.parent / "makers/tools"
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
        self.files = Files(log=folder / "log", calls=folder / "calls", panel=folder / "panel")

    def start(self) -> None:
        """Makes the unit and starts the updater."""
        for file in (self.files.log, self.files.calls, self.files.panel, self._folder / "sounds"):
            file.touch()
        self._make_head()
        self._make_board()
        self._make_stick()
        self._start_updater()

    def ended(self) -> int | None:
        """None while the updater runs, then its status."""
        return self._updater.poll() if self._updater else None

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
            updater="active" if is_service and self.ended() is None else "inactive",
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
        if not stick.inserted:
            (self._folder / "head/USB_MOUNT").mkdir()
            return
        script = "exit 3\n" if self._setup.board.script == "fails" else UNPACK
        sticks.write_stick(
            self._folder / "stick", stick.directories, script, sticks.version_file_archive, stick.teamviewer
        )
        (self._folder / "head/USB_MOUNT").symlink_to(self._folder / "stick")

    def _candidate(self) -> str:
        """The version that apt picks as the candidate: an older one only if configured."""
        package = self._setup.package
        older = ["dpkg", "--compare-versions", package.offered, "lt", package.installed]
        if package.downgrades or package.installed == "(none)" or subprocess.run(older, check=False).returncode != 0:
            return package.offered
        return package.installed

    def _environment(self) -> dict[str, str]:
        """What the tools need."""
        return {
            **variables(self._setup),
            "PATH": str(self._folder / "bin"),
            "UNIT": str(self._folder),
            "BENCH_TOOLS": str(TOOLS_FOLDER),
            "PACKAGE_OFFERED": self._candidate(),
        }

    def _start_updater(self) -> None:
        environment = self._environment() | {
            "BENCH_CALLS": str(self.files.calls),
            "BENCH_SPEED": str(self._speed),
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
