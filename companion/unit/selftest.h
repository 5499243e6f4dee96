#pragma once

#include "unit/environment.h"

#include <iosfwd>
#include <string>

inline constexpr char passSound[] = "/root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav";
inline constexpr char failSound[] = "/root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav";

/// How a test of panel or sound ended.
struct SelfTest
{
    int tested = 0; ///< LEDs or sounds
    int failedCommands = 0;
    std::string reason; ///< of the last failure, printable
};

/// Shows every LED of the panel in every colour up to the first that fails, then darkens the panel. `out`, if any, gets
/// what must be seen.
SelfTest testPanel(const Unit& unit, const UnitSite& site, std::ostream* out);

/// Plays both sounds to their end. `out`, if any, gets what must be heard.
SelfTest testSound(const Unit& unit, std::ostream* out);
