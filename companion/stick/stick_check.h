#pragma once

#include "findings.h"
#include "stick/folder.h"

#include <iosfwd>
#include <string>

/// Checks the stick at `path` for what the updater will do with it, and prints the report to `out`.
///
/// Reads only, runs nothing and opens no file outside the stick: a symbolic link that leads out of it is reported
/// and not followed.
///
/// @param json  print one JSON object instead of text
/// @return a Report::Status; also STATUS_UNCHECKED, with a message on `errors`, when there is no folder to read
int runStick(const std::string& path, bool json, std::ostream& out, std::ostream& errors);

/// The check itself: adds to `report` what it finds.
///
/// @param onUnit  the stick is where the unit mounts it
void checkStick(const StickFolder& stick, bool onUnit, Report& report);

/// Checks the name that the updater reads the board's version from: the first line of the listing without its first
/// five bytes.
///
/// @return the version as the updater will compare it, not printable as it is
std::string checkVersionName(const std::string& name, Report& report);
