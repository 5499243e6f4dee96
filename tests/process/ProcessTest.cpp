#include "LedManager.h"
#include "Log.h"
#include "Record.h"
#include "Sleep.h"
#include "UpdateManager.h"

#include <gtest/gtest.h>

#include <array>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <locale>
#include <pthread.h>
#include <string>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <thread>
#include <unistd.h>
#include <vector>

// The real platform: shells, pipes, signals and pauses. Nothing here runs a tool of a unit.

namespace
{

using Messages = std::vector<std::string>;

/// The message of `text`; fails the test when it is not exactly one record.
std::string messageOf(const std::string& text)
{
    const std::optional<platform::Record> record = platform::parseRecord(text);
    EXPECT_TRUE(record) << text;
    return record ? record->message : "";
}

/// Sends standard output to `descriptor` during a test.
class Redirection
{
public:
    explicit Redirection(int descriptor) { EXPECT_EQ(dup2(descriptor, STDOUT_FILENO), STDOUT_FILENO); }
    ~Redirection()
    {
        dup2(mStdout, STDOUT_FILENO);
        close(mStdout);
    }
    Redirection(const Redirection&) = delete;
    Redirection& operator=(const Redirection&) = delete;

private:
    const int mStdout = dup(STDOUT_FILENO);
};

/// Takes over standard output during a test, and keeps the data of each write(2) as one text.
class Output
{
public:
    Output() : mSockets(makeSockets()), mRedirection(mSockets[0]) {}
    ~Output()
    {
        close(mSockets[0]);
        close(mSockets[1]);
    }
    Output(const Output&) = delete;
    Output& operator=(const Output&) = delete;

    std::vector<std::string> writes() const
    {
        std::vector<std::string> texts;
        std::vector<char> buffer(1 << 20);
        ssize_t size = 0;
        while ((size = recv(mSockets[1], buffer.data(), buffer.size(), MSG_DONTWAIT)) >= 0) {
            texts.emplace_back(buffer.data(), static_cast<std::size_t>(size));
        }
        return texts;
    }

    /// The messages of the records; fails the test when a write was not exactly one record.
    Messages messages() const
    {
        Messages result;
        for (const std::string& text : writes()) {
            result.push_back(messageOf(text));
        }
        return result;
    }

private:
    static std::array<int, 2> makeSockets()
    {
        std::array<int, 2> sockets = {-1, -1};
        // This kind of socket preserves the boundaries of each write.
        EXPECT_EQ(socketpair(AF_UNIX, SOCK_SEQPACKET, 0, sockets.data()), 0);
        return sockets;
    }

    const std::array<int, 2> mSockets;
    const Redirection mRedirection;
};

class Runner : public testing::Test
{
protected:
    std::int32_t run(const std::string& command) { return UpdateManager::runProcess(command, output); }

    Output log;
    std::string output = "from an earlier run";
};

TEST_F(Runner, SilentCommandGivesZero)
{
    EXPECT_EQ(run("true"), 0);
    EXPECT_EQ(output, "");
    EXPECT_EQ(log.messages(), (Messages{"Running command: true", "Exit code:0"}));
}

TEST_F(Runner, OutputAndExitCodeArriveWhole)
{
    EXPECT_EQ(run("printf 'one\\r\\n\\ntwo'; exit 100"), 100);
    EXPECT_EQ(output, "one\r\n\ntwo");
    EXPECT_EQ(log.messages().back(), "Exit code:100");
}

class ExitCode : public Runner, public testing::WithParamInterface<int>
{
};
INSTANTIATE_TEST_SUITE_P(Codes, ExitCode, testing::Values(1, 2, 100, 127, 128, 200, 255),
                         testing::PrintToStringParamName());

TEST_P(ExitCode, KeepsEightBits)
{
    EXPECT_EQ(run("exit " + std::to_string(GetParam())), GetParam());
}

TEST_F(Runner, ToolThatIsMissingIsTheShells127)
{
    EXPECT_EQ(run("/nonexistent/tool 2>/dev/null"), 127);
}

class KilledShell : public Runner, public testing::WithParamInterface<std::string>
{
};
INSTANTIATE_TEST_SUITE_P(Signals, KilledShell, testing::Values("KILL", "SEGV", "PIPE", "TERM"),
                         [](const testing::TestParamInfo<std::string>& shell) { return shell.param; });

TEST_P(KilledShell, GivesZero)
{
    EXPECT_EQ(run("echo before; kill -" + GetParam() + " $$"), 0);
    EXPECT_EQ(output, "before\n");
    EXPECT_EQ(log.messages().back(), "Exit code:0");
}

TEST_F(Runner, ChildThatTheShellSawKilledIsAnExitCode)
{
    EXPECT_EQ(run("sh -c 'kill -KILL $$'; exit $?"), 128 + SIGKILL);
}

TEST_F(Runner, StandardErrorIsLeftAlone)
{
    testing::internal::CaptureStderr();
    EXPECT_EQ(run("echo out; echo error >&2"), 0);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "error\n");
    EXPECT_EQ(output, "out\n");
}

