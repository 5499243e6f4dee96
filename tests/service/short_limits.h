/// The limits of service/limits.h, shortened.
// clang-format off
inline constexpr Limit limits[] = {
    {"panel", "i2cset", nullptr, 1, 3, false, false},
    {"sound", "aplay", nullptr, 2, 2, false, false},
    {"stick", "ls", nullptr, 2, 2, false, false},
    {"detach", "umount", "--lazy", 2, 2, false, false},
    {"stick", "umount", nullptr, 2, 2, false, false},
    {"services", "systemctl", nullptr, 5, 5, false, false},
    {"mirrors", "apt", "update", 12, 12, false, false},
    {"versions", "apt-cache", nullptr, 8, 8, false, false},
    {"installation", "apt", nullptr, 20, 20, false, true},
    {"board-version", "ssh", "version.txt", 6, 6, false, false},
    {"upload", "scp", nullptr, 6, 6, true, false}, // 20 attempts of two copies
    {"board-script", "ssh", nullptr, 6, 6, false, true},
    {"repair", "dpkg", nullptr, 15, 20, true, false},
    {"repair", "apt-get", nullptr, 15, 20, true, false},
    {"verification", "verify-stick", nullptr, 5, 5, false, false},
    {"journal", "journalctl", nullptr, 2, 6, false, false},
    {"journal", "sync", nullptr, 2, 6, false, false},
    {"other", nullptr, nullptr, 3, 3, false, false},
};
// clang-format on
inline constexpr double grace = 0.5;   // s
inline constexpr double silence = 0.5; // s
