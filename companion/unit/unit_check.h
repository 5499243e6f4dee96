#pragma once

#include "unit/environment.h"

#include <cstdint>
#include <iosfwd>

struct statvfs;

inline constexpr char passSound[] = "/root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav";
inline constexpr char failSound[] = "/root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav";

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

/// Checks what the package manager needs: its locks, unfinished work, its words, free space, the mirrors. These are
/// refreshed into private lists, and the unit's hooks are not run: nothing changes.
void checkPackageManager(const Unit& unit, Report& report);

/// Checks that no installation is unfinished.
void checkUnfinishedWork(const Unit& unit, Report& report);

/// Checks that a package that needs `needed` bytes fits into the file system with the state `system`, statvfs(3).
void checkFreeSpace(const struct statvfs& system, std::uint64_t needed, Report& report);

/// Does the tests of panel and sound that `options` ask for: shows every LED in every colour up to the first that
/// fails, then darkens the panel; plays both sounds to their end. `out` gets what must be seen and heard, or the JSON
/// object.
///
/// @return as runUnit()
int runSelfTests(const UnitOptions& options, const Unit& unit, std::ostream& out, std::ostream& errors);

/// Checks whether the unit is fit for an update, and prints the report to `out`.
///
/// Starts no service and lights no LED; writes only a temporary folder, which it removes, and what the package tool
/// caches of its own accord. A mirror that gives nothing costs 25 s, a slow one up to two minutes. With `panel` or
/// `sound` it does what these ask for instead, unless the updater is running.
///
/// @return a Report::Status; STATUS_UNCHECKED, with a message on `errors`, when a test is refused
int runUnit(const UnitOptions& options, const UnitSite& site, std::ostream& out, std::ostream& errors);
