#include "unit/unit_check.h"

#include "findings.h"
#include "unit/board.h"
#include "unit/environment.h"
#include "unit/packages.h"
#include "unit/selftest.h"
#include "unit/wave.h"

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <ostream>
#include <system_error>
#include <utility>

namespace
{

const std::string darkPanel =
    "cannot light the panel (log: \"system returned false: i2cset ...\"). The update itself runs, "
    "but the operator sees neither its progress nor its outcome.";
const std::string noSound =
    "plays no sound (log: \"Failed to play a sound\"); the panel shows the outcome all the same.";

/// The unit check: each operation adds to the report what it finds.
class UnitCheck
{
public:
    UnitCheck(const Unit& unit, Report& report) : mUnit(unit), mReport(report), mUpdaterRuns(unit.updaterRuns()) {}

    void run()
    {
        if (mUpdaterRuns) {
            add(Severity::WARNING, "updater-runs", "The updater is running.", "goes on undisturbed.",
                "Check again when it has ended: what it holds or changes shows up here as a fault.");
        }
        if (!mUnit.isRoot()) {
            add(Severity::UNCHECKED, "not-root", "This check does not run as root.",
                "runs as root, with root's keys and rights.", "Run it as root.");
        }
        mReport.addFact("head", "Head",
                        (mUnit.isMainHead() ? "main head, package " : "remote head, package ") + shown(mUnit.package()),
                        mUnit.isMainHead() ? "main" : "remote");
        checkServices();
        checkTools();
        if (!mUnit.isMainHead()) {
            checkPanel();
            checkSound();
        }
        checkBoard(mUnit, mReport);
        checkPackageManager(mUnit, mReport);
    }

private:
    void add(Severity severity, const char* check, std::string what, std::string effect, std::string remedy)
    {
        mReport.add({severity, check, std::move(what), std::move(effect), std::move(remedy)});
    }

    void checkServices()
    {
        if (!mUnit.servicesKnown()) {
            add(Severity::UNCHECKED, "services-unknown", "The service manager cannot be asked.",
                "stops and starts the application through it.", "Run this check on the unit.");
            return;
        }
        // systemctl(1) exits with 5 for a unit that is not loaded.
        checkService("harl", "service_harl",
                     "can neither stop the application before the update nor start it afterwards (log: status 1280).");
        checkService("harl-updater", "service_harl_updater",
                     "is not started as a service, and its last command fails (log: status 1280).");
    }

    void checkService(const std::string& service, const std::string& fact, const std::string& effect)
    {
        const std::string state = mUnit.property(service, "LoadState");
        if (state != "loaded") {
            add(Severity::ERROR, "service-not-loaded",
                "The service " + shown(service) + " cannot be used: " + shown(state) + '.', effect,
                "Install its unit file: systemctl status " + service);
        }
        mReport.addFact(fact, "Service " + service, escaped(mUnit.property(service, "ActiveState")));
    }

    void checkTools()
    {
        const std::string failure = mUnit.failure() + '.';
        const std::string noVersion = mUnit.isMainHead() ? "installs nothing." : "leaves the board as it is.";
        mReport.addFact("search_path", "Search path", escaped(mUnit.searchPath()));
        findTool("systemctl", "cannot stop and start the application (log: status 32512).");
        findTool("umount", "cannot release the stick (log: status 32512).");
        findTool("rm", "cannot remove the first-boot marker, although the log says \"removed\".");
        findTool("ls",
                 "finds no version on the stick (log: \"Failed to check candidate QUORB version\") and " + noVersion);
        findTool("apt", "cannot refresh the mirrors (log: \"NOT OK 127\") and " + failure);
        findTool("apt-cache", "finds no versions (log: \"NWM_UM_CHECK_UPDATE_FAILED\") and " + failure);
        findTool("ssh", "cannot ask the board for its version (log: \"Exit code:127\") and " + noVersion);
        findTool("scp",
                 "cannot upload the board's files (log: \"Uploading failed. Trying again. \"), gives up after 20 "
                 "attempts and " +
                     failure);
    }

    /// False, and reported, when the service's search path does not lead to the tool.
    bool findTool(const char* name, const std::string& effect, Severity severity = Severity::ERROR)
    {
        if (!mUnit.program(name).empty()) {
            return true;
        }
        add(severity, "tool-missing",
            "The command " + shown(name) + " is not on the service's search path " + shown(mUnit.searchPath()) + '.',
            effect, "Install it, or set PATH in the service's unit file.");
        return false;
    }

