"""Writes a run as a page of its own: the panel's LEDs and the commands against time, the summary and the log."""

import re
from collections.abc import Iterator
from html import escape
from itertools import pairwise
from pathlib import Path
from string import Template

from bench.show.text import Summary
from bench.observation import Call, Run, now
from bench.panel import STEP_UNIT, Panel, color_name, led_name
from bench.scenario import Scenario
from bench.show.panel import fill_of, panel_picture

WIDTH = 1200  # of the timeline; all lengths are in the drawing's own unit
LEFT = 90  # of the time axis; the names of the LEDs are before it
RIGHT = 16  # margin after the axis
ROW = 20
LETTER = 6.2  # about the width of one
DARK = "#e4e6ea"
COMMAND, WAIT = "#57606a", "#c9a227"
TICKS = [0.1, 0.2, 0.5, 1, 2, 5, 10, 20, 30, 60, 120, 300]  # s
MOST_TICKS = 16

# Style of the pages of all runs and of their index: light and dark, for a screen of 1,200 pixels and for paper.
STYLE = """
:root { color-scheme: light dark; --text: #1c1f24; --line: #d8dbe0; --wrong: #b01020; --bar: #57606a; }
@media (prefers-color-scheme: dark) { :root { --text: #e6e8eb; --line: #3c4148; --wrong: #ff7b82; --bar: #9aa4b0; } }
@media print { :root { color-scheme: light; --text: #000000; } a { color: inherit; } tr, svg { break-inside: avoid; } }
body { font: 14px/1.4 sans-serif; margin: 24px auto; max-width: 1168px; padding: 0 16px; color: var(--text); }
h1 { font-size: 22px; margin: 0; } h2 { font-size: 16px; margin: 28px 0 8px; }
table { border-collapse: collapse; } th { text-align: left; font-weight: 600; }
td, th { padding: 2px 16px 2px 0; vertical-align: top; }
svg { max-width: 100%; height: auto; }
#timeline text { font-size: 11px; fill: var(--text); } #timeline line { stroke: var(--line); }
code, pre { font: 12px monospace; white-space: pre-wrap; overflow-wrap: anywhere; }
.number { text-align: right; white-space: nowrap; } .wrong { color: var(--wrong); }
"""
PAGE = Template(
    """<!DOCTYPE html>
<html lang="en">
<meta charset="utf-8">
<meta name="viewport" content="width=device-width">
<title>$name: $outcome</title>
<style>$style</style>
<h1>$name: $outcome</h1>
<p>$summary<br>Unit: $unit. $speed</p>
$wrong<h2>Panel at the end</h2>
$panel
<h2>Timeline</h2>
$timeline
<h2>Summary</h2>
<table>$rows</table>
<h2>Commands</h2>
<table><tr><th class="number">after</th><th class="number">took</th><th class="number">status</th><th>command</th></tr>
$commands</table>
<h2>Log</h2>
<pre>$log</pre>
</html>
"""
)


def page_name(scenario: Scenario) -> str:
    """The file of the scenario's page in a gallery."""
    return f"{scenario.name}.html"


def page(summary: Summary, speed: float) -> str:
    """The page for a run whose waits were `speed` times shorter."""
    run, scenario = summary.result.run, summary.scenario
    begin = run.calls[0].start if run.calls else now()
    ends = [call.end or call.start for call in run.calls] + [moment for moment, _ in run.sent]
    end = max([begin + 0.1, *ends])
    speeded = f"The updater's waits are {speed:g} times shorter, commands take their real time." if speed > 1 else ""
    wrong = "".join(f'<p class="wrong">Not as the scenario says: {escape(line)}</p>\n' for line in summary.wrong)
    return PAGE.substitute(
        style=STYLE,
        name=escape(scenario.name),
        outcome=escape(summary.outcome),
        summary=escape(scenario.summary),
        unit=escape(summary.unit),
        speed=speeded,
        wrong=wrong,
        panel=panel_picture(run.panel.shown(now())),
        timeline=_timeline(run, begin, end),
        rows="".join(f"<tr><th>{escape(name)}<td>{escape(value)}\n" for name, value in summary.rows()),
        commands="".join(_command(call, begin) for call in run.commands()),
        log=escape(run.log),
    )


def write_page(file: Path, text: str) -> None:
    """Writes a page; bytes of a log that are not text become question marks."""
    file.write_text(text, encoding="utf-8", errors="replace")


