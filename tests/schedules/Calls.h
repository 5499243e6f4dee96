#pragma once

#include <functional>
#include <string>

/// @file
/// Replaces pthreads and the platform while a Scheduler runs. Outside of that they are unchanged.

/// What the program does, as seen by the platform; each is called on the thread that does it.
struct Observer
{
    /// Answers a command with its raw wait status. It runs whole; `output` is what popen(3) gives.
    std::function<int(int thread, const std::string& command, std::string& output)> command = {};
    std::function<void(int thread, int byte)> byte = {};            ///< one half of a LED command
    std::function<void(int thread)> pause = {};                     ///< it begins a pause
    std::function<void(int thread)> created = {};                   ///< a new thread
    std::function<void(int thread)> locked = {};                    ///< it has taken a mutex
    std::function<void(bool waited, bool underLock)> notified = {}; ///< a thread waited; the notifier holds a mutex
};

/// Takes the calls of the next run().
void observe(const Observer& observer);