TEST_F(Runner, LongLinesAndManyLinesArriveWhole)
{
    EXPECT_EQ(run("head -c 3000 /dev/zero | tr '\\0' x; echo; seq 1 100000"), 0);
    std::string expected(3000, 'x');
    expected += '\n';
    for (int i = 1; i <= 100000; ++i) {
        expected += std::to_string(i) + '\n';
    }
    EXPECT_TRUE(output == expected);
}

TEST_F(Runner, ZeroByteTakesTheRestOfItsPieceOf1023BytesWithIt)
{
    EXPECT_EQ(run("head -c 1022 /dev/zero | tr '\\0' x; printf '\\0next\\n'"), 0);
    EXPECT_EQ(output, std::string(1022, 'x') + "next\n");
}

TEST_F(Runner, CommandThatClosesItsOutputEarlyIsWaitedFor)
{
    EXPECT_EQ(run("echo early; exec >&-; sleep 0.2; exit 7"), 7);
    EXPECT_EQ(output, "early\n");
}

TEST_F(Runner, StatusThatNobodyCanReadGivesZero)
{
    // With SIGCHLD ignored the kernel discards the status and pclose(3) fails with ECHILD.
    void (*const before)(int) = std::signal(SIGCHLD, SIG_IGN);
    EXPECT_EQ(run("echo text; exit 5"), 0);
    std::signal(SIGCHLD, before);
    EXPECT_EQ(output, "text\n");
    EXPECT_EQ(log.messages().back(), "Exit code:0");
}

TEST_F(Runner, PipeThatCannotBeOpenedGivesZeroAndNoFurtherRecord)
{
    ASSERT_EQ(run("true"), 0); // a sanitizer, too, opens descriptors when it meets a type for the first time
    rlimit before = {};
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
    const rlimit none = {0, before.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &none), 0);
    std::string text = "from an earlier run";
    const std::int32_t code = UpdateManager::runProcess("echo text", text);
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &before), 0);
    EXPECT_EQ(code, 0);
    EXPECT_EQ(text, "");
    EXPECT_EQ(log.messages(), (Messages{"Running command: true", "Exit code:0", "Running command: echo text"}));
}

TEST_F(Runner, SignalWhileReadingLosesNoOutput)
{
    struct sigaction action = {};
    struct sigaction before = {};
    action.sa_handler = [](int) {};
    action.sa_flags = SA_RESTART;
    sigaction(SIGUSR1, &action, &before);
    const pthread_t reader = pthread_self();
    std::thread storm([reader] {
        for (int i = 0; i < 300; ++i) {
            pthread_kill(reader, SIGUSR1);
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        }
    });
    EXPECT_EQ(run("for i in 1 2 3 4 5 6; do echo $i; sleep 0.05; done; exit 3"), 3);
    storm.join();
    sigaction(SIGUSR1, &before, nullptr);
    EXPECT_EQ(output, "1\n2\n3\n4\n5\n6\n");
}

TEST_F(Runner, FailedInstallLogsCodeAndOutputInOneRecord)
{
    EXPECT_FALSE(UpdateManager::installUpdate("seq 1 3000; exit 100"));
    const Messages messages = log.messages();
    ASSERT_EQ(messages.size(), 4U);
    EXPECT_EQ(messages[3].compare(0, 8, "1001\n2\n3"), 0);
    EXPECT_EQ(messages[3].substr(messages[3].size() - 5), "3000\n");
}

