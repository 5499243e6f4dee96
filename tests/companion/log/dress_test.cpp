/// The same log in any dress gives the same facts.

#include "golden_logs.h"
#include "log/catalogue.h"
#include "log/dress.h"
#include "log/json.h"
#include "log/run.h"
#include "texts.h"

#include <algorithm>
#include <functional>
#include <string>

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

namespace
{

using Json = nlohmann::ordered_json;

/// What is said of each run, without its places in the log.
///
/// @param tools  with the lines of other programs
std::string saidOf(std::string_view log, bool tools)
{
    std::string said;
    RunBuilder builder([&](Run& run) {
        explain(run);
        run.firstLine = run.lastLine = run.torn.records = run.otherLines = 0;
        for (Step& step : run.steps) {
            step.line = 0;
        }
        Json facts = runToJson(run, "");
        facts.erase("cannot_tell"); // torn records have their line
        for (Json& step : facts["steps"]) {
            if (!tools) {
                step.erase("tools_said");
            }
        }
        said += facts.dump(1, ' ', false, Json::error_handler_t::replace) + '\n';
    });
    LogParser parser(builder);
    Dress dress(parser);
    for (std::size_t begin = 0; begin < log.size(); begin += 1000) {
        dress.feed(log.substr(begin, 1000));
    }
    dress.finish();
    builder.finish();
    return said;
}

using Outcomes = std::vector<Outcome>;

Outcomes outcomesOf(std::string_view log)
{
    Outcomes outcomes;
    RunBuilder builder([&](Run& run) { outcomes.push_back(run.outcome); });
    LogParser parser(builder);
    Dress dress(parser);
    dress.feed(log);
    dress.finish();
    builder.finish();
    return outcomes;
}

std::string replaced(std::string text, const std::string& from, const std::string& to)
{
    for (std::size_t position = 0; (position = text.find(from, position)) != std::string::npos; position += to.size()) {
        text.replace(position, from.size(), to);
    }
    return text;
}

std::string stripped(const std::string& line, bool left, bool right)
{
    const std::size_t begin = left ? line.find_first_not_of(" \t") : 0;
    const std::size_t end = right ? line.find_last_not_of(" \t") : line.size() - 1;
    return line.empty() || begin == std::string::npos || end == std::string::npos ? ""
                                                                                  : line.substr(begin, end - begin + 1);
}

/// A journal's entry as journalctl -o export writes it.
std::string exported(const std::string& line)
{
    std::string size(8, '\0');
    size[0] = static_cast<char>(line.size() & 0xFF);
    size[1] = static_cast<char>(line.size() >> 8);
    const bool text = line.find('\t') == std::string::npos;
    return "__CURSOR=s=1\n_PID=412\nSYSLOG_IDENTIFIER=harl-updater\nMESSAGE" + (text ? "=" : '\n' + size) + line +
           "\n\n";
}

Json entry(const std::string& line)
{
    return {{"_PID", "412"}, {"MESSAGE", line}, {"SYSLOG_IDENTIFIER", "harl-updater"}, {"PRIORITY", "6"}};
}

struct DressOfLog
{
    const char* name;
    std::function<std::string(const std::string& line)> of;
    bool reversed = false;
    bool blanksLost = false; ///< A missing version, and whose line one is, can no longer be seen everywhere.
};

void PrintTo(const DressOfLog& dress, std::ostream* out)
{
    *out << dress.name;
}

const std::string blanks(8, ' ');

const DressOfLog dresses[] = {
    {"Export", exported},
    {"Json", [](const std::string& line) { return entry(line).dump() + '\n'; }},
    {"JsonOfBytes",
     [](const std::string& line) {
         Json object = entry(line);
         object["MESSAGE"] = std::vector<unsigned char>(line.begin(), line.end());
         return object.dump() + '\n';
     }},
    {"JsonPretty", [](const std::string& line) { return entry(line).dump(8) + '\n'; }},
    {"JsonSse", [](const std::string& line) { return "data: " + entry(line).dump() + "\n\n"; }},
    {"JsonSeq", [](const std::string& line) { return "\x1e" + entry(line).dump() + '\n'; }},
    {"Verbose",
     [](const std::string& line) {
         return "Sat 2026-11-21 07:35:33.072 UTC [s=1;i=2]\n    _PID=412\n    SYSLOG_IDENTIFIER=harl-updater\n"
                "    MESSAGE=" +
                line + '\n';
     }},
    {"ShortFrench",
     [](const std::string& line) {
         return "nov. 21 07:35:33 unit harl-updater[412]: " + replaced(line, "\t", blanks) + '\n';
     }},
    {"ShortRussian",
     [](const std::string& line) {
         return "ноя 21 07:35:33 unit harl-updater[412]: " + replaced(line, "\t", blanks) + '\n';
     }},
    {"ShortMonotonic",
     [](const std::string& line) {
         return "[   12.345678] unit harl-updater[412]: " + replaced(line, "\t", blanks) + '\n';
     }},
    {"WithUnit",
     [](const std::string& line) {
         return "Sat 2026-11-21 07:35:33 UTC unit harl-updater.service[412]: " + line + '\n';
     }},
    {"Syslog",
     [](const std::string& line) {
         return "Nov 21 07:35:33 unit harl-updater[412]: " + replaced(line, "\t", "#011") + '\n';
     }},
    {"Coloured", [](const std::string& line) { return "\x1b[0;1;31m" + line + "\x1b[0m\n"; }},
    {"TabsAsTwoBlanks", [](const std::string& line) { return replaced(line, "\t", "  ") + '\n'; }, false, true},
    {"DoubleSpaced", [](const std::string& line) { return line + "\n\n"; }},
    {"StrippedLeft", [](const std::string& line) { return stripped(line, true, false) + '\n'; }, false, true},
    {"StrippedRight", [](const std::string& line) { return stripped(line, false, true) + '\n'; }, false, true},
    {"WindowsLineEnds", [](const std::string& line) { return line + "\r\n"; }},
    {"NewestFirst", [](const std::string& line) { return line + '\n'; }, true},
    {"JournalNewestFirst",
     [](const std::string& line) { return "Nov 21 07:35:33 unit harl-updater[412]: " + line + '\n'; }, true},
};

class LogDress : public testing::TestWithParam<DressOfLog>
{
};

} // namespace

