#pragma once

#include "log/run.h"

#include <nlohmann/json_fwd.hpp>

/// A problem of a run, explained before, for programs.
nlohmann::ordered_json problemToJson(const Run& run, const Problem& problem);

/// A run, explained before, for programs. Times are local, "2026-11-21T07:15:33"; durations are in seconds.
nlohmann::ordered_json runToJson(const Run& run, const std::string& source);
