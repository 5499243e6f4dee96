"""The packages of the real unit's head and the repository that offers them; each is built once and kept."""

import contextlib
import os
import shutil
import subprocess
import tempfile
from pathlib import Path

CONTROL = """Package: {name}
Version: {version}
Architecture: all
Maintainer: Bench <bench@localhost>
Description: software of the instrument
"""

# Maintainer scripts by what `package.install` in a scenario says.
SCRIPTS = {
    "fails": {"postinst": "#!/bin/sh\nexit 1\n"},
    "interrupted": {"preinst": "#!/bin/sh\n: >/run/package-installs\nexec sleep 60\n"},
    "holds-lock": {"postinst": "#!/bin/sh\n: >/run/other-package-installs\nexec sleep 2\n"},
}


def package(name: str, version: str, scripts: str, kept: Path) -> Path:
    """A folder with the package's .deb and the index of a repository that offers just it. Made when not in `kept`."""
    folder = kept / f"{name}_{version}_{scripts}"
    if folder.exists():
        return folder
    kept.mkdir(parents=True, exist_ok=True)
    work = Path(tempfile.mkdtemp(prefix=".new-", dir=kept))
    try:
        (work / "repository").mkdir()
        _build(name, version, scripts, work)
        with contextlib.suppress(OSError):  # another run was faster
            os.rename(work / "repository", folder)
    finally:
        shutil.rmtree(work)
    return folder


def _build(name: str, version: str, scripts: str, work: Path) -> None:
    tree = work / "tree"
    files = {
        "DEBIAN/control": CONTROL.format(name=name, version=version),
        "DEBIAN/conffiles": f"/etc/{name}.conf\n",
        f"etc/{name}.conf": f"version={version}\n",
        f"opt/{name}/version": f"{version}\n",
    }
    files |= {f"DEBIAN/{script}": text for script, text in SCRIPTS.get(scripts, {}).items()}
    for path, text in files.items():
        (tree / path).parent.mkdir(parents=True, exist_ok=True)
        (tree / path).write_text(text)
        (tree / path).chmod(0o755 if text.startswith("#!") else 0o644)
    for path in [tree, *tree.rglob("*")]:
        if path.is_dir():
            path.chmod(0o755)
    repository = work / "repository"
    build = ["dpkg-deb", "--root-owner-group", "--build", tree, repository]
    subprocess.run(build, check=True, stdout=subprocess.DEVNULL)
    with (repository / "Packages").open("wb") as index:
        subprocess.run(["dpkg-scanpackages", "."], cwd=repository, check=True, stdout=index, stderr=subprocess.DEVNULL)
