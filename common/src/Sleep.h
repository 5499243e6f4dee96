#pragma once

#include <cerrno>
#include <ctime>

/// Blocks the calling thread for `seconds` (s).
///
/// A sleep that a signal interrupts goes on with the time that remains (nanosleep(2), EINTR); any other failure ends
/// it early.
inline void sleepSeconds(std::time_t seconds)
{
    timespec remaining = {seconds, 0};
    while (nanosleep(&remaining, &remaining) == -1 && errno == EINTR) {
    }
}
