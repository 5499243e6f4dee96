#include "log/parser.h"

#include <algorithm>
#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace
{

/// Writes down what the parser hands over, one text for each event.
class Events : public LogSink
{
public:
    void record(const ParsedRecord& record) override
    {
        list.push_back("record " + std::to_string(record.line) + ' ' + std::to_string(record.time) + ' ' +
                       std::string(record.thread) + ' ' + std::string(record.operation) + ": " +
                       std::string(record.message.value_or("(none)")));
    }
    void otherLine(std::uint64_t line, std::string_view program, std::string_view text) override
    {
        list.push_back("other " + std::to_string(line) + " [" + std::string(program) + "] " + std::string(text));
    }
    void torn(std::uint64_t line) override { list.push_back("torn " + std::to_string(line)); }

    std::vector<std::string> list;
};

std::vector<std::string> parsed(const std::string& text, std::size_t blockSize = std::string::npos)
{
    Events events;
    LogParser parser(events);
    for (std::size_t position = 0; position < text.size();) {
        const std::string block = text.substr(position, blockSize);
        parser.feed(block);
        position += block.size();
    }
    parser.finish();
    return events.list;
}

using List = std::vector<std::string>;

const std::string mirrors =
    "Updater | 02-03-2024 04-05-06\t77\tUpdateManager.cpp:271\tstatic bool UpdateManager::updateMirrors()\n";
const std::string mirrorsEvent = " 1709352306 77 updateMirrors: ";

} // namespace

TEST(LogParser, RecordIsReadWhole)
{
    EXPECT_EQ(parsed(mirrors + "\t\t\tNOT OK 7\n"), List{"record 1" + mirrorsEvent + "NOT OK 7"});
}

TEST(LogParser, EmptyMessageIsARecord)
{
    EXPECT_EQ(parsed(mirrors + "\t\t\t\n"), List{"record 1" + mirrorsEvent});
}

TEST(LogParser, MessageKeepsItsOwnBlanks)
{
    EXPECT_EQ(parsed(mirrors + "\t\t\t  \tA  B \n"), List{"record 1" + mirrorsEvent + "  \tA  B "});
}

TEST(LogParser, ParametersOfTheFunctionDoNotConfuseItsName)
{
    const std::string head =
        "Updater | 02-03-2024 04-05-06\t77\tUpdateManager.cpp:74\tvoid UpdateManager::update(std::vector<"
        "UpdateManager::UpdateComponent>, bool)\n\t\t\t\n";
    EXPECT_EQ(parsed(head), List{"record 1 1709352306 77 update: "});
}

TEST(LogParser, LeapDayAndYearEndCountRight)
{
    const auto timeOf = [](const std::string& date) {
        return parsed("Updater | " + date + "\t1\ta.cpp:1\tint main(int, char**)\n\t\t\t\n").at(0);
    };
    EXPECT_EQ(timeOf("29-02-2024 23-59-59"), "record 1 1709251199 1 main: ");
    EXPECT_EQ(timeOf("01-03-2024 00-00-00"), "record 1 1709251200 1 main: ");
    EXPECT_EQ(timeOf("01-01-1970 00-00-01"), "record 1 1 1 main: ");
}

TEST(LogParser, CarriageReturnsAreTakenOff)
{
    EXPECT_EQ(parsed("Updater | 02-03-2024 04-05-06\t77\ta.cpp:1\tint main(int, char**)\r\n\t\t\t2.1.0\r\r\n"),
              List{"record 1 1709352306 77 main: 2.1.0"});
}

TEST(LogParser, JournalsPrefixesAreTakenOff)
{
    for (const std::string prefix :
         {"Nov 21 07:35:33 unit harl-updater[123]: ", "2026-11-21T07:35:33+0000 unit harl-updater[123]: ",
          "Nov 21 07:35:33.002000 unit harl-updater[123]: ", "[    5.123456] harl-updater[123]: ",
          "Sat 2026-11-21 07:35:33 UTC unit harl-updater[123]: ", "1795246533.002000 unit harl-updater[123]: "}) {
        std::string log = prefix;
        log.append(mirrors).append(prefix).append("\t\t\tOK\n");
        EXPECT_EQ(parsed(log), List{"record 1" + mirrorsEvent + "OK"}) << prefix;
    }
}

