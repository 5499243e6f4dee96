"""Usage: log_documents_test.py TOOL

Compares the tables of docs/operator.md and docs/technician.md, and those of the outcomes in the README and the manual
page, with the updater's code, and with what `harl-updater-tool log` says of the golden logs.
"""

import json
import re
import subprocess
import sys
import unittest
from pathlib import Path

ROOT = Path(__file__).resolve().parents[3]
GOLDEN = ROOT / "tests/companion/golden/log"
OPERATOR = (ROOT / "docs/operator.md").read_text()
TECHNICIAN = (ROOT / "docs/technician.md").read_text()
FEEDBACK = (ROOT / "remote/RemoteUpdateManager.cpp").read_text()
ENGINE = (ROOT / "common/src/UpdateManager.cpp").read_text()
TOOL = ""

LITERAL = r'"((?:[^"\\]|\\.)*)"'
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
BY_SERVICE = (frozenset({("FAIL", "fail")}), "none")


def product_messages() -> set[str]:
    """The texts of all messages that the updater logs, without blanks at their ends."""
    found = set()
    for folder in ("common/src", "remote"):
        for file in (ROOT / folder).glob("*.cpp"):
            for statement in re.findall(r"\bLOG\(\)([^;]*);", file.read_text()):
                found |= {text.strip() for text in re.findall(LITERAL, statement)}
    return found - {""}


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
    return pattern(f"{lit.replace('remote', 'REMOTE').replace('main', 'MAIN')}, {color}" if color else
                   f"{lit.upper()}, {lit} colour")


def product_patterns() -> dict[str, tuple[frozenset[tuple[str, str]], str]]:
    """What the operator is shown and played for each report of the engine; none of those that light nothing."""
    found = {}
    for callback in ("resultCallback", "errorCallback"):
        body = re.search(rf"::{callback}\([^)]*\)\n{{(.*?)\n}}", FEEDBACK, re.DOTALL)[1]
        sound = re.search(r"SOUND_(\w+)", body)[1].lower()
        for cases, action in re.findall(r"((?:\s+case \w+::\w+:)+)(.*?)break;", body, re.DOTALL):
            lit = frozenset((led, color.lower()) for led, color in re.findall(r"LED_(\w+), \w+::COLOR_(\w+)", action))
            found |= {report: (lit, sound) for report in re.findall(r"::(\w+):", cases) if lit}
    return found


class Patterns(unittest.TestCase):
    """What each panel and sound means."""

    def test_operator_has_each_pattern_once_with_its_meanings(self) -> None:
        rows = table(OPERATOR, "LEDs", "Sound", "What it means", "What you do")
        told = {(pattern(leds), sound): meaning for leds, sound, meaning, _ in rows}
        self.assertEqual(len(told), len(rows))
        shown = product_patterns()
        self.assertEqual(set(told), set(shown.values()) | {BY_SERVICE})
        self.assertEqual(set(shown), set(MEANINGS))
        for report, view in shown.items():
            self.assertIn(MEANINGS[report], told[view], report)

    def test_readme_and_manual_page_say_the_same(self) -> None:
        rows = table(OPERATOR, "LEDs", "Sound", "What it means", "What you do")
        expected = {(pattern(leds), sound, meaning) for leds, sound, meaning, _ in rows}
        readme = table((ROOT / "README.md").read_text(), "LEDs", "Sound", "Outcome")
        self.assertEqual({(short_pattern(leds), *rest) for leds, *rest in readme},
                         {row for row in expected if row[:2] != BY_SERVICE})
        manual = (ROOT / "docs/man/harl-updater.8").read_text().partition("\n_\n")[2].partition("\n.TE")[0]
        told = [line.split("\t") for line in re.sub(r"T{\n(.*)\nT}", r"\1", manual).splitlines()]
        self.assertEqual({(short_pattern(leds), *rest) for leds, *rest in told}, expected)

    def test_technician_has_each_report_with_its_pattern(self) -> None:
        shown = product_patterns()
        rows = table(TECHNICIAN, "LEDs", "Sound", "The updater reported", "Names, explained below")
        reports = [(quoted(row[2])[0], (pattern(row[0]), row[1])) for row in rows if quoted(row[2])]
        self.assertEqual(dict(reports), shown)
        self.assertEqual(len(reports), len(shown))

    def test_service_lights_what_is_told(self) -> None:
        script = (ROOT / "service/give-back").read_text()
        lit = re.findall(r"^    send (0x\w+) (0x\w+)$", script, re.MULTILINE)  # behind the loop that darkens all
        header = (ROOT / "remote/LedManager.h").read_text()
        codes = {name: int(value) for name, value in re.findall(r"\b((?:LED|COLOR)_\w+) = (\d+),", header)}
        pairs = [(int(led, 16), int(color, 16)) for led, color in lit]
        self.assertEqual(pairs, [(codes["LED_FAIL"], codes["COLOR_FAIL"])])

    def test_colour_codes(self) -> None:
        header = (ROOT / "remote/LedManager.h").read_text()
        for name, code in re.findall(r"COLOR_(BLUE|PASS|FAIL) = (\d+),", header):
            self.assertIn(f"{code} ({name.lower()})", TECHNICIAN)


