#pragma once

#include "texts.h"

#include <cstddef>
#include <cstdint>
#include <iosfwd>
#include <string>
#include <string_view>
#include <vector>

#include <nlohmann/json.hpp>

/// How much a finding matters for an update.
enum class Severity {
    NOTE,      ///< Worth knowing; the update does what it should.
    WARNING,   ///< The update works, but not everything is as it should be.
    ERROR,     ///< The update fails, does something else than intended, or its outcome cannot be seen.
    UNCHECKED, ///< Could not be found out here; the answer is open.
};

/// The word for `severity` in reports: "note", "warning", "error" or "unchecked".
const char* severityWord(Severity severity);

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
    Report(std::string command, std::string subject, std::string good = "fit for an update");

    /// Adds a fact: `name` in snake_case for programs, `label` and `text` for people, `value` for programs.
    void addFact(std::string name, std::string label, std::string text, nlohmann::ordered_json value);

    /// Adds a fact whose value for programs is its text.
    void addFact(const std::string& name, const std::string& label, const std::string& text);

    /// Gives the catalogue's texts values for all findings that are added from now on.
    void define(Values values);

    void add(Finding finding);

    /// Adds a finding of the catalogue.
    ///
    /// @param name  as there: the check's name, and behind a dot the form of it where it has several
    void add(const std::string& name, Values values = {});

    /// The text of a fact for programs; empty when there is none of this name.
    std::string fact(const std::string& name) const;

    const std::vector<Finding>& findings() const { return mFindings; }
    Status status() const;

    /// Prints the report for people: facts, findings with the most serious first, verdict. With `json`: toJson().
    void write(bool json, std::ostream& out) const;

    /// The report for programs: command, subject, status, fit, facts and findings in the order of their checks.
    nlohmann::ordered_json toJson() const;

private:
    void print(std::ostream& out) const;
    std::size_t count(Severity severity) const;

    struct Fact
    {
        std::string name;
        std::string label;
        std::string text;
        nlohmann::ordered_json value;
    };

    std::string mCommand;
    std::string mSubject;
    std::string mGood;
    std::vector<Fact> mFacts;
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

/// The columns of the terminal that `out` is, or 100 where it is none.
std::size_t widthOf(const std::ostream& out);

/// Prints lines, each no longer than the terminal is wide, or 100 columns where `out` is none. They break at blanks
/// only, so that a path stays whole. What goes on in a further line begins below the place of the line's tab, which
/// itself is not printed.
///
/// @param text  printable but for tabs and line ends
void printText(std::string_view text, std::ostream& out);

/// `text` made fit for a terminal and for JSON whatever bytes it holds.
///
/// Control characters, invalid UTF-8 and characters that are invisible or change the direction of writing become \n,
/// \t, \r, \xHH (a byte) or \u{HHHH} (a character); a double quote and a backslash get a backslash.
std::string escaped(std::string_view text);

/// escaped() `text` in double quotes. One of more than 300 bytes is cut, which three dots behind the quotes show.
std::string shown(std::string_view text);

/// `bytes` with an SI unit and in full: "3.1 MB (3,145,728 bytes)"; below 1,000 only "17 bytes".
std::string byteCount(std::uint64_t bytes);

/// `count` and the noun that fits it: "1 entry", "2 entries". Without `plural` it is the noun and an s.
std::string counted(std::uint64_t count, const std::string& noun, const std::string& plural = "");

/// shown() texts with commas between; of more than five only the first five and how many more there are.
std::string listed(const std::vector<std::string>& texts);
