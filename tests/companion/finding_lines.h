#pragma once

#include "findings.h"

#include <string>
#include <vector>

using Lines = std::vector<std::string>;

// Each of these also compares the whole report with the kept one: kept_reports.h.

/// Severity and check of every finding, such as "error file-missing", in order.
Lines findingsOf(const Report& report);

/// What the one finding of `check` says; a failure of the test when there is none or are several.
std::string whatOf(const Report& report, const std::string& check);

/// The value of the fact `name` as JSON text; empty when there is none.
std::string factOf(const Report& report, const std::string& name);
