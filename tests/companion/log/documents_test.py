"""Compares the tables of docs/operator.md and docs/technician.md, and those of the outcomes in the README and the
manual page, with what the bench expects of the updater, and with what `harl-updater-tool log` says of the golden logs.
"""

import json
import re
import subprocess
import tempfile
from collections.abc import Callable
from pathlib import Path
from typing import Any

import pytest

from bench import scenario
from bench.expected import COMMANDS, expected_commands, expected_log
from bench.makers.sticks import write_stick
from bench.outcomes import CHECK_FAILED, ENDED_EARLY, INSTALLATION_FAILED, UP_TO_DATE, UPDATED, Outcome
from bench.panel import COLOR_CODES, color_name, led_name
from bench.show.panel import pictures
from tests.commands import output_of, run_command

ROOT = Path(__file__).resolve().parents[3]
GOLDEN = ROOT / "tests/companion/golden/log"
OPERATOR = (ROOT / "docs/operator.md").read_text()
TECHNICIAN = (ROOT / "docs/technician.md").read_text()

# What a message that tells a failure looks like.
FAILURE = re.compile("fail|false|error|unknown|not ok", re.IGNORECASE)
# A word that the meaning of each report must have, in the operator's table.
MEANINGS = {
    "RESULT_NO_UPDATE": "nothing to update",
    "RESULT_UPDATED": "updated",
    "ERROR_CHECK_UPDATE": "version could not be read",
    "ERROR_UPDATE_MIRRORS": "mirrors",
    "ERROR_INSTALL_PACKAGE": "package",
    "ERROR_INSTALL_QUORB": "board could not be installed",
}
# Messages that no scenario of the bench brings about, because nothing in the updater asks for them.
UNREACHABLE = {"Unknown sound"}

Pattern = tuple[frozenset[tuple[str, str]], str]


def view(outcome: Outcome) -> Pattern:
    """LEDs with colours, and the sound, in the documents' words."""
    return frozenset(outcome.panel.items()), outcome.sound or "none"


BY_SERVICE = view(ENDED_EARLY)
# What the operator is shown and played for each report of the engine.
REPORTS = {
    "RESULT_NO_UPDATE": view(UP_TO_DATE),
    "RESULT_UPDATED": view(UPDATED),
    "ERROR_CHECK_UPDATE": view(CHECK_FAILED),
    "ERROR_UPDATE_MIRRORS": view(CHECK_FAILED),
    "ERROR_INSTALL_PACKAGE": view(INSTALLATION_FAILED),
    "ERROR_INSTALL_QUORB": view(INSTALLATION_FAILED),
}
# The tool's word for each.
TOLD_AS = {
    "no-update": "RESULT_NO_UPDATE",
    "updated": "RESULT_UPDATED",
    "check-failed": "ERROR_CHECK_UPDATE",
    "mirrors-failed": "ERROR_UPDATE_MIRRORS",
    "package-failed": "ERROR_INSTALL_PACKAGE",
    "board-failed": "ERROR_INSTALL_QUORB",
}


def expected_messages() -> list[str]:
    """The messages that the bench expects in all of its scenarios, without the commands in them."""
    lines = (line for name in scenario.names() for line in expected_log(scenario.load(name).expect.log))
    messages = {line.partition(":")[2] for line in lines if line != "..."}
    for command in COMMANDS.values():
        messages = {message.replace(command, "") for message in messages}
    return sorted(messages)


def table(text: str, *header: str) -> list[list[str]]:
    """The rows of the one table with this header."""
    start = "| " + " | ".join(header) + " |\n"
    assert text.count(start) == 1, f"{text.count(start)} tables with the header {start}"
    rows = text.partition(start)[2].partition("\n\n")[0].splitlines()[1:]
    return [[cell.strip() for cell in row.strip("|").split("|")] for row in rows]


def quoted(cell: str) -> list[str]:
    """What stands between backticks."""
    return re.findall("`([^`]*)`", cell)


def names(cell: str) -> str:
    """A pattern for the names that a cell lists; "board-..." stands for all that begin like this."""
    return "|".join(re.escape(name).replace(r"\.\.\.", "[a-z-]+") for name in quoted(cell))


def pattern(leds: str) -> frozenset[tuple[str, str]]:
    """LEDs and colours that "REMOTE and MAIN, pass colour" tells."""
    lit = re.fullmatch(r"([A-Z]+)(?: and ([A-Z]+))?, (pass|fail) colour", leds)
    assert lit, f"no pattern: {leds}"
    return frozenset((led, lit[3]) for led in lit.groups()[:2] if led)


