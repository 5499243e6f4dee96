#pragma once

#include "findings.h"
#include "stick/folder.h"

#include <iosfwd>
#include <string>
#include <string_view>

#include <sys/types.h>

inline constexpr char archiveName[] = "OSUpgrade.zip";
inline constexpr char scriptName[] = "unzipUpgrade.sh";
inline constexpr char unfinishedPrefix[] = ".unfinished-"; ///< of the version folder while `stick make` writes it

/// Checks the stick at `path` for what the updater will do with it, and prints the report to `out`.
///
/// Reads only, runs nothing and opens no file outside the stick: a symbolic link that leads out of it is reported
/// and not followed.
///
/// @param json     print one JSON object instead of text
/// @param keyring  with the keys that the maker signs with; empty: the installed one
/// @return a Report::Status; also STATUS_UNCHECKED, with a message on `errors`, when there is no folder to read
int runStick(const std::string& path, bool json, std::ostream& out, std::ostream& errors,
             const std::string& keyring = "");

/// Says that there is no stick to read at `path` because of `error`, an errno: refuse() for `command`.
Report::Status refuseStick(const char* command, const std::string& path, int error, bool json, std::ostream& out,
                           std::ostream& errors);

/// The check itself: adds to `report` what it finds.
///
/// @param onUnit  the stick is where the unit mounts it
void checkStick(const StickFolder& stick, bool onUnit, Report& report);

/// Checks the name that the updater reads the board's version from: the first line of the listing without its first
/// five bytes.
///
/// @return the version as the updater will compare it, not printable as it is
std::string checkVersionName(const std::string& name, Report& report);

inline constexpr std::size_t scriptBytesChecked = std::size_t{1024} * 1024;

/// Checks that the board's kernel can run the install script, and its line ends.
///
/// @param start  the first bytes of the script, up to scriptBytesChecked
/// @param size   of the whole script (bytes)
/// @param name   the script's, for messages, printable
void checkScript(std::string_view start, std::uint64_t size, const std::string& name, Report& report);

/// Checks that the script of this name and mode, stat(2), can be started on the board: the upload takes its run bit
/// along.
///
/// @param keepsPermissions  false when the mount's options make up the mode
/// @param onUnit            the mount is the unit's
void checkRunBit(mode_t mode, bool keepsPermissions, bool onUnit, const std::string& name, Report& report);