class Figures(unittest.TestCase):
    """Durations and counts."""

    def test_waits(self) -> None:
        waits = [int(seconds) for seconds in re.findall(r"sleepSeconds\((\d+)\)", ENGINE)]
        self.assertEqual(sorted(waits), [10, 30, 780])
        for told in (f"{780 // 60} silent minutes are normal", "for 30 seconds", "10 seconds later"):
            self.assertIn(told, OPERATOR)
        self.assertIn("silent for 13 minutes", TECHNICIAN)

    def test_operator_waits_longer_than_the_updater(self) -> None:
        waits = [int(seconds) for seconds in re.findall(r"sleepSeconds\((\d+)\)", ENGINE)]
        dark = int(re.search(r"wait (\d+) minutes, then call", OPERATOR)[1])
        self.assertIn("blue for more than an hour", OPERATOR)
        self.assertIn(f"{dark} minutes with a dark panel and an hour with a blue one: at least two and four times",
                      TECHNICIAN)
        self.assertGreaterEqual(dark * 60, 2 * sum(waits))
        self.assertGreaterEqual(3600, 4 * sum(waits))
        self.assertIn("does not come back within two minutes after the outcome", OPERATOR)
        self.assertGreaterEqual(120, 2 * (sum(waits) - max(waits)))

    def test_upload_attempts(self) -> None:
        attempts = re.search(r"const int attempts = (\d+);", ENGINE)[1]
        self.assertIn(f"{attempts} attempts failed", TECHNICIAN)
        self.assertIn(f"when it comes {attempts} times", TECHNICIAN)

    def test_statuses_mean_what_the_tool_says(self) -> None:
        log = (GOLDEN / "package-and-board.log").read_text()
        for kind, number, meaning in table(TECHNICIAN, "In the log", "Number", "Means"):
            if quoted(kind) != ["Install script ended with code:"]:
                continue
            with self.subTest(number):
                changed = re.sub("(Install script ended with code: ).*", rf"\g<1>{number}", log)
                run = explained(changed)[0]
                [step] = [step for step in run["steps"] if step["name"] == "run-board-script"]
                first = re.split("[:;]", meaning)[0]
                self.assertIn(first, step["detail"])


class Messages(unittest.TestCase):
    """Each message of the updater, and what to make of it."""

    failures = {quoted(row[0])[0]: row[1] for row in table(TECHNICIAN, "Message", "Name")}
    normal = {message for row in table(TECHNICIAN, "Message", "Means") for message in quoted(row[0])}

    def test_each_is_in_one_table(self) -> None:
        told = list(self.failures) + list(self.normal)
        self.assertEqual(sorted(told), sorted(product_messages()), "docs/technician.md against the code's messages")

    def test_failures_are_among_the_failures(self) -> None:
        for message in self.normal:
            self.assertIsNone(FAILURE.search(message.replace("Pass/Fail", "")), message)
        for message in self.failures:
            self.assertIsNotNone(FAILURE.search(message), message)


