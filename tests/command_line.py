"""How CTest starts a test: the build folder or a program first, then words for unittest."""

import sys
from pathlib import Path
from typing import NoReturn

SKIPPED = 77  # cmake/python_test.cmake


def take_word() -> str:
    """Takes the first word off the command line. Ends the test with its usage when there is none."""
    if len(sys.argv) < 2:
        sys.exit(sys.modules["__main__"].__doc__)
    return sys.argv.pop(1)


def take_path() -> Path:
    """Takes the first word off the command line, a path."""
    return Path(take_word()).resolve()


def skip(why: str) -> NoReturn:
    """Ends the test as skipped."""
    print(f"skipped: {why}")
    sys.exit(SKIPPED)
