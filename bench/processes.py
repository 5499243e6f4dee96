"""The processes of this machine."""

import contextlib
from collections.abc import Iterator
from pathlib import Path


def children(process: int) -> list[int]:
    """The children of all its threads, none when it has ended."""
    found: list[int] = []
    with contextlib.suppress(OSError):
        for thread in Path(f"/proc/{process}/task").iterdir():
            found += map(int, (thread / "children").read_text().split())
    return found


def descendants(process: int) -> Iterator[int]:
    """Its children, their children and so on, each before its own."""
    for child in children(process):
        yield child
        yield from descendants(child)


def find(process: int, name: str) -> int | None:
    """The first of the descendants of `process` that runs the program `name`."""
    for candidate in descendants(process):
        with contextlib.suppress(OSError):
            if Path(f"/proc/{candidate}/comm").read_text() == f"{name}\n":
                return candidate
    return None


def words(process: int) -> list[str]:
    """Its command line, empty when it has ended."""
    with contextlib.suppress(OSError):
        return Path(f"/proc/{process}/cmdline").read_text(errors="replace").split("\0")[:-1]
    return []
