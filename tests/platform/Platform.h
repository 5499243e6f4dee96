#pragma once

#include "Record.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <thread>
#include <vector>

/// A stand-in for the platform: linked into a test program, it replaces the C library's `system`, `popen`, `pclose` and
/// `nanosleep`, and std::cout's buffer.
///
/// Every call and every log record becomes an entry of one journal, so that a test compares the whole course of events.
/// A command that has no scripted answer prints nothing and exits with 0; a pause takes 10 ms. All operations may be
/// called from any thread.
namespace platform
{

using Lines = std::vector<std::string>;

/// What a command does when it runs.
struct Answer
{
    int status = 0;                    ///< raw wait status that `system` or `pclose` returns; -1 for their failure
    std::string output = {};           ///< what `popen`'s stream yields
    bool starts = true;                ///< false: `popen` returns a null pointer
    std::function<void()> before = {}; ///< runs first, on the calling thread; for delays
};

/// An answer of a command that exits normally with `code`.
Answer exits(int code, const std::string& output = "");

/// Forgets the journal, the answers, the pauses and the hook, and takes over std::cout.
void reset();

/// Scripts the answers of an exact command line, in order; the last one repeats.
void script(const std::string& command, const std::vector<Answer>& answers);

/// Replaces the pauses: `pause` has the parameters and the result of nanosleep(2), including errno.
void scriptSleep(const std::function<int(const timespec* duration, timespec* remaining)>& pause);

/// Runs `hook` on the thread that has just written a record, before the thread continues.
void afterRecord(const std::function<void()>& hook);

/// Adds an entry of the test's own, for example from a callback.
void note(const std::string& text);

/// The entries so far: `log:` and a message, `system:` or `popen:` and a command line, `sleep:` and seconds, or a note.
Lines journal();

/// The entries of one thread.
Lines journal(std::thread::id thread);

/// The entries that begin with `prefix`, without it.
Lines entries(const std::string& prefix);

/// The log records so far. Fails the test when one is not well-formed.
std::vector<Record> records();

/// The address of the last command's text. Two calls with the same address got the same text, not two equal ones.
const void* lastCommand();

/// How many objects of `size` bytes (less than 64) the calling thread has released with delete.
int released(std::size_t size);

/// Waits until `condition` holds. Fails the test after ten seconds.
void waitFor(const std::function<bool()>& condition);

/// Sleeps in real time.
void delay(int milliseconds);

} // namespace platform
