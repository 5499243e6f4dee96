"""Commands that the tests run."""

import os
import shutil
import subprocess
from pathlib import Path

import pytest


def output_of(*command: str | Path, status: int = 0, folder: Path | None = None, **environment: str | Path) -> str:
    """What the command prints, errors included; it must end with the status."""
    done = subprocess.run(
        command,
        cwd=folder,
        env=os.environ | {name: str(value) for name, value in environment.items()},
        stdin=subprocess.DEVNULL,
        stdout=subprocess.PIPE,
        stderr=subprocess.STDOUT,
        text=True,
        check=False,
    )
    assert done.returncode == status, done.stdout
    return done.stdout


def needs(*tools: str) -> pytest.MarkDecorator:
    """Skips the tests where one of the tools is missing."""
    missing = [tool for tool in tools if not shutil.which(tool)]
    return pytest.mark.skipif(bool(missing), reason=f"not installed: {' '.join(missing)}; tests/run installs them")
