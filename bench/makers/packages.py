"""Packages, made by dpkg-deb, and the index of a repository that offers them."""

import contextlib
import os
import shutil
import subprocess
import tempfile
from dataclasses import dataclass, field
from pathlib import Path

from bench.makers.files import write, write_script

SOURCES = "deb [trusted=yes] file:/srv/{folder} ./\n"  # apt's line for a repository in /srv
# Folders that dpkg and apt require, below the root of a unit without a package.
DATABASE = [
    "etc/apt/preferences.d",
    "var/cache/apt/archives/partial",
    "var/lib/apt/lists/partial",
    "var/lib/dpkg/info",
    "var/lib/dpkg/updates",
    "var/log/apt",
]


@dataclass
class Package:
    """A package of the instrument with any content."""

    name: str
    version: str
    fields: dict[str, str] = field(default_factory=dict)  # more of the control file's
    scripts: dict[str, str] = field(default_factory=dict)  # lines of the maintainer scripts, by their names
    files: dict[str, str] = field(default_factory=dict)  # texts by path; those below etc/ are configuration files


def build(package: Package, folder: Path) -> Path:
    """Builds `package` into `folder`. Returns its file."""
    with tempfile.TemporaryDirectory(prefix="package-") as name:
        tree = Path(name)
        control = {
            "Package": package.name,
            "Version": package.version,
            "Architecture": "all",
            "Maintainer": "Bench <bench@localhost>",
            **package.fields,
            "Description": "software of the instrument",
        }
        write(tree / "DEBIAN/control", "".join(f"{key}: {value}\n" for key, value in control.items()))
        configuration = "".join(f"/{path}\n" for path in package.files if path.startswith("etc/"))
        if configuration:
            write(tree / "DEBIAN/conffiles", configuration)
        for script, lines in package.scripts.items():
            write_script(tree / "DEBIAN" / script, f"set -e\n{lines}")
        for path, text in package.files.items():
            write(tree / path, text)
        return build_tree(tree, folder)


def build_tree(tree: Path, folder: Path) -> Path:
    """Builds the package whose files lie in `tree` into `folder`. Returns its file."""
    for path in [tree, *tree.rglob("*")]:
        if path.is_dir():
            path.chmod(0o755)
    folder.mkdir(parents=True, exist_ok=True)
    with tempfile.TemporaryDirectory(prefix=".new-", dir=folder) as name:
        # gzip: every dpkg of a unit can unpack it.
        command: list[str | Path] = ["dpkg-deb", "--root-owner-group", "-Zgzip", "--build", tree, name]
        subprocess.run(command, check=True, stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, text=True)
        [file] = Path(name).iterdir()
        return file.rename(folder / file.name)


def raise_version(file: Path, version: str, folder: Path, more: dict[str, str] | None = None) -> Path:
    """Builds the package `file` again as `version` into `folder`, with `more` texts appended to its files."""
    with tempfile.TemporaryDirectory(prefix="package-") as name:
        tree = Path(name) / "tree"
        subprocess.run(["dpkg-deb", "--raw-extract", file, tree], check=True)
        control = (tree / "DEBIAN/control").read_text().splitlines()
        lines = [f"Version: {version}" if line.startswith("Version:") else line for line in control]
        (tree / "DEBIAN/control").write_text("".join(f"{line}\n" for line in lines))
        for path, text in (more or {}).items():
            with (tree / path).open("a") as extended:
                extended.write(text)
        return build_tree(tree, folder)


def write_index(repository: Path) -> None:
    """Writes the index of the packages in the folder `repository`, where apt reads it."""
    # dpkg-scanpackages finds nothing in a folder of another mount namespace.
    scan: list[str | Path] = ["dpkg-scanpackages", "--multiversion", repository]
    done = subprocess.run(scan, cwd="/", check=True, capture_output=True, text=True)
    (repository / "Packages").write_text(done.stdout.replace(f"Filename: {repository}/", "Filename: ./"))


# Maintainer scripts by the value of `package.install` in a scenario.
SCRIPTS = {
    "fails": {"postinst": "exit 1"},
    "interrupted": {"preinst": ": >/run/package-installs\nexec sleep 60"},
    "holds-lock": {"postinst": ": >/run/other-package-installs\nexec sleep 2"},
}


def kept_package(name: str, version: str, scripts: str, kept: Path) -> Path:
    """A folder with the package's .deb and the index of a repository that offers only it. Made if not in `kept`."""
    folder = kept / f"{name}_{version}_{scripts}"
    if folder.exists():
        return folder
    kept.mkdir(parents=True, exist_ok=True)
    work = Path(tempfile.mkdtemp(prefix=".new-", dir=kept))
    try:
        files = {f"etc/{name}.conf": f"version={version}\n", f"opt/{name}/version": f"{version}\n"}
        build(Package(name, version, scripts=SCRIPTS.get(scripts, {}), files=files), work / "repository")
        write_index(work / "repository")
        with contextlib.suppress(OSError):  # another run was faster
            os.rename(work / "repository", folder)
    finally:
        shutil.rmtree(work)
    return folder


def candidate(installed: str, offered: str, downgrades: bool) -> str:
    """The version that apt picks: an older one than the installed only where `downgrades` are configured."""
    older = ["dpkg", "--compare-versions", offered, "lt", installed]
    if downgrades or installed == "(none)" or subprocess.run(older, check=False).returncode != 0:
        return offered
    return installed