def explained(log: str) -> list[dict]:
    """What the tool says of each run in a log."""
    done = subprocess.run([TOOL, "log", "--json"], input=log.encode(errors="surrogateescape"), capture_output=True,
                          timeout=60, check=False)
    return json.loads(done.stdout)["runs"]


class Names(unittest.TestCase):
    """The tool's names of what went wrong."""

    remedies = {quoted(row[0])[0]: row for row in table(TECHNICIAN, "Name", "Cause", "Remedy")}
    source = (ROOT / "companion/log/explain.cpp").read_text()

    def test_each_name_of_the_tool_has_cause_and_remedy(self) -> None:
        used = re.findall(r'(?:problem\(\s*run, [^,]+,\s+|push_back\(\s*{)"([a-z-]+)"', self.source)
        used += sum(re.findall(r'\? "([a-z]+-[a-z-]+)" : "([a-z]+-[a-z-]+)"', self.source), ())
        self.assertGreater(len(used), 20)
        self.assertEqual(set(used), set(self.remedies))
        for row in self.remedies.values():
            self.assertTrue(all(row), row)

    def test_names_elsewhere_are_in_that_table_or_a_check_of_stick_or_unit(self) -> None:
        sources = (ROOT / "companion").glob("**/*.cpp")
        checks = "".join(file.read_text() for file in sources if file.parent.name != "log")
        elsewhere = set(re.findall(r"`\[?([a-z]+(?:-[a-z]+)+)\]?`", TECHNICIAN)) - set(self.remedies) - {
            "harl-updater-tool", "apt-cache", "ssh-copy-id"}
        self.assertGreater(len(elsewhere), 3)
        for name in elsewhere:
            self.assertIn(f'"{name}"', checks)

    def test_words_of_the_tools(self) -> None:
        block = self.source.partition("const Hint hints[] = {")[2].partition("\n};")[0]
        said = [re.sub(r"\\(.)", r"\1", text).replace("\\", "")
                for text in re.findall(r"^    {" + LITERAL, block, re.MULTILINE)]
        rows = table(TECHNICIAN, "Words", "Cause", "Remedy")
        self.assertEqual([quoted(row[0])[0] for row in rows], said)

    def test_golden_logs_lead_from_panel_and_message_to_the_name(self) -> None:
        patterns = table(TECHNICIAN, "LEDs", "Sound", "The updater reported", "Names, explained below")
        seen = set()
        for file in sorted(GOLDEN.glob("*.log")):
            for run in explained(file.read_text(errors="surrogateescape")):
                if not run["failure"]:
                    continue
                name = run["failure"]["name"]
                seen.add(name)
                with self.subTest(file.stem):
                    self.assertIn(name, self.remedies)
                    self.check_message(run, name)
                    if run["head"] == "remote":
                        view = set(run["panel"].items()), run["sound"] or "none"
                        rows = [row[3] for row in patterns if self.matches(row, *view)]
                        self.assertTrue(any(re.fullmatch(names(row), name) for row in rows), (view, name))
        self.assertGreater(len(seen), 8)

    @staticmethod
    def matches(row: list[str], panel: set[tuple[str, str]], sound: str) -> bool:
        if "blue" in row[0]:
            return panel == {("any", "blue")} and sound == row[1]
        return (set(pattern(row[0])), row[1]) == (panel, sound)

    def check_message(self, run: dict, name: str) -> None:
        [step] = [step for step in run["steps"] if step["line"] == run["failure"]["line"]]
        rows = [row for message, row in Messages.failures.items() if step["word"].startswith(message)]
        # A failed installation's record is its exit code and output alone.
        if step["word"] and step["name"] != "install-package" and name != "statuses-lost":
            self.assertTrue(any(re.search(names(row), name) for row in rows), (step["word"], name))


if __name__ == "__main__":
    TOOL = str(Path(sys.argv.pop(1)).resolve())
    unittest.main()
