#pragma once

#include "findings.h"
#include "unit/environment.h"

#include <cstdint>

#include <sys/statvfs.h>

/// Checks what the package manager needs: its locks, unfinished work, its words, free space, the mirrors. These are
/// refreshed into private lists, and the unit's hooks are not run: nothing changes.
void checkPackageManager(const Unit& unit, Report& report);

/// Checks that no installation is unfinished.
void checkUnfinishedWork(const Unit& unit, Report& report);

/// Checks that a package that needs `needed` bytes fits into the file system with the state `system`, statvfs(3).
void checkFreeSpace(const struct statvfs& system, std::uint64_t needed, Report& report);
