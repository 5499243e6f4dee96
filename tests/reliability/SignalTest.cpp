/// Signals that arrive while the updater waits: real pauses, real commands.

#include "Sleep.h"
#include "UpdateManager.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <iostream>
#include <pthread.h>
#include <thread>

namespace
{

using Clock = std::chrono::steady_clock;

/// A handled signal about every millisecond for the thread that made it.
class Storm
{
public:
    /// `flags` are those of sigaction(2): with SA_RESTART the kernel resumes interrupted reads.
    explicit Storm(int flags)
    {
        struct sigaction action = {};
        action.sa_handler = [](int) { ++received; };
        action.sa_flags = flags;
        sigaction(SIGUSR1, &action, nullptr);
        received = 0;
        mThread = std::thread([this, target = pthread_self()] {
            while (!mOver) {
                pthread_kill(target, SIGUSR1);
                std::this_thread::sleep_for(std::chrono::milliseconds(1));
            }
        });
    }
    ~Storm()
    {
        mOver = true;
        mThread.join();
    }
    Storm(const Storm&) = delete;
    Storm& operator=(const Storm&) = delete;

    static std::atomic<int> received;

private:
    std::atomic<bool> mOver{false};
    std::thread mThread;
};
std::atomic<int> Storm::received{0};

class SignalStorm : public testing::Test
{
protected:
    void SetUp() override { std::cout.rdbuf(nullptr); }
    void TearDown() override
    {
        std::cout.clear();
        std::cout.rdbuf(mBuffer);
        EXPECT_GT(Storm::received, 10);
    }

private:
    std::streambuf* const mBuffer = std::cout.rdbuf();
};

TEST_F(SignalStorm, ShortensNoPause)
{
    const Storm storm(0);
    const Clock::time_point begin = Clock::now();
    sleepSeconds(2);
    EXPECT_GE(Clock::now() - begin, std::chrono::seconds(2));
}

TEST_F(SignalStorm, LosesNoOutputAndNoExitCode)
{
    const Storm storm(SA_RESTART);
    std::string output;
    const int code = UpdateManager::runProcess(
        "i=0; while [ $i -lt 20000 ]; do echo line-$i; i=$((i + 1)); done; sleep 0.3; exit 7", output);
    std::string expected;
    for (int i = 0; i < 20000; ++i) {
        expected += "line-" + std::to_string(i) + "\n";
    }
    EXPECT_EQ(output, expected);
    EXPECT_EQ(code, 7);
}

// pclose(3) and system(3) wait again by themselves, so that no flag of the handler is needed.
TEST_F(SignalStorm, LosesNoExitCodeWhileACommandEnds)
{
    const Storm storm(0);
    FILE* pipe = popen("exec >&-; sleep 0.3; exit 5", "r");
    EXPECT_EQ(pclose(pipe), 5 * 256);
    EXPECT_EQ(std::system("sleep 0.3; exit 6"), 6 * 256);
}

} // namespace
