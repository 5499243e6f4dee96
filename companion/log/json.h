#pragma once

#include "log/run.h"

#include <nlohmann/json.hpp>

/// A run, explained before, for programs. Times are local, "2026-11-21T07:15:33"; durations are in seconds.
nlohmann::ordered_json runToJson(const Run& run);

/// Name of an outcome for programs, such as "no-update"; "none" when a log does not reach it.
const char* outcomeName(Outcome outcome);

/// "2026-11-21T07:15:33" of a ParsedRecord::time.
std::string isoText(std::int64_t time);
