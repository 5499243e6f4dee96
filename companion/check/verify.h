#pragma once

#include "unit/environment.h"

#include <iosfwd>

struct VerifyOptions
{
    bool json = false;
    bool record = false; ///< one line for the journal: "verify: the unit is well"
};

/// Checks after an update whether the unit is well: the package's files, unfinished installations, the versions against
/// what the last run in the journal was to install, and the application.
///
/// Changes nothing; ends within four minutes whatever does not answer.
///
/// @return a Report::Status
int runVerify(const VerifyOptions& options, const UnitSite& site, std::ostream& out);
