#include "findings.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <iostream>
#include <sstream>
#include <utility>

#include <sys/ioctl.h>
#include <unistd.h>
#include <utf8.h>

namespace
{

const std::size_t longestShown = 300; // bytes; a file name has at most 255
const std::array<const char*, 4> severityWords = {"note", "warning", "error", "unchecked"};

/// True for characters beyond ASCII that do not show, or that change how their neighbours show.
bool isInvisible(char32_t character)
{
    static const std::array<std::pair<char32_t, char32_t>, 12> ranges = {{
        {0x80, 0xA0},       // C1 controls, no-break space
        {0xAD, 0xAD},       // soft hyphen
        {0x34F, 0x34F},     // combining grapheme joiner
        {0x61C, 0x61C},     // Arabic letter mark
        {0x115F, 0x1160},   // Hangul fillers
        {0x180B, 0x180E},   // Mongolian separators
        {0x2000, 0x200F},   // blanks, zero width, direction marks
        {0x2028, 0x202F},   // line separators, direction embeddings
        {0x205F, 0x206F},   // blanks, direction isolates
        {0x3000, 0x3000},   // ideographic space
        {0xFE00, 0xFEFF},   // variation selectors, Arabic presentation forms, byte order mark
        {0xE0000, 0x10FFFF} // tags, private use
    }};
    return std::any_of(ranges.begin(), ranges.end(),
                       [&](const auto& range) { return character >= range.first && character <= range.second; });
}

std::string formatted(const char* format, unsigned value)
{
    std::array<char, 32> buffer{};
    std::snprintf(buffer.data(), buffer.size(), format, value);
    return buffer.data();
}

/// Appends a character, whose UTF-8 is `bytes`, in its printable form.
void appendEscaped(std::string& text, char32_t character, std::string_view bytes)
{
    static const std::string_view named = "\nn\rr\tt\"\"\\\\"; // a character and what follows its backslash
    const std::size_t place = character < 0x80 ? named.find(static_cast<char>(character)) : std::string_view::npos;
    if (place != std::string_view::npos && place % 2 == 0) {
        text.append("\\").append(1, named[place + 1]);
    } else if (character < 0x20 || character == 0x7F) {
        text += formatted("\\x%02x", character);
    } else if (isInvisible(character)) {
        text += formatted("\\u{%x}", character);
    } else {
        text += bytes;
    }
}

/// The columns that a terminal needs for `text`: two for each wide character, Unicode's annex 11, none for one that
/// combines with the one before.
std::size_t columnsOf(std::string_view text)
{
    std::size_t columns = 0;
    for (const auto* next = text.begin(); next != text.end();) {
        const char32_t character = utf8::unchecked::next(next);
        const bool wide =
            (character >= 0x1100 && character <= 0x115F) || (character >= 0x2E80 && character <= 0xA4CF) ||
            (character >= 0xAC00 && character <= 0xD7A3) || (character >= 0xF900 && character <= 0xFAFF) ||
            (character >= 0xFF01 && character <= 0xFF60) || (character >= 0x1F300 && character <= 0x3FFFD);
        const bool combines = character >= 0x300 && character <= 0x36F;
        columns += combines ? 0 : wide ? 2 : 1;
    }
    return columns;
}

void printLine(std::string_view line, std::size_t width, std::ostream& out)
{
    const std::size_t tab = line.find('\t');
    const std::string_view label = line.substr(0, tab == std::string_view::npos ? 0 : tab);
    const std::string_view rest = line.substr(tab + 1); // all of it without a tab
    out << label;
    if (line.size() <= width) { // no character has more columns than bytes
        out << rest;
        return;
    }
    const std::size_t begin = columnsOf(label); // of what goes on in a further line
    std::size_t column = begin;
    for (std::string_view words = rest; !words.empty();) {
        const std::size_t blanks = std::min(words.find_first_not_of(' '), words.size());
        const std::string_view word = words.substr(blanks, words.find(' ', blanks) - blanks);
        const std::size_t columns = columnsOf(word);
        const bool breaks = column > begin && column + blanks + columns > width;
        out << (breaks ? '\n' + std::string(begin, ' ') : std::string(blanks, ' ')) << word;
        column = (breaks ? begin : column + blanks) + columns;
        words.remove_prefix(blanks + word.size());
    }
}

std::string withSeparators(std::uint64_t number)
{
    std::string digits = std::to_string(number);
    for (std::size_t position = digits.size(); position > 3;) {
        position -= 3;
        digits.insert(position, ",");
    }
    return digits;
}

} // namespace

const char* severityWord(Severity severity)
{
    return severityWords.at(static_cast<std::size_t>(severity));
}

Report::Report(std::string command, std::string subject, std::string good)
    : mCommand(std::move(command)), mSubject(std::move(subject)), mGood(std::move(good))
{
}

std::string Report::fact(const std::string& name) const
{
    const auto found =
        std::find_if(mFacts.begin(), mFacts.end(), [&](const Fact& candidate) { return candidate.name == name; });
    return found != mFacts.end() && found->value.is_string() ? found->value.get<std::string>() : "";
}

