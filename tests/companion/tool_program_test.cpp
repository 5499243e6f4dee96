#include "command.h"

#include "stick/zip_file.h"
#include "test_folder.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

using namespace std::chrono_literals;
using testing::HasSubstr;

namespace
{

CommandResult tool(std::vector<std::string> arguments)
{
    arguments.insert(arguments.begin(), TOOL);
    return runCommand(arguments, {"PATH=/usr/bin:/bin"}, 60s);
}

class ToolProgram : public testing::Test
{
protected:
    void putVersion(const std::string& folder) const
    {
        const std::string path = "debs/QUORB/armhf/" + folder;
        stick.put(path + "/OSUpgrade.zip", zipArchive({{"version.txt", "Brimvale\t2.2.0\r\n"}}));
        stick.put(path + "/unzipUpgrade.sh", "#!/bin/sh\n", 0755);
    }

    TestFolder stick;
};

} // namespace

TEST_F(ToolProgram, FitStickGivesZero)
{
    putVersion("quorb2.2.0");
    const CommandResult result = tool({"stick", stick.path()});
    EXPECT_EQ(result.exitCode, 0) << result.output;
    EXPECT_THAT(result.output, HasSubstr(" is fit for an update.\n"));
    EXPECT_EQ(result.errors, "");
}

TEST_F(ToolProgram, UnfitStickGivesOne)
{
    const CommandResult result = tool({"stick", stick.path(), "--json"});
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(nlohmann::json::parse(result.output)["findings"][0]["check"], "no-board-folder");
}

TEST_F(ToolProgram, UnreadableStickGivesTwo)
{
    const CommandResult result = tool({"stick", stick.path("nowhere")});
    EXPECT_EQ(result.exitCode, 2);
    EXPECT_EQ(result.output, "");
    EXPECT_THAT(result.errors, HasSubstr("nowhere"));
}

TEST_F(ToolProgram, WrongUsageGivesTwoAndSaysWhatToDo)
{
    for (const std::vector<std::string>& arguments : std::vector<std::vector<std::string>>{
             {}, {"stik"}, {"stick", "--jsn"}, {"stick", "a", "b"}, {"unit", "a"}, {"--json"}}) {
        const CommandResult result = tool(arguments);
        EXPECT_EQ(result.exitCode, 2) << testing::PrintToString(arguments);
        EXPECT_EQ(result.output, "");
        EXPECT_THAT(result.errors, HasSubstr("--help")) << testing::PrintToString(arguments);
    }
}

TEST_F(ToolProgram, UnknownSubcommandIsNamed)
{
    EXPECT_THAT(tool({"stik"}).errors, HasSubstr("not expected: stik\n"));
    EXPECT_THAT(tool({}).errors, HasSubstr("A subcommand is required"));
}

TEST_F(ToolProgram, VersionIsThatOfTheProject)
{
    const CommandResult result = tool({"--version"});
    EXPECT_EQ(result.exitCode, 0);
    EXPECT_EQ(result.output, "harl-updater-tool " VERSION "\n");
    EXPECT_EQ(result.errors, "");
}

TEST_F(ToolProgram, HelpNamesThePlaceOfTheStickAndTheExitStatuses)
{
    const CommandResult result = tool({"stick", "--help"});
    EXPECT_EQ(result.exitCode, 0);
    EXPECT_THAT(result.output, HasSubstr("/root/USB_MOUNT"));
    EXPECT_THAT(result.output, HasSubstr("Exit status: 0 fit for an update, 1 not fit, 2 "));
    EXPECT_EQ(result.output.back(), '\n');
}
