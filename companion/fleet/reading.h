#pragma once

#include "fleet/fleet.h"

#include <string>
#include <vector>

#include <nlohmann/json.hpp>

/// Reads logs of many units into `fleet`, two or more inputs at once where the machine has the cores: journals through
/// journalctl(1), exports and other formats of journals, saved logs, and archives of `harl-updater-tool report` through
/// tar(1).
///
/// An entry of a journal belongs to the machine that it names, and one that comes again is dropped. A log without such
/// entries is a unit of its own, named after its file. Of an input that is damaged or cut off, the runs without an end
/// are left out.
///
/// @param paths  files, folders with files, or "-" for standard input
/// @return what could not be read, and why: "input" and "why" of each
nlohmann::ordered_json readFleet(const std::vector<std::string>& paths, Fleet& fleet);
