#include "unit/unit_check.h"

#include "findings.h"
#include "unit/environment.h"
#include "unit/packages.h"
#include "unit/selftest.h"

#include <array>
#include <cerrno>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <ostream>
#include <string_view>
#include <system_error>
#include <utility>

#include <sys/stat.h>

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

/// The unit check: each operation adds to the report what it finds.
class UnitCheck
{
public:
    UnitCheck(const Unit& unit, Report& report) : mUnit(unit), mReport(report), mUpdaterRuns(unit.updaterRuns()) {}

    void run()
    {
        if (mUpdaterRuns) {
            mReport.add("updater-runs");
        }
        if (!mUnit.isRoot()) {
            mReport.add("not-root");
        }
        mReport.addFact("head", "Head",
                        (mUnit.isMainHead() ? "main head, package " : "remote head, package ") + shown(mUnit.package()),
                        mUnit.isMainHead() ? "main" : "remote");
        checkServices();
        checkJournal();
        checkClock();
        checkTools();
        if (!mUnit.isMainHead()) {
            checkPanel();
            checkSound();
        }
        checkBoard(mUnit, mReport);
        checkPackageManager(mUnit, mReport);
    }

private:
    void checkServices()
    {
        if (!mUnit.servicesKnown()) {
            mReport.add("services-unknown");
            return;
        }
        checkService("harl", "service_harl");
        checkService("harl-updater", "service_harl_updater");
    }

    /// systemctl(1) exits with 5 for a unit that is not loaded.
    void checkService(const std::string& service, const std::string& fact)
    {
        const std::string state = mUnit.property(service, "LoadState");
        if (state != "loaded") {
            mReport.add("service-not-loaded." + service, {{"state", shown(state)}});
        }
        if (mUnit.property(service, "NeedDaemonReload") == "yes") {
            mReport.add("service-not-reloaded", {{"service", shown(service)}});
        }
        mReport.addFact(fact, "Service " + service, escaped(mUnit.property(service, "ActiveState")));
    }

    /// Without its folder the journal is kept in memory, journald.conf(5).
    void checkJournal()
    {
        if (!std::filesystem::exists(mUnit.path("/var/log/journal"))) {
            mReport.add("journal-volatile");
        }
    }

    /// The package tools keep the time at which the updater was built.
    void checkClock()
    {
        struct stat updater = {};
        if (stat(mUnit.path("/usr/sbin/harl-updater").c_str(), &updater) == 0 &&
            std::time(nullptr) < updater.st_mtime) {
            mReport.add("clock-behind");
        }
    }

    void checkTools()
    {
        mReport.addFact("search_path", "Search path", escaped(mUnit.searchPath()));
        for (const char* tool : {"systemctl", "umount", "rm", "ls", "apt", "apt-cache", "ssh", "scp"}) {
            findTool(tool);
        }
    }

    /// False, and reported, when the service's search path does not lead to the tool.
    bool findTool(const std::string& name)
    {
        const bool found = !mUnit.program(name).empty();
        if (!found) {
            mReport.add("tool-missing." + name, {{"tool", shown(name)}, {"search-path", shown(mUnit.searchPath())}});
        }
        return found;
    }

    void checkPanel()
    {
        if (!findTool("i2cset")) {
            return;
        }
        checkPanelAddress();
        if (!std::filesystem::exists(mUnit.path("/dev/i2c-0"))) {
            mReport.add("panel-bus-missing");
        } else if (!mUpdaterRuns) { // a read could come between the two bytes of a LED's command
            checkPanelAnswer();
        }
    }

    void checkPanelAddress()
    {
        // A register number out of range: i2cset(8) judges the chip address before it and opens no bus.
        const CommandResult address = mUnit.run({"i2cset", "-y", "0", "0x07", "0x100", "c"}, quick);
        const bool refused = contains(address.errors, "hip address");
        if (refused || !contains(address.errors, "ata address")) {
            mReport.add(refused ? "panel-address-refused" : "panel-address-unknown",
                        {{"program", shown(mUnit.program("i2cset"))}, {"complaint", complaint(address)}});
        }
    }

