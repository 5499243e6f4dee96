"""The result of a scenario: the guest's files and its part of the I2C trace, in the form of a run of the bench."""

import json
import re
from dataclasses import dataclass
from pathlib import Path
from statistics import median

from bench.compare import seen_log
from bench.makers.sounds import SOUNDS, samples
from bench.observation import Run
from bench.runner import Result
from bench.unit import Files, State

# A line of QEMU's log: an event of the board's I2C bus (hw/i2c/trace-events).
EVENT = re.compile(r"i2c_(?P<kind>send|recv) \w+\(addr:0x07\) data:0x(?P<byte>\w\w)")
# A line of the guest kernel's trace: time since boot (s), and the byte it was asked to send (events/smbus/smbus_write).
WRITE = re.compile(r" (?P<time>[\d.]+): smbus_write: i2c-0 a=007 f=\w+ c=(?P<byte>\w+) BYTE ")
PIECE = 400  # bytes of a sound, 25 ms
LAST_PIECES = 8
CLD_EXITED = 1  # waitid(2), shown by the service manager in ExecMainCode; other codes are for signals


@dataclass
class Evidence:
    """Everything about one scenario's run; `before` and `after` are the guest's state lines by their names."""

    result: Result
    asked: list[int]  # the bytes for the panel's controller that the guest's kernel was asked to send
    sent: list[int]  # those that went over the bus
    before: dict[str, str]
    after: dict[str, str]
    identifiers: set[str]  # of the updater's own records in the journal
    package_script: dict[str, float]  # "began", "ended": times of the package's maintainer script, s since the boot
    before_cut: list[str] | None  # the records in the journal of the run before the power cut; None: no cut
    power_cuts: list[float]  # when the power was cut, s since the boot
    flashing: dict[str, list[float]]  # how long phases of it took (s), with the "hand-over" and "direct"

    def flashing_ratio(self) -> float:
        """How many times longer a phase of the flashing takes with the hand-over."""
        return median(self.flashing["hand-over"]) / median(self.flashing["direct"])

    def remarks(self) -> list[str]:
        """Other measurements, a line each."""
        lines = []
        if self.flashing:
            lines.append(
                f"A phase of the flashing: {median(self.flashing['hand-over']):.2f} s with the hand-over,"
                f" {median(self.flashing['direct']):.2f} s without, {self.flashing_ratio():.2f} times as long"
            )
        if self.before_cut is not None:
            lines.append(f"Of the run before the power cut the journal has {len(self.before_cut)} records")
        return lines


def read_bus(trace: Path) -> list[list[int]]:
    """The bytes sent over the bus, in parts: before the guest's first mark (a read), between marks, after the last."""
    parts: list[list[int]] = [[]]
    for match in EVENT.finditer(trace.read_text()):
        if match["kind"] == "recv":
            parts.append([])
        else:
            parts[-1].append(int(match["byte"], 16))
    return parts


def read_state(file: Path) -> dict[str, str]:
    """A file of NAME=VALUE lines."""
    return dict(line.split("=", 1) for line in file.read_text().splitlines())


def read_journal(file: Path, log: Path) -> set[str]:
    """Writes the updater's own lines of the journal to `log`, without those of its children and systemd.

    Returns the identifiers of those lines. The updater's process is the one that printed the banner.
    """
    entries = [json.loads(line) for line in file.read_text().splitlines()]
    texts = [entry["MESSAGE"] for entry in entries]
    # journalctl gives a message with unprintable characters, such as a carriage return, as a list of bytes.
    lines = [text if isinstance(text, str) else bytes(text).decode("utf-8", "backslashreplace") for text in texts]
    process = next((entry["_PID"] for entry, line in zip(entries, lines) if "TavrenUpdater version: " in line), None)
    own = [(entry, line) for entry, line in zip(entries, lines) if entry.get("_PID") == process]
    log.write_text("".join(f"{line}\n" for _, line in own), newline="")
    return {entry.get("SYSLOG_IDENTIFIER", "") for entry, _ in own}


def read_words(file: Path) -> list[list[str]]:
    """The words of each line; no lines without the file."""
    return [line.split() for line in file.read_text().splitlines()] if file.exists() else []


def read_before_cut(folder: Path) -> list[str] | None:
    """The records in the journal of the run before the power cut, as the bench compares them; None: no cut."""
    journal = folder / "journal-before-cut"
    if not journal.exists():
        return None
    files = Files(log=folder / "log-before-cut", calls=folder / "none", panel=folder / "none")
    read_journal(journal, files.log)
    run = Run(files)
    run.update()
    return seen_log(run)


def heard(recording: Path) -> list[str]:
    """The sounds that the sound card played to their end, by file name.

    The loopback card may drop samples when its timer is late: nine of ten pieces must be there, in order, and one of
    the last ones.
    """
    data = recording.read_bytes()
    names = []
    for name in SOUNDS:
        sound = samples(name)
        pieces = [sound[start : start + PIECE] for start in range(0, len(sound), PIECE)]
        position, found = 0, []
        for index, piece in enumerate(pieces):
            if (place := data.find(piece, position)) >= 0:
                position = place + PIECE
                found.append(index)
        if len(found) >= 0.9 * len(pieces) and found[-1] >= len(pieces) - LAST_PIECES:
            names.append(name)
    return names


def read(folder: Path, sent: list[int]) -> Evidence:
    """Reads the result of one scenario in `folder`; `sent` are the bytes that went over the bus meanwhile."""
    before, after = read_state(folder / "before"), read_state(folder / "after")
    files = Files(log=folder / "log", calls=folder / "calls", panel=folder / "panel")
    identifiers = read_journal(folder / "journal", files.log)
    writes = list(WRITE.finditer((folder / "i2c").read_text()))
    files.panel.write_text("".join(f"{write['time']} {byte:02x}\n" for write, byte in zip(writes, sent)))
    run = Run(files)
    run.update()
    code = int(after["ExecMainStatus"])
    state = State(
        package=after["package"],
        board=after["board"],
        marker=after["marker"] == "yes",
        stick=after["stick"] == "yes",
        harl=after["harl"],
        sounds=heard(folder / "heard.raw"),
    )
    result = Result(
        run=run,
        state=state,
        status=code if int(after["ExecMainCode"]) == CLD_EXITED else -code,
        seconds=float(after["uptime"]) - float(before["uptime"]),
    )
    package_script = {name: float(moment) for name, moment in read_words(folder / "package-script")}
    flashing: dict[str, list[float]] = {}
    for name, begin, end in read_words(folder / "flashing"):
        flashing.setdefault(name, []).append(float(end) - float(begin))
    power_cuts = [float(moment) for [moment] in read_words(folder / "power-cuts")]
    asked = [int(write["byte"], 16) for write in writes]
    kept = read_before_cut(folder)
    return Evidence(
        result, asked, sent, before, after, identifiers, package_script, kept, power_cuts, flashing
    )
