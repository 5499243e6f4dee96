#include "unit/unit_check.h"

#include "finding_lines.h"
#include "unit/standin.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
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
    UnitSite site = unit.site();
    site.pause = [&, pause = site.pause](int seconds) {
        out << "(" << seconds << " s)\n";
        pause(seconds);
    };
    EXPECT_EQ(runUnit(panel, site, out, errors), 0);
    const char* const leds[] = {"0x10", "0x11", "0x12", "0x13", "0x14", "0x15", "0x16",
                                "0x17", "0x18", "0x19", "0x1a", "0x1b", "0x1c", "0x1d"};
    Lines expected;
    for (const std::string color : {"0x1", "0x2", "0x8", "0x0"}) {
        for (const std::string led : leds) {
            expected.push_back("i2cset -y 0 0x07 " + led + " c");
            expected.push_back("i2cset -y 0 0x07 " + color + " c");
        }
        if (color != "0x0") {
            expected.push_back("pause 2");
        }
    }
    EXPECT_EQ(calls(), expected);
    EXPECT_EQ(out.str(), "All 14 LEDs must be blue now.\n(2 s)\n"
                         "All 14 LEDs must be in the pass colour now.\n(2 s)\n"
                         "All 14 LEDs must be in the fail colour now.\n(2 s)\n"
                         "All 14 LEDs must be dark now.\n");
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
    EXPECT_EQ(run(sound), 0);
    EXPECT_EQ(calls(), (Lines{"aplay /root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav",
                              "aplay /root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav"}));
    EXPECT_EQ(out.str(), "Playing the pass sound: it must be heard.\n"
                         "Playing the fail sound: it must be heard.\n");
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
