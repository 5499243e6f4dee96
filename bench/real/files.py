"""The files of the real unit before an update: of the head, the board and the stick."""

import os
import shutil
import subprocess
from pathlib import Path

from bench.makers import sticks
from bench.makers.board import write_version
from bench.makers.files import write
from bench.makers.keys import sign_index
from bench.makers.packages import DATABASE, SOURCES, kept_package
from bench.makers.sounds import write_sounds
from bench.scenario import TOOLS, Setup

HERE = Path(__file__).parent
MIRROR_PORT = 8080
SIGNED_SOURCES = f"deb [signed-by=/etc/apt/mirror.gpg] http://127.0.0.1:{MIRROR_PORT} ./\n"
MAKERS = HERE.parent / "makers"


def head_package(setup: Setup) -> str:
    """The name of the head's own package."""
    return "solvik4-dh" if setup.updater.program == "main" else "solvik4-rh"


def search_path(setup: Setup) -> str:
    """The updater's search path: with a tool missing, one that holds the other tools only."""
    return "/opt/bench/tools" if setup.tools.missing else "/opt/bench/bin:/usr/sbin:/usr/bin:/sbin:/bin"


def write_head(folder: Path, setup: Setup, kept: Path, has_systemd: bool) -> None:
    """The head's files: package sources, sounds, marker and the bench's additions to the tools."""
    write(folder / "etc/apt/apt.conf.d/50bench", 'APT::Sandbox::User "root";\n')
    write(folder / "etc/dpkg/dpkg.cfg.d/bench", "force-unsafe-io\n")
    _write_packages(folder, setup, kept)
    (folder / "root/USB_MOUNT").mkdir(parents=True)
    write_sounds(folder)
    if setup.head.marker:
        write(folder / "root/RESOURCES/tavren1stboot", "")
    if setup.head.teamviewer_script != "absent":
        script = (HERE / "teamviewer" / f"{setup.head.teamviewer_script}.sh").read_text()
        write(folder / "root/RESOURCES/teamviewer_updatescript.sh", script, 0o755)
    # ALSA has no sound card here: the default device is a file, or rather a program that reads the samples.
    device = 'pcm.!default { type file slave.pcm null file "|/opt/bench/bin/play" format raw }\n'
    write(folder / ("etc/asound.conf" if setup.head.sound == "present" else "etc/asound.absent"), device)
    _write_tools(folder / "opt/bench", setup, has_systemd)


def write_board(folder: Path, setup: Setup, head: Path) -> None:
    """The board's files: the version file, its sshd's configuration, and the keys on both sides."""
    board = setup.board
    write_version(folder, board.installed, board.version_file)
    configuration = (
        "ListenAddress 192.168.9.2\n"
        "HostKey /etc/ssh/host_key\n"
        "UsePAM no\n"
        "Subsystem sftp /opt/bench/bin/sftp\n"
    )
    write(folder / "etc/ssh/sshd_config", configuration)
    write(folder / "opt/bench/bin/sftp", (HERE / "board/sftp").read_text(), 0o755)
    for key in (head / "root/.ssh/id_ed25519", folder / "etc/ssh/host_key", folder.parent / "other_key"):
        key.parent.mkdir(parents=True, exist_ok=True)
        subprocess.run(["ssh-keygen", "-q", "-t", "ed25519", "-N", "", "-C", "bench", "-f", key], check=True)
    other = (folder.parent / "other_key.pub").read_text()
    accepted = (head / "root/.ssh/id_ed25519.pub").read_text() if board.login != "key-refused" else other
    known = (folder / "etc/ssh/host_key.pub").read_text() if board.login != "host-key-changed" else other
    write(folder / "root/.ssh/authorized_keys", accepted)
    write(head / "root/.ssh/known_hosts", f"192.168.9.2 {known}")


def write_stick(folder: Path, setup: Setup) -> None:
    """The stick's files: for each version a zip archive and a script that unpacks it; the marker for TeamViewer."""
    script = (HERE / "stick" / f"{setup.board.script}.sh").read_text()
    stick = setup.stick
    sticks.write_stick(folder, stick.directories, script, teamviewer=stick.teamviewer)


def _write_packages(folder: Path, setup: Setup, kept: Path) -> None:
    """The repository with the offered package, and the .deb of the one that is installed first."""
    name, wanted = head_package(setup), setup.package
    for path in DATABASE:
        (folder / path).mkdir(parents=True)
    write(folder / "var/lib/dpkg/status", "")
    scripts = "interrupted" if setup.updater.stopped == "in-install" else wanted.install
    (folder / "srv/installed").mkdir(parents=True)
    if wanted.known:
        shutil.copytree(kept_package(name, wanted.offered, scripts, kept), folder / "srv/repository")
        if wanted.installed != "(none)":
            for file in kept_package(name, wanted.installed, "works", kept).glob("*.deb"):
                shutil.copy(file, folder / "srv/installed")
    else:
        shutil.copytree(kept_package("other", "1.0", "works", kept), folder / "srv/repository")
    if wanted.install == "locked":
        [file] = kept_package("other", "1.0", "holds-lock", kept).glob("*.deb")
        shutil.copy(file, folder / "srv/other.deb")
    if setup.mirrors.server == "file":
        write(folder / "etc/apt/sources.list", SOURCES.format(folder="repository"))
    else:
        sign_index(folder / "srv/repository", folder / "etc/apt/mirror.gpg", setup.mirrors.refresh)
        write(folder / "etc/apt/sources.list", SIGNED_SOURCES)
        write(folder / "etc/apt/apt.conf.d/60mirror", 'Acquire::Retries "0"; Acquire::http::Timeout "5";\n')
    if setup.mirrors.refresh == "unreachable":
        (folder / "srv/repository").rename(folder / "srv/unreachable")
    if wanted.downgrades:
        write(folder / "etc/apt/preferences", 'Package: *\nPin: origin ""\nPin-Priority: 1001\n')
        write(folder / "etc/apt/apt.conf.d/60downgrade", 'APT::Get::allow-downgrades "true";\n')


def _write_tools(folder: Path, setup: Setup, has_systemd: bool) -> None:
    """What precedes the real tools in the search path; for a missing tool, a search path without it."""
    wrappers = folder / "bin"
    shutil.copytree(HERE / "head", wrappers)
    if not has_systemd:
        shutil.copy(MAKERS / "tools/systemctl", wrappers)
    if setup.stick.teamviewer != "unreadable":
        (wrappers / "ls").unlink()
    for tool in setup.tools.killed:
        shutil.copy(MAKERS / "tools/killed", wrappers / tool)
    (folder / "out").mkdir()
    (folder / "board").mkdir()
    if setup.tools.missing:
        (folder / "tools").mkdir()
        for tool in set(TOOLS) - set(setup.tools.missing):
            inside = "/opt/bench/bin" if (wrappers / tool).exists() else os.path.dirname(shutil.which(tool) or "")
            (folder / "tools" / tool).symlink_to(f"{inside}/{tool}")
