"""What a boot carries into the unit: the guest's program, packages, stick, keys, and a folder for each scenario."""

import math
import os
import shutil
import struct
import subprocess
import tarfile
from pathlib import Path

from target.plan import Plan

ROOT = Path(__file__).parent.parent
RATE = 8000  # Hz, of both sounds; the loopback card takes it unchanged
SOUND_SECONDS = 2
# Each sound is a sweep, so that every piece of it is found nowhere else: its first and its last frequency, Hz.
SOUNDS = {"SND_RESULT_PASS.wav": (300, 900), "SND_RESULT_FAIL.wav": (1000, 1600)}
BOARD_VERSION = "2.2.0"  # on the stick
ARCHIVE_SIZE = 200_000  # bytes

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


def samples(name: str) -> bytes:
    """The sound file `name` as its samples: 16 bit, mono."""
    first, last = SOUNDS[name]
    count = RATE * SOUND_SECONDS
    turns = [(first + (last - first) * i / count / 2) * i / RATE for i in range(count)]
    return b"".join(struct.pack("<h", round(8000 * math.sin(2 * math.pi * turn))) for turn in turns)


def write_sound(file: Path) -> None:
    """Writes the sound file that `file` names."""
    data = samples(file.name)
    header = struct.pack("<4sI8sIHHIIHH", b"RIFF", 36 + len(data), b"WAVEfmt ", 16, 1, 1, RATE, 2 * RATE, 2, 16)
    file.write_bytes(header + struct.pack("<4sI", b"data", len(data)) + data)


def write_package(folder: Path, version: str, depends: str, seconds: int, use_up_memory: bool) -> None:
    """Writes the head's package of `version` into `folder`; its maintainer script tells that it began and ended."""
    tree = folder / "tree"
    (tree / "DEBIAN").mkdir(parents=True)
    (tree / "opt/solvik4").mkdir(parents=True)
    (tree / "opt/solvik4/version").write_text(version + "\n")
    control = f"Package: solvik4-rh\nVersion: {version}\nArchitecture: armhf\n"
    control += "Maintainer: Target test <test@target.invalid>\n"
    control += f"Depends: {depends}\n" if depends else ""
    (tree / "DEBIAN/control").write_text(control + "Description: instrument package of the target test\n")
    script = tree / "DEBIAN/postinst"
    if seconds:
        note = 'echo "{}" "$(cut -d " " -f 1 /proc/uptime)" >> /run/package-script'
        lines = ["#!/bin/sh", "set -e", note.format("began")]
        # A tool that keeps a line without an end in memory is killed for it.
        lines += ["tail /dev/zero || true"] if use_up_memory else []
        # It goes on talking after its long work, to whoever listens then.
        lines += [f"sleep {seconds}", "echo set up", note.format("ended")]
        script.write_text("".join(f"{line}\n" for line in lines))
        script.chmod(0o755)
    run("dpkg-deb", "--root-owner-group", "-Zgzip", "--build", tree, folder)
    shutil.rmtree(tree)


def write_newer_updater(package: Path, folder: Path) -> None:
    """Writes `package` (harl-updater) with a newer version into `folder`."""
    tree = folder / "tree"
    run("dpkg-deb", "--raw-extract", package, tree)
    control = tree / "DEBIAN/control"
    lines = [line + "+newer" if line.startswith("Version:") else line for line in control.read_text().splitlines()]
    control.write_text("\n".join(lines) + "\n")
    run("dpkg-deb", "--root-owner-group", "-Zgzip", "--build", tree, folder)
    shutil.rmtree(tree)


def package_version(package: Path) -> str:
    """The version of a package file."""
    return subprocess.check_output(["dpkg-deb", "--field", package, "Version"], text=True).strip()