    void checkPanel()
    {
        if (!findTool("i2cset", darkPanel)) {
            return;
        }
        checkPanelAddress();
        if (!std::filesystem::exists(mUnit.path("/dev/i2c-0"))) {
            add(Severity::ERROR, "panel-bus-missing", "There is no bus device \"/dev/i2c-0\".", darkPanel,
                "Load the kernel's driver: modprobe i2c-dev");
        } else if (!mUpdaterRuns) { // a read could come between the two bytes of a LED's command
            checkPanelAnswer();
        }
    }

    void checkPanelAddress()
    {
        // A register number out of range: i2cset(8) judges the chip address before it and opens no bus.
        const CommandResult address = mUnit.run({"i2cset", "-y", "0", "0x07", "0x100", "c"}, quick);
        if (contains(address.errors, "hip address")) {
            add(Severity::ERROR, "panel-address-refused",
                shown(mUnit.program("i2cset")) + " refuses the panel's address 0x07: " + complaint(address) + '.',
                darkPanel,
                "i2c-tools since 4.2 needs the option -a. Put a command i2cset that adds it before it on the service's "
                "search path, or install an older i2c-tools.");
        } else if (!contains(address.errors, "ata address")) {
            add(Severity::UNCHECKED, "panel-address-unknown",
                shown(mUnit.program("i2cset")) +
                    " does not tell whether it takes the panel's address 0x07: " + complaint(address) + '.',
                "lights the panel with it.", "Run the lamp test: harl-updater-tool unit --panel");
        }
    }

    void checkPanelAnswer()
    {
        const CommandResult answer = mUnit.run({"i2cdetect", "-y", "-a", "-r", "0", "0x07", "0x07"}, quick);
        const std::string row = valueAfter(answer.output, "00:");
        if (contains(row, "UU")) {
            add(Severity::ERROR, "panel-busy", "A kernel driver has taken the panel's address 0x07 on bus 0.",
                darkPanel, "Remove the driver.");
        } else if (contains(row, "--")) {
            add(Severity::ERROR, "panel-silent", "Nothing answers at the panel's address 0x07 on bus 0.", darkPanel,
                "Check the panel's cable and supply.");
        } else if (!contains(row, "07")) {
            add(Severity::UNCHECKED, "panel-unknown", "The panel's bus could not be asked: " + complaint(answer) + '.',
                "lights the panel over it.", "Run the lamp test: harl-updater-tool unit --panel");
        }
    }

    void checkSound()
    {
        findTool("aplay", noSound, Severity::WARNING);
        for (const char* sound : {passSound, failSound}) {
            checkSoundFile(sound);
        }
        std::ifstream devices(mUnit.path("/proc/asound/pcm")); // one line for each, snd(4) of the kernel
        const std::string text(std::istreambuf_iterator<char>(devices), {});
        if (!contains(text, "playback")) {
            add(Severity::WARNING, "sound-device", "There is no sound device.", noSound,
                "Check the sound driver: aplay -l");
        }
    }

    void checkSoundFile(const char* sound)
    {
        const std::string effect = "plays nothing or a noise in its place; the panel shows the outcome all the same.";
        std::ifstream file(mUnit.path(sound), std::ios::binary);
        if (!file && errno != ENOENT) {
            add(Severity::UNCHECKED, "sound-file",
                "The sound " + shown(sound) + " cannot be read: " + errorText(errno) + '.', effect,
                "Run this check as root.");
            return;
        }
        const std::string fault = file ? soundFault(file) : "it is not there";
        if (!fault.empty()) {
            add(Severity::WARNING, "sound-file", "The sound " + shown(sound) + " cannot be played: " + fault + '.',
                effect, "Install the sound file again.");
        }
    }

    static std::string soundFault(std::ifstream& file)
    {
        std::string start(std::size_t{64} * 1024, '\0');
        file.read(start.data(), static_cast<std::streamsize>(start.size()));
        start.resize(static_cast<std::size_t>(file.gcount()));
        file.clear();
        file.seekg(0, std::ios::end);
        return waveFault(start, static_cast<std::uint64_t>(file.tellg()));
    }

    const Unit& mUnit;
    Report& mReport;
    bool mUpdaterRuns;
};

int runSelfTests(const UnitOptions& options, const Unit& unit, const UnitSite& site, std::ostream& out,
                 std::ostream& errors)
{
    if (unit.updaterRuns()) {
        if (options.json) {
            out << refusal("unit", "the updater is running and uses panel and sound itself").dump(2) << '\n';
        }
        errors << "harl-updater-tool: the updater is running and uses panel and sound itself. Run the test when it has "
                  "ended.\n";
        return Report::STATUS_UNCHECKED;
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

void checkUnit(const Unit& unit, Report& report)
{
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
