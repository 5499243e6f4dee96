#include "texts.h"

#include "embedded.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <iostream>
#include <sstream>

#include <nlohmann/json.hpp>
#include <sys/ioctl.h>
#include <unistd.h>
#include <utf8.h>

namespace
{

const std::size_t longestShown = 300; // bytes; a file name has at most 255

using Ranges = std::vector<std::pair<char32_t, char32_t>>;

/// Characters beyond ASCII that do not show, or that change how their neighbours show.
const Ranges invisible = {
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
};
/// Those that take two columns of a terminal, Unicode's annex 11, and those that combine with the one before.
const Ranges wide = {{0x1100, 0x115F}, {0x2E80, 0xA4CF}, {0xAC00, 0xD7A3},
                     {0xF900, 0xFAFF}, {0xFF01, 0xFF60}, {0x1F300, 0x3FFFD}};
const Ranges combining = {{0x300, 0x36F}};

bool isIn(const Ranges& ranges, char32_t character)
{
    return character >= ranges.front().first && // which spares ASCII the search
           std::any_of(ranges.begin(), ranges.end(),
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
    } else if (isIn(invisible, character)) {
        text += formatted("\\u{%x}", character);
    } else {
        text += bytes;
    }
}

/// The columns that a terminal needs for `text`.
std::size_t columnsOf(std::string_view text)
{
    std::size_t columns = 0;
    for (const auto* next = text.begin(); next != text.end();) {
        const char32_t character = utf8::unchecked::next(next);
        columns += isIn(combining, character) ? 0 : isIn(wide, character) ? 2 : 1;
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

std::vector<std::string> linesOf(const std::string& text)
{
    std::vector<std::string> lines;
    std::istringstream stream(text);
    for (std::string line; std::getline(stream, line);) {
        lines.push_back(line);
    }
    return lines;
}

const nlohmann::ordered_json& catalogue(const char* section)
{
    static const nlohmann::ordered_json all = [] {
        auto texts = nlohmann::ordered_json::parse(embeddedCatalogue);
        texts.update(nlohmann::ordered_json::parse(embeddedCommands));
        return texts;
    }();
    return all.at(section);
}

std::string unfilled(const nlohmann::ordered_json& text)
{
    if (text.is_string()) {
        return text.get<std::string>();
    }
    std::string result;
    for (const auto& line : text) {
        result += (result.empty() ? "" : " ") + line.get<std::string>();
    }
    return result;
}

std::string filled(const std::string& text, const Values& values)
{
    std::string result;
    std::size_t position = 0;
    for (std::size_t open = 0; (open = text.find('{', position)) != std::string::npos;) {
        const std::size_t close = text.find('}', open);
        const std::string name = text.substr(open + 1, close - open - 1);
        const auto value = values.find(name);
        result += text.substr(position, open - position);
        result += value != values.end() ? value->second : sharedText(name, values);
        position = close + 1;
    }
    return result + text.substr(position);
}

std::string sharedText(const std::string& name, const Values& values, const char* section)
{
    return filled(unfilled(catalogue(section).at(name)), values);
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
    double value = static_cast<double>(bytes) / 1000;
    const char* prefix = "kMGTPE";
    for (; value >= 999.95; ++prefix) {
        value /= 1000;
    }
    std::array<char, 32> buffer{};
    std::snprintf(buffer.data(), buffer.size(), "%.1f %cB (", value, *prefix);
    return buffer.data() + withSeparators(bytes) + " bytes)";
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
