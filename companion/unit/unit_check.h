#pragma once

#include "unit/environment.h"

#include <iosfwd>

struct UnitOptions
{
    bool json = false;  ///< Print one JSON object instead of text.
    bool panel = false; ///< Test the lamps instead of checking.
    bool sound = false; ///< Play both sounds instead of checking.
};

/// The check itself: adds to `report` what it finds.
void checkUnit(const Unit& unit, Report& report);

/// Asks the board for its version as the updater does: the fact "board_version", or what is wrong.
void checkBoard(const Unit& unit, Report& report);

/// Checks whether the unit is fit for an update, and prints the report to `out`.
///
/// Starts no service and lights no LED; writes only a temporary folder, which it removes, and what the package tool
/// caches of its own accord. A mirror that gives nothing costs 25 s, a slow one up to two minutes. With `panel` or
/// `sound` it does what these ask for instead, unless the updater is running.
///
/// @return a Report::Status; STATUS_UNCHECKED, with a message on `errors`, when a test is refused
int runUnit(const UnitOptions& options, const UnitSite& site, std::ostream& out, std::ostream& errors);
