#include "finding_lines.h"

#include <gtest/gtest.h>

Lines findingsOf(const Report& report)
{
    Lines lines;
    for (const Finding& finding : report.findings()) {
        lines.push_back(nlohmann::json(finding.severity).get<std::string>() + ' ' + finding.check);
    }
    return lines;
}

std::string whatOf(const Report& report, const std::string& check)
{
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
    const nlohmann::ordered_json facts = report.toJson()["facts"];
    return facts.contains(name) ? facts[name].dump() : "";
}
