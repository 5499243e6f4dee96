"""The files of a stick."""

import io
import os
import zipfile
from collections.abc import Callable
from pathlib import Path

from bench.makers.board import version_text
from bench.makers.files import write

VERSIONS = "debs/QUORB/armhf"
TEAMVIEWER = "debs/installTV"
PREFIX = "quorb"  # of a version directory's name
PAYLOAD = 200_000  # bytes; more than a full board has left


def version_of(directory: str) -> str:
    """The version in the name of a version directory."""
    return directory[len(PREFIX) :]


def zip_archive(version: str) -> bytes:
    """An upgrade archive: the board's new version file, and data that cannot be compressed."""
    file = io.BytesIO()
    with zipfile.ZipFile(file, "w") as archive:
        archive.writestr("version.txt", version_text(version))
        archive.writestr("firmware.bin", os.urandom(PAYLOAD))
    return file.getvalue()


def version_file_archive(version: str) -> bytes:
    """The archive of a unit without unzip: the new version file itself."""
    return version_text(version).encode()


def write_stick(
    folder: Path,
    directories: list[str],
    script: str,
    archive: Callable[[str], bytes] = zip_archive,
    teamviewer: str = "absent",
) -> None:
    """Writes the files of a stick into `folder`.

    @param directories  names of the version directories, "quorb2.2.0" and the like
    @param script       unzipUpgrade.sh, which the board runs
    @param archive      makes OSUpgrade.zip for a version
    @param teamviewer   what debs/installTV is: "absent", a "directory", otherwise a file
    """
    (folder / VERSIONS).mkdir(parents=True)
    for directory in directories:
        write(folder / VERSIONS / directory / "unzipUpgrade.sh", script, 0o755)
        (folder / VERSIONS / directory / "OSUpgrade.zip").write_bytes(archive(version_of(directory)))
    if teamviewer == "directory":
        (folder / TEAMVIEWER).mkdir()
    elif teamviewer != "absent":
        write(folder / TEAMVIEWER, "")