TEST(LogParser, EightBlanksStandForATab)
{
    const std::string prefix = "Nov 21 07:35:33 unit harl-updater[123]: ";
    const std::string tab(8, ' ');
    EXPECT_EQ(parsed(prefix + "Updater | 02-03-2024 04-05-06" + tab + "77" + tab + "UpdateManager.cpp:271" + tab +
                     "static bool UpdateManager::updateMirrors()\n" + prefix + tab + tab + tab + "  Version\n"),
              List{"record 1" + mirrorsEvent + "  Version"});
}

TEST(LogParser, JournalMayLeaveOutAnEmptyMessage)
{
    const std::string prefix = "Nov 21 07:35:33 unit harl-updater[123]: ";
    EXPECT_EQ(parsed(prefix + mirrors + prefix + mirrors + prefix + "\t\t\tOK\n"),
              (List{"record 1" + mirrorsEvent + "(none)", "record 2" + mirrorsEvent + "OK"}));
}

TEST(LogParser, JournalMayHideAMessage)
{
    const std::string prefix = "Nov 21 07:35:33 unit harl-updater[123]: ";
    EXPECT_EQ(parsed(prefix + mirrors + prefix + "[12B blob data]\n"), List{"record 1" + mirrorsEvent + "(none)"});
}

TEST(LogParser, ConsolesPrefixIsTakenOff)
{
    const std::string prefix = "[2026-11-21 07:35:33.123] ";
    EXPECT_EQ(parsed(prefix + mirrors + prefix + "\t\t\tOK\n" + prefix + "scp: gone\n"),
              (List{"record 1" + mirrorsEvent + "OK", "other 3 [] scp: gone"}));
}

TEST(LogParser, OtherProgramsLinesCarryTheirName)
{
    EXPECT_EQ(
        parsed(mirrors + "\t\t\tOK\nNov 21 07:35:33 unit ssh[9]: Connection timed out\nscp: gone: [3]: x\n\n"),
        (List{"record 1" + mirrorsEvent + "OK", "other 3 [ssh] Connection timed out", "other 4 [] scp: gone: [3]: x"}));
}

TEST(LogParser, RecordBehindAnUnfinishedLineIsFound)
{
    EXPECT_EQ(parsed("password: " + mirrors + "\t\t\tOK\n"),
              (List{"other 1 [] password: ", "record 1" + mirrorsEvent + "OK"}));
}

TEST(LogParser, HeadWithoutItsMessageIsTorn)
{
    EXPECT_EQ(parsed(mirrors + mirrors + "\t\t\tOK\n"),
              (List{"torn 1", "record 1" + mirrorsEvent + "(none)", "record 2" + mirrorsEvent + "OK"}));
    EXPECT_EQ(parsed(mirrors + "E: broken\n"),
              (List{"other 2 [] E: broken", "torn 1", "record 1" + mirrorsEvent + "(none)"}));
}

TEST(LogParser, HeadInterruptedByAnotherIsTorn)
{
    EXPECT_EQ(parsed("Updater | 02-03-20" + mirrors + "\t\t\tOK\n"),
              (List{"torn 1", "record 1" + mirrorsEvent + "OK"}));
}

TEST(LogParser, OpenRecordComesBeforeTheTornOneOfTheNextLine)
{
    EXPECT_EQ(parsed(mirrors + "Updater | 02-03-20" + mirrors + "\t\t\tOK\n"),
              (List{"torn 1", "record 1" + mirrorsEvent + "(none)", "torn 2", "record 2" + mirrorsEvent + "OK"}));
}

TEST(LogParser, MessageInterruptedByAHeadKeepsWhatIsThere)
{
    EXPECT_EQ(parsed(mirrors + "\t\t\tRunning com" + mirrors + "\t\t\tOK\n"),
              (List{"record 1" + mirrorsEvent + "Running com", "record 2" + mirrorsEvent + "OK"}));
}