    void checkPanelAnswer()
    {
        const CommandResult answer = mUnit.run({"i2cdetect", "-y", "-a", "-r", "0", "0x07", "0x07"}, quick);
        const std::string row = valueAfter(answer.output, "00:");
        if (contains(row, "UU") || contains(row, "--")) {
            mReport.add(contains(row, "UU") ? "panel-busy" : "panel-silent");
        } else if (!contains(row, "07")) {
            mReport.add("panel-unknown", {{"complaint", complaint(answer)}});
        }
    }

    void checkSound()
    {
        findTool("aplay");
        for (const char* sound : {passSound, failSound}) {
            checkSoundFile(sound);
        }
        std::ifstream devices(mUnit.path("/proc/asound/pcm")); // one line for each, snd(4) of the kernel
        const std::string text(std::istreambuf_iterator<char>(devices), {});
        if (!contains(text, "playback")) {
            mReport.add("sound-device");
        }
    }

    void checkSoundFile(const char* sound)
    {
        std::ifstream file(mUnit.path(sound), std::ios::binary);
        if (!file && errno != ENOENT) {
            mReport.add("sound-file.unknown", {{"path", shown(sound)}, {"error", errorText(errno)}});
            return;
        }
        const std::string fault = file ? soundFault(file) : "it is not there";
        if (!fault.empty()) {
            mReport.add("sound-file", {{"path", shown(sound)}, {"fault", fault}});
        }
    }

    /// What is wrong with a WAV file's frame, Multimedia Programming Interface and Data Specifications 1.0.
    static std::string soundFault(std::ifstream& file)
    {
        std::array<char, 12> frame{}; // "RIFF", the length of what follows with the lowest byte first, "WAVE"
        file.read(frame.data(), frame.size());
        file.clear();
        const auto size = static_cast<std::uint64_t>(file.seekg(0, std::ios::end).tellg());
        const std::string_view text(frame.data(), frame.size());
        if (text.substr(0, 4) != "RIFF" || text.substr(8) != "WAVE") {
            return size == 0 ? "it is empty" : "it is no WAV file";
        }
        std::uint64_t length = 8;
        for (std::size_t byte = 0; byte < 4; ++byte) {
            length += std::uint64_t{static_cast<unsigned char>(frame.at(4 + byte))} << (8 * byte);
        }
        return size < length
                   ? "it is cut off: " + std::to_string(size) + " of " + std::to_string(length) + " bytes are there"
                   : "";
    }

    const Unit& mUnit;
    Report& mReport;
    bool mUpdaterRuns;
};

int runSelfTests(const UnitOptions& options, const Unit& unit, const UnitSite& site, std::ostream& out,
                 std::ostream& errors)
{
    if (unit.updaterRuns()) {
        return refuse("unit", options.json,
                      "the updater is running and uses panel and sound itself. Run the test when it has ended.", out,
                      errors);
    }
    nlohmann::ordered_json results = {{"command", "unit"}, {"version", jsonVersion}};
    int status = Report::STATUS_FIT;
    const auto take = [&](const char* name, const char* tested, const SelfTest& test) {
        results[name] = {{tested, test.tested}, {"failed_commands", test.failedCommands}, {"reason", test.reason}};
        if (test.failedCommands > 0) {
            errors << "harl-updater-tool: " << counted(static_cast<std::uint64_t>(test.failedCommands), "command")
                   << " of the " << name << " test failed: " << test.reason
                   << ". To find out why, as root: harl-updater-tool unit\n";
            status = Report::STATUS_NOT_FIT;
        }
    };
    std::ostream* const text = options.json ? nullptr : &out;
    if (options.panel) {
        take("panel", "leds", testPanel(unit, site, text));
    }
    if (options.sound) {
        take("sound", "sounds", testSound(unit, text));
    }
    if (options.json) {
        out << results.dump(2) << '\n';
    }
    return status;
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

void checkUnit(const Unit& unit, Report& report)
{
    unit.defineTexts(report);
    UnitCheck(unit, report).run();
}

int runUnit(const UnitOptions& options, const UnitSite& site, std::ostream& out, std::ostream& errors)
{
    const Unit unit(site);
    if (options.panel || options.sound) {
        return runSelfTests(options, unit, site, out, errors);
    }
    Report report("unit", "The unit");
    checkUnit(unit, report);
    report.write(options.json, out);
    return report.status();
}
