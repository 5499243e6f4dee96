#pragma once

#include <functional>
#include <map>
#include <string>

#include <nlohmann/json.hpp>

/// What reports are made of, companion/catalogue.json, which is a part of the program: texts that others share, the
/// failures of runs, what a log leaves open, and the findings of checks.
///
/// @param section  "texts", "tools", "failures", "gaps" or "findings"
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
