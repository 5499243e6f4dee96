"""The real unit's systemd: first process of the head, with the updater and the instrument's application as services.

It needs root and a control group; elsewhere makers/tools/systemctl replaces it.
"""

import contextlib
import os
import subprocess
from pathlib import Path

from bench.makers.files import write
from bench.scenario import Setup

PROGRAM = Path("/lib/systemd/systemd")
ENDED = "bench: the updater has ended: "  # the journal's line after the updater's last one

TARGET = """[Unit]
DefaultDependencies=no
Wants=systemd-journald.service {services}
"""
APPLICATION = """[Unit]
DefaultDependencies=no
[Service]
ExecStart=/bin/sleep infinity
"""
# Keeps standard error out of the journal: the log of a run is the updater's standard output.
UPDATER = f"""[Unit]
DefaultDependencies=no
After=systemd-journald.service harl.service
[Service]
ExecStart={{command}}
StandardInput=file:/opt/bench/input
StandardOutput=journal
StandardError=append:/opt/bench/out/errors
KillMode=process
ExecStopPost=/bin/sh -c 'echo "{ENDED}$$EXIT_CODE $$EXIT_STATUS"'
"""
# The service manager stops the updater while the package's own script runs, see makers/packages.py.
STOP_WHEN = """[Unit]
DefaultDependencies=no
[Path]
PathExists=/run/package-installs
"""
STOP = """[Unit]
DefaultDependencies=no
[Service]
Type=oneshot
ExecStart=/bin/systemctl stop harl-updater
RemainAfterExit=yes
"""
JOURNAL = """[Journal]
Storage=volatile
RateLimitIntervalSec=0
"""


def obstacle() -> str:
    """Why systemd cannot run on this machine; "" when it can."""
    if os.geteuid() != 0 or "4294967295" not in Path("/proc/self/uid_map").read_text():
        return "not root"
    if not PROGRAM.exists():
        return "systemd is not installed"
    probe = ["unshare", "--mount", "--cgroup", "sh", "-c", "mount -t cgroup2 cgroup2 /tmp && mount -t sysfs sysfs /tmp"]
    if _own_control_group() is None or subprocess.run(probe, stderr=subprocess.DEVNULL, check=False).returncode != 0:
        return "no control group"
    return ""


def make_control_group(folder: Path) -> Path:
    """A control group for the head, named in the file `control-group` of the folder; see cleanup.py."""
    parent = _own_control_group()
    assert parent
    group = parent / f"{folder.parent.name}-{folder.name}"
    (folder / "control-group").write_text(f"{group}\n")
    group.mkdir()
    return group


def service_active(group: Path, name: str) -> bool:
    """Whether the service `name` runs."""
    with contextlib.suppress(OSError):
        return bool((group / "system.slice" / f"{name}.service" / "cgroup.procs").read_text())
    return False


def updater_service(setup: Setup) -> str:
    """The service that the updater runs in: not its own if it must survive the end of that."""
    return "by-hand.service" if setup.updater.stopped == "never" else "harl-updater.service"


def write_services(folder: Path, setup: Setup, command: str) -> None:
    """The head's services, with `command` as the updater."""
    services = folder / "etc/systemd/system"
    instrument: list[str] = []
    write(services / "harl-updater.service", APPLICATION)
    write(services / updater_service(setup), UPDATER.format(command=command))
    if setup.head.harl == "known":
        write(services / "harl.service", APPLICATION)
        instrument.append("harl.service")
    wanted = [updater_service(setup), *instrument]
    if setup.updater.stopped == "in-install":
        write(services / "stop-in-install.path", STOP_WHEN)
        write(services / "stop-in-install.service", STOP)
        wanted.append("stop-in-install.path")
    for target, names in {"bench": wanted, "instrument": instrument}.items():
        write(services / f"{target}.target", TARGET.format(services=" ".join(names)))
    write(folder / "etc/systemd/journald.conf", JOURNAL)


class Journal:
    """Turns the updater's journal back into its output, as far as the journal keeps it.

    The journal drops empty lines and the blanks at the end of lines, and with them the second line of a record without
    a message.
    """

    def __init__(self, source: Path, target: Path) -> None:
        self._source = source
        self._target = target
        self._offset = 0
        self._in_head = False  # past the first line of a record
        self.ended = ""  # how the updater ended: "exited 0", "killed TERM"

    def begin_again(self) -> None:
        """Leaves out what has not been read; the updater is about to start again."""
        self.update()
        self._target.write_text("")
        self._in_head = False
        self.ended = ""

    def update(self) -> None:
        """Reads what is new."""
        if not self._source.exists():
            return
        with self._source.open("rb") as source, self._target.open("ab") as target:
            source.seek(self._offset)
            data = source.read()
            data = data[: data.rfind(b"\n") + 1]
            self._offset += len(data)
            for line in data.splitlines(keepends=True):
                is_head, is_end = line.startswith(b"Updater | "), line.startswith(ENDED.encode())
                if self._in_head and (is_head or is_end):
                    target.write(b"\t\t\t\n")
                self._in_head = is_head
                if is_end:
                    target.flush()
                    self.ended = line.decode().removeprefix(ENDED).strip()
                    return
                target.write(line)


def _own_control_group() -> Path | None:
    """This process's group in the unified hierarchy."""
    mounts = [line.split() for line in Path("/proc/self/mountinfo").read_text().splitlines()]
    mounted = [Path(fields[4]) for fields in mounts if "cgroup2" in fields[fields.index("-") :]]
    own = [line[3:] for line in Path("/proc/self/cgroup").read_text().splitlines() if line.startswith("0::")]
    if not mounted or not own:
        return None
    group = mounted[0] / own[0].lstrip("/")
    return group if os.access(group / "cgroup.procs", os.W_OK) else None
