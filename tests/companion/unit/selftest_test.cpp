#include "unit/unit_check.h"

#include "finding_lines.h"
#include "unit/standin.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>
#include <sstream>

using testing::HasSubstr;

namespace
{

const UnitOptions panel = {false, true, false};
const UnitOptions sound = {false, false, true};

class UnitSelfTest : public testing::Test
{
protected:
    int run(const UnitOptions& options) { return runUnit(options, unit.site(), out, errors); }

    /// What is printed comes among the calls.
    int runAmongCalls(const UnitOptions& options)
    {
        std::ofstream calls(unit.folder.path("calls"), std::ios::app);
        return runUnit(options, unit.site(), calls, errors);
    }

    /// The calls and pauses without those that ask the service manager and the package manager.
    Lines calls() const
    {
        Lines lines = unit.calls();
        const auto asks = [](const std::string& call) {
            return call.rfind("systemctl show", 0) == 0 || call.rfind("dpkg-query --show ", 0) == 0;
        };
        lines.erase(std::remove_if(lines.begin(), lines.end(), asks), lines.end());
        return lines;
    }

    StandInUnit unit;
    std::ostringstream out;
    std::ostringstream errors;
};

} // namespace

TEST_F(UnitSelfTest, LampTestShowsEveryLedInEveryColourAndLeavesThePanelDark)
{
    EXPECT_EQ(runAmongCalls(panel), 0);
    const char* const leds[] = {"0x10", "0x11", "0x12", "0x13", "0x14", "0x15", "0x16",
                                "0x17", "0x18", "0x19", "0x1a", "0x1b", "0x1c", "0x1d"};
    const std::pair<const char*, const char*> colours[] = {
        {"0x1", "blue"}, {"0x2", "in the pass colour"}, {"0x8", "in the fail colour"}, {"0x0", "dark"}};
    Lines expected;
    for (const auto& [colour, name] : colours) {
        for (const std::string led : leds) {
            expected.push_back("i2cset -y 0 0x07 " + led + " c");
            expected.push_back("i2cset -y 0 0x07 " + std::string(colour) + " c");
        }
        expected.push_back("All 14 LEDs must be " + std::string(name) + " now.");
        expected.emplace_back("pause 2");
    }
    expected.pop_back(); // when the panel is dark the test ends
    EXPECT_EQ(calls(), expected);
    EXPECT_EQ(errors.str(), "");
}

TEST_F(UnitSelfTest, PanelThatDoesNotAnswerFailsTheLampTest)
{
    unit.set("HEAD_PANEL", "absent");
    EXPECT_EQ(run(panel), 1);
    EXPECT_EQ(out.str(), "");
    EXPECT_EQ(errors.str(), "harl-updater-tool: 56 commands of the panel test failed: \"Error: Write failed\". "
                            "To find out why, as root: harl-updater-tool unit\n");
}

TEST_F(UnitSelfTest, LampTestEndsWithTheFirstColourThatFailsAndLeavesThePanelDark)
{
    unit.replaceTool("i2cset", "cd \"${0%/*}/..\"; printf 'i2cset %s\\n' \"$*\" >>calls\n"
                               "[ \"$4\" != 0x2 ] || [ -e failed ] || { >failed; exit 1; }");
    EXPECT_EQ(run(panel), 1);
    EXPECT_EQ(out.str(), "All 14 LEDs must be blue now.\n");
    EXPECT_THAT(errors.str(), testing::StartsWith("harl-updater-tool: 1 command of the panel test failed: "));
    EXPECT_THAT(calls(), testing::Not(testing::Contains("i2cset -y 0 0x07 0x8 c")));
    EXPECT_EQ(calls().back(), "i2cset -y 0 0x07 0x0 c");
}

TEST_F(UnitSelfTest, SoundTestPlaysBothSounds)
{
    EXPECT_EQ(runAmongCalls(sound), 0);
    EXPECT_EQ(calls(),
              (Lines{"Playing the pass sound: it must be heard.", "aplay /root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav",
                     "Playing the fail sound: it must be heard.", "aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav"}));
    EXPECT_EQ(errors.str(), "");
}

TEST_F(UnitSelfTest, MissingSoundDeviceFailsTheSoundTest)
{
    unit.set("HEAD_SOUND", "absent");
    EXPECT_EQ(run(sound), 1);
    EXPECT_THAT(errors.str(), HasSubstr("2 commands of the sound test failed"));
    EXPECT_THAT(errors.str(), HasSubstr("To find out why, as root: harl-updater-tool unit\n"));
}

TEST_F(UnitSelfTest, BothTestsGiveOneJsonObject)
{
    unit.set("HEAD_SOUND", "absent");
    EXPECT_EQ(run({true, true, true}), 1);
    EXPECT_EQ(out.str(), R"({
  "command": "unit",
  "version": 1,
  "panel": {
    "leds": 14,
    "failed_commands": 0,
    "reason": ""
  },
  "sound": {
    "sounds": 2,
    "failed_commands": 2,
    "reason": "\"aplay: main:831: audio open error: No such file or directory\""
  }
}
)");
}

TEST_F(UnitSelfTest, TestsAreRefusedWhileTheUpdatersServiceRuns)
{
    unit.set("UNIT_UPDATER", "active");
    EXPECT_EQ(run(panel), 2);
    EXPECT_EQ(run(sound), 2);
    EXPECT_EQ(out.str(), "");
    EXPECT_EQ(run({true, true, true}), 2);
    EXPECT_EQ(nlohmann::json::parse(out.str())["command"], "unit");
    EXPECT_THAT(nlohmann::json::parse(out.str())["error"], HasSubstr("the updater is running"));
    EXPECT_EQ(calls(), Lines());
    EXPECT_THAT(errors.str(), HasSubstr("the updater is running and uses panel and sound itself. "
                                        "Run the test when it has ended.\n"));
}

TEST_F(UnitSelfTest, TestsAreRefusedWhileAnUpdaterStartedByHandRuns)
{
    unit.put("proc/17/comm", "harl-updater\n");
    EXPECT_EQ(run(panel), 2);
    EXPECT_EQ(run(sound), 2);
    EXPECT_EQ(calls(), Lines());
}
