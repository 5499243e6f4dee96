#pragma once

/// How long the updater's tools may take. docs/reliability.md describes what the operator sees at each limit.
struct Limit
{
    const char* name; ///< calls of one name share a budget
    const char* tool; ///< as it is called
    const char* word; ///< what one of its arguments contains; null: any call
    double call;      ///< s, for one call
    double budget;    ///< s in one run, for all calls that reach their limit together
    bool everyCall;   ///< the budget counts the others as well
    bool noted;       ///< its beginning and its end are noted, for what runs after the updater
};

#ifdef LIMITS
#include LIMITS // shorter ones, for tests
#else
/// The first match counts. The last entry is for everything else.
inline constexpr Limit limits[] = {
    {"panel", "i2cset", nullptr, 5, 60, false, false},
    {"sound", "aplay", nullptr, 120, 120, false, false},
    {"stick", "ls", nullptr, 120, 120, false, false},
    {"detach", "umount", "--lazy", 20, 20, false, false},
    {"stick", "umount", nullptr, 120, 120, false, false},
    {"services", "systemctl", nullptr, 300, 300, false, false},
    {"mirrors", "apt", "update", 1080, 1080, false, false}, // the application is back within 20 minutes
    {"versions", "apt-cache", nullptr, 180, 180, false, false},
    {"installation", "apt", nullptr, 5400, 5400, false, true},
    {"board-version", "ssh", "version.txt", 180, 180, false, false},
    {"upload", "scp", nullptr, 3600, 3600, true, false}, // 20 attempts of two copies
    {"board-script", "ssh", nullptr, 1800, 1800, false, true},
    {"repair", "dpkg", nullptr, 600, 720, true, false},
    {"repair", "apt-get", nullptr, 600, 720, true, false},
    {"verification", "verify-stick", nullptr, 300, 300, false, false},
    {"journal", "journalctl", nullptr, 5, 20, false, false},
    {"journal", "sync", nullptr, 5, 20, false, false},
    {"other", nullptr, nullptr, 300, 300, false, false},
};
/// From SIGTERM to SIGKILL, and from there until what does not die is left running.
inline constexpr double grace = 3; // s
/// How long to wait for output that another process holds open after the tool has ended.
inline constexpr double silence = 1; // s
#endif
