#include "Log.h"

#include "UnitTest.h"

#include <cstdlib>
#include <ctime>
#include <sstream>

namespace
{

struct Speaker
{
    static void speak(int) { LOG() << "spoken"; }
};

class LogTest : public UnitTest
{
};

TEST_F(LogTest, RecordHoldsEveryPieceInItsPlace)
{
    Speaker::speak(1);
    std::ostringstream thread;
    thread << std::this_thread::get_id();

    const std::vector<platform::Record> records = platform::records();
    ASSERT_EQ(records.size(), 1U);
    EXPECT_EQ(records[0].text, "Updater | " + records[0].time + "\t" + thread.str() + "\tLogTest.cpp:" +
                                   records[0].line + "\tstatic void {anonymous}::Speaker::speak(int)\n\t\t\tspoken\n");
    EXPECT_GT(std::stoi(records[0].line), 0);
}

TEST_F(LogTest, LineIsTheStatements)
{
    LOG();
    const int line = __LINE__ - 1;
    EXPECT_EQ(platform::records().at(0).line, std::to_string(line));
}

TEST_F(LogTest, MessageMayBeEmpty)
{
    LOG();
    EXPECT_EQ(platform::records().at(0).message, "");
}

TEST_F(LogTest, PiecesStandWithoutSeparators)
{
    LOG() << "code:" << -3 << true << "end ";
    EXPECT_EQ(platform::records().at(0).message, "code:-31end ");
}

TEST_F(LogTest, RecordIsOnePieceAndFlushed)
{
    LOG() << "a"
          << "b";
    const std::vector<platform::Record> records = platform::records();
    ASSERT_EQ(records.size(), 1U);
    EXPECT_TRUE(records[0].flushed);
}

TEST_F(LogTest, RecordUnderABraceLessIfBelongsToIt)
{
    // NOLINTBEGIN(readability-braces-around-statements)
    for (const bool speak : {false, true})
        if (speak)
            LOG() << "then";
        else
            platform::note("else");
    // NOLINTEND(readability-braces-around-statements)
    EXPECT_EQ(journal(), (Lines{"else", "log:then"}));
}

TEST_F(LogTest, TimeIsLocalOnThe24HourClock)
{
    // At any time of day, one of the two zones is in the afternoon: 24 hours, not 12.
    for (const char* zone : {"XXX+11:00", "XXX-01:00"}) {
        SCOPED_TRACE(zone);
        ASSERT_EQ(setenv("TZ", zone, 1), 0);
        tzset();
        platform::reset();
        const std::time_t before = std::time(nullptr);
        LOG();
        const std::time_t after = std::time(nullptr);
        const std::string time = platform::records().at(0).time;
        Lines allowed;
        for (std::time_t now = before; now <= after; ++now) {
            char text[32];
            ASSERT_NE(std::strftime(text, sizeof text, "%d-%m-%Y %H-%M-%S", std::localtime(&now)), 0U);
            allowed.push_back(text);
        }
        EXPECT_THAT(allowed, testing::Contains(time));
    }
    unsetenv("TZ");
    tzset();
}

TEST_F(LogTest, RecordNamesTheThreadThatSpeaks)
{
    std::ostringstream id;
    std::thread thread([&id] {
        id << std::this_thread::get_id();
        Speaker::speak(2);
    });
    thread.join();
    EXPECT_EQ(platform::records().at(0).thread, id.str());
}

} // namespace
