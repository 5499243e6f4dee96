"""Writes a run as a page: what the bench observed, then what the companion program draws from the run's log.

The design of both is that of the companion program's page.
"""

import re
import subprocess
import tempfile
from collections.abc import Iterator
from html import escape
from itertools import pairwise
from pathlib import Path

from bench.build import ROOT
from bench.observation import Run, now
from bench.panel import STEP_UNIT, Panel, color_name, led_name
from bench.scenario import Scenario
from bench.show.panel import fill_of, panel_picture
from bench.show.steps import taken
from bench.show.text import Summary, shortened

TEMPLATE = (ROOT / "companion/log/page.mustache").read_text(encoding="utf-8")
TOOL = Path("companion/harl-updater-tool")  # in the folder of the programs
WIDTH = 1168  # of the chart; all lengths are in the drawing's own unit
LEFT = 90  # of the time axis; the names of the LEDs are before it
RIGHT = 16  # margin after the axis
ROW = 20
LETTER = 6.2  # about the width of one
LANE, COMMAND, WAIT = "var(--lane)", "var(--bar)", "var(--wait)"
TICKS = [0.1, 0.2, 0.5, 1, 2, 5, 10, 20, 30, 60, 120, 300]  # s
MOST_TICKS = 16


def page_name(scenario: Scenario) -> str:
    """The file of the scenario's page in a gallery."""
    return f"{scenario.name}.html"


def frame(title: str, content: str) -> str:
    """A page with this title and this content of its body."""
    begin = _part("begin")
    for text in (">Update log<", ">Updates<"):
        begin = begin.replace(text, f">{escape(title)}<")
    return f"{begin}{content}{_part('end')}"


def page(summary: Summary, speed: float, build: Path) -> str:
    """The page for a run whose waits were `speed` times shorter, with the programs in the folder `build`."""
    run, scenario = summary.result.run, summary.scenario
    begin = run.calls[0].start if run.calls else now()
    ends = [call.end or call.start for call in run.calls] + [moment for moment, _ in run.sent]
    end = max([begin + 0.1, *ends])
    speeded = f"The updater's waits are {shortened(speed)}, commands take their real time." if speed > 1 else ""
    wrong = "".join(f'<p class="bad">Not as expected: {escape(line)}</p>\n' for line in summary.wrong)
    rows = "".join(f"<tr><th>{escape(name)}</th><td>{escape(value)}</td></tr>\n" for name, value in summary.rows())
    return frame(
        f"{scenario.name}: {summary.outcome}",
        f"<p>{escape(scenario.summary)}<br>Unit: {escape(summary.unit)}. {speeded}</p>\n{wrong}"
        f"{panel_picture(run.panel.shown(now()))}\n{_chart(run, begin, end)}\n<table>\n{rows}</table>\n"
        f"{_explained(run.log, build / TOOL)}<h2>Log</h2>\n<pre>{escape(run.log)}</pre>\n",
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


def _part(name: str) -> str:
    """A part of the companion program's template."""
    part = re.search(f"{{{{#{name}}}}}\n(.*?){{{{/{name}}}}}\n", TEMPLATE, re.DOTALL)
    assert part, name
    return part[1]


def _explained(log: str, tool: Path) -> str:
    """The runs of a log as the companion program draws them; "" for a log without a record, or without the program."""
    if not tool.exists():
        return ""
    with tempfile.TemporaryDirectory() as folder:
        drawn = Path(folder) / "page.html"
        (Path(folder) / "log").write_text(log, encoding="utf-8", errors="replace")
        command: list[str | Path] = [tool, "log", "--html", drawn.name, "log"]
        subprocess.run(command, cwd=folder, capture_output=True, check=False)
        if not drawn.exists():
            return ""
        text = drawn.read_text(encoding="utf-8")
    runs = re.search("</h1>\n(.*)</body>", text, re.DOTALL)
    assert runs
    return runs[1]


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


def _chart(run: Run, begin: float, end: float) -> str:
    """The LEDs, the commands and the waits against time."""
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
        drawn += bar(begin, end, top, LANE, f"{led_name(led)} dark")
        for start, stop, color in spans:
            title = f"{led_name(led)} {color_name(color)} from {start - begin:.2f} s to {stop - begin:.2f} s"
            drawn += bar(start, stop, top, fill_of(color), title)
        top += ROW
    top += 10
    for calls in taken(run):
        is_wait = calls[0].call == "nanosleep"
        text = f"wait of {calls[0].seconds} s" if is_wait else calls[0].text
        for call in calls:
            stop = call.end if call.end is not None else end
            drawn += bar(call.start, stop, top, WAIT if is_wait else COMMAND, f"{text}: {stop - call.start:.2f} s")
        took = f"{f'{len(calls)} times, ' if len(calls) > 1 else ''}{stop - calls[0].start:.2f} s"
        left = across(calls[0].start)
        drawn += _label(re.sub(r"( +-o \S+)+", " …", text), took, left, max(across(stop), left + 1), top + 11)
        top += ROW
    step = next((tick for tick in TICKS if (end - begin) / tick <= MOST_TICKS), TICKS[-1])
    grid = ""
    for number in range(int((end - begin) / step) + 1):
        x = across(begin + number * step)
        grid += f'<line x1="{x:.1f}" y1="0" x2="{x:.1f}" y2="{top}"/>'
        grid += f'<text x="{x:.1f}" y="{top + 14}" text-anchor="middle">{number * step:g} s</text>\n'
    return f'<svg id="chart" viewBox="0 0 {WIDTH} {top + 20}">\n{grid}{drawn}</svg>'


def _label(text: str, took: str, left: float, right: float, baseline: float) -> str:
    """What was done and how long it took, after its bar, or before it where there is more space; cut to what fits."""
    after = WIDTH - right >= left - LEFT
    room = int(((WIDTH - right if after else left - LEFT) - 12) / LETTER) - len(took) - 2
    shown = text if len(text) <= room else f"{text[: max(room - 1, 0)]}…"
    place = f'x="{right + 5:.1f}"' if after else f'x="{left - 5:.1f}" text-anchor="end"'
    return f'<text {place} y="{baseline}">{escape(f"{shown}: {took}")}</text>\n'
