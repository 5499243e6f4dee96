#pragma once

#include <cstdint>
#include <functional>
#include <iosfwd>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include <nlohmann/json_fwd.hpp>

inline bool startsWith(std::string_view text, std::string_view start)
{
    return text.substr(0, start.size()) == start;
}

inline bool contains(std::string_view text, std::string_view part)
{
    return text.find(part) != std::string_view::npos;
}

/// The lines of `text`, without their ends.
std::vector<std::string> linesOf(const std::string& text);

// What reports are made of

/// companion/catalogue.json and commands.json, which are a part of the program: texts that others share, the failures
/// of runs, what a log leaves open, the findings of checks, and the commands' help.
///
/// @param section  "texts", "tools", "failures", "gaps", "findings" or "commands"
const nlohmann::ordered_json& catalogue(const char* section);

/// What takes the place of the names in braces.
using Values = std::map<std::string, std::string, std::less<>>;

/// A text of the catalogue as it is there: a string or an array of its lines.
std::string unfilled(const nlohmann::ordered_json& text);

/// `text` with each {name} replaced by the value of that name or else by the shared text of it. Values stay as they
/// are.
std::string filled(const std::string& text, const Values& values);

/// The text of this name in a section that holds texts alone, filled().
std::string sharedText(const std::string& name, const Values& values = {}, const char* section = "texts");

// What is shown

/// The columns of the terminal that `out` is, or 100 where it is none.
std::size_t widthOf(const std::ostream& out);

/// Prints lines, each no longer than widthOf() `out`. They break at blanks only, so that a path stays whole. What goes
/// on in a further line begins below the place of the line's tab, which itself is not printed.
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

/// shown() texts with commas between; of more than five only the first five and how many more there are.
std::string listed(const std::vector<std::string>& texts);

/// `bytes` with an SI unit and in full: "3.1 MB (3,145,728 bytes)"; below 1,000 only "17 bytes".
std::string byteCount(std::uint64_t bytes);

/// `count` and the noun that fits it: "1 entry", "2 entries". Without `plural` it is the noun and an s.
std::string counted(std::uint64_t count, const std::string& noun, const std::string& plural = "");