TEST_F(Runner, RecordsOfManyThreadsStayWhole)
{
    const std::size_t speakers = 8;
    const std::size_t each = 25;
    std::vector<std::thread> threads;
    threads.reserve(speakers);
    for (std::size_t i = 0; i < speakers; ++i) {
        threads.emplace_back([i] {
            for (std::size_t j = 0; j < each; ++j) {
                LOG() << std::string(i * 1000, 'x') << j;
                std::this_thread::sleep_for(std::chrono::milliseconds(1));
            }
        });
    }
    // Read while they write: the socket holds only a limited number.
    std::size_t records = 0;
    while (records < speakers * each) {
        records += log.messages().size();
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(records, speakers * each);
}

TEST(Log, WritesAgainAfterARecordThatCouldNotBeWritten)
{
    int pipe[2] = {-1, -1};
    ASSERT_EQ(pipe2(pipe, O_NONBLOCK), 0);
    char buffer[4096] = {};
    {
        const Redirection redirection(pipe[1]);
        while (write(pipe[1], buffer, sizeof buffer) > 0) {
        }
        LOG() << "finds the pipe full";
        while (read(pipe[0], buffer, sizeof buffer) > 0) {
        }
        LOG() << "finds room";
    }
    const ssize_t size = read(pipe[0], buffer, sizeof buffer);
    close(pipe[0]);
    close(pipe[1]);
    ASSERT_GT(size, 0);
    EXPECT_EQ(messageOf(std::string(buffer, static_cast<std::size_t>(size))), "finds room");
}

/// Groups digits: 32512 becomes "32.512".
class Grouping : public std::numpunct<char>
{
    char do_thousands_sep() const override { return '.'; }
    std::string do_grouping() const override { return "\3"; }
};

/// The message of a record that is written while the global locale groups digits. The thread is a number, too: with
/// separators in it the record could not be parsed.
std::string messageWithGrouping()
{
    const Output output;
    const std::locale before = std::locale::global(std::locale(std::locale(), new Grouping));
    LOG() << 32512;
    std::locale::global(before);
    return output.messages().at(0);
}

TEST(Log, WritesNumbersInTheClassicLocale)
{
    EXPECT_EQ(messageWithGrouping(), "32512");
}

TEST(Log, WritesNumbersInTheClassicLocaleAlsoWhenAnotherIsSetLater)
{
    {
        const Output output;
        LOG() << "first";
    }
    EXPECT_EQ(messageWithGrouping(), "32512");
}

double secondsOf(void (*action)())
{
    const auto begin = std::chrono::steady_clock::now();
    action();
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
}

TEST(Pause, LastsAsLongAsAskedFor)
{
    const double seconds = secondsOf([] { sleepSeconds(1); });
    EXPECT_GE(seconds, 1.0);
    EXPECT_LT(seconds, 5.0);
}

TEST(Pause, IsNotShortenedBySignals)
{
    struct sigaction action = {};
    struct sigaction before = {};
    action.sa_handler = [](int) {};
    sigaction(SIGALRM, &action, &before);
    itimerval often = {{0, 20000}, {0, 20000}};
    setitimer(ITIMER_REAL, &often, nullptr);
    const double seconds = secondsOf([] { sleepSeconds(1); });
    often = {};
    setitimer(ITIMER_REAL, &often, nullptr);
    sigaction(SIGALRM, &before, nullptr);
    EXPECT_GE(seconds, 1.0);
    EXPECT_LT(seconds, 5.0);
}

TEST(Panel, MissingToolIsLoggedForEachLed)
{
    const char* path = std::getenv("PATH");
    const std::string before = path == nullptr ? "" : path;
    const Output log;
    setenv("PATH", "/nonexistent", 1);
    LedManager::turnOffAll();
    setenv("PATH", before.c_str(), 1);
    const Messages messages = log.messages();
    ASSERT_EQ(messages.size(), 14U);
    EXPECT_EQ(messages[0], "system returned false: i2cset -y 0 0x07 0x10 c ; i2cset -y 0 0x07 0x0 c");
    EXPECT_EQ(messages[13], "system returned false: i2cset -y 0 0x07 0x1d c ; i2cset -y 0 0x07 0x0 c");
}

} // namespace
