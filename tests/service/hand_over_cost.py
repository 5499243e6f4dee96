"""Usage: hand_over_cost.py HAND_OVER [PAIRS]

Measures the cost of the hand-over: the CPU time of a LED command, including the updater's shell, in turn through the
hand-over and directly. The bus is absent; the real tool does the rest of its work. Fails above the allowed ratio.
"""

import os
import shutil
import statistics
import sys
import tempfile
from pathlib import Path

PAIRS = 300
LARGEST_RATIO = 1.6
TOOL = "/usr/sbin/i2cset"


def cpu_time(line: str, environment: dict[str, str]) -> float:
    """The CPU time (ms) of a command line, with that of its processes."""
    quiet = [(os.POSIX_SPAWN_OPEN, number, "/dev/null", os.O_RDWR, 0) for number in (0, 1, 2)]
    process = os.posix_spawn("/bin/sh", ["sh", "-c", line], environment, file_actions=quiet)
    _, _, usage = os.wait4(process, 0)
    return float(usage.ru_utime + usage.ru_stime) * 1000


def main() -> int:
    """Measures, prints and compares with the limit."""
    if len(sys.argv) < 2:
        sys.exit(__doc__)
    hand_over = sys.argv[1]
    pairs = int(sys.argv[2]) if len(sys.argv) > 2 else PAIRS
    if not Path(TOOL).exists():
        sys.exit("hand_over_cost: no i2c-tools here")
    with tempfile.TemporaryDirectory(prefix="hand-over-cost-") as name:
        folder = Path(name)
        shutil.copy(hand_over, folder / "i2cset")
        (folder / "run").mkdir()
        path = "/usr/sbin:/usr/bin:/sbin:/bin"
        through = {"PATH": f"{folder}:{path}", "RUNTIME_DIRECTORY": str(folder / "run")}
        line = "i2cset {0}-y 0 0x07 0x12 c ; i2cset {0}-y 0 0x07 0x1 c"
        cpu_time(line.format(""), through)  # the first call of a run finds out the option
        times = [
            (cpu_time(line.format("-a "), {"PATH": path}), cpu_time(line.format(""), through)) for _ in range(pairs)
        ]
    direct, handed = (statistics.median(column) for column in zip(*times))
    ratio = handed / direct
    print(f"{pairs} pairs: {direct:.2f} ms directly, {handed:.2f} ms through the hand-over: {ratio:.2f} times")
    return 0 if ratio <= LARGEST_RATIO else 1


if __name__ == "__main__":
    sys.exit(main())