def short_pattern(leds: str) -> frozenset[tuple[str, str]]:
    """LEDs and colours of "remote and main, pass colour", or of "fail", which needs no colour."""
    lit, _, color = leds.partition(", ")
    return pattern(
        f"{lit.replace('remote', 'REMOTE').replace('main', 'MAIN')}, {color}"
        if color
        else f"{lit.upper()}, {lit} colour"
    )


WAITS = scenario.load("package-and-board").expect.waits
PATTERNS = table(OPERATOR, "Panel", "LEDs", "Sound", "What it means", "What you do")
REPORTED = table(TECHNICIAN, "LEDs", "Sound", "The updater reported", "Names")
STATUSES = [
    row[1:]
    for row in table(TECHNICIAN, "In the log", "Number", "Means")
    if quoted(row[0]) == ["Install script ended with code:"]
]
# The messages of the updater, and what to make of each failure.
FAILURES = {quoted(row[0])[0]: row[1] for row in table(TECHNICIAN, "Message", "Name")}
NORMAL = {message for row in table(TECHNICIAN, "Message", "Means") for message in quoted(row[0])}
Explained = Callable[[str], list[dict[str, Any]]]


@pytest.fixture(scope="module")
def explained(tool: Path) -> Explained:
    """What the tool says of each run in a log."""

    def explain(log: str) -> list[dict[str, Any]]:
        command = [str(tool), "log", "--json"]
        done = subprocess.run(command, input=log.encode(errors="surrogateescape"), capture_output=True, timeout=60)
        runs: list[dict[str, Any]] = json.loads(done.stdout)["runs"]
        return runs

    return explain


@pytest.fixture(scope="module")
def catalogue(tool: Path) -> dict[str, dict[str, Any]]:
    """The tool's failures by name."""
    return {failure["name"]: failure for failure in json.loads(output_of(tool, "explain", "--json"))["failures"]}


def matches(row: list[str], panel: set[tuple[str, str]], sound: str) -> bool:
    """Whether a row of the technician's table is about this panel and sound."""
    if "blue" in row[0]:
        return panel == {("any", "blue")} and sound == row[1]
    return (set(pattern(row[0])), row[1]) == (panel, sound)


def check_message(run: dict[str, Any], name: str) -> None:
    [step] = [step for step in run["steps"] if step["line"] == run["failure"]["line"]]
    rows = [row for message, row in FAILURES.items() if step["word"].startswith(message)]
    # A failed installation's record is its exit code and output alone.
    if step["word"] and step["name"] != "install-package" and name != "statuses-lost":
        assert any(re.search(names(row), name) for row in rows), (step["word"], name)


class TestPatterns:
    """What each panel and sound means."""

    def test_operator_has_each_pattern_once_with_its_meanings(self) -> None:
        told = {(pattern(leds), sound): meaning for _, leds, sound, meaning, _ in PATTERNS}
        assert len(told) == len(PATTERNS)
        assert set(told) == set(REPORTS.values()) | {BY_SERVICE}
        assert set(REPORTS) == set(MEANINGS)
        for report, shown in REPORTS.items():
            assert MEANINGS[report] in told[shown], report

    def test_operator_has_the_picture_of_each_pattern(self) -> None:
        for picture, leds, *_ in PATTERNS:
            drawn = (ROOT / "docs" / picture.partition("](")[2].removesuffix(")")).read_text()
            lit = {tuple(title.split()) for title in re.findall("<title>(.*?)</title>", drawn)}
            assert {led for led in lit if led[1] != "dark"} == pattern(leds), picture

    def test_pictures_are_those_of_the_panel_s_model(self) -> None:
        kept = {file.name: file.read_text() for file in (ROOT / "docs/panel").iterdir()}
        assert kept == pictures()

    def test_operator_has_all_pictures(self) -> None:
        assert set(re.findall(r"\(panel/(\S+?)\)", OPERATOR)) == set(pictures())

    def test_golden_logs_show_each_report_like_this(self, explained: Explained) -> None:
        seen = set()
        for name in scenario.names():
            expect = scenario.load(name).expect
            [run] = explained((GOLDEN / f"{name}.log").read_text(errors="surrogateescape"))
            if run["head"] == "remote" and run["outcome"] in TOLD_AS and expect.panel and expect.sound:
                report = TOLD_AS[run["outcome"]]
                assert (frozenset(expect.panel.items()), expect.sound) == REPORTS[report], name
                seen.add(report)
        assert seen == set(REPORTS)

    def test_readme_and_manual_page_say_the_same(self) -> None:
        expected = {(pattern(leds), sound, meaning) for _, leds, sound, meaning, _ in PATTERNS}
        readme = table((ROOT / "README.md").read_text(), "LEDs", "Sound", "Outcome")
        assert {(short_pattern(leds), *rest) for leds, *rest in readme} == expected
        manual = (ROOT / "docs/man/harl-updater.8").read_text().partition("\n_\n")[2].partition("\n.TE")[0]
        told = [line.split("\t") for line in re.sub(r"T{\n(.*)\nT}", r"\1", manual).splitlines()]
        assert {(short_pattern(leds), *rest) for leds, *rest in told} == expected

    def test_technician_has_each_report_with_its_pattern(self) -> None:
        reports = [(quoted(row[2])[0], (pattern(row[0]), row[1])) for row in REPORTED if quoted(row[2])]
        assert dict(reports) == REPORTS
        assert len(reports) == len(REPORTS)

    def test_service_lights_what_is_told(self) -> None:
        script = (ROOT / "service/give-back").read_text()
        [led] = re.findall(r"^        wanted=(0x\w+)$", script, re.MULTILINE)  # without an outcome
        color = re.findall(r"^            color=(0x\w+)$", script, re.MULTILINE)[-1]
        assert {led_name(int(led, 16)): color_name(int(color, 16))} == ENDED_EARLY.panel

    def test_colour_codes(self) -> None:
        for name in ("blue", "pass", "fail"):
            assert f"{COLOR_CODES[name]} ({name})" in TECHNICIAN


