#include "unit/unit_check.h"

#include <array>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <ostream>
#include <string_view>
#include <system_error>
#include <utility>

#include <endian.h>
#include <sys/stat.h>

namespace
{

const auto boardLimit = 45s; // 2 s to connect, then ten unanswered keep-alives of 4 s

/// systemctl(1) exits with 5 for a unit that is not loaded.
void checkService(const Unit& unit, const std::string& service, const std::string& fact, Report& report)
{
    const std::string state = unit.property(service, "LoadState");
    if (state != "loaded") {
        report.add("service-not-loaded." + service, {{"state", shown(state)}});
    }
    if (unit.property(service, "NeedDaemonReload") == "yes") {
        report.add("service-not-reloaded", {{"service", shown(service)}});
    }
    report.addFact(fact, "Service " + service, escaped(unit.property(service, "ActiveState")));
}

/// False, and reported, when the service's search path does not lead to the tool.
bool findTool(const Unit& unit, const std::string& name, Report& report)
{
    const bool found = !unit.program(name).empty();
    if (!found) {
        report.add("tool-missing." + name, {{"tool", shown(name)}, {"search-path", shown(unit.searchPath())}});
    }
    return found;
}

void checkPanelAddress(const Unit& unit, Report& report)
{
    // A register number out of range: i2cset(8) judges the chip address before it and opens no bus.
    const CommandResult address = unit.run({"i2cset", "-y", "0", "0x07", "0x100", "c"}, quick);
    const bool refused = contains(address.errors, "hip address");
    if (refused || !contains(address.errors, "ata address")) {
        report.add(refused ? "panel-address-refused" : "panel-address-unknown",
                   {{"program", shown(unit.program("i2cset"))}, {"complaint", complaint(address)}});
    }
}

void checkPanelAnswer(const Unit& unit, Report& report)
{
    const CommandResult answer = unit.run({"i2cdetect", "-y", "-a", "-r", "0", "0x07", "0x07"}, quick);
    const std::string row = valueAfter(answer.output, "00:");
    if (contains(row, "UU") || contains(row, "--")) {
        report.add(contains(row, "UU") ? "panel-busy" : "panel-silent");
    } else if (!contains(row, "07")) {
        report.add("panel-unknown", {{"complaint", complaint(answer)}});
    }
}

void checkPanel(const Unit& unit, Report& report)
{
    if (!findTool(unit, "i2cset", report)) {
        return;
    }
    checkPanelAddress(unit, report);
    if (!std::filesystem::exists(unit.path("/dev/i2c-0"))) {
        report.add("panel-bus-missing");
    } else if (!unit.updaterRuns()) { // a read could come between the two bytes of a LED's command
        checkPanelAnswer(unit, report);
    }
}

/// What is wrong with a WAV file's frame, Multimedia Programming Interface and Data Specifications 1.0.
std::string soundFault(std::ifstream& file)
{
    std::array<char, 12> frame{}; // "RIFF", the length of what follows with the lowest byte first, "WAVE"
    file.read(frame.data(), frame.size());
    file.clear();
    const auto size = static_cast<std::uint64_t>(file.seekg(0, std::ios::end).tellg());
    const std::string_view text(frame.data(), frame.size());
    if (text.substr(0, 4) != "RIFF" || text.substr(8) != "WAVE") {
        return size == 0 ? "it is empty" : "it is no WAV file";
    }
    std::uint32_t length = 0;
    std::memcpy(&length, &frame[4], sizeof length);
    const std::uint64_t wanted = 8 + std::uint64_t{le32toh(length)};
    return size < wanted
               ? "it is cut off: " + std::to_string(size) + " of " + std::to_string(wanted) + " bytes are there"
               : "";
}

void checkSoundFile(const Unit& unit, const char* sound, Report& report)
{
    std::ifstream file(unit.path(sound), std::ios::binary);
    if (!file && errno != ENOENT) {
        report.add("sound-file.unknown", {{"path", shown(sound)}, {"error", std::strerror(errno)}});
        return;
    }
    const std::string fault = file ? soundFault(file) : "it is not there";
    if (!fault.empty()) {
        report.add("sound-file", {{"path", shown(sound)}, {"fault", fault}});
    }
}

void checkSound(const Unit& unit, Report& report)
{
    findTool(unit, "aplay", report);
    for (const char* sound : {passSound, failSound}) {
        checkSoundFile(unit, sound, report);
    }
    std::ifstream devices(unit.path("/proc/asound/pcm")); // one line for each, snd(4) of the kernel
    const std::string text(std::istreambuf_iterator<char>(devices), {});
    if (!contains(text, "playback")) {
        report.add("sound-device");
    }
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
    if (answer.exitCode == 255 || answer.exitCode < 0) { // 255: an error of ssh(1) itself
        const bool unknown = contains(answer.errors, "Host key verification failed");
        const bool denied = contains(answer.errors, "Permission denied");
        const bool changed = contains(answer.errors, "HOST IDENTIFICATION HAS CHANGED");
        report.add((unknown || denied) && !unit.site().isRoot ? "board-login.user"
                   : changed                                  ? "board-host-key.changed"
                   : unknown                                  ? "board-host-key.unknown"
                   : denied                                   ? "board-login"
                                                              : "board-unreachable",
                   {{"complaint", complaint(answer)}});
        return;
    }
    const std::string value = valueAfter(answer.output, boardVersionKey);
    const std::string version = value.substr(0, value.find('\r'));
    if (answer.succeeded() && !version.empty()) {
        report.addFact("board_version", "Board's version", shown(version), escaped(version));
    } else {
        report.add("board-version", {{"answer", answer.output.empty() ? complaint(answer) : shown(answer.output)}});
    }
}

void checkUnit(const Unit& unit, Report& report)
{
    unit.defineTexts(report);
    if (unit.updaterRuns()) {
        report.add("updater-runs");
    }
    if (!unit.site().isRoot) {
        report.add("not-root");
    }
    const bool main = unit.isMainHead();
    report.addFact("head", "Head", (main ? "main head, package " : "remote head, package ") + shown(unit.package()),
                   main ? "main" : "remote");
    if (unit.servicesKnown()) {
        checkService(unit, "harl", "service_harl", report);
        checkService(unit, "harl-updater", "service_harl_updater", report);
    } else {
        report.add("services-unknown");
    }
    if (!std::filesystem::exists(unit.path("/var/log/journal"))) { // kept in memory then, journald.conf(5)
        report.add("journal-volatile");
    }
    struct stat updater = {}; // the package tools keep the time at which it was built
    if (stat(unit.path("/usr/sbin/harl-updater").c_str(), &updater) == 0 && std::time(nullptr) < updater.st_mtime) {
        report.add("clock-behind");
    }
    report.addFact("search_path", "Search path", escaped(unit.searchPath()));
    for (const char* tool : {"systemctl", "umount", "rm", "ls", "apt", "apt-cache", "ssh", "scp"}) {
        findTool(unit, tool, report);
    }
    if (!main) {
        checkPanel(unit, report);
        checkSound(unit, report);
    }
    checkBoard(unit, report);
    checkPackageManager(unit, report);
}

int runUnit(const UnitOptions& options, const UnitSite& site, std::ostream& out, std::ostream& errors)
{
    const Unit unit(site);
    if (options.panel || options.sound) {
        return runSelfTests(options, unit, out, errors);
    }
    Report report("unit", "The unit");
    checkUnit(unit, report);
    report.write(options.json, out);
    return report.status();
}
