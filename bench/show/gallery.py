"""The index of the pages that bench/run --all --record writes: each scenario, how it ended, what the panel showed."""

from html import escape
from string import Template

from bench.observation import now
from bench.show.page import STYLE, page_name
from bench.show.panel import panel_picture
from bench.show.text import Summary

INDEX = Template(
    """<!DOCTYPE html>
<html lang="en">
<meta charset="utf-8">
<meta name="viewport" content="width=device-width">
<title>Updates on the bench unit</title>
<style>$style
.panel { width: 420px; height: auto; }
td { border-top: 1px solid var(--line); padding-top: 6px; padding-bottom: 6px; }
</style>
<h1>Updates on the bench unit</h1>
<p>$counts</p>
<table><tr><th>scenario<th>panel at the end<th>outcome<th>sound<th class="number">duration
$rows</table>
</html>
"""
)


def index(summaries: list[Summary], missing: list[tuple[str, str]]) -> str:
    """The index page; `missing` has the names of the scenarios without a run, and why."""
    wrong = sum(bool(summary.wrong) for summary in summaries)
    counts = f"{len(summaries)} scenarios, {wrong} of them not as expected."
    if missing:
        counts += f" {len(missing)} did not run."
    ordered = sorted(summaries, key=lambda summary: summary.scenario.name)
    rows = "".join(_row(summary) for summary in ordered)
    rows += "".join(f'<tr><td>{escape(name)}<td colspan="4" class="wrong">{escape(why)}\n' for name, why in missing)
    return INDEX.substitute(style=STYLE, counts=counts, rows=rows)


def _row(summary: Summary) -> str:
    scenario, result = summary.scenario, summary.result
    wrong = "".join(f'<br><span class="wrong">{escape(line)}</span>' for line in summary.wrong)
    return (
        f'<tr><td><a href="{page_name(scenario)}">{escape(scenario.name)}</a><br>{escape(scenario.summary)}{wrong}'
        f"<td>{panel_picture(result.run.panel.shown(now()))}<td>{escape(summary.outcome)}"
        f'<td>{escape(", ".join(result.state.sounds) or "none")}<td class="number">{result.seconds:.1f} s\n'
    )
