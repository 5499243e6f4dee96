"""The inputs of a boot of the unit: the guest's program, packages, stick, keys, and a folder for each scenario."""

import hashlib
import re
import shutil
import subprocess
import tarfile
import tempfile
from dataclasses import replace
from pathlib import Path

from bench.makers.board import VERSION_FILE, version_text, write_version
from bench.makers.files import write
from bench.makers.packages import SOURCES, Package, build, raise_version, write_index
from bench.makers.sounds import write_sounds
from bench.makers.sticks import write_stick, zip_archive
from target.plan import Plan, PlanError, Settings

ROOT = Path(__file__).parent.parent
BOARD_VERSION = "2.2.0"  # on the stick

HARL = """[Unit]
Description=Instrument application
[Service]
ExecStart=/bin/sleep infinity
[Install]
WantedBy=multi-user.target
"""


def run(*command: str | Path) -> None:
    """Runs a tool of the host, silently. Raises CalledProcessError."""
    subprocess.run(command, check=True, stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, text=True)


def head_package(version: str, settings: Settings, depends: str = "") -> Package:
    """The head's package of `version`; a maintainer script that takes time notes when it begins and ends."""
    files = {f"opt/solvik4/part{number}": f"{version}\n" * 1000 for number in range(1, settings.package_files)}
    package = Package("solvik4-rh", version, files={"opt/solvik4/version": f"{version}\n", **files})
    if depends:
        package.fields["Depends"] = depends
    if settings.script_seconds:
        note = 'echo "{}" "$(cut -d " " -f 1 /proc/uptime)" >> /run/package-script'
        lines = [note.format("began")]
        # A tool that keeps an endless line in memory is killed.
        lines += ["tail /dev/zero || true"] if settings.event == "out-of-memory" else []
        # It prints more after its long work, to whoever still reads.
        lines += [f"sleep {settings.script_seconds}", "echo set up", note.format("ended")]
        package.scripts["postinst"] = "\n".join(lines)
    return package


def package_version(package: Path) -> str:
    """The version of a package file."""
    return subprocess.check_output(["dpkg-deb", "--field", package, "Version"], text=True).strip()


def write_scenario(folder: Path, plan: Plan, updater: Path, speed: float, again: bool) -> None:
    """Writes the folder of a scenario: its settings, the installed package and the repository."""
    setup = plan.like.setup
    repository = folder / "repository"
    depends = ""
    if plan.settings.needs_newer_updater:
        newer = f"{package_version(updater)}+newer"
        depends = f"harl-updater (>= {newer})"
        raise_version(updater, newer, repository)
    at_once = replace(plan.settings, event="nothing", script_seconds=0)
    build(head_package(setup.package.installed, at_once), folder).rename(folder / "installed.deb")
    build(head_package(setup.package.offered, plan.settings, depends), repository)
    write_index(repository)
    write_version(folder / "board", setup.board.installed)
    if plan.settings.board_script_limit and speed > 1:
        build_hand_over(folder / "hand-over", plan.settings.board_script_limit)
    settings = {
        "mirrors": setup.mirrors.refresh,
        "board_link": setup.board.link,
        "board_script": setup.board.script,
        "marker": "yes" if setup.head.marker else "no",
        "event": "nothing" if again else plan.settings.event,  # see plan.py
        "power_cuts": "" if again else " ".join(map(str, plan.settings.power_cuts)),
        "keep_journal": "yes" if plan.settings.is_cut() else "no",  # on the disk
        "keep_head": "yes" if again else "no",  # the head and the board stay as the power cut left them
        "times_flashing": "yes" if plan.settings.times_flashing else "no",
        "speed": str(speed),  # how many times shorter the updater's waits are
        "shortest_wait": str(plan.settings.shortest_wait if speed > 1 else 1),
        "waits": str(round(sum(plan.like.expect.waits) / speed)),  # s, that they take
    }
    (folder / "settings").write_text("".join(f"{key}='{value}'\n" for key, value in settings.items()))


