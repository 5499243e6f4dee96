#pragma once

#include "texts.h"

#include <iosfwd>
#include <string>
#include <utility>
#include <vector>

#include <nlohmann/json.hpp>

/// How much a finding matters for an update.
enum class Severity {
    NOTE,      ///< Worth knowing; the update does what it should.
    WARNING,   ///< The update works, but not everything is as it should be.
    ERROR,     ///< The update fails, does something else than intended, or its outcome cannot be seen.
    UNCHECKED, ///< Could not be found out here; the answer is open.
};

NLOHMANN_JSON_SERIALIZE_ENUM(Severity, {{Severity::NOTE, "note"},
                                        {Severity::WARNING, "warning"},
                                        {Severity::ERROR, "error"},
                                        {Severity::UNCHECKED, "unchecked"}})

/// One thing that a check noticed.
struct Finding
{
    Severity severity;
    std::string check;  ///< Fixed name of the check in kebab-case, for programs and for the tables of the documents.
    std::string what;   ///< What is the case, in a sentence.
    std::string effect; ///< What the updater would do because of it.
    std::string remedy; ///< How to mend it; empty when nothing is to be done.
};

/// What a check found: plain facts, findings, and the verdict that follows from them.
///
/// Every text in it is printable: what comes from outside goes through shown() or escaped() first.
class Report
{
public:
    /// Exit status of a check.
    enum Status {
        STATUS_FIT = 0,
        STATUS_NOT_FIT = 1,   ///< At least one error.
        STATUS_UNCHECKED = 2, ///< No error, but something could not be found out; also the status of a wrong usage.
    };

    /// @param command  name of the check for programs
    /// @param subject  what was checked, printable
    /// @param good     what it is without an error
    Report(std::string command, std::string subject, std::string good = "fit for an update")
        : mCommand(std::move(command)), mSubject(std::move(subject)), mGood(std::move(good))
    {
    }

    /// Adds a fact: `name` in snake_case for programs, `label` and `text` for people, `value`, or else `text`, for
    /// programs.
    void addFact(const std::string& name, const std::string& label, const std::string& text,
                 const nlohmann::ordered_json& value)
    {
        mLines.emplace_back(label, text);
        mFacts[name] = value;
    }
    void addFact(const std::string& name, const std::string& label, const std::string& text)
    {
        addFact(name, label, text, text);
    }

    /// Gives the catalogue's texts values for all findings that are added from now on.
    void define(Values values) { mValues.merge(values); }

    void add(Finding finding) { mFindings.push_back(std::move(finding)); }

    /// Adds a finding of the catalogue.
    ///
    /// @param name  as there: the check's name, and behind a dot the form of it where it has several
    void add(const std::string& name, Values values = {});

    /// The text of a fact for programs; empty when there is none of this name.
    std::string fact(const std::string& name) const { return mFacts.value(name, ""); }

    const std::vector<Finding>& findings() const { return mFindings; }
    Status status() const;

    /// Prints the report for people: facts, findings with the most serious first, verdict. With `json`: toJson().
    void write(bool json, std::ostream& out) const;

    /// The report for programs: command, subject, status, fit, facts and findings in the order of their checks.
    nlohmann::ordered_json toJson() const;

private:
    std::size_t count(Severity severity) const;

    std::string mCommand;
    std::string mSubject;
    std::string mGood;
    nlohmann::ordered_json mFacts = nlohmann::ordered_json::object();
    std::vector<std::pair<std::string, std::string>> mLines; // the facts for people
    std::vector<Finding> mFindings;
    Values mValues;
};

/// Version of the JSON that every command prints: docs/harl-updater-tool.schema.json.
inline constexpr int jsonVersion = 1;

/// Says why a command could not do its work: on `errors` behind the program's name, with `json` as an object on `out`
/// too.
///
/// @param text  sentences, printable
/// @return STATUS_UNCHECKED
Report::Status refuse(const std::string& command, bool json, const std::string& text, std::ostream& out,
                      std::ostream& errors);
