#pragma once

#include "unit/unit_check.h"

inline constexpr char passSound[] = "/root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav";
inline constexpr char failSound[] = "/root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav";

/// Does the tests of panel and sound that `options` ask for: shows every LED in every colour up to the first that
/// fails, then darkens the panel; plays both sounds to their end. `out` gets what must be seen and heard, or the JSON
/// object.
///
/// @return as runUnit()
int runSelfTests(const UnitOptions& options, const Unit& unit, const UnitSite& site, std::ostream& out,
                 std::ostream& errors);
