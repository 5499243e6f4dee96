"""Usage: page_test.py BUILD_FOLDER

The page that bench/run --record writes."""

import io
import os
import re
import subprocess
import sys
import tempfile
import unittest
from contextlib import redirect_stdout
from dataclasses import replace
from html.parser import HTMLParser
from pathlib import Path

from bench.show import page as page_module
from bench.show import panel as panel_module
from bench.observation import Run
from bench.panel import STEP_TIME
from bench.run_all import run_all
from bench.runner import UnitMaker
from bench.scenario import load
from bench.unit import Files
from tests.command_line import take_path

ROOT = Path(__file__).parents[2]
BUILD = ROOT / "build/default"


BLUE, PASS = panel_module.FILLS["blue"], panel_module.FILLS["pass"]


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


def written(scenario: str, folder: str) -> str:
    """The page of a run of `scenario` on stand-ins."""
    file = Path(folder) / "page.html"
    arguments = ["--build", str(BUILD), "--unit", "stand-in", "--speed", "2000", "--record", str(file), scenario]
    command = [sys.executable, "-B", "-m", "bench", *arguments]
    done = subprocess.run(command, env=os.environ | {"TMPDIR": folder}, capture_output=True, text=True, check=False)
    assert file.exists(), done.stdout + done.stderr
    assert f"\nPage: {file}\n" in done.stdout
    return file.read_text(encoding="utf-8")


class Lit(unittest.TestCase):
    """When the LEDs are lit, from the bytes that were sent to the panel."""

    def lit(self, *sent: tuple[float, int]) -> dict[int, list[tuple[float, float, int]]]:
        nothing = Path("none")
        run = Run(Files(nothing, nothing, nothing), sent=list(sent))
        return {led: spans for led, spans in page_module.lit(run, 20.0).items() if spans}

    def test_nothing_sent(self) -> None:
        self.assertEqual(self.lit(), {})

    def test_from_the_second_byte_to_the_next_change(self) -> None:
        self.assertEqual(
            self.lit((10.0, 0x12), (10.5, 0x01), (12.0, 0x12), (12.5, 0x00), (13.0, 0x13), (14.0, 0x02)),
            {0x12: [(10.5, 12.5, 1)], 0x13: [(14.0, 20.0, 2)]},
        )

    def test_change_of_colour_without_a_dark_time(self) -> None:
        sent = [(10.0, 0x12), (10.0, 0x01), (12.0, 0x12), (12.0, 0x02)]
        self.assertEqual(self.lit(*sent), {0x12: [(10.0, 12.0, 1), (12.0, 20.0, 2)]})

    def test_sequence_of_the_controller(self) -> None:
        steps = [0x12, 0x80, 0x12, 0xC1, STEP_TIME, 100, 0x12, 0xC0, STEP_TIME, 50, 0x12, 0x40]
        found = self.lit(*((10.0, byte) for byte in steps))
        self.assertEqual([(round(start, 1), round(stop, 1), color) for start, stop, color in found[0x12]],
                         [(10.0, 12.0, 1), (13.0, 15.0, 1), (16.0, 18.0, 1), (19.0, 20.0, 1)])


