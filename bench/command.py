"""What the bench's commands have in common."""

import os
import subprocess
import sys
from collections.abc import Callable

from bench.scenario import ScenarioError
from bench.unit import UnitError


def status_of(command: Callable[[], int]) -> int:
    """The status of `command`; each exception becomes one line and its own status, see docs/bench.md."""
    try:
        return command()
    except BrokenPipeError:
        os.dup2(os.open(os.devnull, os.O_WRONLY), sys.stdout.fileno())
        return 1
    except ScenarioError as error:
        print(f"bench: {error}", file=sys.stderr)
        return 2
    except (UnitError, OSError, subprocess.SubprocessError) as error:
        print(f"bench: {error}", file=sys.stderr)
        return 1
    except KeyboardInterrupt:
        return 130
