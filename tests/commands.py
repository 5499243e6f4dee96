"""Commands that the tests run."""

import os
import shutil
import subprocess
from collections.abc import Mapping
from pathlib import Path

import pytest

Result = subprocess.CompletedProcess[str]


def run_command(
    *command: str | Path,
    folder: Path | None = None,
    environment: Mapping[str, str] | None = None,
    text: str = "",
    errors: int = subprocess.PIPE,
) -> Result:
    """What the command does within ten minutes, with the text as its input."""
    return subprocess.run(
        command, cwd=folder, env=environment, input=text, stdout=subprocess.PIPE, stderr=errors, text=True, timeout=600
    )


def output_of(*command: str | Path, status: int = 0, folder: Path | None = None, **variables: str | Path) -> str:
    """What the command prints, errors included; it must end with the status."""
    environment = os.environ | {name: str(value) for name, value in variables.items()}
    done = run_command(*command, folder=folder, environment=environment, errors=subprocess.STDOUT)
    assert done.returncode == status, done.stdout
    return done.stdout


def needs(*tools: str) -> pytest.MarkDecorator:
    """Skips the tests where one of the tools is missing."""
    missing = [tool for tool in tools if not shutil.which(tool)]
    return pytest.mark.skipif(bool(missing), reason=f"not installed: {' '.join(missing)}; tests/run installs them")