class TestFigures:
    """Durations and counts."""

    def test_waits(self) -> None:
        assert sorted(WAITS) == [10, 30, 780]
        for told in (f"{780 // 60} silent minutes are normal", "for 30 seconds", "10 seconds later"):
            assert told in OPERATOR
        assert "silent for 13 minutes" in TECHNICIAN

    def test_operator_waits_longer_than_the_updater(self) -> None:
        [minutes] = re.findall(r"wait (\d+) minutes, then call", OPERATOR)
        dark = int(minutes)
        assert "blue for more than an hour" in OPERATOR
        assert (
            f"{dark} minutes with a dark panel and an hour with a blue one: at least two and four times" in TECHNICIAN
        )
        assert dark * 60 >= 2 * sum(WAITS)
        assert 3600 >= 4 * sum(WAITS)
        assert "does not come back within two minutes after the outcome" in OPERATOR
        assert 120 >= 2 * (sum(WAITS) - max(WAITS))

    def test_upload_attempts(self) -> None:
        commands = expected_commands(scenario.load("board-upload-fails").expect.commands)
        attempts = commands.count(COMMANDS["upload-board"])
        assert f"{attempts} attempts failed" in TECHNICIAN
        assert f"when it comes {attempts} times" in TECHNICIAN

    @pytest.mark.parametrize("number, meaning", STATUSES, ids=[number for number, _ in STATUSES])
    def test_status_means_what_the_tool_says(self, explained: Explained, number: str, meaning: str) -> None:
        log = (GOLDEN / "package-and-board.log").read_text()
        [run] = explained(re.sub("(Install script ended with code: ).*", rf"\g<1>{number}", log))
        [step] = [step for step in run["steps"] if step["name"] == "run-board-script"]
        assert re.split("[:;]", meaning)[0] in step["detail"]


class TestMessages:
    """Each message of the updater, and what to make of it."""

    def test_each_is_in_one_table(self) -> None:
        told = list(FAILURES) + list(NORMAL)
        assert len(told) == len(set(told))
        for message in expected_messages():
            # Versions, the words of the query's output, numbers, and the signs between them.
            variable = re.fullmatch(r"(?:\s|[\d.]+|-1|\(none\)|solvik4-[rd]h:|Brimvale|\\r)*", message)
            assert variable or any(text in message for text in told), f"not in docs/technician.md: {message}"

    def test_each_is_one_of_the_updater(self) -> None:
        logs = "".join(file.read_text(errors="replace") for file in GOLDEN.glob("*.log"))
        for message in {*FAILURES, *NORMAL} - UNREACHABLE:
            assert message in logs

    def test_failures_are_among_the_failures(self) -> None:
        for message in NORMAL:
            assert not FAILURE.search(message.replace("Pass/Fail", "")), message
        for message in FAILURES:
            assert FAILURE.search(message), message


CODES = [0, 1, 9, 100, 127, 255, 25600, 32512, 65280, -1]


def variants(log: str) -> list[str]:
    """The same run with each status that it logs replaced by others, and cut off after each record."""
    statuses = list(re.finditer(r"(?<=Exit code:)-?\d+|(?<=ended with code: )-?\d+|(?<=\t\t\t)-?\d+(?=\n)", log))
    found = [f"{log[:status.start()]}{code}{log[status.end():]}" for status in statuses for code in CODES]
    return found + [log[: record.start()] for record in re.finditer("^Updater", log, re.MULTILINE) if record.start()]


