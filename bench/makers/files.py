"""Single files of a unit."""

from pathlib import Path


def write(path: Path, text: str, mode: int = 0o644) -> None:
    """Writes a file, line ends as they are in `text`, and the folders above it."""
    path.parent.mkdir(parents=True, exist_ok=True)
    path.write_text(text, newline="")
    path.chmod(mode)


def replace_text(path: Path, text: str) -> None:
    """Replaces a file that others read meanwhile: they find the old text or the new one."""
    part = path.with_name(f"{path.name}.part")
    part.write_text(text)
    part.rename(path)


def write_script(path: Path, lines: str) -> None:
    """Writes an executable shell script of these lines, and the folders above it."""
    write(path, f"#!/bin/sh\n{lines.strip()}\n", 0o755)
