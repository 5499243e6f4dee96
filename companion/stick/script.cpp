#include "stick/script.h"

#include <algorithm>

#include <sys/stat.h>

namespace
{

const std::size_t firstLineBytes = 255; // what the kernel reads of it, execve(2)

/// Why the kernel cannot run a script that begins with `line`, and how to mend it.
struct Refusal
{
    std::string what; ///< empty when it can
    std::string remedy;
};

/// The interpreter that `line`, which begins with "#!", names.
std::string_view interpreterOf(std::string_view line)
{
    line.remove_prefix(2);
    line.remove_prefix(std::min(line.find_first_not_of(" \t"), line.size()));
    return line.substr(0, line.find_first_of(" \t"));
}

Refusal refusalOf(std::string_view line)
{
    const std::string start = shown(line.substr(0, 60));
    if (line.substr(0, 2) != "#!") {
        return {"the first line must begin with \"#!\" but is " + start + '.',
                "Save it as plain text without a byte order mark, with \"#!/bin/sh\" as its first line."};
    }
    if (line.find('\r') != std::string_view::npos) {
        return {"the first line ends as Windows ends lines: the kernel looks for an interpreter " +
                    shown(interpreterOf(line)) + '.',
                "Save it with Unix line ends: sed -i 's/\\r$//' unzipUpgrade.sh"};
    }
    if (interpreterOf(line).substr(0, 1) != "/" || line.size() > firstLineBytes ||
        line.find('\0') != std::string_view::npos) {
        return {"the first line names no interpreter by its whole path: " + start + '.',
                "Begin the script with \"#!/bin/sh\"."};
    }
    return {};
}

} // namespace

void checkScript(std::string_view start, std::uint64_t size, const std::string& name, Report& report)
{
    if (start.substr(0, 4) == std::string_view("\x7f"
                                               "ELF")) {
        report.addFact("script_interpreter", "Script", byteCount(size) + ", a compiled program", nullptr);
        return;
    }
    const std::string_view firstLine = start.substr(0, start.find('\n'));
    const Refusal refusal = refusalOf(firstLine);
    if (!refusal.what.empty()) {
        // A shell may take over a file that the kernel refuses, and read it as a script of its own.
        report.add({Severity::ERROR, "script-first-line", name + ": " + refusal.what,
                    "copies the files. The board's kernel refuses the script; unless the board's shell makes something "
                    "of it, nothing is installed. Only the script's status in the log tells so: it waits 13 minutes "
                    "and shows a finished update.",
                    refusal.remedy});
        return;
    }
    const std::string_view interpreter = interpreterOf(firstLine);
    report.addFact("script_interpreter", "Script", byteCount(size) + ", run by " + shown(interpreter),
                   escaped(interpreter));

    // Behind a zero byte a script carries data, not lines.
    const std::string_view text = start.substr(0, start.find('\0'));
    const std::size_t carriageReturn = text.find("\r\n");
    if (carriageReturn == std::string_view::npos) {
        return;
    }
    const auto line = 1 + std::count(text.begin(), text.begin() + static_cast<std::ptrdiff_t>(carriageReturn), '\n');
    report.add({Severity::ERROR, "script-line-ends",
                name + ": line " + std::to_string(line) + " ends as Windows ends lines (carriage return, line feed).",
                "copies it; the board's shell takes the carriage return for a part of the line's last word. The script "
                "fails or does something else, and the update still counts as done.",
                "Save it with Unix line ends: sed -i 's/\\r$//' unzipUpgrade.sh"});
}

void checkRunBit(mode_t mode, bool keepsPermissions, bool onUnit, const std::string& name, Report& report)
{
    if ((mode & (S_IXUSR | S_IXGRP | S_IXOTH)) != 0) {
        return;
    }
    if (!onUnit && !keepsPermissions) {
        report.add({Severity::WARNING, "script-run-bit",
                    name + " has no run bit here. This file system keeps none: the mount's options decide on the unit.",
                    "copies the script with the run bit that the unit's mount gives it.",
                    "Run this check on the unit as well."});
        return;
    }
    report.add(
        {Severity::ERROR, "script-run-bit", name + " has no run bit.",
         "copies the files and cannot start the script on the board, unless one from an earlier update is there, which "
         "keeps its run bit. Only the script's status in the log tells so: it waits 13 minutes and shows a finished "
         "update, but the board still has its old version.",
         keepsPermissions ? "Set it: chmod +x unzipUpgrade.sh" : "Mount the stick with the option fmask=0022."});
}
