"""The stand-in unit: the updater runs on this machine, with a search path that holds only the tools of tools.sh."""

import os
import re
import signal
import subprocess
from pathlib import Path

from bench.scenario import TOOLS, Scenario, variables
from bench.unit import PROGRAMS, Files, State, with_pid_file

HERE = Path(__file__).parent


def sanitizers(program: Path) -> list[str]:
    """The sanitizers that `program` was built with: they have to be loaded before anything else."""
    # A script in the program's place has none: ldd fails.
    libraries = subprocess.run(["ldd", program], capture_output=True, text=True, check=False).stdout
    return re.findall(r"^\s*(lib[at]san\.so\.\d+) ", libraries, re.MULTILINE)


class StandInUnit:
    """A unit (see unit.py) whose state is a few files, changed by the stand-in tools."""

    kind = "stand-in"
    name = "stand-ins for all tools"
    log_is_exact = True

    def __init__(self, scenario: Scenario, folder: Path, speed: float, build: Path) -> None:
        self._settings = scenario.unit
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
        known = self._settings["head"]["harl"] == "known"
        is_service = self._settings["updater"]["stopped"] != "never"
        return State(
            package=self._read("package") if self._settings["package"]["known"] else "(none)",
            board=self._board_version(),
            marker=(self._folder / "head/RESOURCES/tavren1stboot").exists(),
            stick=(self._folder / "head/USB_MOUNT").is_symlink(),
            harl=self._read("harl") if known else "unknown",
            updater="active" if is_service and self.ended() is None else "inactive",
            sounds=(self._folder / "sounds").read_text().split(),
        )

    def close(self) -> None:
        """Ends the updater and its children; the folder goes with its owner."""
        if self._updater:
            try:
                os.killpg(self._updater.pid, signal.SIGKILL)
            except ProcessLookupError:
                pass
            self._updater.wait()
            self._updater = None

    def _read(self, name: str) -> str:
        return (self._folder / name).read_text().strip()

    def _board_version(self) -> str:
        file = self._folder / "board/root/App/AppExe/version.txt"
        lines = file.read_text().splitlines() if file.exists() else []
        versions = [line.split("\t", 1)[1] for line in lines if line.startswith("Brimvale\t")]
        return versions[-1] if versions else ""

    def _make_head(self) -> None:
        (self._folder / "package").write_text(self._settings["package"]["installed"] + "\n")
        (self._folder / "harl").write_text("active\n")
        sounds = self._folder / "head/RESOURCES/SOUNDS"
        sounds.mkdir(parents=True)
        for name in ("SND_RESULT_PASS.wav", "SND_RESULT_FAIL.wav"):
            (sounds / name).touch()
        if self._settings["head"]["marker"]:
            (self._folder / "head/RESOURCES/tavren1stboot").touch()
        tools = self._folder / "bin"
        tools.mkdir()
        for tool in TOOLS:
            if tool not in self._settings["tools"]["missing"]:
                (tools / tool).symlink_to(HERE / "tools.sh")

    def _make_board(self) -> None:
        board = self._settings["board"]
        folder = self._folder / "board/root/App/AppExe"
        folder.mkdir(parents=True)
        if board["version_file"]:
            text = board["version_file"].replace("{version}", board["installed"])
            (folder / "version.txt").write_text(text, newline="")

    def _make_stick(self) -> None:
        stick = self._settings["stick"]
        (self._folder / "head/USB_MOUNT").mkdir()
        if not stick["inserted"]:
            return
        versions = self._folder / "stick/debs/QUORB/armhf"
        versions.mkdir(parents=True)
        for directory in stick["directories"]:
            (versions / directory).mkdir()
            # The stand-in archive is the new version file itself.
            content = f"Name\tQuorb\r\nBrimvale\t{directory[5:]}\r\n"
            (versions / directory / "OSUpgrade.zip").write_text(content, newline="")
            unpack = "/bin/cp root/OSUpgrade.zip root/App/AppExe/version.txt\n"
            script = "exit 3\n" if self._settings["board"]["script"] == "fails" else unpack
            (versions / directory / "unzipUpgrade.sh").write_text(script)
        teamviewer = self._folder / "stick/debs/installTV"
        if stick["teamviewer"] == "file":
            teamviewer.touch()
        elif stick["teamviewer"] == "directory":
            teamviewer.mkdir()
        (self._folder / "head/USB_MOUNT").rmdir()
        (self._folder / "head/USB_MOUNT").symlink_to(self._folder / "stick")

    def _start_updater(self) -> None:
        environment = {
            "PATH": str(self._folder / "bin"),
            "UNIT": str(self._folder),
            "BENCH_CALLS": str(self.files.calls),
            "BENCH_SPEED": str(self._speed),
        } | variables(self._settings)
        env = ["/usr/bin/env"]
        if self._settings["updater"]["children"] == "ignored":
            env.append("--ignore-signal=CHLD")
        program = self._build / PROGRAMS[self._settings["updater"]["program"]]
        env.append("LD_PRELOAD=" + ":".join([*sanitizers(program), str(self._build / "bench/call_recorder.so")]))
        with self.files.log.open("wb") as log, (self._folder / "errors").open("wb") as errors:
            self._updater = subprocess.Popen(
                with_pid_file(self._folder, [*env, program, *self._settings["updater"]["arguments"]]),
                env=environment,
                cwd=self._folder,
                stdin=subprocess.DEVNULL,
                stdout=log,
                stderr=errors,
                start_new_session=True,
            )
