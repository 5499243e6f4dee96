#include "log/log_command.h"

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

/// The explanation of each log in golden/log/, which is the working directory of these tests.
class LogGolden : public testing::TestWithParam<std::string>
{
};

namespace
{

std::vector<std::string> namesOfFiles(const std::filesystem::path& folder, const std::string& extension)
{
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(folder)) {
        if (entry.path().extension() == extension) {
            names.push_back(entry.path().stem());
        }
    }
    std::sort(names.begin(), names.end());
    return names;
}

std::string content(const std::string& file)
{
    std::ostringstream text;
    text << std::ifstream(file, std::ios::binary).rdbuf();
    return text.str();
}

} // namespace

TEST_P(LogGolden, ExplanationIsAsKept)
{
    std::ostringstream out;
    std::ostringstream errors;
    LogOptions options;
    options.file = GetParam() + ".log";
    const int status = runLog(options, out, errors);
    EXPECT_EQ(out.str(), content(GetParam() + ".txt"))
        << "If it is meant: tests/companion/log/make-golden --explanations";
    EXPECT_EQ(errors.str(), "");
    EXPECT_NE(status, LOG_UNREADABLE);
}

INSTANTIATE_TEST_SUITE_P(Each, LogGolden, testing::ValuesIn(namesOfFiles(GOLDEN_LOG_FOLDER, ".log")),
                         [](const auto& test) {
                             std::string name = test.param;
                             std::replace(name.begin(), name.end(), '-', '_');
                             return name;
                         });

TEST(LogGoldenFiles, EveryScenarioHasOne)
{
    const std::vector<std::string> kept = namesOfFiles(GOLDEN_LOG_FOLDER, ".log");
    for (const std::string& scenario : namesOfFiles(SCENARIO_FOLDER, ".toml")) {
        EXPECT_TRUE(std::binary_search(kept.begin(), kept.end(), scenario))
            << "Make it: tests/companion/log/make-golden " << scenario;
    }
}
