#pragma once

#include <functional>
#include <map>
#include <string>
#include <string_view>

#include <nlohmann/json.hpp>

inline bool startsWith(std::string_view text, std::string_view start)
{
    return text.substr(0, start.size()) == start;
}

inline bool contains(std::string_view text, std::string_view part)
{
    return text.find(part) != std::string_view::npos;
}

/// What reports are made of, companion/catalogue.json and commands.json, which are a part of the program: texts that
/// others share, the failures of runs, what a log leaves open, the findings of checks, and the commands' help.
///
/// @param section  "texts", "tools", "failures", "gaps", "findings" or "commands"
const nlohmann::ordered_json& catalogue(const char* section);

/// What takes the place of the names in braces.
using Values = std::map<std::string, std::string, std::less<>>;

/// A text of the catalogue, which is a string or an array of its lines, with each {name} replaced by the value of that
/// name or else by the shared text of it. Values stay as they are.
std::string filled(const nlohmann::ordered_json& text, const Values& values);

/// A text of the catalogue as it is there.
std::string unfilled(const nlohmann::ordered_json& text);

/// The shared text of this name, without values.
std::string sharedText(const char* name);
