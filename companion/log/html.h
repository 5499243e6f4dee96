#pragma once

#include "log/run.h"

#include <iosfwd>
#include <string>

#include <nlohmann/json_fwd.hpp>

/// Writes the part of a page's template that shows the data of this name.
///
/// @param page  embeddedPage or embeddedFleetPage
void renderPart(const char* page, const char* part, const nlohmann::ordered_json& content, std::ostream& out);

/// Writes a run, explained before: what happened, why and what to do, and its timeline of threads, commands, waits and
/// LED pattern. A page, which needs nothing from outside, is beginPage(), its runs and endPage().
void writeRunToPage(const Run& run, const std::string& source, std::ostream& out);
void beginPage(std::ostream& out);
void endPage(std::ostream& out);
