"""A machine with real systemd, apt and dpkg in namespaces of its own on this one. Needs root."""

import contextlib
import os
import signal
import subprocess
import tempfile
import time
from collections.abc import Iterator
from pathlib import Path

from bench.cleanup import remove_control_group
from bench.real.systemd import make_control_group, obstacle

# The machine ends with the process that made it, however that ends.
PARENT = ["setpriv", "--pdeathsig", "KILL"]
NAMESPACES = ["--mount", "--ipc", "--uts", "--pid", "--fork", "--kill-child", "--mount-proc"]
MACHINE = Path(__file__).with_name("machine.sh")
LONGEST_START = 60  # s
LONGEST_COMMAND = 120  # s


class MachineError(Exception):
    """The machine cannot be made here; the text says why."""


class Machine:
    """A running machine. `files` holds its files besides the /usr of the root file system `system`.

    What the machine writes stays in memory, or goes to the file system in the file `disk`. Its network is its own, or
    that of `neighbour`.
    """

    def __init__(
        self, folder: Path, system: Path, disk: Path | None = None, neighbour: "Machine | None" = None
    ) -> None:
        self._folder = folder
        self.system = system
        self._neighbour = neighbour
        self._disk = [disk] if disk else []
        self.files = folder / "files"
        self.files.mkdir()
        (folder / "memory").mkdir()
        self._namespaces: subprocess.Popen[bytes] | None = None
        self._control_group: Path | None = None

    def start(self) -> None:
        """Returns when systemd is up. Raises MachineError."""
        if reason := obstacle():
            raise MachineError(reason)
        self._control_group = make_control_group(self._folder)
        command = [*PARENT, "unshare", "--net", *NAMESPACES]
        if self._neighbour:
            network = f"/proc/{self._neighbour._first_process()}/ns/net"
            command = [*PARENT, "nsenter", f"--net={network}", "unshare", *NAMESPACES]
        with (self._folder / "console").open("wb") as console:
            self._namespaces = subprocess.Popen(
                [*command, MACHINE, self._folder, self.system, self._control_group, *self._disk],
                stdin=subprocess.DEVNULL,
                stdout=console,
                stderr=console,
                start_new_session=True,
            )
        end = time.monotonic() + LONGEST_START
        # The word, not the status: before systemd runs, systemctl takes the machine for a chroot and ends with 0.
        while self._inside("systemctl", "is-active", "basic.target").stdout != "active\n":
            if self._namespaces.poll() is not None or time.monotonic() > end:
                text = (self._folder / "console").read_text(errors="replace").strip().splitlines()
                raise MachineError(text[-1] if text else "systemd does not come up")
            time.sleep(0.1)

    def stop(self) -> None:
        """Ends every process of the machine."""
        if self._namespaces is None:
            return
        with contextlib.suppress(OSError):
            os.kill(self._first_process(), signal.SIGKILL)
        self._namespaces.kill()
        self._namespaces.wait()
        for _ in range(100):  # a group stays busy until its last process is gone
            remove_control_group(str(self._control_group))
            if not self._control_group or not self._control_group.exists():
                return
            time.sleep(0.05)

    def run(self, *command: str) -> str:
        """What the command prints in the machine; fails with its errors when its status is not 0."""
        done = self._inside(*command)
        if done.returncode != 0:
            raise AssertionError(f"{' '.join(command)}: status {done.returncode}\n{done.stdout}{done.stderr}")
        return done.stdout

    def status(self, *command: str) -> int:
        """The status of the command in the machine."""
        return self._inside(*command).returncode

    def root(self) -> Path:
        """The machine's root, seen from outside."""
        return Path(f"/proc/{self._first_process()}/root")

    def _inside(self, *command: str) -> subprocess.CompletedProcess[str]:
        try:
            enter = ["nsenter", "--all", f"--target={self._first_process()}", "--root", "--wd"]
        except OSError:
            return subprocess.CompletedProcess(command, 1, "", "not started")
        environment = {"PATH": "/usr/sbin:/usr/bin:/sbin:/bin", "HOME": "/root", "LC_ALL": "C"}
        return subprocess.run(
            [*enter, *command], env=environment, capture_output=True, text=True, check=False, timeout=LONGEST_COMMAND
        )

    def _first_process(self) -> int:
        """systemd, as the host numbers it."""
        assert self._namespaces
        pid = self._namespaces.pid
        try:
            return int(Path(f"/proc/{pid}/task/{pid}/children").read_text().split()[0])
        except IndexError as error:
            raise ProcessLookupError(pid) from error


@contextlib.contextmanager
def machine(system: Path, disk: Path | None = None, neighbour: Machine | None = None) -> Iterator[Machine]:
    """A machine with the programs of `system`, see Machine: not started yet, and removed at the end of the block."""
    with tempfile.TemporaryDirectory(prefix="machine-") as folder:
        made = Machine(Path(folder), system, disk, neighbour)
        try:
            yield made
        finally:
            made.stop()
