#include "Run.h"

#include "Calls.h"
#include "Commands.h"
#include "LedManager.h"
#include "Scheduler.h"

#include <iostream>
#include <map>
#include <time.h>
#include <vector>

int updaterMain(int, char**); // main() of the remote head's program, renamed for this test program

namespace
{

/// The panel's controller: a LED's code selects it, the next byte is its colour.
class Panel
{
public:
    void take(int byte)
    {
        if (mSelected == 0) {
            mSelected = byte;
        } else {
            mColors[mSelected] = byte;
            mSelected = 0;
        }
    }
    std::map<int, int> lit() const
    {
        std::map<int, int> colors;
        for (const auto& [led, color] : mColors) {
            if (color != 0) {
                colors[led] = color;
            }
        }
        return colors;
    }

private:
    int mSelected = 0;
    std::map<int, int> mColors;
};

std::string policy(const std::string& candidate)
{
    return "solvik4:\n  Installed: 1.2.0\n  Candidate: " + candidate + "\n";
}

/// The unit's answer to a command.
int answer(Ending ending, const std::string& command, std::string& output)
{
    const int failed = 1 << 8;
    if (command == policyCommand) {
        output = ending == Ending::ReadFailure ? "" : policy(ending == Ending::NothingToUpdate ? "1.2.0" : "1.3.0");
    } else if (command == boardVersionCommand) {
        output = "Brimvale\t2.1.0\r\n";
    } else if (command == stickVersionCommand) {
        output = ending == Ending::NothingToUpdate ? "quorb2.1.0\n" : "quorb2.2.0\n";
    } else if (command == installCommand && ending == Ending::InstallFailure) {
        return failed;
    }
    return 0;
}

std::map<int, int> outcomeOf(Ending ending)
{
    switch (ending) {
    case Ending::NothingToUpdate:
        return {{0x12, 2}, {0x15, 2}};
    case Ending::Updated:
        return {{0x13, 2}};
    case Ending::ReadFailure:
        return {{0x12, 8}, {0x15, 8}};
    case Ending::InstallFailure:
        return {{0x14, 8}};
    }
    return {};
}

/// Ends the schedule's branching once a thread has made its cycles but continues.
class Cycles
{
public:
    void pause(int thread) { ++mPauses[thread]; }
    void byte(int thread, int byte)
    {
        if (byte == 0x10 && mPauses[thread] >= Scheduler::cycles) {
            Scheduler::active()->endBranching();
        }
    }

private:
    std::map<int, int> mPauses;
};

/// Resets the panel's one object to its state at the start of a process.
void forgetThreads()
{
    LedManager::instance()->stopFlashRemoteAndMainInBlue();
    LedManager::instance()->waitForFlashingEnd();
}

const int mainThread = 0;
const int updateThread = 1;

} // namespace

Found exploreUpdate(Ending ending)
{
    std::cout.rdbuf(nullptr);
    Found found;
    Scheduler scheduler;
    do {
        Panel panel;
        Cycles cycles;
        bool worked = false;     // the update's thread has run a command
        bool shown = false;      // it has sent a byte
        bool stopped = false;    // it has taken the lock of the flashing
        bool mainLocked = false; // the main thread has, to start it
        bool late = false;
        bool lost = false;
        const auto expect = [&found](bool holds, const char* otherwise) {
            if (!holds && found.finding.empty()) {
                found.finding = otherwise;
            }
        };
        Observer observer;
        observer.command = [&](int thread, const std::string& command, std::string& output) {
            worked = worked || thread == updateThread;
            return answer(ending, command, output);
        };
        observer.byte = [&](int thread, int byte) {
            panel.take(byte);
            cycles.byte(thread, byte);
            expect(thread != updateThread || worked, "the flashing is started before the update");
            shown = shown || thread == updateThread;
            expect(!shown || thread == updateThread || late, "another thread sends a byte after the outcome's first");
        };
        observer.pause = [&](int thread) { cycles.pause(thread); };
        observer.created = [](int) {};
        observer.locked = [&](int thread) {
            mainLocked = mainLocked || thread == mainThread;
            stopped = stopped || thread == updateThread;
            late = late || (stopped && !mainLocked);
        };
        observer.notified = [&](bool waited, bool underLock) {
            lost = lost || !waited;
            expect(underLock, "a notification without the lock");
        };
        observe(observer);
        const bool returned = scheduler.run([] { updaterMain(0, nullptr); });
        forgetThreads();
        ++found.schedules;
        found.late += late ? 1 : 0;
        found.lost += lost ? 1 : 0;
        found.hangs += returned ? 0 : 1;
        found.stuck += returned || lost ? 0 : 1;
        expect(late || returned || lost, "main() does not return");
        expect(!returned || !lost, "main() returns without the notification");
        expect(late || panel.lit() == outcomeOf(ending), "the panel does not show the outcome");
    } while (found.finding.empty() && scheduler.next());
    return found;
}

Found exploreFlashing()
{
    std::cout.rdbuf(nullptr);
    Found found;
    Scheduler scheduler;
    do {
        Panel panel;
        Cycles cycles;
        int flashing = 0; // the round's thread
        int bytes = 0;    // that it sent
        bool waitedFor = false;
        Observer observer;
        observer.byte = [&](int thread, int byte) {
            panel.take(byte);
            cycles.byte(thread, byte);
            ++bytes;
            if (thread != flashing || waitedFor) {
                found.finding = "a thread that was waited for sends a byte";
            }
        };
        observer.pause = [&](int thread) { cycles.pause(thread); };
        observer.created = [&](int thread) {
            flashing = thread;
            bytes = 0;
            waitedFor = false;
        };
        observer.locked = [](int) {};
        observe(observer);
        const bool returned = scheduler.run([&] {
            for (int round = 0; round < 2; ++round) {
                LedManager::instance()->startFlashRemoteAndMainInBlue();
                const timespec second = {1, 0};
                nanosleep(&second, nullptr);
                LedManager::instance()->stopFlashRemoteAndMainInBlue();
                LedManager::instance()->waitForFlashingEnd();
                waitedFor = true;
                found.late += bytes == 4 ? 1 : 0; // both LEDs off, and nothing else
                if (bytes % 32 != 4 || !panel.lit().empty()) {
                    found.finding = "a round does not end with both LEDs off";
                }
            }
        });
        forgetThreads();
        ++found.schedules;
        if (found.finding.empty() && !returned) {
            found.finding = "the flashing cannot be started, stopped and waited for";
        }
    } while (found.finding.empty() && scheduler.next());
    return found;
}
