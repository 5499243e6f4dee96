"""The page that bench/run --record writes."""

import os
import re
import sys
from collections.abc import Callable
from dataclasses import replace
from html.parser import HTMLParser
from pathlib import Path

import pytest

from bench.show import page as page_module
from bench.show import panel as panel_module
from bench.observation import Run
from bench.panel import STEP_TIME
from bench.run_all import run_all
from bench.runner import UnitMaker
from bench.scenario import load
from bench.unit import Files
from tests.commands import run_command

ROOT = Path(__file__).parents[2]
BLUE, PASS = panel_module.FILLS["blue"], panel_module.FILLS["pass"]


Written = Callable[[str], str]


class Elements(HTMLParser):
    """The page's elements: name, attributes, the text right after the start; inner titles go to `titles`."""

    def __init__(self, page: str) -> None:
        super().__init__()
        self.found: list[tuple[str, dict[str, str | None], str]] = []
        self.feed(page)
        self.close()

    def handle_starttag(self, tag: str, attributes: list[tuple[str, str | None]]) -> None:
        self.found.append((tag, dict(attributes), ""))

    def handle_data(self, data: str) -> None:
        if self.found:
            tag, attributes, text = self.found[-1]
            self.found[-1] = tag, attributes, text + data

    def texts(self, name: str) -> list[str]:
        """The texts of the elements `name`."""
        return [text.strip() for tag, _, text in self.found if tag == name]

    def filled(self, fill: str) -> list[str]:
        """The titles of the bars in the colour `fill`."""
        pairs = zip(self.found, self.found[1:])
        return [text for (tag, attributes, _), (_, _, text) in pairs if tag == "rect" and attributes["fill"] == fill]


@pytest.fixture
def written(build: Path, tmp_path: Path) -> Written:
    """The page of a run of a scenario on stand-ins."""

    def page_of(scenario: str) -> str:
        file = tmp_path / "page.html"
        words = ["--build", str(build), "--unit", "stand-in", "--speed", "2000", "--record", str(file), scenario]
        done = run_command(
            sys.executable, "-B", "-m", "bench", *words, environment=os.environ | {"TMPDIR": str(tmp_path)}
        )
        assert file.exists(), done.stdout + done.stderr
        assert f"\nPage: {file}\n" in done.stdout
        return file.read_text(encoding="utf-8")

    return page_of


def lit(*sent: tuple[float, int]) -> dict[int, list[tuple[float, float, int]]]:
    """When the LEDs are lit, from the bytes that were sent to the panel."""
    nothing = Path("none")
    run = Run(Files(nothing, nothing, nothing), sent=list(sent))
    return {led: spans for led, spans in page_module.lit(run, 20.0).items() if spans}


def test_nothing_sent() -> None:
    assert lit() == {}


def test_from_the_second_byte_to_the_next_change() -> None:
    assert lit((10.0, 0x12), (10.5, 0x01), (12.0, 0x12), (12.5, 0x00), (13.0, 0x13), (14.0, 0x02)) == {
        0x12: [(10.5, 12.5, 1)],
        0x13: [(14.0, 20.0, 2)],
    }


def test_change_of_colour_without_a_dark_time() -> None:
    sent = [(10.0, 0x12), (10.0, 0x01), (12.0, 0x12), (12.0, 0x02)]
    assert lit(*sent) == {0x12: [(10.0, 12.0, 1), (12.0, 20.0, 2)]}


def test_sequence_of_the_controller() -> None:
    steps = [0x12, 0x80, 0x12, 0xC1, STEP_TIME, 100, 0x12, 0xC0, STEP_TIME, 50, 0x12, 0x40]
    found = lit(*((10.0, byte) for byte in steps))
    assert [(round(start, 1), round(stop, 1), color) for start, stop, color in found[0x12]] == [
        (10.0, 12.0, 1),
        (13.0, 15.0, 1),
        (16.0, 18.0, 1),
        (19.0, 20.0, 1),
    ]