TEST(LogParser, BeginningInTheMiddleOfARecordIsTorn)
{
    EXPECT_EQ(parsed("\t\t\tOK\n" + mirrors + "\t\t\tOK\n"), (List{"torn 1", "record 2" + mirrorsEvent + "OK"}));
}

TEST(LogParser, EndInTheMiddleOfARecordIsTorn)
{
    EXPECT_EQ(parsed(mirrors), (List{"torn 1", "record 1" + mirrorsEvent + "(none)"}));
    EXPECT_EQ(parsed(mirrors.substr(0, 25)), List{"torn 1"});
    EXPECT_EQ(parsed(mirrors + "\t\t\tO"), List{"record 1" + mirrorsEvent + "O"});
}

TEST(LogParser, ImpossibleTimesAreNoRecord)
{
    for (const std::string time :
         {"00-03-2024 04-05-06", "02-13-2024 04-05-06", "02-03-2024 24-05-06", "02-03-2024 04-60-06",
          "2024-03-02 04-05-06", "02-03-2024 04:05:06", "02-03-20x4 04-05-06"}) {
        EXPECT_EQ(parsed("Updater | " + time + "\t1\ta.cpp:1\tint main(int, char**)\n"), List{"torn 1"}) << time;
    }
}

TEST(LogParser, BlocksMakeNoDifference)
{
    const std::string text = "\t\t\tcut\nUpdater | 02-03-20" + mirrors + "\t\t\tOK\r\nfoo\n\n" + mirrors + mirrors +
                             "\t\t\tRunning com" + mirrors + "\t\t\t" + std::string(70000, 'x') + "\nend";
    const List whole = parsed(text);
    ASSERT_GT(whole.size(), 8U);
    for (const std::size_t size : {1, 2, 3, 7, 64, 4096}) {
        EXPECT_EQ(parsed(text, size), whole) << size;
    }
}

TEST(LogParser, MessageBehindAToolsLineIsItsHeads)
{
    EXPECT_EQ(parsed(mirrors + "W: slow\n\t\t\tOK\n"), (List{"other 2 [] W: slow", "record 1" + mirrorsEvent + "OK"}));
}

TEST(LogParser, BlanksEmptyLinesAndColoursMakeNoDifference)
{
    const List expected = {"record 1" + mirrorsEvent + "OK"};
    const std::string blanks = "Updater | 02-03-2024 04-05-06  77 UpdateManager.cpp:271 static bool "
                               "UpdateManager::updateMirrors()\n";
    EXPECT_EQ(parsed(blanks + "OK\n"), expected);
    EXPECT_EQ(parsed(mirrors + "\n\t\t\tOK\n\n"), expected);
    EXPECT_EQ(parsed("\x1b[1;31m" + mirrors + "\x1b[0m\t\t\tOK\x1b[0m\n"), expected);
    EXPECT_EQ(parsed("nov. 21 07:35:33 unit harl-updater[412]: " + mirrors +
                     "nov. 21 07:35:33 unit harl-updater[412]: #011#011#011OK\n"),
              expected);
}

TEST(LogParser, EmptyMessageMayLackItsBlanks)
{
    EXPECT_EQ(parsed(mirrors + "\n" + mirrors + "\t\t\tOK\n"),
              (List{"record 1" + mirrorsEvent, "record 3" + mirrorsEvent + "OK"}));
}

TEST(LogParser, OverlongLineIsCutAndTheNextOneRead)
{
    const List events = parsed(std::string(3 * LogParser::longestLine, 'x') + '\n' + mirrors + "\t\t\tOK\n", 1000);
    ASSERT_EQ(events.size(), 2U);
    EXPECT_EQ(events[0], "other 1 [] " + std::string(LogParser::longestLine, 'x'));
    EXPECT_EQ(events[1], "record 2" + mirrorsEvent + "OK");
}

TEST(LogParser, BinaryBytesDoNoHarm)
{
    std::string log = "~\xff\x01 Updater | ~\n" + mirrors + "\t\t\t\xff~\n";
    std::replace(log.begin(), log.end(), '~', '\0');
    EXPECT_EQ(parsed(log).back().substr(0, 8), "record 2");
}