# Directories, script, and a name that becomes another one.
BAD_STICKS = [
    (["quorb2.2.0", "quorb2.3.0"], "#!/bin/sh\n", None),
    (["quorb2.2.0"], "#!/bin/sh\nexit\r\n", None),
    (["quorb2.2.0"], "exit\n", None),
    (["quorb2.2.0"], "#!/bin/sh\n", ("debs/QUORB", "debs/quorb")),
    (["quorb2.2.0", "file"], "#!/bin/sh\n", ("debs/QUORB/armhf/file/OSUpgrade.zip", "debs/QUORB/armhf/README")),
]


def said_of_stick(tool: Path, directories: list[str], script: str, renamed: tuple[str, str] | None) -> set[str]:
    """The names of what the tool finds wrong with a stick."""
    with tempfile.TemporaryDirectory(prefix="stick-") as name:
        folder = Path(name)
        write_stick(folder / "stick", directories, script)
        if renamed:
            (folder / "stick" / renamed[0]).rename(folder / "stick" / renamed[1])
        said = run_command(tool, "stick", folder / "stick").stdout
        return set(re.findall(r"\[([a-z-]+)\]$", said, re.MULTILINE))


class TestNames:
    """The tool's names of what went wrong."""

    def test_each_name_of_a_log_is_in_the_catalogue_with_cause_and_remedy(
        self, explained: Explained, catalogue: dict[str, dict[str, Any]]
    ) -> None:
        used: set[str] = set()
        for file in GOLDEN.glob("*.log"):
            log = file.read_text(errors="surrogateescape")
            for run in explained(log + "".join(variants(log))):
                used |= {problem["name"] for problem in [run["failure"], *run["besides"]] if problem}
        assert len(used) > 20
        assert used <= set(catalogue)
        for failure in catalogue.values():
            assert failure["cause"] and failure["remedy"], failure

    def test_names_in_the_guide_are_in_the_catalogue_or_a_check_of_the_stick(
        self, catalogue: dict[str, dict[str, Any]], tool: Path
    ) -> None:
        elsewhere = (
            set(re.findall(r"`\[?([a-z]+(?:-[a-z]+)+)\]?`", TECHNICIAN))
            - set(catalogue)
            - {"harl-updater-tool", "apt-cache", "ssh-copy-id"}
        )
        assert len(elsewhere) > 3
        assert elsewhere == set().union(*(said_of_stick(tool, *stick) for stick in BAD_STICKS)) & elsewhere

    def test_each_failure_that_is_reported_is_in_the_row_of_its_report(
        self, catalogue: dict[str, dict[str, Any]]
    ) -> None:
        for name, failure in catalogue.items():
            for report in [name for name in failure["reported"].split(", ") if name]:
                cells = [
                    row[3]
                    for row in REPORTED
                    if report in row[2] or (report == "ERROR_CHECK_UPDATE" and "the same" in row[2])
                ]
                if not name.startswith("teamviewer-"):  # on the main head, whose program has its own panel
                    assert any(re.fullmatch(names(cell), name) for cell in cells), (name, report)

    def test_words_of_the_tools_lead_to_their_entry(
        self, explained: Explained, catalogue: dict[str, dict[str, Any]]
    ) -> None:
        failing = {
            "refresh-mirrors": ("mirrors-fail", "refresh-mirrors"),
            "install-package": ("package-install-fails", "install-package"),
            "check-board": ("board-unreachable-after-package", "read-board"),
            "upload-board": ("board-upload-fails", "upload-board"),
        }
        phrases = 0
        for name, failure in catalogue.items():
            for phrase in failure["phrases"]:
                for step in phrase["steps"]:
                    golden, command = failing[step]
                    log = (GOLDEN / f"{golden}.log").read_text()
                    place = log.index("Updater |", log.index(COMMANDS[command]))
                    said = explained(f"{log[:place]}E: {phrase['words']} foo\n{log[place:]}")[0]["failure"]["name"]
                    assert said == name, phrase
                    phrases += 1
        assert phrases > 40

    def test_golden_logs_lead_from_panel_and_message_to_the_name(
        self, explained: Explained, catalogue: dict[str, dict[str, Any]]
    ) -> None:
        seen = set()
        for file in sorted(GOLDEN.glob("*.log")):
            for run in explained(file.read_text(errors="surrogateescape")):
                if not run["failure"]:
                    continue
                name = run["failure"]["name"]
                seen.add(name)
                assert name in catalogue
                check_message(run, name)
                if run["head"] == "remote":
                    view = set(run["panel"].items()), run["sound"] or "none"
                    rows = [row[3] for row in REPORTED if matches(row, *view)]
                    assert any(re.fullmatch(names(row), name) for row in rows), (view, name)
        assert len(seen) > 8
