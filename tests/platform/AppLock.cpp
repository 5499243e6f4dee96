#include "AppLock.h"

#include <ctime>
#include <pthread.h>

std::atomic<bool> applicationLockWaited{false};

/// Replaces the C library's function, which std::condition_variable::wait() calls.
///
/// The caller holds the mutex until the wait has begun, so that a notification, which takes it as well, comes after.
extern "C" int pthread_cond_wait(pthread_cond_t* condition, pthread_mutex_t* mutex)
{
    applicationLockWaited = true;
    timespec end = {};
    clock_gettime(CLOCK_REALTIME, &end);
    end.tv_sec += 3600;
    return pthread_cond_timedwait(condition, mutex, &end);
}
