"""Everything observed of a run: the log's records, commands and waits with their times, the panel and its changes."""

import re
import time
from dataclasses import dataclass, field
from pathlib import Path

from bench.panel import Panel
from bench.unit import Files

# First line of a record: time, thread, source position, function. The message is all up to the next first line.
RECORD = re.compile(
    r"^Updater \| (?P<time>\d\d-\d\d-\d{4} \d\d-\d\d-\d\d)\t(?P<thread>\d+)\t(?P<file>\w+\.\w+):(?P<line>\d+)\t"
    r"(?P<function>.+)\n\t\t\t(?P<message>(?:.*\n)(?:(?!Updater \| ).*\n)*)",
    re.MULTILINE,
)


def now() -> float:
    """The clock of all times of a run, s."""
    return time.clock_gettime(time.CLOCK_BOOTTIME)


@dataclass
class Record:
    """One record of the updater's log."""

    time: str
    thread: str
    file: str
    function: str
    message: str

    @property
    def operation(self) -> str:
        """The function's bare name."""
        return re.sub(r"\(.*", "", self.function).split("::")[-1].split()[-1]


def records_of(log: str) -> list[Record]:
    """The whole records of a log."""
    return [
        Record(match["time"], match["thread"], match["file"], match["function"], match["message"][:-1])
        for match in RECORD.finditer(log)
    ]


@dataclass
class Call:
    """One command, or one wait, of the updater. `end` and `status` are None when it never returned."""

    call: str  # system, popen or nanosleep
    thread: str
    start: float  # s
    text: str  # command line
    seconds: int = 0  # asked for by a wait
    real: float = 0.0  # s, that the wait really takes
    rest: tuple[float, float] = (0.0, 0.0)  # of a wait: what remained of `seconds`, from which moment on (s)
    end: float | None = None
    status: int | None = None

    def left(self, moment: float) -> float:
        """How much of the seconds that a wait was asked for remains at `moment` (s)."""
        rest, since = self.rest
        until = self.start + self.real
        return rest * max(0.0, until - moment) / (until - since) if until > since else 0.0


@dataclass
class Change:
    """What the panel shows from `time` (s) on."""

    time: float
    leds: dict[int, int]


@dataclass
class Run:
    """Everything observed so far. `update` reads what is new."""

    files: Files
    log: str = ""
    calls: list[Call] = field(default_factory=list)
    panel: Panel = field(default_factory=Panel)
    sent: list[tuple[float, int]] = field(default_factory=list)  # to the panel: time (s), byte
    changes: list[Change] = field(default_factory=list)
    _offsets: dict[Path, int] = field(default_factory=dict)

    def update(self) -> str:
        """Reads what was appended to the unit's files; returns the new part of the log."""
        for line in self._new_lines(self.files.calls).splitlines():
            self._take_call(line)
        for line in self._new_lines(self.files.panel).splitlines():
            moment, byte = line.split()
            self.sent.append((float(moment), int(byte, 16)))
            self.panel.send(int(byte, 16), float(moment))
            leds = self.panel.shown(float(moment))
            if leds != (self.changes[-1].leds if self.changes else dict.fromkeys(leds, 0)):
                self.changes.append(Change(float(moment), leds))
        text = self._new_lines(self.files.log)
        self.log += text
        return text

    def records(self) -> list[Record]:
        """The log's records."""
        return records_of(self.log)

    def commands(self) -> list[Call]:
        """All commands except those of the panel and the sound, in order."""
        apart = ("i2cset ", "aplay ")
        return [call for call in self.calls if call.call != "nanosleep" and not call.text.startswith(apart)]

    def waits(self) -> list[Call]:
        """The waits, in order, without those of the flashing thread."""
        flashing = {call.thread for call in self.calls if call.call == "nanosleep" and call.seconds == 1}
        return [call for call in self.calls if call.call == "nanosleep" and call.thread not in flashing]

    def _new_lines(self, path: Path) -> str:
        """Whole lines only: the rest comes with the next call."""
        if not path.exists():
            return ""
        with path.open("rb") as file:
            file.seek(self._offsets.get(path, 0))
            data = file.read()
        data = data[: data.rfind(b"\n") + 1]
        self._offsets[path] = self._offsets.get(path, 0) + len(data)
        return data.decode("utf-8", "backslashreplace")

    def _take_call(self, line: str) -> None:
        moment, thread, call, phase, value, text = line.split("\t", 5)
        if phase == "start":
            entry = Call(call, thread, float(moment), text)
            if call == "nanosleep":
                entry.seconds, entry.real, entry.text = int(value), float(text), ""
                entry.rest = float(value), entry.start
            self.calls.append(entry)
            return
        for entry in reversed(self.calls):
            if entry.thread == thread and entry.end is None:
                if phase == "rest":  # the speed has changed
                    entry.rest = float(value), float(moment)
                    entry.real = float(moment) + float(text) - entry.start
                else:
                    entry.end, entry.status = float(moment), int(value)
                return
