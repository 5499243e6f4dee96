#include "stick/script.h"

#include <algorithm>

#include <sys/stat.h>

namespace
{

const std::size_t firstLineBytes = 255; // what the kernel reads of it, execve(2)

/// The interpreter that `line` names behind its "#!".
std::string_view interpreterOf(std::string_view line)
{
    line.remove_prefix(std::min<std::size_t>(line.size(), 2));
    line.remove_prefix(std::min(line.find_first_not_of(" \t"), line.size()));
    return line.substr(0, line.find_first_of(" \t"));
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
    const Values values = {
        {"name", name}, {"start", shown(firstLine.substr(0, 60))}, {"interpreter", shown(interpreterOf(firstLine))}};
    const bool names = firstLine.substr(0, 2) == "#!";
    if (names && firstLine.find('\r') != std::string_view::npos) {
        report.add("script-first-line.windows", values);
        return;
    }
    if (names && (interpreterOf(firstLine).substr(0, 1) != "/" || firstLine.size() > firstLineBytes ||
                  firstLine.find('\0') != std::string_view::npos)) {
        report.add("script-first-line.interpreter", values);
        return;
    }
    if (names) {
        report.addFact("script_interpreter", "Script", byteCount(size) + ", run by " + shown(interpreterOf(firstLine)),
                       escaped(interpreterOf(firstLine)));
    } else {
        report.add("script-first-line", values);
    }

    // Behind a zero byte a script carries data, not lines.
    const std::string_view text = start.substr(0, start.find('\0'));
    const std::size_t carriageReturn = text.find("\r\n");
    if (carriageReturn == std::string_view::npos) {
        return;
    }
    const auto line = 1 + std::count(text.begin(), text.begin() + static_cast<std::ptrdiff_t>(carriageReturn), '\n');
    report.add("script-line-ends", {{"name", name}, {"line", std::to_string(line)}});
}

void checkRunBit(mode_t mode, bool keepsPermissions, bool onUnit, const std::string& name, Report& report)
{
    if ((mode & (S_IXUSR | S_IXGRP | S_IXOTH)) != 0) {
        return;
    }
    report.add(keepsPermissions ? "script-run-bit"
               : onUnit         ? "script-run-bit.mount"
                                : "script-run-bit.elsewhere",
               {{"name", name}});
}
