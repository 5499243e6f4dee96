"""Usage: program_test.py SCENARIO BUILD_FOLDER

Runs the updater's executable on the stand-in unit and compares all that can be seen of it from outside.
"""

import sys
import unittest
from pathlib import Path

from bench import scenario
from bench.compare import differences
from bench.observation import RECORD, Call
from bench.panel import FIRST_LED, LAST_LED
from bench.runner import Result, run_on, temporary_folder
from bench.standin.unit import StandInUnit

SPEED = 2000  # times shorter waits, each 0.2 s at least

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

SOUNDS = {
    "resultCallback": "aplay /root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav",
    "errorCallback": "aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav",
}
LEDS_OFF = [f"i2cset -y 0 0x07 {led:#04x} c ; i2cset -y 0 0x07 0x0 c" for led in range(FIRST_LED, LAST_LED + 1)]
OUTCOME_LEDS = {
    "REMOTE MAIN pass": ["0x12 c ; i2cset -y 0 0x07 0x2 c", "0x15 c ; i2cset -y 0 0x07 0x2 c"],
    "PASS pass": ["0x13 c ; i2cset -y 0 0x07 0x2 c"],
    "REMOTE MAIN fail": ["0x12 c ; i2cset -y 0 0x07 0x8 c", "0x15 c ; i2cset -y 0 0x07 0x8 c"],
    "FAIL fail": ["0x14 c ; i2cset -y 0 0x07 0x8 c"],
}


class ProgramTest(unittest.TestCase):
    """What holds for the run of one scenario."""

    what: scenario.Scenario
    result: Result

    def setUp(self) -> None:
        self.maxDiff = None
        self.run_seen = self.result.run
        self.calls = self.run_seen.calls
        self.records = self.run_seen.records()
        self.callbacks = [record.operation for record in self.records if record.operation in SOUNDS]

    def update_calls(self) -> list[Call]:
        """The commands and waits of the update's thread."""
        first = next(call for call in self.calls if call.text == "systemctl stop harl")
        return [call for call in self.calls if call.thread == first.thread]

    def test_comes_out_as_the_scenario_says(self) -> None:
        self.assertEqual(differences(self.what, self.result), [])

    def test_log_is_made_of_whole_records(self) -> None:
        log = self.run_seen.log
        self.assertEqual("".join(match[0] for match in RECORD.finditer(log)), log)

    def test_records_carry_their_functions_signatures(self) -> None:
        for record in self.records:
            self.assertIn(record.function, FUNCTIONS[record.file])

    def test_main_thread_waits_for_the_update(self) -> None:
        seen = [
            (record.operation, record.message)
            for record in self.records
            if record.thread == self.records[0].thread and record.operation != "turnOn"
        ]
        expected = [
            ("main", "TavrenUpdater version: 1.0.0"),
            ("main", "BEFORE UPDATE"),
            ("update", ""),
            ("lockApp", ""),
        ]
        if self.result.status == 0:
            expected += [("lockApp", ""), ("update", "1"), ("main", "AFTER UPDATE")]
        self.assertEqual(seen, expected)

    def test_panel_goes_dark_first(self) -> None:
        self.assertEqual([call.text for call in self.calls[:14]], LEDS_OFF)

    def test_waits_stand_at_their_places(self) -> None:
        calls = [call.text or call.seconds for call in self.update_calls()]
        before = {30: "i2cset", 10: "systemctl start harl", 780: "ssh  "}
        after = {30: "umount", 10: "systemctl stop harl-updater", 780: "rm "}
        for index, call in enumerate(calls):
            if isinstance(call, int):
                self.assertTrue(str(calls[index - 1]).startswith(before[call]), calls[index - 1])
                self.assertTrue(str(calls[index + 1]).startswith(after[call]), calls[index + 1])

    def test_outcome_is_lit_after_the_sound_on_a_dark_panel(self) -> None:
        self.assertLessEqual(len(self.callbacks), 1)
        if not self.callbacks:
            return
        [sound] = [index for index, call in enumerate(self.calls) if call.text.startswith("aplay ")]
        self.assertEqual(self.calls[sound].text, SOUNDS[self.callbacks[0]])
        self.assertEqual([call.text for call in self.calls[sound - 14 : sound]], LEDS_OFF)
        self.assertEqual({call.thread for call in self.calls[sound - 14 :]}, {self.calls[sound].thread})
        lit = [call.text for call in self.calls[sound + 1 :] if call.text.startswith("i2cset")]
        self.assertIn(lit, [[f"i2cset -y 0 0x07 {text}" for text in leds] for leds in OUTCOME_LEDS.values()])

    def test_remote_and_main_flash_blue_in_turn(self) -> None:
        on = [call.text for call in self.calls if call.text.endswith("0x1 c")]
        blue = [f"i2cset -y 0 0x07 {led} c ; i2cset -y 0 0x07 0x1 c" for led in ("0x12", "0x15")]
        self.assertEqual(on, (blue * len(on))[: len(on)])
        if self.callbacks:  # an update that ended earlier may have met its first cycle
            self.assertTrue(on)


if __name__ == "__main__":
    name, folder = sys.argv[1:]
    ProgramTest.what = scenario.load(name)
    with temporary_folder() as temporary:
        unit = StandInUnit(ProgramTest.what, temporary, SPEED, Path(folder))
        ProgramTest.result = run_on(unit, lambda run, log: None, SPEED)
    unittest.main(argv=sys.argv[:1])
