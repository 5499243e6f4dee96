#pragma once

#include "Commands.h"
#include "Platform.h"
#include "UpdateManager.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <ostream>
#include <string>

/// A test with a fresh journal, whose engine reports into it as notes.
class UnitTest : public testing::Test
{
protected:
    void SetUp() override;

    /// Registers the callbacks that note the reports, and forgets the record of the registration.
    static void registerCallbacks();
};

/// A value of a parameterised test, and its name there.
template <typename Value>
struct Named
{
    const char* name;
    Value value;
};

template <typename Value>
void PrintTo(const Named<Value>& named, std::ostream* stream)
{
    *stream << named.name;
}

/// A fixture whose tests run once for each of some named values.
template <typename Fixture, typename Value = int>
class With : public Fixture, public testing::WithParamInterface<Named<Value>>
{
protected:
    static const Value& value() { return testing::WithParamInterface<Named<Value>>::GetParam().value; }
};

/// The name of a test's parameter, which is a row of a table.
template <typename Row>
std::string nameOf(const testing::TestParamInfo<Row>& info)
{
    return info.param.name;
}

/// Raw wait statuses that are not 0.
const Named<int> failedStatuses[] = {{"NoProcess", -1}, {"Signal1", 1},     {"Signal9", 9},
                                     {"Exit1", 256},    {"Exit5", 5 * 256}, {"Exit255", 255 * 256}};

/// Exit codes of a command that are neither success nor apt's 100.
const Named<int> otherCodes[] = {{"1", 1}, {"99", 99}, {"101", 101}, {"255", 255}};

/// For a test whose EXPECT_EXIT must run in a process that has not started anything yet.
#ifdef EMULATED // QEMU's user emulation cannot start the program once more
#define NEEDS_A_FRESH_PROCESS() GTEST_SKIP()
#else
#define NEEDS_A_FRESH_PROCESS() GTEST_FLAG_SET(death_test_style, "threadsafe")
#endif

/// How many results, including failures, the running test has so far.
int resultsSoFar();

/// Ends the process of a death test, whose failures nobody prints: with 0 if there are none after the first `before`
/// results, which the test had before it made the process; otherwise with 1 and the failures on standard error.
[[noreturn]] void endCase(int before);

void noteResult(UpdateManager::Result result);
void noteError(UpdateManager::Error error);
void noteUpdateFound(std::vector<UpdateManager::UpdateComponent> components);

using platform::entries;
using platform::exits;
using platform::journal;
using platform::Lines;
using platform::script;

/// The command line that sends the panel's controller two bytes, and those that send every LED the same `second` byte.
std::string ledCommand(const std::string& first, const std::string& second);
Lines allLeds(const std::string& second);

/// As the journal spells them: a record's message, a command run by system(3), and one opened by popen(3).
std::string logged(const std::string& message);
std::string ran(const std::string& command);
std::string opened(const std::string& command);
std::string running(const std::string& command); // the runner's record in front of opened()
Lines ran(const Lines& commands);

/// Answers: a raw wait status without output, and no shell at all.
platform::Answer raw(int status);
platform::Answer doesNotStart();

/// What `apt-cache policy` prints for a package with these two versions.
std::string policy(const std::string& installed, const std::string& candidate);

/// The one journal of all `parts`, in order.
Lines joined(const std::vector<Lines>& parts);

/// What the runner and the successful check of the mirrors leave in the journal, and so on for the other steps.
Lines mirrorsOk();
Lines packageChecked(const std::string& query, const std::string& installed, const std::string& candidate);
Lines packageInstalled(const std::string& command);
Lines boardChecked(const std::string& installed, const std::string& candidate);
Lines boardNotReadable();
Lines boardInstalled(const std::string& scriptStatus = "0");
Lines boardUploadFailed();
Lines harlStopped();
Lines harlStarted();

/// Scripts the unit: versions of the package and of the board, installed and offered.
void scriptPackage(const std::string& query, const std::string& installed, const std::string& candidate);
void scriptBoard(const std::string& installed, const std::string& candidate);