def test_update(written: Written) -> None:
    page = written("package-and-board")
    elements = Elements(page)
    assert "package-and-board: updated" in elements.texts("h1")
    names = [text for text in elements.texts("text") if text in ("REMOTE", "PASS", "FAIL", "MAIN", "10", "1d")]
    assert names == ["REMOTE", "PASS", "FAIL", "MAIN", "10", "REMOTE", "PASS", "FAIL", "MAIN", "1d"]
    assert elements.filled(BLUE)
    assert all(re.match(r"(REMOTE|MAIN) blue from ", title) for title in elements.filled(BLUE))
    assert len(elements.filled(PASS)) == 1
    assert re.search(r"^PASS pass from ", elements.filled(PASS)[0])
    waits = [title.split(":")[0] for title in elements.filled(page_module.WAIT)]
    assert waits == ["wait of 780 s", "wait of 30 s", "wait of 10 s"]
    commands = elements.filled(page_module.COMMAND)
    assert len(commands) == 13  # that of the sound, and those of the table
    assert re.search(r"^apt --assume-yes install solvik4-rh: \d+\.\d\d s$", commands[3])
    assert "BEFORE UPDATE" in elements.texts("pre")[-1]
    assert "Not as expected" not in page


def test_explained_as_the_companion_program_does(written: Written, build: Path) -> None:
    if not (build / page_module.TOOL).exists():
        pytest.skip("without the companion program nothing explains the log")
    page = written("board-upload-fails")
    assert "[board-upload-failed]</b>" in page
    assert "<th>Flashing thread</th>" in page
    for once in ("<!DOCTYPE html>", "<style>", "<h1>", "</html>"):
        assert page.count(once) == 1, once


def test_attempts_share_a_row(written: Written) -> None:
    elements = Elements(written("board-upload-fails"))
    assert sum(title.startswith("scp ") for title in elements.filled(page_module.COMMAND)) == 20
    [row] = [text for text in elements.texts("text") if text.startswith("scp ")]
    assert re.search(r"…: 20 times, \d\.\d\d s$", row)


def test_needs_nothing_else(written: Written) -> None:
    page = written("up-to-date")
    assert not re.search(r"https?:|url\(|@import", page)
    assert not {"script", "link", "img", "iframe"} & {tag for tag, _, _ in Elements(page).found}


def test_text_that_looks_like_markup(written: Written) -> None:
    page = written("board-unreachable")
    assert "&quot; cat /root/App/AppExe/version.txt | grep &#x27;Brimvale&#x27;&quot;" in page


def test_run_that_differs_from_the_scenario(written: Written, tmp_path: Path) -> None:
    file = tmp_path / "wrong.toml"
    text = (ROOT / "bench/scenarios/up-to-date.toml").read_text()
    file.write_text(text.replace('summary = "', 'summary = "<u>', 1).replace("marker = true", "marker = false"))
    page = written(str(file))
    assert "Not as expected: marker: expected False, not True" in page
    assert "&lt;u&gt;" in page
    assert "<u>" not in page


def test_index_of_runs_and_of_a_scenario_that_does_not_run(build: Path, tmp_path: Path) -> None:
    scenarios = [load(name) for name in ("mirrors-fail", "up-to-date", "harl-unknown")]
    expect = replace(scenarios[1].expect, marker=not scenarios[1].expect.marker)
    scenarios[1] = replace(scenarios[1], expect=expect)
    scenarios[2] = replace(scenarios[2], only="real")
    assert not run_all(UnitMaker("stand-in", 2000, build), scenarios, 2, tmp_path)
    assert {file.name for file in tmp_path.iterdir()} == {"index.html", "mirrors-fail.html", "up-to-date.html"}
    index = (tmp_path / "index.html").read_text(encoding="utf-8")
    elements = Elements(index)
    assert "2 scenarios, 1 of them not as expected. 1 did not run." in elements.texts("p")
    assert elements.texts("a") == ["mirrors-fail", "up-to-date"]
    assert [title for title in elements.texts("title") if title.endswith((" pass", " fail"))] == [
        "REMOTE fail",
        "MAIN fail",
        "REMOTE pass",
        "MAIN pass",
    ]
    assert "marker: expected" in index
    assert "harl-unknown needs the real unit" in index
