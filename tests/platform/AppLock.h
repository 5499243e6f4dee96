#pragma once

#include <atomic>

/// True once a thread of the test program waits on the application lock.
///
/// The lock is a bare wait and notify: a run of instant commands could notify before the main thread waits. A stand-in
/// for an early command waits for this instead of being slow, so that no run depends on a delay.
extern std::atomic<bool> applicationLockWaited;
