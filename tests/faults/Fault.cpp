#include "Fault.h"

#include <csignal>

namespace
{

std::string same(const std::string& healthy)
{
    return healthy;
}

std::string nothing(const std::string&)
{
    return "";
}

std::string afterTenMebibytes(const std::string& healthy)
{
    const std::string line = std::string(64 * 1024 - 1, '.') + '\n';
    std::string text;
    for (int i = 0; i < 160; ++i) {
        text += line;
    }
    return text + healthy;
}

std::string afterMebibyteLine(const std::string& healthy)
{
    return std::string(1 << 20, 'x') + '\n' + healthy;
}

std::string afterEveryByte(const std::string& healthy)
{
    std::string text;
    for (int value = 0; value < 256; ++value) {
        text += static_cast<char>(value);
    }
    return text + '\n' + healthy;
}

std::string withCarriageReturns(const std::string& healthy)
{
    std::string text;
    for (const char character : healthy) {
        text += character == '\n' ? "\r\n" : std::string(1, character);
    }
    return text;
}

std::string withoutLastLineEnd(const std::string& healthy)
{
    return healthy.substr(0, healthy.size() - (healthy.empty() ? 0 : 1));
}

const int exitCodes[] = {1, 2, 100, 127, 255};
const int signals[] = {SIGKILL, SIGSEGV, SIGPIPE};
const int slow = 20; // ms, as much shorter than seconds as all waits are

} // namespace

const std::vector<Fault>& readFaults()
{
    static const std::vector<Fault> faults = [] {
        std::vector<Fault> all;
        for (const int code : exitCodes) {
            all.push_back({"exit" + std::to_string(code), code * 256, Text::Kept, same});
            // For a missing tool the shell gives 127 and prints nothing on standard output.
            all.push_back({code == 127 ? "toolMissing" : "exit" + std::to_string(code) + "Silent", code * 256,
                           Text::None, nothing});
        }
        for (const int signal : signals) {
            all.push_back({"killed" + std::to_string(signal), signal, Text::Kept, same});
            all.push_back({"killed" + std::to_string(signal) + "Silent", signal, Text::None, nothing});
        }
        all.push_back({"noOutput", 0, Text::None, nothing});
        all.push_back({"tenMebibytes", 0, Text::Preceded, afterTenMebibytes});
        all.push_back({"mebibyteLine", 0, Text::Preceded, afterMebibyteLine});
        all.push_back({"everyByte", 0, Text::Preceded, afterEveryByte});
        all.push_back({"carriageReturns", 0, Text::CarriageReturns, withCarriageReturns});
        all.push_back({"noLastLineEnd", 0, Text::Kept, withoutLastLineEnd});
        all.push_back({"noShell", 0, Text::None, nothing, false});
        all.push_back({"statusLost", -1, Text::Kept, same});
        all.push_back({"slow", 0, Text::Kept, same, true, slow});
        return all;
    }();
    return faults;
}

const std::vector<Fault>& runFaults()
{
    static const std::vector<Fault> faults = [] {
        std::vector<Fault> all;
        for (const int code : exitCodes) {
            all.push_back({code == 127 ? "toolMissing" : "exit" + std::to_string(code), code * 256, Text::None, same});
        }
        for (const int signal : signals) {
            all.push_back({"killed" + std::to_string(signal), signal, Text::None, same});
        }
        all.push_back({"noShell", -1, Text::None, same});
        all.push_back({"slow", 0, Text::None, same, true, slow});
        return all;
    }();
    return faults;
}
