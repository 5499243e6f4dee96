"""The board's sshd: the machine's own, or one that is unpacked into the build folder and never installed."""

import fcntl
import os
import shutil
import subprocess
import tempfile
from dataclasses import dataclass
from pathlib import Path

from bench.build import ROOT
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
        tree, files = Path(name, "tree"), Path(name, "files")
        architecture = subprocess.run(["dpkg", "--print-architecture"], stdout=subprocess.PIPE, text=True, check=True)
        unpack = [str(ROOT / "scripts/unpack-packages"), architecture.stdout.strip(), str(tree), *PACKAGES]
        unpacked = subprocess.run(unpack, stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, text=True, check=False)
        if unpacked.returncode != 0:
            reason = (unpacked.stderr.strip().splitlines() or ["no reason given"])[-1]
            raise UnitError(f"the board's sshd cannot be fetched: {reason}")
        (files / "sbin").mkdir(parents=True)
        (files / "lib").mkdir()
        shutil.copy(tree / "usr/sbin/sshd", files / "sbin")
        shutil.copy(tree / "usr/lib/openssh/sftp-server", files / "sbin")
        [library] = tree.rglob("libwrap.so.0")
        shutil.copy(library, files / "lib")
        os.rename(files, target)