def write_scenario(folder: Path, plan: Plan, updater: Path, speed: float, again: bool) -> None:
    """Writes the folder of a scenario: its settings, the installed package and the repository."""
    unit = plan.like.unit
    repository = folder / "repository"
    repository.mkdir(parents=True)
    depends = ""
    if plan.settings["needs_newer_updater"]:
        depends = f"harl-updater (>= {package_version(updater)}+newer)"
        write_newer_updater(updater, repository)
    write_package(folder, unit["package"]["installed"], "", 0, False)
    os.rename(folder / f"solvik4-rh_{unit['package']['installed']}_armhf.deb", folder / "installed.deb")
    use_up_memory = plan.settings["event"] == "out-of-memory"
    write_package(repository, unit["package"]["offered"], depends, plan.settings["script_seconds"], use_up_memory)
    with (repository / "Packages").open("w") as index:
        scan = ["dpkg-scanpackages", "--multiversion", "."]
        subprocess.run(scan, cwd=repository, stdout=index, stderr=subprocess.PIPE, text=True, check=True)
    settings = {
        "mirrors": unit["mirrors"]["refresh"],
        "board_version": unit["board"]["installed"],
        "board_link": unit["board"]["link"],
        "marker": "yes" if unit["head"]["marker"] else "no",
        "event": "nothing" if again else plan.settings["event"],  # see plan.py
        "keep_head": "yes" if again else "no",  # the head is left as the power cut left it
        "speed": str(speed),  # how many times shorter the updater's waits are
        "waits": str(round(sum(plan.like.expect["waits"]) / speed)),  # s, that they take
    }
    (folder / "settings").write_text("".join(f"{key}='{value}'\n" for key, value in settings.items()))


def write_stick(image: Path, folder: Path) -> None:
    """Writes the stick: a FAT file system with the board's upgrade files. `folder` is for the files on their way."""
    version = folder / f"debs/QUORB/armhf/quorb{BOARD_VERSION}"
    version.mkdir(parents=True)
    archive = version / "OSUpgrade.zip"
    archive.write_bytes(os.urandom(ARCHIVE_SIZE))
    checksum = subprocess.check_output(["sha256sum", archive], text=True).split()[0]
    (version / "unzipUpgrade.sh").write_text(
        "#!/bin/sh\nset -e\n"
        f"echo '{checksum}  /root/OSUpgrade.zip' | sha256sum --check --status -\n"
        f"printf 'Name\\tQuorb\\r\\nBrimvale\\t{BOARD_VERSION}\\r\\n' > /root/App/AppExe/version.txt\n"
    )
    with image.open("wb") as file:
        file.truncate(8 << 20)
    run("mkfs.vfat", image)
    run("mcopy", "-s", "-i", image, folder / "debs", "::")
    shutil.rmtree(folder)


def write_head(folder: Path, image: Path) -> None:
    """Writes the files of the head's own that all scenarios share."""
    sounds = folder / "root/RESOURCES/SOUNDS"
    sounds.mkdir(parents=True)
    for name in SOUNDS:
        write_sound(sounds / name)
    ssh = folder / "root/.ssh"
    ssh.mkdir()
    run("ssh-keygen", "-q", "-t", "ed25519", "-N", "", "-f", ssh / "id_ed25519")
    shutil.copy(ssh / "id_ed25519.pub", ssh / "authorized_keys")
    host_key = " ".join((image / "ssh_host_ed25519_key.pub").read_text().split()[:2])
    (ssh / "known_hosts").write_text(f"192.168.9.2 {host_key}\n")
    for path, text in (
        ("etc/systemd/system/harl.service", HARL),
        ("etc/apt/sources.list", "deb [trusted=yes] file:/srv/repository ./\n"),
    ):
        (folder / path).parent.mkdir(parents=True, exist_ok=True)
        (folder / path).write_text(text)


def build_recorder(library: Path) -> None:
    """Builds the bench's recorder of commands and waits for the unit."""
    compiler = ["arm-linux-gnueabihf-g++-11", "-std=c++17", "-O2", "-shared", "-fPIC"]
    run(*compiler, "-o", library, ROOT / "bench/call_recorder.cpp", "-ldl")


def write_input(
    disk: Path, folder: Path, image: Path, updater: Path, plans: list[Plan], speed: float, again: bool
) -> None:
    """Writes the disk that brings `plans` into the unit. `again`: the run after a power cut."""
    shutil.rmtree(folder, ignore_errors=True)
    folder.mkdir()
    write_head(folder / "root", image)
    write_stick(folder / "stick.img", folder / "stick")
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
