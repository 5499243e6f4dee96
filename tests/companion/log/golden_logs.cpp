#include "golden_logs.h"

#include "log/catalogue.h"

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>

Lines goldenLogs()
{
    return namesOfFiles(GOLDEN_LOG_FOLDER, ".log");
}

Lines namesOfFiles(const std::string& folder, const std::string& extension)
{
    Lines names;
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

void readRuns(std::string_view log, const std::function<void(const Run&)>& take)
{
    RunBuilder builder([&](Run& run) {
        explain(run);
        take(run);
    });
    LogParser parser(builder);
    parser.feed(log);
    parser.finish();
    builder.finish();
    EXPECT_EQ(builder.current(), nullptr);
}

std::string goldenLogName(const testing::TestParamInfo<std::string>& test)
{
    std::string name = test.param;
    std::replace(name.begin(), name.end(), '-', '_');
    return name;
}