class Page(unittest.TestCase):
    """A page of a whole run."""

    def setUp(self) -> None:
        holder = tempfile.TemporaryDirectory()
        self.addCleanup(holder.cleanup)
        self.folder = holder.name

    def test_update(self) -> None:
        page = written("package-and-board", self.folder)
        elements = Elements(page)
        self.assertIn("package-and-board: updated", elements.texts("h1"))
        names = [text for text in elements.texts("text") if text in ("REMOTE", "PASS", "FAIL", "MAIN", "10", "1d")]
        self.assertEqual(names, ["REMOTE", "PASS", "FAIL", "MAIN", "10", "REMOTE", "PASS", "FAIL", "MAIN", "1d"])
        self.assertTrue(elements.filled(BLUE))
        self.assertTrue(all(re.match(r"(REMOTE|MAIN) blue from ", title) for title in elements.filled(BLUE)))
        self.assertEqual(len(elements.filled(PASS)), 1)
        self.assertRegex(elements.filled(PASS)[0], r"^PASS pass from ")
        waits = [title.split(":")[0] for title in elements.filled(page_module.WAIT)]
        self.assertEqual(waits, ["wait of 780 s", "wait of 30 s", "wait of 10 s"])
        commands = elements.filled(page_module.COMMAND)
        self.assertEqual(len(commands), 13)  # that of the sound, and those of the table
        self.assertRegex(commands[3], r"^apt --assume-yes install solvik4-rh: \d+\.\d\d s$")
        self.assertIn("BEFORE UPDATE", elements.texts("pre")[-1])
        self.assertNotIn("Not as expected", page)

    @unittest.skipUnless((BUILD / page_module.TOOL).exists(), "without the companion program nothing explains the log")
    def test_explained_as_the_companion_program_does(self) -> None:
        page = written("board-upload-fails", self.folder)
        self.assertIn("[board-upload-failed]</b>", page)
        self.assertIn("<th>Flashing thread</th>", page)
        for once in ("<!DOCTYPE html>", "<style>", "<h1>", "</html>"):
            self.assertEqual(page.count(once), 1, once)

    def test_attempts_share_a_row(self) -> None:
        elements = Elements(written("board-upload-fails", self.folder))
        self.assertEqual(sum(title.startswith("scp ") for title in elements.filled(page_module.COMMAND)), 20)
        [row] = [text for text in elements.texts("text") if text.startswith("scp ")]
        self.assertRegex(row, r"…: 20 times, \d\.\d\d s$")

    def test_needs_nothing_else(self) -> None:
        page = written("up-to-date", self.folder)
        self.assertIsNone(re.search(r"https?:|url\(|@import", page))
        self.assertFalse({"script", "link", "img", "iframe"} & {tag for tag, _, _ in Elements(page).found})

    def test_text_that_looks_like_markup(self) -> None:
        page = written("board-unreachable", self.folder)
        self.assertIn("&quot; cat /root/App/AppExe/version.txt | grep &#x27;Brimvale&#x27;&quot;", page)

    def test_run_that_differs_from_the_scenario(self) -> None:
        file = Path(self.folder) / "wrong.toml"
        text = (ROOT / "bench/scenarios/up-to-date.toml").read_text()
        file.write_text(text.replace('summary = "', 'summary = "<u>', 1).replace("marker = true", "marker = false"))
        page = written(str(file), self.folder)
        self.assertIn("Not as expected: marker: expected False, not True", page)
        self.assertIn("&lt;u&gt;", page)
        self.assertNotIn("<u>", page)


class Gallery(unittest.TestCase):
    """The pages of many runs, and their index."""

    def test_index_of_runs_and_of_a_scenario_that_does_not_run(self) -> None:
        scenarios = [load(name) for name in ("mirrors-fail", "up-to-date", "harl-unknown")]
        expect = replace(scenarios[1].expect, marker=not scenarios[1].expect.marker)
        scenarios[1] = replace(scenarios[1], expect=expect)
        scenarios[2] = replace(scenarios[2], only="real")
        with tempfile.TemporaryDirectory() as name:
            folder = Path(name)
            with redirect_stdout(io.StringIO()):
                self.assertFalse(run_all(UnitMaker("stand-in", 2000, BUILD), scenarios, 2, folder))
            self.assertEqual(
                {file.name for file in folder.iterdir()}, {"index.html", "mirrors-fail.html", "up-to-date.html"}
            )
            index = (folder / "index.html").read_text(encoding="utf-8")
        elements = Elements(index)
        self.assertIn("2 scenarios, 1 of them not as expected. 1 did not run.", elements.texts("p"))
        self.assertEqual(elements.texts("a"), ["mirrors-fail", "up-to-date"])
        self.assertEqual([title for title in elements.texts("title") if title.endswith((" pass", " fail"))],
                         ["REMOTE fail", "MAIN fail", "REMOTE pass", "MAIN pass"])
        self.assertIn("marker: expected", index)
        self.assertIn("harl-unknown needs the real unit", index)


if __name__ == "__main__":
    BUILD = take_path()
    unittest.main()
