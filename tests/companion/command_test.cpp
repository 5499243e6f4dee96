#include "command.h"

#include "test_folder.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <csignal>
#include <fstream>
#include <thread>

#include <sys/types.h>

using namespace std::chrono_literals;

namespace
{

const std::vector<std::string> environment = {"PATH=/usr/bin:/bin", "COLOUR=blue"};

CommandResult shell(const std::string& line, std::chrono::milliseconds limit = 20s)
{
    return runCommand({"sh", "-c", line}, environment, limit);
}

} // namespace

TEST(Command, OutputErrorsAndStatusAreKeptApart)
{
    const CommandResult result = shell("echo out; echo err >&2; exit 3");
    EXPECT_TRUE(result.started);
    EXPECT_FALSE(result.timedOut);
    EXPECT_EQ(result.exitCode, 3);
    EXPECT_FALSE(result.succeeded());
    EXPECT_EQ(result.output, "out\n");
    EXPECT_EQ(result.errors, "err\n");
}

TEST(Command, EnvironmentIsWhollyGiven)
{
    EXPECT_EQ(runCommand({"env"}, environment, 20s).output, "PATH=/usr/bin:/bin\nCOLOUR=blue\n");
}

TEST(Command, ArgumentsAreNotReadByAShell)
{
    EXPECT_EQ(runCommand({"echo", "$(id)", "`id`", "a;b", ""}, environment, 20s).output, "$(id) `id` a;b \n");
}

TEST(Command, InputIsEmptyAndThereIsNoTerminal)
{
    EXPECT_EQ(shell("cat; tty </dev/tty || echo none").output, "none\n");
}

TEST(Command, SignalThatIsIgnoredEndsNoCommand)
{
    const auto before = std::signal(SIGHUP, SIG_IGN);
    EXPECT_EQ(shell("kill -HUP $PPID; sleep 0.1; echo out").output, "out\n");
    std::signal(SIGHUP, before);
}

TEST(Command, MissingProgramIsNotStarted)
{
    for (const std::string name : {"no-such-program", "/no/such/program", "/etc/passwd", "/"}) {
        const CommandResult result = runCommand({name}, environment, 20s);
        EXPECT_FALSE(result.started) << name;
        EXPECT_EQ(result.exitCode, -1) << name;
    }
}

TEST(Command, SignalGivesNoExitStatus)
{
    const CommandResult result = shell("kill -KILL $$");
    EXPECT_TRUE(result.started);
    EXPECT_FALSE(result.timedOut);
    EXPECT_EQ(result.exitCode, -1);
}

TEST(Command, ProgramAndItsChildrenAreEndedAtTheLimit)
{
    const auto begin = std::chrono::steady_clock::now();
    const CommandResult result = shell("sleep 60 & echo $!; wait", 2s);
    EXPECT_LT(std::chrono::steady_clock::now() - begin, 20s);
    EXPECT_TRUE(result.timedOut);
    EXPECT_EQ(result.exitCode, -1);
    const pid_t child = std::stoi(result.output);
    for (int attempt = 0; attempt < 500 && kill(child, 0) == 0; ++attempt) {
        std::ifstream stat("/proc/" + std::to_string(child) + "/stat");
        std::string id;
        std::string name;
        std::string state;
        if (stat >> id >> name >> state && state == "Z") {
            return; // ended; nobody has asked for its status yet
        }
        std::this_thread::sleep_for(10ms);
    }
    EXPECT_NE(kill(child, 0), 0) << "the program's child still runs";
}

TEST(Command, ChildThatKeepsTheOutputOpenIsNotWaitedFor)
{
    const auto begin = std::chrono::steady_clock::now();
    const CommandResult result = shell("sleep 30 & echo done");
    EXPECT_LT(std::chrono::steady_clock::now() - begin, 15s);
    EXPECT_EQ(result.output.substr(0, 5), "done\n");
    EXPECT_TRUE(result.succeeded());
}

TEST(Command, MuchOutputIsCutAndDoesNotBlock)
{
    const CommandResult result = shell("head -c 3000000 /dev/zero; head -c 3000000 /dev/zero >&2");
    EXPECT_TRUE(result.succeeded());
    EXPECT_EQ(result.output.size(), 256U * 1024);
    EXPECT_EQ(result.errors.size(), 256U * 1024);
}

TEST(Command, ProgramIsLookedForInTheOrderOfTheSearchPath)
{
    const TestFolder folder;
    folder.put("a/tool", "#!/bin/sh\n", 0644); // cannot be run
    folder.makeFolder("b/tool");
    folder.put("c/tool", "#!/bin/sh\n", 0755);
    folder.put("d/tool", "#!/bin/sh\n", 0755);
    const auto path = [&](const std::string& name) { return folder.path(name).string(); };
    const std::string searchPath = path("a") + ':' + path("b") + ':' + path("c") + ':' + path("d");
    EXPECT_EQ(findProgram("tool", searchPath), path("c/tool"));
    EXPECT_EQ(findProgram(path("d/tool"), searchPath), path("d/tool"));
    EXPECT_EQ(findProgram("tool", ""), "");
}
