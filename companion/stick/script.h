#pragma once

#include "findings.h"

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include <sys/types.h>

inline constexpr std::size_t scriptBytesChecked = std::size_t{1024} * 1024;

/// Checks that the board's kernel can run the install script, and its line ends.
///
/// @param start  the first bytes of the script, up to scriptBytesChecked
/// @param size   of the whole script (bytes)
/// @param name   the script's name for messages, printable
void checkScript(std::string_view start, std::uint64_t size, const std::string& name, Report& report);

/// Checks that the script can be started on the board: the upload takes its run bit along.
///
/// @param mode             of the script, as stat(2) gives it
/// @param keepsPermissions false when the mount's options make up the mode
/// @param onUnit           the mount is the unit's
/// @param name             the script's name for messages, printable
void checkRunBit(mode_t mode, bool keepsPermissions, bool onUnit, const std::string& name, Report& report);
