#include "unit/board.h"

namespace
{

const auto boardLimit = 45s; // 2 s to connect, then ten unanswered keep-alives of 4 s

std::string boardNotRead(const Unit& unit)
{
    return unit.isMainHead()
               ? "logs \"Failed to checkUpdate\", installs nothing and " + unit.failure() + '.'
               : "logs \"Failed to checkUpdate\" and leaves the board as it is. The panel shows \"nothing to "
                 "update\" when the head's package is up to date, and a failed check when it has just been "
                 "installed.";
}

void checkBoardVersion(const CommandResult& answer, const Unit& unit, Report& report)
{
    const std::string value = valueAfter(answer.output, boardVersionKey);
    const std::string version = value.substr(0, value.find('\r'));
    if (!answer.succeeded() || version.empty()) {
        report.add({Severity::ERROR, "board-version",
                    "The board's version file holds no line with \"Brimvale\", a tab and a version: " +
                        (answer.output.empty() ? complaint(answer) : shown(answer.output)) + '.',
                    boardNotRead(unit), "Look at it: ssh 192.168.9.2 cat /root/App/AppExe/version.txt"});
        return;
    }
    report.addFact("board_version", "Board's version", shown(version), escaped(version));
}

} // namespace

void checkBoard(const Unit& unit, Report& report)
{
    // The updater's own command, which asks nobody here and learns no new host key.
    const CommandResult answer =
        unit.run({"ssh", "-o", "BatchMode=yes", "-o", "StrictHostKeyChecking=yes", "-o", "UpdateHostKeys=no", "-o",
                  "ServerAliveInterval=4", "-o", "ServerAliveCountMax=10", "-o", "ConnectTimeout=2", "-o",
                  "TCPKeepAlive=yes", boardAddress, boardVersionCommand},
                 boardLimit);
    if (!answer.started) {
        return; // reported with the tools
    }
    const bool refused = answer.exitCode == 255; // ssh(1): an error of its own
    const bool forKeys =
        contains(answer.errors, "Host key verification failed") || contains(answer.errors, "Permission denied");
    if (refused && forKeys && !unit.isRoot()) {
        report.add({Severity::UNCHECKED, "board-login", "The board refuses this user: " + complaint(answer) + '.',
                    boardNotRead(unit), "Run this check as root: root's keys count."});
    } else if (refused && contains(answer.errors, "HOST IDENTIFICATION HAS CHANGED")) {
        report.add(
            {Severity::ERROR, "board-host-key", "The board's host key is not the one that is known.",
             boardNotRead(unit),
             "When the board was replaced: ssh-keygen -R 192.168.9.2, then log in once by hand: ssh 192.168.9.2"});
    } else if (refused && contains(answer.errors, "Host key verification failed")) {
        report.add({Severity::ERROR, "board-host-key", "The board's host key is not known.", boardNotRead(unit),
                    "Log in once by hand and accept the key: ssh 192.168.9.2"});
    } else if (refused && contains(answer.errors, "Permission denied")) {
        report.add({Severity::ERROR, "board-login", "The board refuses a login without a password.", boardNotRead(unit),
                    "Install root's public key on the board: ssh-copy-id 192.168.9.2"});
    } else if (refused || answer.exitCode < 0) {
        report.add({Severity::ERROR, "board-unreachable",
                    "The board at 192.168.9.2 cannot be asked: " + complaint(answer) + '.', boardNotRead(unit),
                    "Check the board's supply and link: ping 192.168.9.2. When it answers: ssh 192.168.9.2"});
    } else {
        checkBoardVersion(answer, unit, report);
    }
}
