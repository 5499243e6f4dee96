#include "Record.h"

#include <regex>

namespace platform
{

std::optional<Record> parseRecord(const std::string& text)
{
    static const std::regex form("Updater \\| ([0-9]{2}-[0-9]{2}-[0-9]{4} [0-9]{2}-[0-9]{2}-[0-9]{2})\t"
                                 "([0-9]+)\t([^\t/:]+):([0-9]+)\t([^\t\n]+)");
    static const std::string separator = "\n\t\t\t";
    const std::string::size_type end = text.find('\n');
    const std::string head = text.substr(0, end);
    std::smatch match;
    if (!std::regex_match(head, match, form) || text.compare(end, separator.size(), separator) != 0 ||
        text.size() == end + separator.size() || text.back() != '\n') {
        return std::nullopt;
    }
    const std::string::size_type begin = end + separator.size();
    const std::string message = text.substr(begin, text.size() - begin - 1);
    return Record{match[1], match[2], match[3], match[4], match[5], message, text};
}

std::vector<std::string> splitLog(const std::string& log)
{
    static const std::string lineBeforeRecord = "\nUpdater | ";
    std::vector<std::string> texts;
    for (std::string::size_type begin = 0; begin < log.size();) {
        const std::string::size_type next = log.find(lineBeforeRecord, begin);
        const std::string::size_type end = next == std::string::npos ? log.size() : next + 1;
        texts.push_back(log.substr(begin, end - begin));
        begin = end;
    }
    return texts;
}

} // namespace platform
