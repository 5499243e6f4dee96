#include "LedManager.h"
#include "unit/unit_check.h"

#include <array>
#include <ostream>
#include <sstream>
#include <utility>

namespace
{

const auto soundLimit = 60s;

/// How a test of panel or sound ended.
struct SelfTest
{
    int tested = 0; ///< LEDs or sounds
    int failedCommands = 0;
    std::string reason; ///< of the last failure, printable
};

void runIn(SelfTest& test, const Unit& unit, const std::vector<std::string>& command, std::chrono::milliseconds limit)
{
    const CommandResult result = unit.run(command, limit);
    if (!result.succeeded()) {
        ++test.failedCommands;
        test.reason = complaint(result);
    }
}

void lightAll(SelfTest& test, const Unit& unit, LedManager::Color color)
{
    for (int led = LedManager::LED_FIRST; led <= LedManager::LED_LAST; ++led) {
        for (const int value : {led, static_cast<int>(color)}) {
            std::ostringstream byte;
            byte << "0x" << std::hex << value;
            runIn(test, unit, {"i2cset", "-y", "0", "0x07", byte.str(), "c"}, quick);
        }
    }
}

SelfTest testPanel(const Unit& unit, std::ostream& out)
{
    const std::array<std::pair<LedManager::Color, const char*>, 3> colors = {{
        {LedManager::COLOR_BLUE, "blue"},
        {LedManager::COLOR_PASS, "in the pass colour"},
        {LedManager::COLOR_FAIL, "in the fail colour"},
    }};
    SelfTest test;
    test.tested = LedManager::LED_LAST - LedManager::LED_FIRST + 1;
    for (const auto& [color, name] : colors) {
        lightAll(test, unit, color);
        if (test.failedCommands > 0) {
            break;
        }
        out << "All " << test.tested << " LEDs must be " << name << " now." << std::endl;
        unit.site().pause(2);
    }
    lightAll(test, unit, LedManager::COLOR_OFF);
    if (test.failedCommands == 0) {
        out << "All " << test.tested << " LEDs must be dark now." << std::endl;
    }
    return test;
}

SelfTest testSound(const Unit& unit, std::ostream& out)
{
    SelfTest test;
    for (const auto& [sound, name] : {std::pair(passSound, "pass"), std::pair(failSound, "fail")}) {
        out << "Playing the " << name << " sound: it must be heard." << std::endl;
        runIn(test, unit, {"aplay", sound}, soundLimit);
        ++test.tested;
    }
    return test;
}

} // namespace

int runSelfTests(const UnitOptions& options, const Unit& unit, std::ostream& out, std::ostream& errors)
{
    if (unit.updaterRuns()) {
        return refuse("unit", options.json,
                      "the updater is running and uses panel and sound itself. Run the test when it has ended.", out,
                      errors);
    }
    nlohmann::ordered_json results = {{"command", "unit"}, {"version", jsonVersion}};
    int status = Report::STATUS_FIT;
    const auto take = [&](const char* name, const char* tested, const SelfTest& test) {
        results[name] = {{tested, test.tested}, {"failed_commands", test.failedCommands}, {"reason", test.reason}};
        if (test.failedCommands > 0) {
            errors << "harl-updater-tool: " << counted(static_cast<std::uint64_t>(test.failedCommands), "command")
                   << " of the " << name << " test failed: " << test.reason
                   << ". To find out why, as root: harl-updater-tool unit\n";
            status = Report::STATUS_NOT_FIT;
        }
    };
    std::ostream text(options.json ? nullptr : out.rdbuf());
    if (options.panel) {
        take("panel", "leds", testPanel(unit, text));
    }
    if (options.sound) {
        take("sound", "sounds", testSound(unit, text));
    }
    if (options.json) {
        out << results.dump(2) << '\n';
    }
    return status;
}
