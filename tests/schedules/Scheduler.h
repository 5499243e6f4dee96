#pragma once

#include <functional>
#include <memory>
#include <string>
#include <ucontext.h>
#include <vector>

/// Runs a program's threads one at a time, in every order up to a bound.
///
/// Each thread is a coroutine of the one real thread. The functions of pthreads and of the platform are replaced
/// (Calls.cpp); each of them calls point(), sleep() or block(), where another thread may continue. A switch at point()
/// is a preemption: there are at most `preemptions` of them in a schedule. A switch at a pause, at a wait or at a
/// thread's end is free.
class Scheduler
{
public:
    static const int preemptions = 2;
    static const int cycles = 2; ///< pauses of one thread, after which endBranching() may be called

    /// Runs `program` as thread 0 until it returns or no thread can continue.
    ///
    /// @return false when `program` did not return
    bool run(const std::function<void()>& program);

    /// Goes to the next schedule; false when there is none.
    bool next();

    /// The running scheduler, or a null pointer outside run().
    static Scheduler* active();

    // For the replaced functions

    /// Adds a thread; returns its number.
    int create(const std::function<void()>& body);

    /// The number of the thread that runs.
    int current() const { return mCurrent; }

    bool hasEnded(int thread) const { return mThreads.at(static_cast<std::size_t>(thread))->ended; }

    /// Another thread may continue here, at the cost of a preemption.
    void point();

    /// The thread pauses: any thread may continue.
    void sleep();

    /// The thread cannot continue before `condition` holds.
    void block(const std::function<bool()>& condition);

    /// From here on the schedule only runs to its end, without branching: the rest is beyond the bound.
    void endBranching() { mBranching = false; }

private:
    struct Thread
    {
        std::function<void()> body;
        std::function<bool()> condition; ///< null: can continue
        bool ended = false;
        int pauses = 0;
        std::unique_ptr<char[]> stack;
        ucontext_t context = {};
    };

    struct Choice
    {
        int taken;
        int count;
    };

    static void enter();
    std::vector<int> runnable() const;
    int choose(const std::vector<int>& options);
    void switchTo(int thread);
    void leave(const std::vector<int>& options);

    std::vector<std::unique_ptr<Thread>> mThreads;
    std::vector<std::unique_ptr<char[]>> mStacks; ///< of ended schedules, to be used again
    std::vector<Choice> mChoices;                 ///< of this schedule, and those the next one repeats
    std::size_t mNextChoice = 0;
    int mCurrent = 0;
    int mPreemptions = 0;
    bool mBranching = true;
    ucontext_t mOutside = {};
};
