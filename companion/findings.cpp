#include "findings.h"

#include <algorithm>
#include <array>
#include <ostream>

void Report::add(const std::string& name, Values values)
{
    values.insert(mValues.begin(), mValues.end());
    const nlohmann::ordered_json& entry = catalogue("findings").at(name);
    const auto text = [&](const char* part) { return filled(unfilled(entry.at(part)), values); };
    add({entry.at("severity").get<Severity>(), name.substr(0, name.find('.')), text("what"), text("effect"),
         text("remedy")});
}

std::size_t Report::count(Severity severity) const
{
    return static_cast<std::size_t>(std::count_if(
        mFindings.begin(), mFindings.end(), [&](const Finding& finding) { return finding.severity == severity; }));
}

Report::Status Report::status() const
{
    return count(Severity::ERROR) > 0 ? STATUS_NOT_FIT : count(Severity::UNCHECKED) > 0 ? STATUS_UNCHECKED : STATUS_FIT;
}

void Report::write(bool json, std::ostream& out) const
{
    if (json) {
        out << toJson().dump(2) << '\n';
        return;
    }
    std::size_t width = 0;
    for (const auto& [label, fact] : mLines) {
        width = std::max(width, label.size());
    }
    std::string text;
    for (const auto& [label, fact] : mLines) {
        text.append(label).append(":").append(width - label.size() + 2, ' ').append("\t").append(fact).append("\n");
    }
    for (Severity severity : {Severity::ERROR, Severity::UNCHECKED, Severity::WARNING, Severity::NOTE}) {
        for (const Finding& finding : mFindings) {
            if (finding.severity == severity) {
                text += '\n' + nlohmann::json(severity).get<std::string>() + ": \t" + finding.what + " [" +
                        finding.check + "]\n";
                text += finding.effect.empty() ? "" : "  The updater: \t" + finding.effect + '\n';
                text += finding.remedy.empty() ? "" : "  Fix:         \t" + finding.remedy + '\n';
            }
        }
    }
    const std::size_t warnings = count(Severity::WARNING);
    const std::array<std::string, 3> verdicts = {
        " is " + mGood, " is NOT " + mGood, ": not everything could be checked, whether it is " + mGood + " is open"};
    printText(text + '\n' + mSubject + verdicts.at(status()) +
                  (warnings > 0 ? ", with " + counted(warnings, "warning") : "") + ".\n",
              out);
}

nlohmann::ordered_json Report::toJson() const
{
    nlohmann::ordered_json findings = nlohmann::ordered_json::array();
    for (const Finding& finding : mFindings) {
        findings.push_back({{"severity", finding.severity},
                            {"check", finding.check},
                            {"what", finding.what},
                            {"effect", finding.effect},
                            {"remedy", finding.remedy}});
    }
    return {{"command", mCommand},           {"version", jsonVersion},
            {"subject", mSubject},           {"status", static_cast<int>(status())},
            {"fit", status() == STATUS_FIT}, {"facts", mFacts},
            {"findings", findings}};
}

Report::Status refuse(const std::string& command, bool json, const std::string& text, std::ostream& out,
                      std::ostream& errors)
{
    if (json) {
        const nlohmann::ordered_json object = {
            {"command", command}, {"version", jsonVersion}, {"status", Report::STATUS_UNCHECKED}, {"error", text}};
        out << object.dump(2) << '\n';
    }
    errors << "harl-updater-tool: " << text << '\n';
    return Report::STATUS_UNCHECKED;
}
