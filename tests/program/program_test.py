"""Runs the updater's executable on the stand-in unit and compares everything visible from outside."""

from pathlib import Path

import pytest

from bench import scenario
from bench.compare import differences
from bench.expected import COMMANDS, led_command, sound_command
from bench.observation import RECORD, Call
from bench.outcomes import OUTCOMES
from bench.panel import COLOR_CODES, FIRST_LED, LAST_LED, LED_CODES
from bench.runner import run_on, temporary_folder
from bench.standin.unit import StandInUnit

SPEED = 2000  # times shorter waits, each 0.2 s at least
BOARD_WAIT = 780  # s, while the board installs

# The functions that write records, as g++ 11 spells them.
FUNCTIONS = {
    "main.cpp": {"int main(int, char**)"},
    "RemoteUpdateManager.cpp": {
        "void RemoteUpdateManager::update()",
        "static void RemoteUpdateManager::processUpdate()",
        "static void RemoteUpdateManager::lockApp()",
        "static void RemoteUpdateManager::unlockApp()",
        "static void RemoteUpdateManager::resultCallback(UpdateManager::Result)",
        "static void RemoteUpdateManager::errorCallback(UpdateManager::Error)",
    },
    "UpdateManager.cpp": {
        "void UpdateManager::setCallbacks(UpdateManager::ResultCallback, UpdateManager::ErrorCallback, "
        "UpdateManager::UpdateFoundCallback)",
        "void UpdateManager::init(bool)",
        "void UpdateManager::update(std::vector<UpdateManager::UpdateComponent>, bool)",
        "void UpdateManager::deinit(bool)",
        "static void UpdateManager::updateRemoteHead()",
        "static void UpdateManager::deinitRemoteHead()",
        "static bool UpdateManager::updateMirrors()",
        "static bool UpdateManager::checkUpdate(bool, const string&, std::string&, std::string&, bool&)",
        "static bool UpdateManager::installUpdate(const string&)",
        "static bool UpdateManager::checkQuorbUpdate(std::string&, std::string&, bool&)",
        "static bool UpdateManager::uploadQuorbFiles()",
        "static bool UpdateManager::installQuorbUpdate()",
        "static void UpdateManager::stopHARL()",
        "static void UpdateManager::startHARL()",
        "static void UpdateManager::stopUpdater()",
        "static int32_t UpdateManager::runProcess(const string&, std::string&)",
    },
    "LedManager.cpp": {"static void LedManager::turnOn(LedManager::Led, LedManager::Color)"},
    "SoundManager.cpp": {"static void SoundManager::play(SoundManager::Sound)"},
}

CALLBACK_SOUNDS = {"resultCallback": "pass", "errorCallback": "fail"}
LEDS_OFF = [led_command(led, COLOR_CODES["off"]) for led in range(FIRST_LED, LAST_LED + 1)]


class Ran:
    """The run of one scenario."""

    def __init__(self, name: str, build: Path, folder: Path) -> None:
        self.what = scenario.load(name)
        self.result = run_on(StandInUnit(self.what, folder, SPEED, build), lambda run, log: None, SPEED)
        self.log = self.result.run.log
        self.calls = self.result.run.calls
        self.records = self.result.run.records()
        self.callbacks = [record.operation for record in self.records if record.operation in CALLBACK_SOUNDS]

    def update_calls(self) -> list[Call]:
        """The commands and waits of the update's thread."""
        first = next(call for call in self.calls if call.text == COMMANDS["stop-harl"])
        return [call for call in self.calls if call.thread == first.thread]


# The others run another program: see tests/bench.
@pytest.fixture(scope="module", params=[name for name in scenario.names() if not name.startswith("main-head-")])
def ran(request: pytest.FixtureRequest, build: Path) -> Ran:
    with temporary_folder() as folder:
        return Ran(request.param, build, folder)


def test_comes_out_as_the_scenario_says(ran: Ran) -> None:
    assert differences(ran.what, ran.result) == []


def test_log_is_made_of_whole_records(ran: Ran) -> None:
    assert "".join(match[0] for match in RECORD.finditer(ran.log)) == ran.log


def test_records_carry_their_functions_signatures(ran: Ran) -> None:
    for record in ran.records:
        assert record.function in FUNCTIONS[record.file]


def test_main_thread_waits_for_the_update(ran: Ran) -> None:
    seen = [
        (record.operation, record.message)
        for record in ran.records
        if record.thread == ran.records[0].thread and record.operation != "turnOn"
    ]
    expected = [
        ("main", "TavrenUpdater version: 1.0.0"),
        ("main", "BEFORE UPDATE"),
        ("update", ""),
        ("lockApp", ""),
    ]
    if ran.result.status == 0:
        expected += [("lockApp", ""), ("update", "1"), ("main", "AFTER UPDATE")]
    assert seen == expected


def test_update_thread_is_silent_until_the_update_begins(ran: Ran) -> None:
    begin = [record.message for record in ran.records].index("BEFORE UPDATE")
    assert {record.thread for record in ran.records[: begin + 1]} == {ran.records[0].thread}


def test_panel_goes_dark_first(ran: Ran) -> None:
    assert [call.text for call in ran.calls[:14]] == LEDS_OFF


def test_waits_stand_at_their_places(ran: Ran) -> None:
    calls = [call.text or call.seconds for call in ran.update_calls()]
    before = {30: "i2cset", 10: COMMANDS["start-harl"], BOARD_WAIT: COMMANDS["install-board"]}
    after = {30: COMMANDS["release-stick"], 10: COMMANDS["stop-updater"], BOARD_WAIT: COMMANDS["remove-marker"]}
    for index, call in enumerate(calls):
        if isinstance(call, int):
            assert str(calls[index - 1]).startswith(before[call]), calls[index - 1]
            assert str(calls[index + 1]).startswith(after[call]), calls[index + 1]


def test_outcome_is_lit_after_the_sound_on_a_dark_panel(ran: Ran) -> None:
    assert len(ran.callbacks) <= 1
    if not ran.callbacks:
        return
    [sound] = [index for index, call in enumerate(ran.calls) if call.text.startswith("aplay ")]
    assert ran.calls[sound].text == sound_command(CALLBACK_SOUNDS[ran.callbacks[0]])
    assert [call.text for call in ran.calls[sound - 14 : sound]] == LEDS_OFF
    assert {call.thread for call in ran.calls[sound - 14 :]} == {ran.calls[sound].thread}
    lit = [call.text for call in ran.calls[sound + 1 :] if call.text.startswith("i2cset")]
    shown = [outcome for outcome in OUTCOMES if outcome.sound == CALLBACK_SOUNDS[ran.callbacks[0]]]
    commands = [[led_command(LED_CODES[led], COLOR_CODES[o.color]) for led in o.leds] for o in shown]
    assert lit in commands


def test_remote_and_main_flash_blue_in_turn(ran: Ran) -> None:
    on = [call.text for call in ran.calls if call.text.endswith("0x1 c")]
    blue = [led_command(LED_CODES[led], COLOR_CODES["blue"]) for led in ("REMOTE", "MAIN")]
    assert on == (blue * len(on))[: len(on)]
    # A shorter update may end before the first cycle of the flashing.
    if BOARD_WAIT in [call.seconds for call in ran.update_calls()]:
        assert on