def write_stick_image(image: Path, folder: Path, never_returns: bool) -> None:
    """Writes the stick: a FAT file system with the board's upgrade files. `folder` is for temporary files."""
    archive = zip_archive(BOARD_VERSION)
    # The image has no unzip.
    text = version_text(BOARD_VERSION).replace("\t", "\\t").replace("\r\n", "\\r\\n")
    script = (
        "#!/bin/sh\nset -e\n"
        f"echo '{hashlib.sha256(archive).hexdigest()}  /root/OSUpgrade.zip' | sha256sum --check --status -\n"
        f"printf '{text}' > /{VERSION_FILE}.new\n"
        f"mv /{VERSION_FILE}.new /{VERSION_FILE}\n"
    )
    if never_returns:
        script = "#!/bin/sh\nwhile :; do sleep 60; done\n"
    write_stick(folder, [f"quorb{BOARD_VERSION}"], script, lambda _: archive)
    with image.open("wb") as file:
        file.truncate(8 << 20)
    run("mkfs.vfat", image)
    run("mcopy", "-s", "-i", image, folder / "debs", "::")
    shutil.rmtree(folder)


def write_head(folder: Path, image: Path) -> None:
    """Writes the head's own files, which all scenarios share."""
    write_sounds(folder)
    ssh = folder / "root/.ssh"
    ssh.mkdir()
    run("ssh-keygen", "-q", "-t", "ed25519", "-N", "", "-f", ssh / "id_ed25519")
    shutil.copy(ssh / "id_ed25519.pub", ssh / "authorized_keys")
    host_key = " ".join((image / "ssh_host_ed25519_key.pub").read_text().split()[:2])
    (ssh / "known_hosts").write_text(f"192.168.9.2 {host_key}\n")
    write(folder / "etc/systemd/system/harl.service", HARL)
    write(folder / "etc/apt/sources.list", SOURCES.format(folder="repository"))


def build_recorder(library: Path) -> None:
    """Builds the bench's recorder of commands and waits for the unit."""
    compiler = ["arm-linux-gnueabihf-g++-11", "-std=c++17", "-O2", "-shared", "-fPIC"]
    run(*compiler, "-o", library, ROOT / "bench/call_recorder.cpp", "-ldl")


def build_hand_over(program: Path, limit: int) -> None:
    """Builds the hand-over with `limit` (s) for the board's script; everything else is as shipped."""
    with tempfile.TemporaryDirectory(prefix="hand-over-") as name:
        folder = Path(name)
        shutil.copy(ROOT / "service/hand_over.cpp", folder)
        shipped = (ROOT / "service/limits.h").read_text()
        row = r'(\{"board-script", "ssh", nullptr, )\d+, \d+'
        table, count = re.subn(row, rf"\g<1>{limit}, {limit}", shipped)
        if count != 1:
            raise PlanError("service/limits.h: has not the one row for the board's script: see target/inputs.py")
        write(folder / "limits.h", table)
        options = ["-std=c++17", "-O2", "-fno-exceptions", "-fno-rtti", "-static", "-s"]
        run("arm-linux-gnueabihf-g++-11", *options, "-o", program, folder / "hand_over.cpp")


def write_input(
    disk: Path, folder: Path, image: Path, updater: Path, plans: list[Plan], speed: float, again: bool
) -> None:
    """Writes the disk with `plans` for the unit. `again`: the run after a power cut."""
    shutil.rmtree(folder, ignore_errors=True)
    folder.mkdir()
    write_head(folder / "root", image)
    for script in {plan.like.setup.board.script for plan in plans}:
        write_stick_image(folder / f"stick-{script}.img", folder / "stick", script == "never-returns")
    build_recorder(folder / "call_recorder.so")
    shutil.copy(Path(__file__).parent / "guest/main", folder / "main")
    shutil.copy(updater, folder / "harl-updater.deb")
    (folder / "names").write_text("".join(f"{plan.name}\n" for plan in plans))
    for plan in plans:
        write_scenario(folder / "scenarios" / plan.name, plan, updater, speed, again)

    def owned_by_root(entry: tarfile.TarInfo) -> tarfile.TarInfo:
        entry.uid = entry.gid = 0
        entry.uname = entry.gname = "root"
        return entry

    with tarfile.open(disk, "w") as archive:
        archive.add(folder, ".", filter=owned_by_root)
    shutil.rmtree(folder)
    with disk.open("ab") as file:
        file.truncate(-(-disk.stat().st_size // (1 << 20)) << 20)
