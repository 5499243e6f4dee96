#pragma once

#include <atomic>

/// True once a thread of the test program waits on the application lock.
///
/// The lock is a bare wait and notify: a run of instant commands could notify before the main thread waits. A stand-in
/// for an early command waits for this instead of being slow; no run then depends on a delay.
extern std::atomic<bool> applicationLockWaited;
