"""Usage: scripts/python -m bench.show.panel FOLDER

Draws the front panel as the operator sees it. The command writes a picture of each outcome, of the flashing and of
the dark panel into FOLDER: docs/panel has those of the operator's page.
"""

import sys
from pathlib import Path

from bench.outcomes import CHECK_FAILED, INSTALLATION_FAILED, UP_TO_DATE, UPDATED
from bench.panel import COLOR_CODES, LED_CODES, color_name, led_name, panel_after

FILLS = {"off": "#ffffff", "blue": "#1f6feb", "pass": "#1a9c3e", "fail": "#d1242f"}
OTHER_FILL = "#a020a0"
# The mark on a lit LED, so that colours differ in black and white too: a dot, a tick, a cross.
MARKS = {
    "blue": '<circle r="4" fill="#ffffff"/>',
    "pass": '<path d="M-6 0 L-2 5 L6 -5" fill="none" stroke="#ffffff" stroke-width="3"/>',
    "fail": '<path d="M-5 -5 L5 5 M-5 5 L5 -5" fill="none" stroke="#ffffff" stroke-width="3"/>',
}
PITCH, MARGIN = 45, 28  # from LED to LED, from the edge to the first
HEIGHT = 62
OUTCOMES = {
    "up-to-date": UP_TO_DATE,
    "updated": UPDATED,
    "check-failed": CHECK_FAILED,
    "installation-failed": INSTALLATION_FAILED,
}


def fill_of(color: int) -> str:
    """The colour of a LED in a drawing."""
    return FILLS.get(color_name(color), OTHER_FILL)


def panel_picture(*states: dict[int, int]) -> str:
    """The panel with the colours of its LEDs, as SVG. States that follow one another are below each other."""
    width = 2 * MARGIN + (len(states[0]) - 1) * PITCH
    height = HEIGHT * len(states)
    drawn = f'<rect x="1" y="1" width="{width - 2}" height="{height - 2}" rx="8" fill="#eceef1" stroke="gray"/>\n'
    for row, leds in enumerate(states):
        drawn += "".join(_led(led, color, MARGIN + n * PITCH, row) for n, (led, color) in enumerate(leds.items()))
    return (
        f'<svg class="panel" viewBox="0 0 {width} {height}" width="{width}"'
        f' role="img" font-family="sans-serif" font-size="11">\n{drawn}</svg>'
    )


def _led(led: int, color: int, x: int, row: int) -> str:
    y = row * HEIGHT + 24
    light = f'<circle r="13" fill="{fill_of(color)}" stroke="#4a5058"/>{MARKS.get(color_name(color), "")}'
    name = led_name(led)
    text = f'<text y="30" text-anchor="middle" fill="#1c1f24">{name}</text>' if led in LED_CODES.values() else ""
    shown = f"{name} {color_name(color)}" if color else f"{name} dark"
    return f'<g transform="translate({x} {y})"><title>{shown}</title>{light}{text}</g>\n'


def after(*commands: tuple[str, str]) -> dict[int, int]:
    """What the controller shows after commands of LED and colour, by name."""
    return panel_after(code for led, color in commands for code in (LED_CODES[led], COLOR_CODES[color])).shown(0)


def pictures() -> dict[str, str]:
    """The pictures by file name."""
    made = {name: panel_picture(after(*outcome.panel.items())) for name, outcome in OUTCOMES.items()}
    made["dark"] = panel_picture(after())
    made["flashing"] = panel_picture(after(("REMOTE", "blue")), after(("MAIN", "blue")))
    # Attributes that only a separate file needs.
    file = '<svg xmlns="http://www.w3.org/2000/svg"'
    return {f"{name}.svg": f"{picture}\n".replace("<svg", file) for name, picture in made.items()}


if __name__ == "__main__":
    if len(sys.argv) != 2:
        sys.exit("Usage: scripts/python -m bench.show.panel FOLDER")
    Path(sys.argv[1]).mkdir(parents=True, exist_ok=True)
    for name, picture in pictures().items():
        (Path(sys.argv[1]) / name).write_text(picture)
