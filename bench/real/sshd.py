"""The board's sshd: the machine's own, or one that is unpacked into the build folder and never installed."""

import fcntl
import os
import shutil
import subprocess
import tempfile
from dataclasses import dataclass
from pathlib import Path

from bench.unit import UnitError

PACKAGES = ["openssh-server", "openssh-sftp-server", "libwrap0"]  # an installed openssh-server would start a server


@dataclass
class Server:
    """The programs as the board sees them; `files`, where needed, goes to its /opt/bench."""

    sshd: str
    sftp_server: str
    files: Path | None = None


def find(kept: Path) -> Server:
    """The server; fetched into the folder `kept` when this machine has none. Raises UnitError."""
    installed = Server("/usr/sbin/sshd", "/usr/lib/openssh/sftp-server")
    if os.access(installed.sshd, os.X_OK) and os.access(installed.sftp_server, os.X_OK):
        return installed
    kept.mkdir(parents=True, exist_ok=True)
    with (kept / "sshd.lock").open("w") as lock:
        fcntl.flock(lock, fcntl.LOCK_EX)
        if not (kept / "sshd").exists():
            _fetch(kept / "sshd")
    return Server("/opt/bench/sbin/sshd", "/opt/bench/sbin/sftp-server", kept / "sshd")


def _fetch(target: Path) -> None:
    with tempfile.TemporaryDirectory(dir=target.parent) as name:
        work = Path(name)
        (work / "files/sbin").mkdir(parents=True)
        (work / "files/lib").mkdir()
        download = ["apt-get", "download", *PACKAGES]
        fetched = subprocess.run(download, cwd=work, capture_output=True, text=True, check=False)
        if fetched.returncode != 0:
            reason = (fetched.stderr.strip().splitlines() or ["no reason given"])[-1]
            raise UnitError(
                f"the board's sshd ({' '.join(PACKAGES)}) cannot be fetched: {reason}. "
                "Connect this machine to its package mirrors and run apt-get update."
            )
        for package in work.glob("*.deb"):
            subprocess.run(["dpkg-deb", "--extract", package, work / "tree"], check=True)
        shutil.copy(work / "tree/usr/sbin/sshd", work / "files/sbin")
        shutil.copy(work / "tree/usr/lib/openssh/sftp-server", work / "files/sbin")
        [library] = (work / "tree").rglob("libwrap.so.0")
        shutil.copy(library, work / "files/lib")
        os.rename(work / "files", target)
