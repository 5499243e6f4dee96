#include "Scheduler.h"

#include <algorithm>
#include <cstddef>
#include <stdexcept>

namespace
{

const std::size_t stackSize = std::size_t{256} * 1024; // bytes; the updater's runner has a buffer of 64 KiB there
const int pausesWithoutEnd = 8;                        // of a thread that no other thread is left to stop
Scheduler* scheduler = nullptr;

} // namespace

Scheduler* Scheduler::active()
{
    return scheduler;
}

bool Scheduler::run(const std::function<void()>& program)
{
    for (const std::unique_ptr<Thread>& thread : mThreads) {
        mStacks.push_back(std::move(thread->stack));
    }
    mThreads.clear();
    mNextChoice = 0;
    mPreemptions = 0;
    mBranching = true;
    create(program);
    mCurrent = 0;
    scheduler = this;
    swapcontext(&mOutside, &mThreads[0]->context);
    scheduler = nullptr;
    return hasEnded(0);
}

bool Scheduler::next()
{
    while (!mChoices.empty() && mChoices.back().taken + 1 == mChoices.back().count) {
        mChoices.pop_back();
    }
    if (mChoices.empty()) {
        return false;
    }
    ++mChoices.back().taken;
    return true;
}

int Scheduler::create(const std::function<void()>& body)
{
    auto thread = std::make_unique<Thread>();
    thread->body = body;
    if (mStacks.empty()) {
        mStacks.push_back(std::make_unique<char[]>(stackSize));
    }
    thread->stack = std::move(mStacks.back());
    mStacks.pop_back();
    getcontext(&thread->context);
    thread->context.uc_stack.ss_sp = thread->stack.get();
    thread->context.uc_stack.ss_size = stackSize;
    makecontext(&thread->context, enter, 0);
    mThreads.push_back(std::move(thread));
    return static_cast<int>(mThreads.size()) - 1;
}

/// Where every thread begins.
void Scheduler::enter()
{
    Thread& self = *scheduler->mThreads[static_cast<std::size_t>(scheduler->mCurrent)];
    self.body();
    self.ended = true;
    if (scheduler->mCurrent == 0) { // the process ends with main(), and every thread with it
        setcontext(&scheduler->mOutside);
    }
    scheduler->leave(scheduler->runnable());
}

void Scheduler::point()
{
    std::vector<int> options = {mCurrent};
    if (mBranching && mPreemptions < preemptions) {
        for (const int thread : runnable()) {
            if (thread != mCurrent) {
                options.push_back(thread);
            }
        }
    }
    const int thread = choose(options);
    if (thread != mCurrent) {
        ++mPreemptions;
        switchTo(thread);
    }
}

void Scheduler::sleep()
{
    std::vector<int> options = runnable();
    // Others first: otherwise a thread that only pauses would always come first.
    std::stable_partition(options.begin(), options.end(), [this](int thread) { return thread != mCurrent; });
    Thread& self = *mThreads[static_cast<std::size_t>(mCurrent)];
    if (options.size() == 1 && ++self.pauses == pausesWithoutEnd) {
        setcontext(&mOutside);
    }
    leave(options);
}

void Scheduler::block(const std::function<bool()>& condition)
{
    while (!condition()) {
        mThreads[static_cast<std::size_t>(mCurrent)]->condition = condition;
        leave(runnable());
    }
    mThreads[static_cast<std::size_t>(mCurrent)]->condition = nullptr;
}

std::vector<int> Scheduler::runnable() const
{
    std::vector<int> numbers;
    for (std::size_t number = 0; number < mThreads.size(); ++number) {
        const Thread& thread = *mThreads[number];
        if (!thread.ended && (!thread.condition || thread.condition())) {
            numbers.push_back(static_cast<int>(number));
        }
    }
    return numbers;
}

int Scheduler::choose(const std::vector<int>& options)
{
    if (options.size() == 1 || !mBranching) {
        return options[0];
    }
    if (mNextChoice == mChoices.size()) {
        mChoices.push_back({0, static_cast<int>(options.size())});
    }
    const Choice& choice = mChoices[mNextChoice++];
    if (choice.count != static_cast<int>(options.size())) {
        throw std::logic_error("a schedule did not repeat itself");
    }
    return options[static_cast<std::size_t>(choice.taken)];
}

void Scheduler::switchTo(int thread)
{
    const int before = mCurrent;
    mCurrent = thread;
    swapcontext(&mThreads[static_cast<std::size_t>(before)]->context,
                &mThreads[static_cast<std::size_t>(thread)]->context);
}

/// Continues one of `options`; without any the schedule ends.
void Scheduler::leave(const std::vector<int>& options)
{
    if (options.empty()) {
        setcontext(&mOutside);
    }
    const int thread = choose(options);
    if (thread != mCurrent) {
        switchTo(thread);
    }
}
