#include "unit/selftest.h"

#include "LedManager.h"

#include <array>
#include <ostream>
#include <sstream>
#include <utility>

namespace
{

const auto soundLimit = 60s;

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

} // namespace

SelfTest testPanel(const Unit& unit, const UnitSite& site, std::ostream* out)
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
        if (out != nullptr) {
            *out << "All " << test.tested << " LEDs must be " << name << " now." << std::endl;
        }
        site.pause(2);
    }
    lightAll(test, unit, LedManager::COLOR_OFF);
    if (out != nullptr && test.failedCommands == 0) {
        *out << "All " << test.tested << " LEDs must be dark now." << std::endl;
    }
    return test;
}

SelfTest testSound(const Unit& unit, std::ostream* out)
{
    SelfTest test;
    for (const auto& [sound, name] : {std::pair(passSound, "pass"), std::pair(failSound, "fail")}) {
        if (out != nullptr) {
            *out << "Playing the " << name << " sound: it must be heard." << std::endl;
        }
        runIn(test, unit, {"aplay", sound}, soundLimit);
        ++test.tested;
    }
    return test;
}