TEST_P(LogDress, MakesNoDifference)
{
    for (const std::string& name : goldenLogs()) {
        if (name.rfind("journal-", 0) == 0 || name.rfind("console-", 0) == 0) {
            continue; // dressed already
        }
        const std::string log = content(name + ".log");
        Lines lines = linesOf(log);
        if (GetParam().reversed) {
            std::reverse(lines.begin(), lines.end());
        }
        std::string dressed;
        for (const std::string& line : lines) {
            dressed += GetParam().of(line);
        }
        const bool missing =
            name.rfind("stick-", 0) == 0 || name == "ssh-killed" || name.rfind("board-version-", 0) == 0;
        if (missing && GetParam().blanksLost) {
            EXPECT_EQ(outcomesOf(dressed), outcomesOf(log)) << name;
            continue;
        }
        const bool tools = !GetParam().blanksLost;
        EXPECT_EQ(saidOf(dressed, tools), saidOf(log, tools)) << name;
    }
}

INSTANTIATE_TEST_SUITE_P(Each, LogDress, testing::ValuesIn(dresses), [](const auto& test) { return test.param.name; });

TEST(LogFiles, RunThatGoesOnInTheNextFileIsOneRun)
{
    const std::string log = content("package-and-board.log");
    const std::size_t middle = log.rfind('\n', log.size() / 2) + 1;
    const auto runsOf = [](const Lines& files) {
        std::vector<Outcome> outcomes;
        RunBuilder builder([&](::Run& run) { outcomes.push_back(run.outcome); });
        for (const std::string& file : files) {
            LogParser parser(builder);
            parser.feed(file);
            parser.finish();
            builder.sourceEnds();
        }
        builder.finish();
        return outcomes;
    };
    EXPECT_THAT(runsOf({log.substr(0, middle), log.substr(middle)}), testing::ElementsAre(Outcome::UPDATED));
    EXPECT_THAT(runsOf({log, log}), testing::ElementsAre(Outcome::UPDATED, Outcome::UPDATED));
    const std::string other = content("board-upload-fails.log");
    EXPECT_EQ(runsOf({log.substr(0, middle), other.substr(other.find("uploadQuorbFiles") - 90)}).size(), 2U);
}
