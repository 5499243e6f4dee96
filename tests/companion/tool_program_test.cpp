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
             {}, {"stik"}, {"stick", "--jsn"}, {"stick", "a", "b"}, {"unit", "a"}, {"--jsn"}, {"log", "--html"}}) {
        const CommandResult result = tool(arguments);
        EXPECT_EQ(result.exitCode, 2) << testing::PrintToString(arguments);
        EXPECT_EQ(result.output, "");
        EXPECT_THAT(result.errors, HasSubstr("--help")) << testing::PrintToString(arguments);
    }
}

TEST_F(ToolProgram, UnknownSubcommandIsNamed)
{
    EXPECT_THAT(tool({"stik"}).errors, HasSubstr("harl-updater-tool: stik is not a command. Did you mean stick?"));
    EXPECT_THAT(tool({"foo"}).errors, HasSubstr("harl-updater-tool: foo is not a command. See: "));
    EXPECT_THAT(tool({"--json"}).errors, HasSubstr("harl-updater-tool: Name a command before --json. See: "));
    EXPECT_THAT(tool({"stick", "make"}).errors,
                HasSubstr("TARGET is missing. See: harl-updater-tool stick make --help"));
    EXPECT_THAT(tool({"log", "--run"}).errors, HasSubstr("harl-updater-tool: Name N behind --run."));
    EXPECT_THAT(tool({"nonsense"}).errors, HasSubstr("harl-updater-tool: nonsense is not a command. See: "));
    EXPECT_THAT(tool({"log", "--html"}).errors, HasSubstr("harl-updater-tool: Name PAGE behind --html."));
    EXPECT_THAT(tool({"log", "--run", "0"}).errors, HasSubstr("harl-updater-tool: --run needs a number from 1 on."));
    EXPECT_THAT(tool({"report"}).errors, HasSubstr("harl-updater-tool: FILE is missing."));
    EXPECT_THAT(tool({}).errors,
                HasSubstr("Name a command: stick, unit, check, verify, log, fleet, explain or report."));
}

TEST_F(ToolProgram, WrongUsageIsAnObjectForPrograms)
{
    const CommandResult result = tool({"log", "--json", "--nonsense"});
    EXPECT_EQ(result.exitCode, 2);
    const nlohmann::json object = nlohmann::json::parse(result.output);
    EXPECT_EQ(object["command"], "log");
    EXPECT_EQ(object["error"], "--nonsense is not an option of log. See: harl-updater-tool log --help");
}

TEST_F(ToolProgram, VersionIsThatOfTheProject)
{
    for (const char* option : {"--version", "-V"}) {
        const CommandResult result = tool({option});
        EXPECT_EQ(result.exitCode, 0);
        EXPECT_EQ(result.output, "harl-updater-tool " VERSION "\n");
        EXPECT_EQ(result.errors, "");
    }
}

TEST_F(ToolProgram, HelpIsACommandToo)
{
    EXPECT_EQ(tool({"help"}).output, tool({"--help"}).output);
    EXPECT_EQ(tool({"help", "log"}).output, tool({"log", "--help"}).output);
    EXPECT_THAT(tool({"help", "log"}).output, HasSubstr("--strict"));
}

TEST_F(ToolProgram, ExplainPrintsAnEntryOrAll)
{
    EXPECT_THAT(tool({"explain", "board-host-key"}).output, HasSubstr("\n  Do now:   Make sure that it is the right"));
    EXPECT_THAT(tool({"explain"}).output, HasSubstr("\n\nboard-host-key\n"));
    EXPECT_EQ(tool({"explain", "nonsense"}).exitCode, 2);
}

TEST_F(ToolProgram, HelpNamesThePlaceOfTheStickAndTheExitStatuses)
{
    const CommandResult result = tool({"stick", "--help"});
    EXPECT_EQ(result.exitCode, 0);
    EXPECT_THAT(result.output, HasSubstr("/root/USB_MOUNT"));
    EXPECT_THAT(result.output, HasSubstr("Exit status: 0 fit for an update, 1 not fit, 2 "));
    EXPECT_EQ(result.output.back(), '\n');
}

TEST_F(ToolProgram, HelpFitsTheTerminal)
{
    const std::string commands[] = {"",       "stick", "stick make", "unit",    "check",
                                    "verify", "log",   "fleet",      "explain", "report"};
    for (const std::string& command : commands) {
        for (const std::size_t width : {40, 80}) {
            const std::string line = "stty cols " + std::to_string(width) + "; " TOOL " " + command + " --help";
            const CommandResult result = runCommand({"script", "--quiet", "--command", line, "/dev/null"},
                                                    {"PATH=/usr/bin:/bin"}, std::chrono::seconds(20));
            std::istringstream lines(result.output);
            std::size_t longest = 0;
            for (std::string one; std::getline(lines, one, '\r'); std::getline(lines, one)) {
                longest = std::max(longest, one.size());
            }
            EXPECT_GT(longest, width / 2) << command;
            EXPECT_LE(longest, width) << command << result.output;
        }
    }
}
