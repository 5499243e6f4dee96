#pragma once

#include "findings.h"
#include "unit/environment.h"

#include <cstdint>

#include <sys/statvfs.h>

/// Checks what the package manager needs: its locks, unfinished work, its words, free space, the mirrors.
void checkPackageManager(const Unit& unit, Report& report);

/// The version of the head's package that a refresh of the mirrors now would bring: into private lists, so that nothing
/// changes. Empty, and reported, when they cannot be refreshed.
std::string candidateNow(const Unit& unit, Report& report);

/// Checks that no installation is unfinished.
void checkUnfinishedWork(const Unit& unit, Report& report);

/// Checks that a package that needs `needed` bytes fits into the file system with the state `system`, statvfs(3).
void checkFreeSpace(const struct statvfs& system, std::uint64_t needed, Report& report);
