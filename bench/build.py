"""Builds what the bench runs."""

import subprocess
import sys
from pathlib import Path

ROOT = Path(__file__).parent.parent
BUILD = ROOT / "build/default"
PACKAGES = ["cmake", "ninja-build", "g++-11", "libgtest-dev", "libgmock-dev"]
PACKAGES += ["util-linux", "iproute2", "openssh-client", "i2c-tools", "alsa-utils", "dpkg-dev", "unzip"]
TARGETS = ["harl-updater", "main-head-driver", "tap", "i2c_bus"]


def build() -> None:
    """Brings the updater and the bench's own programs up to date. Says nothing unless something fails."""
    install = ["scripts/install-packages", *PACKAGES]
    if subprocess.run(install, cwd=ROOT, stdout=sys.stderr, check=False).returncode != 0:
        sys.exit(1)
    commands = [["cmake", "--build", "--preset", "default", "--target", *TARGETS]]
    configured, presets = BUILD / "build.ninja", ROOT / "CMakePresets.json"
    if not configured.exists() or configured.stat().st_mtime < presets.stat().st_mtime:
        commands.insert(0, ["cmake", "--preset", "default"])  # later on the build does so when it needs to
    for command in commands:
        done = subprocess.run(
            command, cwd=ROOT, stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, check=False
        )
        if done.returncode != 0:
            sys.exit(f"{done.stdout}bench: {' '.join(command)} failed with status {done.returncode}")
