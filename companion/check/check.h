#pragma once

#include "unit/environment.h"

#include <iosfwd>
#include <string>

/// True for a machine that has the updater's service.
bool isUnit(const Unit& unit);

/// Checks before an update what it would do now: the unit, the stick at `path`, and what both together come to.
///
/// Changes nothing. On a machine that is no unit, the stick alone is checked.
///
/// @return a Report::Status; also STATUS_UNCHECKED, with a message on `errors`, when there is no stick to read
int runCheck(const std::string& path, bool json, const UnitSite& site, std::ostream& out, std::ostream& errors);

struct ReportOptions
{
    std::string file;                    ///< the archive, which must not be there yet
    std::string stick = stickMountPoint; ///< where a stick may be plugged in
    bool json = false;
};

/// Packs what support needs into one archive (tar, gzip): the journal's runs, what the checks say, versions, clock and
/// the package database's state; no secrets. A README.txt in it says what is left out.
///
/// @return a Report::Status: STATUS_FIT, or STATUS_UNCHECKED with a message on `errors` and no file
int runReport(const ReportOptions& options, const UnitSite& site, std::ostream& out, std::ostream& errors);

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
