#pragma once

#include "log/run.h"

#include <iosfwd>
#include <string>

#include <nlohmann/json.hpp>

/// Writes the part of a page's template that shows the data of this name.
///
/// @param page  embeddedPage or embeddedFleetPage
void renderPart(const char* page, const char* part, const nlohmann::ordered_json& content, std::ostream& out);

/// Writes runs, explained before, as one page that needs nothing from outside: for each run what happened, why and what
/// to do, and its timeline of threads, commands, waits and LED pattern.
class HtmlPage
{
public:
    explicit HtmlPage(std::ostream& out);

    void writeRun(const Run& run, const std::string& source);

    /// Ends the page. Without it, the page is not whole.
    void finish();

private:
    std::ostream& mOut;
};
