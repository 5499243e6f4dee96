#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

/// What the updater does, in the figures and names that more than one question needs (see
/// common/src/UpdateManager.cpp).

inline constexpr char stickMountPoint[] = "/root/USB_MOUNT"; ///< where the unit mounts the stick
inline constexpr char boardFolder[] = "debs/QUORB/armhf";    ///< on the stick
inline constexpr std::size_t versionPrefixLength = 5;        ///< bytes of the version folder's name before the version

inline constexpr char boardAddress[] = "192.168.9.2";
inline constexpr char boardVersionCommand[] = " cat /root/App/AppExe/version.txt | grep 'Brimvale'";
inline constexpr char boardVersionKey[] = "Brimvale\t";

inline constexpr int uploadAttempts = 20;
inline constexpr std::int64_t boardWait = 780;   ///< s, after the board's install script
inline constexpr std::int64_t outcomeWait = 30;  ///< s, for the operator to read the panel
inline constexpr std::int64_t giveBackWait = 10; ///< s, after the start of the application

/// Prints the journal of the updater's services, all entries with their times and programs; --all keeps tabs as they
/// are.
inline const std::vector<std::string> journalCommand = {"journalctl",
                                                        "--unit=harl-updater",
                                                        "--unit=harl-updater-give-back",
                                                        "--unit=harl-updater-verify",
                                                        "--output=short-iso",
                                                        "--all",
                                                        "--quiet",
                                                        "--no-pager"};

/// The head's own package.
inline std::string packageOf(bool mainHead)
{
    return mainHead ? "solvik4-dh" : "solvik4-rh";
}
