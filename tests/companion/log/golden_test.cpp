#include "golden_logs.h"
#include "log/log_command.h"

#include <algorithm>
#include <sstream>

#include <gtest/gtest.h>

/// The explanation of each log in golden/log/, which is the working directory of these tests.
class LogGolden : public testing::TestWithParam<std::string>
{
};

TEST_P(LogGolden, ExplanationIsAsKept)
{
    std::ostringstream out;
    std::ostringstream errors;
    LogOptions options;
    options.files = {GetParam() + ".log"};
    const int status = runLog(options, out, errors);
    EXPECT_EQ(out.str(), content(GetParam() + ".txt"))
        << "If it is meant: tests/companion/log/make-golden --explanations";
    EXPECT_EQ(errors.str(), "");
    EXPECT_NE(status, LOG_UNREADABLE);
}

INSTANTIATE_TEST_SUITE_P(Each, LogGolden, testing::ValuesIn(goldenLogs()), goldenLogName);

TEST(LogGoldenFiles, EveryScenarioHasOne)
{
    const Lines kept = goldenLogs();
    for (const std::string& scenario : namesOfFiles(SCENARIO_FOLDER, ".toml")) {
        EXPECT_TRUE(std::binary_search(kept.begin(), kept.end(), scenario))
            << "Make it: tests/companion/log/make-golden " << scenario;
    }
}
