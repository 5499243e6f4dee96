#include "unit/board.h"

namespace
{

const auto boardLimit = 45s; // 2 s to connect, then ten unanswered keep-alives of 4 s

void checkBoardVersion(const CommandResult& answer, Report& report)
{
    const std::string value = valueAfter(answer.output, boardVersionKey);
    const std::string version = value.substr(0, value.find('\r'));
    if (!answer.succeeded() || version.empty()) {
        report.add("board-version", {{"answer", answer.output.empty() ? complaint(answer) : shown(answer.output)}});
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
    const Values values = {{"complaint", complaint(answer)}};
    if (refused && forKeys && !unit.isRoot()) {
        report.add("board-login.user", values);
    } else if (refused && contains(answer.errors, "HOST IDENTIFICATION HAS CHANGED")) {
        report.add("board-host-key.changed");
    } else if (refused && contains(answer.errors, "Host key verification failed")) {
        report.add("board-host-key.unknown");
    } else if (refused && contains(answer.errors, "Permission denied")) {
        report.add("board-login");
    } else if (refused || answer.exitCode < 0) {
        report.add("board-unreachable", values);
    } else {
        checkBoardVersion(answer, report);
    }
}