void Report::addFact(std::string name, std::string label, std::string text, nlohmann::ordered_json value)
{
    mFacts.push_back({std::move(name), std::move(label), std::move(text), std::move(value)});
}

void Report::addFact(const std::string& name, const std::string& label, const std::string& text)
{
    addFact(name, label, text, text);
}

void Report::define(Values values)
{
    mValues.merge(values);
}

void Report::add(Finding finding)
{
    mFindings.push_back(std::move(finding));
}

void Report::add(const std::string& name, Values values)
{
    values.insert(mValues.begin(), mValues.end());
    const nlohmann::ordered_json& entry = catalogue("findings").at(name);
    const auto* const word = std::find(severityWords.begin(), severityWords.end(), entry.at("severity"));
    add({static_cast<Severity>(word - severityWords.begin()), name.substr(0, name.find('.')),
         filled(entry.at("what"), values), filled(entry.at("effect"), values), filled(entry.at("remedy"), values)});
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
    print(out);
}

void Report::print(std::ostream& out) const
{
    std::size_t width = 0;
    for (const Fact& fact : mFacts) {
        width = std::max(width, fact.label.size());
    }
    std::string text;
    for (const Fact& fact : mFacts) {
        text += fact.label + ':' + std::string(width - fact.label.size() + 2, ' ') + '\t' + fact.text + '\n';
    }
    for (Severity severity : {Severity::ERROR, Severity::UNCHECKED, Severity::WARNING, Severity::NOTE}) {
        for (const Finding& finding : mFindings) {
            if (finding.severity == severity) {
                text +=
                    std::string("\n") + severityWord(severity) + ": \t" + finding.what + " [" + finding.check + "]\n";
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
    nlohmann::ordered_json facts = nlohmann::ordered_json::object();
    for (const Fact& fact : mFacts) {
        facts[fact.name] = fact.value;
    }
    nlohmann::ordered_json findings = nlohmann::ordered_json::array();
    for (const Finding& finding : mFindings) {
        findings.push_back({{"severity", severityWord(finding.severity)},
                            {"check", finding.check},
                            {"what", finding.what},
                            {"effect", finding.effect},
                            {"remedy", finding.remedy}});
    }
    return {{"command", mCommand},           {"version", jsonVersion},
            {"subject", mSubject},           {"status", static_cast<int>(status())},
            {"fit", status() == STATUS_FIT}, {"facts", facts},
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

std::size_t widthOf(const std::ostream& out)
{
    winsize window = {};
    const bool known =
        out.rdbuf() == std::cout.rdbuf() && ioctl(STDOUT_FILENO, TIOCGWINSZ, &window) == 0 && window.ws_col > 0;
    return known ? window.ws_col : 100;
}

void printText(std::string_view text, std::ostream& out)
{
    const std::size_t width = widthOf(out);
    std::istringstream lines{std::string(text)};
    for (std::string line; std::getline(lines, line);) {
        printLine(line, width, out);
        out << (lines.eof() ? "" : "\n");
    }
}

std::string escaped(std::string_view text)
{
    std::string result;
    while (!text.empty()) {
        const char* const invalid = utf8::find_invalid(text.begin(), text.end());
        for (const char* next = text.begin(); next < invalid;) {
            const char* const begin = next;
            const char32_t character = utf8::unchecked::next(next);
            appendEscaped(result, character, {begin, static_cast<std::size_t>(next - begin)});
        }
        text.remove_prefix(static_cast<std::size_t>(invalid - text.begin()));
        if (!text.empty()) {
            result += formatted("\\x%02x", static_cast<unsigned char>(text.front()));
            text.remove_prefix(1);
        }
    }
    return result;
}

std::string shown(std::string_view text)
{
    return '"' + escaped(text.substr(0, longestShown)) + (text.size() > longestShown ? "\"..." : "\"");
}

std::string byteCount(std::uint64_t bytes)
{
    if (bytes < 1000) {
        return counted(bytes, "byte");
    }
    double value = static_cast<double>(bytes);
    std::size_t unit = 0;
    static const std::array<const char*, 6> units = {"kB", "MB", "GB", "TB", "PB", "EB"};
    for (value /= 1000; value >= 999.95 && unit + 1 < units.size(); ++unit) {
        value /= 1000;
    }
    std::array<char, 32> buffer{};
    std::snprintf(buffer.data(), buffer.size(), "%.1f %s", value, units.at(unit));
    return std::string(buffer.data()) + " (" + withSeparators(bytes) + " bytes)";
}

std::string counted(std::uint64_t count, const std::string& noun, const std::string& plural)
{
    return withSeparators(count) + ' ' + (count == 1 ? noun : plural.empty() ? noun + 's' : plural);
}

std::string listed(const std::vector<std::string>& texts)
{
    const std::size_t count = std::min<std::size_t>(texts.size(), 5);
    std::string result;
    for (std::size_t index = 0; index < count; ++index) {
        result += (index == 0 ? "" : ", ") + shown(texts[index]);
    }
    return texts.size() == count ? result : result + " and " + std::to_string(texts.size() - count) + " more";
}