def lit(run: Run, end: float) -> dict[int, list[tuple[float, float, int]]]:
    """For each LED the times from, to (s) in which it was lit, and its colour. Sequences are played until `end`."""
    found: dict[int, list[tuple[float, float, int]]] = {led: [] for led in Panel().leds}
    for start, stop, leds in _shown(run, end):
        for led, color in leds.items():
            spans = found[led]
            if not color:
                continue
            if spans and spans[-1][1:] == (start, color):
                start = spans.pop()[0]
            spans.append((start, stop, color))
    return found


def _shown(run: Run, end: float) -> Iterator[tuple[float, float, dict[int, int]]]:
    """Times from, to (s), and what the LEDs show between."""
    panel = Panel()
    for (moment, byte), (following, _) in pairwise([*run.sent, (end, 0)]):
        panel.send(byte, moment)
        flashing = any(led.started is not None for led in panel.leds.values())
        while moment < following:
            stop = min(following, moment + STEP_UNIT) if flashing else following
            yield moment, stop, panel.shown(moment)
            moment = stop


def _timeline(run: Run, begin: float, end: float) -> str:
    scale = (WIDTH - LEFT - RIGHT) / (end - begin)

    def across(moment: float) -> float:
        return LEFT + (moment - begin) * scale

    def bar(start: float, stop: float, top: float, fill: str, title: str) -> str:
        length = max(1.0, (stop - start) * scale)
        place = f'x="{across(start):.1f}" y="{top}" width="{length:.1f}" height="{ROW - 6}"'
        return f'<rect {place} fill="{fill}"><title>{escape(title)}</title></rect>\n'

    drawn, top = "", 4
    for led, spans in lit(run, end).items():
        drawn += f'<text x="{LEFT - 8}" y="{top + 11}" text-anchor="end">{led_name(led).removeprefix("0x")}</text>'
        drawn += bar(begin, end, top, DARK, f"{led_name(led)} dark")
        for start, stop, color in spans:
            title = f"{led_name(led)} {color_name(color)} from {start - begin:.2f} s to {stop - begin:.2f} s"
            drawn += bar(start, stop, top, fill_of(color), title)
        top += ROW
    top += 10
    waits = run.waits()
    for call in [call for call in run.calls if call in waits or _is_command(call)]:
        text = f"wait of {call.seconds} s" if call in waits else call.text
        stop = call.end if call.end is not None else end
        fill = WAIT if call in waits else COMMAND
        drawn += bar(call.start, stop, top, fill, f"{text}: {stop - call.start:.2f} s")
        left = across(call.start)
        drawn += _label(re.sub(r"( +-o \S+)+", " …", text), left, max(across(stop), left + 1), top + 11)
        top += ROW
    step = next((tick for tick in TICKS if (end - begin) / tick <= MOST_TICKS), TICKS[-1])
    grid = ""
    for number in range(int((end - begin) / step) + 1):
        x = across(begin + number * step)
        grid += f'<line x1="{x:.1f}" y1="0" x2="{x:.1f}" y2="{top}"/>'
        grid += f'<text x="{x:.1f}" y="{top + 14}" text-anchor="middle">{number * step:g} s</text>\n'
    return f'<svg id="timeline" viewBox="0 0 {WIDTH} {top + 20}">\n{grid}{drawn}</svg>'


def _label(text: str, left: float, right: float, baseline: float) -> str:
    """`text` after its bar, or before it where there is more space; cut to what fits."""
    after = WIDTH - right >= left - LEFT
    room = int(((WIDTH - right if after else left - LEFT) - 12) / LETTER)
    shown = text if len(text) <= room else f"{text[: max(room - 1, 0)]}…"
    place = f'x="{right + 5:.1f}"' if after else f'x="{left - 5:.1f}" text-anchor="end"'
    return f'<text {place} y="{baseline}">{escape(shown)}</text>\n'


def _is_command(call: Call) -> bool:
    return call.call != "nanosleep" and not call.text.startswith("i2cset ")


def _command(call: Call, begin: float) -> str:
    took = f"{call.end - call.start:.2f} s" if call.end is not None else "ended"
    status = "" if call.status is None else str(call.status)
    cells = "".join(f'<td class="number">{value}' for value in (f"{call.start - begin:.2f} s", took, status))
    return f"<tr>{cells}<td><code>{escape(call.text)}</code>\n"
