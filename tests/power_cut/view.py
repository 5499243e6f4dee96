"""What the unit sees of its disk: disks that it cannot distinguish need only one run."""

import hashlib
import os
import re
import stat
import subprocess
from pathlib import Path

# Ignored, below the disk's root: what is mounted over or recreated at each start, what nobody reads or no update
# writes, and apt's caches, which apt rebuilds when they do not fit.
UNREAD = re.compile(
    r"/work|/root/(dev|proc|run|srv|sys|tmp|usr|var/log|var/lib/systemd"
    r"|etc/(alternatives|group|machine-id|passwd|\.#.*)|var/lib/dpkg/(available|lock.*|status-old)"
    r"|var/cache/apt/\w+\.bin)"
)
# Of these only their presence counts, not their names or contents: what dpkg begins again, its journal of its steps
# (the state of the packages shows that), and the logs that give-back keeps.
SOME = re.compile(
    r".*(?P<kind>\.dpkg-(new|tmp)|-new|dpkg/tmp\.ci/|dpkg/updates/(tmp\.i|(?=\d))|lib/harl-updater/(?=.*\.log)).*"
)
# The many files of the package differ only in their number: which of them is broken is one case, not forty.
NUMBER = re.compile(r"(?<=part)\d+")


def package_states(root: Path, packages: list[str]) -> str:
    """State and version of the packages in the database of a unit's `root`."""
    form = "--showformat=${Package} ${db:Status-Eflag} ${db:Status-Status} ${Version}\n"
    command = ["dpkg-query", f"--admindir={root}/var/lib/dpkg", "--show", form, *packages]
    done = subprocess.run(command, capture_output=True, text=True, check=False)
    return ", ".join(done.stdout.replace(" ok ", " ").splitlines())


def digest(top: Path) -> str:
    """A hash of what a run sees on the disk mounted at `top`: names, modes and contents, except for the above."""
    return hashlib.sha256(repr(sorted(_entries(top))).encode()).hexdigest()


def _entries(top: Path) -> set[tuple[str, int, bytes]]:
    """Path, mode, and a hash of the content."""
    found = set()
    for folder, folders, files in os.walk(top):
        below = folder.removeprefix(str(top))
        folders[:] = [name for name in folders if not UNREAD.fullmatch(f"{below}/{name}")]
        for path in (f"{below}/{name}" for name in (*folders, *files)):
            if UNREAD.fullmatch(path):
                continue
            if kind := SOME.fullmatch(path):
                found.add((kind["kind"], 0, b""))
                continue
            file = f"{top}{path}"
            mode = os.lstat(file).st_mode
            content = b""
            if stat.S_ISLNK(mode):
                content = os.fsencode(os.readlink(file))
            elif stat.S_ISREG(mode):
                content = Path(file).read_bytes()
            if number := NUMBER.search(path):
                content = content.replace(number[0].encode(), b"")
            found.add((NUMBER.sub("", path), mode, hashlib.sha256(content).digest()))
    return found
