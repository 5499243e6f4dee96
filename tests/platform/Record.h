#pragma once

#include <optional>
#include <string>
#include <vector>

namespace platform
{

/// One log record, taken apart.
struct Record
{
    std::string time;
    std::string thread;
    std::string file;
    std::string line;
    std::string function;
    std::string message;
    std::string text;     ///< the whole record as it was written
    bool flushed = false; ///< set by the stand-in platform
};

/// Takes `text` apart; nothing unless it is exactly one well-formed record.
std::optional<Record> parseRecord(const std::string& text);

/// Cuts a log into the texts of its records; what comes before the first one is a text too.
std::vector<std::string> splitLog(const std::string& log);

} // namespace platform
