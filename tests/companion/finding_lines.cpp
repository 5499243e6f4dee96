#include "finding_lines.h"

#include "kept_reports.h"

#include <gtest/gtest.h>

#include <regex>
#include <sstream>

namespace
{

/// The report as text, each finding on a line for each of its parts.
void compare(const Report& report)
{
    static const std::regex lineBreak("\n +(?!Fix:|The updater:)");
    std::ostringstream text;
    report.write(false, text);
    compareWithKept(std::regex_replace(text.str(), lineBreak, " ") + report.toJson()["facts"].dump() + '\n');
}

} // namespace

Lines findingsOf(const Report& report)
{
    compare(report);
    Lines lines;
    for (const Finding& finding : report.findings()) {
        lines.push_back(nlohmann::json(finding.severity).get<std::string>() + ' ' + finding.check);
    }
    return lines;
}

std::string whatOf(const Report& report, const std::string& check)
{
    compare(report);
    Lines found;
    for (const Finding& finding : report.findings()) {
        if (finding.check == check) {
            found.push_back(finding.what);
        }
    }
    EXPECT_EQ(found.size(), 1U) << check;
    return found.empty() ? "" : found.front();
}

std::string factOf(const Report& report, const std::string& name)
{
    compare(report);
    const nlohmann::ordered_json facts = report.toJson()["facts"];
    return facts.contains(name) ? facts[name].dump() : "";
}
