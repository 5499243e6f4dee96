"""Model of the front panel's LED controller: what its 14 LEDs show after the bytes that reached it."""

from collections.abc import Iterable
from dataclasses import dataclass, field

FIRST_LED = 0x10
LAST_LED = 0x1D
STEP_TIME = 0x1F  # register, in units of STEP_UNIT
STEP_UNIT = 0.02  # s
NAMES = {0x12: "REMOTE", 0x13: "PASS", 0x14: "FAIL", 0x15: "MAIN"}
COLORS = {0: "off", 1: "blue", 2: "pass", 8: "fail"}
LED_CODES = {name: code for code, name in NAMES.items()}
COLOR_CODES = {name: code for code, name in COLORS.items()}


def led_name(led: int) -> str:
    """The name of a LED that has its own use, otherwise its code."""
    return NAMES.get(led, f"{led:#x}")


def color_name(color: int) -> str:
    """The name of a colour in use, otherwise its code."""
    return COLORS.get(color, f"{color:#x}")


def lit(leds: dict[int, int]) -> dict[str, str]:
    """The LEDs that are lit, by name, with the names of their colours."""
    return {led_name(led): color_name(color) for led, color in leds.items() if color}


@dataclass
class Led:
    """One LED: a steady colour, or a sequence that the controller plays by itself."""

    color: int = 0
    steps: list[list[float]] = field(default_factory=list)  # colour, length (s)
    started: float | None = None  # s, when the sequence was started

    def shown(self, time: float) -> int:
        """The colour at `time` (s)."""
        length = sum(step[1] for step in self.steps)
        if self.started is None or length == 0:
            return self.color
        into = (time - self.started) % length
        for color, duration in self.steps:
            if into < duration:
                return int(color)
            into -= duration
        return int(self.steps[-1][0])


class Panel:
    """The controller takes bytes in pairs: a LED and its command, or the step time register and a duration."""

    def __init__(self) -> None:
        self.leds = {led: Led() for led in range(FIRST_LED, LAST_LED + 1)}
        self.faults: list[str] = []  # bytes that mean nothing to the controller
        self._first: int | None = None
        self._appended: Led | None = None  # the LED whose last step a duration sets

    def send(self, byte: int, time: float) -> None:
        """Takes one byte that was sent at `time` (s)."""
        if self._first is None:
            if byte != STEP_TIME and byte not in self.leds:
                self.faults.append(f"{byte:#04x} is no LED")
                return
            self._first = byte
            return
        first, self._first = self._first, None
        if first == STEP_TIME:
            if self._appended is None:
                self.faults.append("a step time without a step")
                return
            self._appended.steps[-1][1] = byte * STEP_UNIT
            return
        led = self.leds[first]
        mode, color = byte & 0xC0, byte & 0x3F
        if mode == 0x00:
            led.color, led.started = color, None
        elif mode == 0x40:
            led.started = time
        elif mode == 0x80:
            led.steps.clear()
            led.started = None
        else:
            led.steps.append([color, 0.0])
            self._appended = led

    def shown(self, time: float) -> dict[int, int]:
        """The colour of every LED at `time` (s)."""
        return {code: led.shown(time) for code, led in self.leds.items()}

    def pattern(self, time: float) -> dict[str, str]:
        """The LEDs that are lit at `time` (s), by name, with the names of their colours."""
        return lit(self.shown(time))


def panel_after(sent: Iterable[int]) -> Panel:
    """A panel that was sent these bytes, all at once."""
    panel = Panel()
    for byte in sent:
        panel.send(byte, 0)
    return panel
