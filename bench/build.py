"""Builds what the bench runs."""

import subprocess
import sys
from pathlib import Path

ROOT = Path(__file__).parent.parent
BUILD = ROOT / "build/default"
TARGETS = ["harl-updater", "main-head", "call_recorder", "i2c_bus"]


def build(*more: str) -> None:
    """Brings the updater, the bench's own programs and the targets `more` up to date; installs what this requires.

    Ends the program when something fails.
    """
    if not (BUILD / TARGETS[0]).exists():
        print("bench: building the updater, for the first time in this checkout", file=sys.stderr)
    if subprocess.run(["scripts/install-bench-packages"], cwd=ROOT, stdout=sys.stderr, check=False).returncode != 0:
        sys.exit(1)
    commands = [["cmake", "--build", "--preset", "default", "--target", *TARGETS, *more]]
    configured, presets = BUILD / "build.ninja", ROOT / "CMakePresets.json"
    if not configured.exists() or configured.stat().st_mtime < presets.stat().st_mtime:
        commands.insert(0, ["cmake", "--preset", "default"])  # later the build does this itself when necessary
    for command in commands:
        done = subprocess.run(
            command, cwd=ROOT, stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, check=False
        )
        if done.returncode != 0:
            sys.exit(f"{done.stdout}bench: {' '.join(command)} failed with status {done.returncode}")
