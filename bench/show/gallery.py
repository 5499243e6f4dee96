"""The index of the pages that bench/run --all --record writes: each scenario, how it ended, what the panel showed."""

from html import escape

from bench.observation import now
from bench.show.page import frame, page_name
from bench.show.panel import panel_picture
from bench.show.text import Summary

HEAD = "".join(f"<th>{name}</th>" for name in ("scenario", "panel at the end", "outcome", "sound", "duration"))


def index(summaries: list[Summary], missing: list[tuple[str, str]]) -> str:
    """The index page; `missing` has the names of the scenarios without a run, and why."""
    wrong = sum(bool(summary.wrong) for summary in summaries)
    counts = f"{len(summaries)} scenarios, {wrong} of them not as expected."
    if missing:
        counts += f" {len(missing)} did not run."
    rows = "".join(_row(summary) for summary in sorted(summaries, key=lambda summary: summary.scenario.name))
    for name, why in missing:
        rows += f'<tr><td>{escape(name)}</td><td colspan="4" class="bad">{escape(why)}</td></tr>\n'
    return frame(
        "Updates on the bench unit", f'<p>{counts}</p>\n<table class="gallery">\n<tr>{HEAD}</tr>\n{rows}</table>\n'
    )


def _row(summary: Summary) -> str:
    scenario, result = summary.scenario, summary.result
    wrong = "".join(f'<br><span class="bad">{escape(line)}</span>' for line in summary.wrong)
    return (
        f'<tr><td><a href="{page_name(scenario)}">{escape(scenario.name)}</a><br>{escape(scenario.summary)}{wrong}</td>'
        f"<td>{panel_picture(result.run.panel.shown(now()))}</td><td>{escape(summary.outcome)}</td>"
        f'<td>{escape(", ".join(result.state.sounds) or "none")}</td>'
        f'<td class="number">{result.seconds:.1f} s</td></tr>\n'
    )
