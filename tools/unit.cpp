#include "unit.h"

#include "LedManager.h"
#include "command.h"
#include "descriptor.h"
#include "findings.h"
#include "unit_wave.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <optional>
#include <ostream>
#include <sstream>
#include <string_view>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>

namespace
{

using namespace std::chrono_literals;

const char defaultSearchPath[] = "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin"; // systemd.exec(5)
const char passSound[] = "/root/RESOURCES/SOUNDS/SND_RESULT_PASS.wav";
const char failSound[] = "/root/RESOURCES/SOUNDS/SND_RESULT_FAIL.wav";

const auto quick = 10s;       // for a command that only looks something up
const auto boardLimit = 45s;  // 2 s to connect, then ten unanswered keep-alives of 4 s
const auto mirrorLimit = 15s; // for all mirrors together
const auto soundLimit = 60s;
const std::size_t mostMirrors = 32;
const std::uint64_t littleSpace = 100'000'000; // bytes

const std::string darkPanel =
    "cannot light the panel (log: \"system returned false: i2cset ...\"). The update itself runs, "
    "but the operator sees neither its progress nor its outcome.";
const std::string boardNotRead =
    "logs \"Failed to checkUpdate\" and leaves the board as it is. The panel shows \"nothing to update\" when the "
    "head's package is up to date, and a failed check when it has just been installed.";

std::string errorText(int error)
{
    return std::generic_category().message(error);
}

/// The lines of `text`, without their ends.
std::vector<std::string> linesOf(const std::string& text)
{
    std::vector<std::string> lines;
    std::istringstream stream(text);
    std::string line;
    while (std::getline(stream, line)) {
        lines.push_back(line);
    }
    return lines;
}

bool contains(const std::string& text, const std::string& part)
{
    return text.find(part) != std::string::npos;
}

/// What follows `key` in the first line of `text` that holds it.
std::optional<std::string> valueAfter(const std::string& text, const std::string& key)
{
    for (const std::string& line : linesOf(text)) {
        const std::size_t position = line.find(key);
        if (position != std::string::npos) {
            return line.substr(position + key.size());
        }
    }
    return std::nullopt;
}

/// What a command said of its failure, for a message.
std::string complaint(const CommandResult& result)
{
    if (!result.started) {
        return "it could not be started";
    }
    if (result.timedOut) {
        return "it did not end in time";
    }
    std::string last;
    for (const std::string& line : linesOf(result.errors)) {
        const std::string text = line.substr(0, line.find('\r')); // ssh(1) ends its lines so
        last = text.empty() ? last : text;
    }
    return last.empty() ? "it ended with status " + std::to_string(result.exitCode) : shown(last);
}

/// A unit as the updater's service finds it: its services, and the environment that the service's commands get.
class Unit
{
public:
    explicit Unit(const UnitSite& site) : mSite(site)
    {
        mEnvironment["PATH"] = site.searchPath;
        takeVariables(linesOf(run({"systemctl", "show-environment"}, quick).output));
        const CommandResult services = run(
            {"systemctl", "show", "--property=Id,LoadState,ActiveState,Environment", "harl", "harl-updater"}, quick);
        mServicesKnown = services.succeeded();
        std::map<std::string, std::string> properties;
        for (const std::string& line : linesOf(services.output + '\n')) {
            const std::size_t equals = line.find('=');
            if (equals != std::string::npos) {
                properties[line.substr(0, equals)] = line.substr(equals + 1);
                continue;
            }
            mServices[properties["Id"]] = properties;
            properties.clear();
        }
        mServices[properties["Id"]] = properties;
        std::istringstream own(property("harl-updater", "Environment"));
        takeVariables({std::istream_iterator<std::string>(own), {}});
    }

    /// Runs `arguments` with the service's search path and locale.
    CommandResult run(const std::vector<std::string>& arguments, std::chrono::milliseconds limit) const
    {
        std::vector<std::string> environment = {"RES_OPTIONS=timeout:1 attempts:2"}; // resolv.conf(5)
        for (const auto& [name, value] : mEnvironment) {
            environment.push_back(name + '=' + value);
        }
        return runCommand(arguments, environment, limit);
    }

    std::string program(const std::string& name) const { return findProgram(name, mEnvironment.at("PATH")); }
    std::string searchPath() const { return mEnvironment.at("PATH"); }
    std::string path(const std::string& absolute) const { return mSite.root + absolute; }
    bool servicesKnown() const { return mServicesKnown; }

    /// The locale's variables of the service, for a message.
    std::string locale() const
    {
        std::string result;
        for (const auto& [name, value] : mEnvironment) {
            if (name != "PATH") {
                result += (result.empty() ? "" : " ") + name + '=' + value;
            }
        }
        return result;
    }

    std::string property(const std::string& service, const std::string& name) const
    {
        const auto properties = mServices.find(service + ".service");
        if (properties == mServices.end()) {
            return "";
        }
        const auto value = properties->second.find(name);
        return value == properties->second.end() ? "" : value->second;
    }

    /// True when the updater runs, as its service or started by hand.
    bool updaterRuns() const
    {
        const std::string state = property("harl-updater", "ActiveState");
        if (!state.empty() && state != "inactive" && state != "failed") {
            return true;
        }
        std::error_code error;
        for (const auto& process : std::filesystem::directory_iterator(path("/proc"), error)) {
            std::ifstream file(process.path() / "comm");
            std::string name;
            if (std::getline(file, name) && name == "harl-updater") {
                return true;
            }
        }
        return false;
    }

private:
    /// Takes over the search path and the locale from NAME=value texts.
    void takeVariables(const std::vector<std::string>& texts)
    {
        for (const std::string& text : texts) {
            const std::size_t equals = text.find('=');
            const std::string name = text.substr(0, equals);
            if (equals != std::string::npos &&
                (name == "PATH" || name == "LANG" || name == "LANGUAGE" || name.rfind("LC_", 0) == 0)) {
                mEnvironment[name] = text.substr(equals + 1);
            }
        }
    }

    const UnitSite& mSite;
    std::map<std::string, std::string> mEnvironment;
    std::map<std::string, std::map<std::string, std::string>> mServices;
    bool mServicesKnown = false;
};

/// The unit check: each operation adds to the report what it finds.
class UnitCheck
{
public:
    UnitCheck(const Unit& unit, Report& report) : mUnit(unit), mReport(report) {}

    void run()
    {
        mUpdaterRuns = mUnit.updaterRuns();
        if (mUpdaterRuns) {
            add(Severity::WARNING, "updater-runs", "The updater is running.", "goes on undisturbed.",
                "Check again when it has ended: what it holds or changes shows up here as a fault.");
        }
        if (geteuid() != 0) {
            add(Severity::UNCHECKED, "not-root", "This check does not run as root.",
                "runs as root, with root's keys and rights.", "Run it as root.");
        }
        checkServices();
        checkTools();
        checkPanel();
        checkSound();
        checkBoard();
        checkLocks();
        checkPackages();
        checkPolicy();
        checkSpace();
        checkMirrors();
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
        const auto check = [&](const std::string& service, const std::string& effect) {
            const std::string state = mUnit.property(service, "LoadState");
            if (state != "loaded") {
                add(Severity::ERROR, "service-not-loaded",
                    "The service " + shown(service) + " cannot be used: " + shown(state.empty() ? "not-found" : state) +
                        '.',
                    effect, "Install its unit file: systemctl status " + service);
            }
            mReport.addFact("service_" + std::string(service == "harl" ? "harl" : "harl_updater"), "Service " + service,
                            escaped(mUnit.property(service, "ActiveState")));
        };
        check("harl",
              "can neither stop the application before the update nor start it afterwards (status 1280 in the log).");
        check("harl-updater", "is not started as a service, and its last command fails (status 1280 in the log).");
    }

    void checkTools()
    {
        static const std::array<std::pair<const char*, const char*>, 10> tools = {{
            {"systemctl", "cannot stop and start the application."},
            {"umount", "cannot release the stick."},
            {"rm", "cannot remove the first-boot marker."},
            {"ls", "finds no version on the stick and leaves the board as it is."},
            {"apt", "ends at once: the mirrors cannot be refreshed, the fail pattern is shown."},
            {"apt-cache", "finds no versions and shows the fail pattern."},
            {"ssh", "cannot ask the board for its version and leaves it as it is."},
            {"scp", "cannot upload the board's files: 20 attempts, then the fail pattern."},
            {"i2cset", "cannot light the panel: the operator sees nothing."},
            {"aplay", "plays no sound."},
        }};
        for (const auto& [name, effect] : tools) {
            if (mUnit.program(name).empty()) {
                add(Severity::ERROR, "tool-missing",
                    std::string("The command ") + shown(name) + " is not on the service's search path " +
                        shown(mUnit.searchPath()) + '.',
                    std::string(effect) + " The log shows status 32512 (command not found).",
                    "Install it, or set PATH in the service's unit file.");
            }
        }
        mReport.addFact("search_path", "Search path", escaped(mUnit.searchPath()));
    }

    void checkPanel()
    {
        if (mUnit.program("i2cset").empty()) {
            return; // reported with the tools
        }
        // A register number out of range: i2cset(8) judges the chip address before it and opens no bus.
        const CommandResult address = mUnit.run({"i2cset", "-y", "0", "0x07", "0x100", "c"}, quick);
        if (contains(address.errors, "hip address")) {
            add(Severity::ERROR, "panel-address-refused",
                shown(mUnit.program("i2cset")) +
                    " refuses the panel's address 0x07: " + complaintLine(address, "hip address") + '.',
                darkPanel,
                "i2c-tools since 4.2 needs the option -a. Put a command i2cset that adds it before it on the service's "
                "search path, or install an older i2c-tools.");
        } else if (!contains(address.errors, "ata address")) {
            add(Severity::UNCHECKED, "panel-address-unknown",
                shown(mUnit.program("i2cset")) +
                    " does not tell whether it takes the panel's address 0x07: " + complaint(address) + '.',
                "lights the panel with it.", "Run the lamp test: harl-updater-tool unit --panel");
        }
        if (!std::filesystem::exists(mUnit.path("/dev/i2c-0"))) {
            add(Severity::ERROR, "panel-bus-missing", "There is no bus device \"/dev/i2c-0\".", darkPanel,
                "Load the kernel's driver: modprobe i2c-dev");
            return;
        }
        if (mUpdaterRuns) {
            return; // a read could come between the two bytes of a LED's command
        }
        const CommandResult answer = mUnit.run({"i2cdetect", "-y", "-a", "-r", "0", "0x07", "0x07"}, quick);
        const std::string row = valueAfter(answer.output, "00:").value_or("");
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

    /// The line of a command's standard error that holds `text`, quoted.
    static std::string complaintLine(const CommandResult& result, const std::string& text)
    {
        for (const std::string& line : linesOf(result.errors)) {
            if (contains(line, text)) {
                return shown(line);
            }
        }
        return complaint(result);
    }

    void checkSound()
    {
        for (const char* sound : {passSound, failSound}) {
            std::ifstream file(mUnit.path(sound), std::ios::binary);
            std::error_code error;
            const std::uintmax_t size = std::filesystem::file_size(mUnit.path(sound), error);
            std::string start(64 * 1024, '\0');
            file.read(start.data(), static_cast<std::streamsize>(start.size()));
            start.resize(static_cast<std::size_t>(file.gcount()));
            const std::string fault = error ? "it cannot be read: " + error.message() : waveFault(start, size);
            if (!fault.empty()) {
                add(Severity::WARNING, "sound-file", "The sound " + shown(sound) + " cannot be played: " + fault + '.',
                    "plays nothing or a noise in its place; the panel shows the outcome all the same.",
                    "Install the sound file again.");
            }
        }
        const CommandResult devices = mUnit.run({"aplay", "-l"}, quick);
        if (devices.started && !contains(devices.output, "card ")) {
            add(Severity::WARNING, "sound-device", "There is no sound device: " + complaint(devices) + '.',
                "plays no sound (log: \"Failed to play a sound\"); the panel shows the outcome all the same.",
                "Check the sound driver: aplay -l");
        }
    }

    void checkBoard()
    {
        // The updater's own command, which asks nobody here and learns no new host key.
        const CommandResult version =
            mUnit.run({"ssh", "-o", "BatchMode=yes", "-o", "StrictHostKeyChecking=yes", "-o", "UpdateHostKeys=no", "-o",
                       "ServerAliveInterval=4", "-o", "ServerAliveCountMax=10", "-o", "ConnectTimeout=2", "-o",
                       "TCPKeepAlive=yes", "192.168.9.2", " cat /root/App/AppExe/version.txt | grep 'Brimvale'"},
                      boardLimit);
        if (!version.started) {
            return; // reported with the tools
        }
        if (contains(version.errors, "HOST IDENTIFICATION HAS CHANGED")) {
            add(Severity::ERROR, "board-host-key", "The board's host key is not the one that is known.", boardNotRead,
                "When the board was replaced: ssh-keygen -R 192.168.9.2, then log in once by hand: ssh 192.168.9.2");
        } else if (contains(version.errors, "Host key verification failed")) {
            add(Severity::ERROR, "board-host-key", "The board's host key is not known.", boardNotRead,
                "Log in once by hand and accept the key: ssh 192.168.9.2");
        } else if (contains(version.errors, "Permission denied")) {
            add(Severity::ERROR, "board-login", "The board refuses a login without a password.", boardNotRead,
                "Install root's public key on the board: ssh-copy-id 192.168.9.2");
        } else if (version.timedOut || version.exitCode == 255) {
            add(Severity::ERROR, "board-unreachable",
                "The board at 192.168.9.2 cannot be reached: " + complaint(version) + '.', boardNotRead,
                "Check the board's supply and link: ping 192.168.9.2");
        } else if (const auto text = valueAfter(version.output, "Brimvale\t"); !version.succeeded() || !text) {
            add(Severity::ERROR, "board-version",
                "The board's version file holds no line with \"Brimvale\", a tab and a version: " +
                    (version.output.empty() ? complaint(version) : shown(version.output)) + '.',
                boardNotRead, "Look at it: ssh 192.168.9.2 cat /root/App/AppExe/version.txt");
        } else {
            const std::string installed = text->substr(0, text->find('\r'));
            mReport.addFact("board_version", "Board's version", shown(installed), escaped(installed));
        }
    }

    void checkLocks()
    {
        static const std::array<std::pair<const char*, const char*>, 4> locks = {{
            {"/var/lib/apt/lists/lock", "cannot refresh the mirrors: it ends at once with the fail pattern."},
            {"/var/lib/dpkg/lock-frontend", "waits with its installation until the other one has ended."},
            {"/var/lib/dpkg/lock", "waits with its installation until the other one has ended."},
            {"/var/cache/apt/archives/lock", "cannot install the package: the fail pattern is shown."},
        }};
        for (const auto& [path, effect] : locks) {
            const Descriptor file(open(mUnit.path(path).c_str(), O_RDONLY | O_CLOEXEC));
            if (!file) {
                if (errno != ENOENT) {
                    add(Severity::UNCHECKED, "package-lock", shown(path) + " cannot be read: " + errorText(errno) + '.',
                        effect, "Run this check as root.");
                }
                continue;
            }
            struct flock lock = {};
            lock.l_type = F_WRLCK;
            lock.l_whence = SEEK_SET;
            if (fcntl(file.number(), F_GETLK, &lock) == 0 && lock.l_type != F_UNLCK) {
                add(Severity::ERROR, "package-lock",
                    "Process " + std::to_string(lock.l_pid) + " holds the package manager's lock " + shown(path) + '.',
                    effect, "Wait until it has ended: ps " + std::to_string(lock.l_pid));
            }
        }
    }

    void checkPackages()
    {
        const CommandResult packages =
            mUnit.run({"dpkg-query", "--show", "--showformat=${db:Status-Abbrev}\\t${binary:Package}\\n"}, quick);
        if (!packages.succeeded()) {
            add(Severity::UNCHECKED, "packages-unknown",
                "The installed packages cannot be listed: " + complaint(packages) + '.', "installs the head's package.",
                "Run this check on the unit.");
            return;
        }
        std::string pending;
        for (const std::string& line : linesOf(packages.output)) {
            // The second letter is the state: not installed, configuration files, installed; the third is an error
            // flag.
            const bool settled = line.size() > 3 && std::strchr("nci", line[1]) != nullptr && line[2] == ' ';
            if (!settled) {
                pending += (pending.empty() ? "" : ", ") +
                           shown(line.substr(std::min<std::size_t>(line.find('\t'), line.size() - 1) + 1));
            }
        }
        std::error_code error;
        for (const auto& entry : std::filesystem::directory_iterator(mUnit.path("/var/lib/dpkg/updates"), error)) {
            const std::string name = entry.path().filename();
            if (name.find_first_not_of("0123456789") == std::string::npos) {
                pending += pending.empty() ? "an interrupted run" : " and an interrupted run";
                break;
            }
        }
        if (!pending.empty()) {
            add(Severity::ERROR, "package-half-configured", "The package manager has unfinished work: " + pending + '.',
                "may see the version as installed that never got configured, and then finds nothing to update; or its "
                "installation fails.",
                "Finish it: dpkg --configure -a");
        }
    }

    void checkPolicy()
    {
        const CommandResult policy = mUnit.run({"apt-cache", "policy", "solvik4-rh", "apt"}, quick);
        if (!policy.started) {
            return; // reported with the tools
        }
        const std::string locale = mUnit.locale();
        if (!locale.empty()) {
            mReport.addFact("locale", "Locale", escaped(locale));
        }
        const bool words = contains(policy.output, "Installed: ") && contains(policy.output, "Candidate: ");
        if (!policy.output.empty() && !words) {
            add(Severity::ERROR, "policy-words",
                "apt-cache does not print \"Installed: \" and \"Candidate: \" under the service's locale " +
                    shown(locale) + '.',
                "finds no versions (log: \"NWM_UM_CHECK_UPDATE_FAILED\") and shows the fail pattern.",
                "Set LC_ALL=C in the service's unit file.");
            return;
        }
        const std::size_t own = policy.output.find("solvik4-rh:\n");
        if (own == std::string::npos) {
            add(policy.output.empty() ? Severity::UNCHECKED : Severity::WARNING, "package-unknown",
                "The package manager does not know the package \"solvik4-rh\" before its mirrors are refreshed.",
                "shows the fail pattern (log: \"NWM_UM_CHECK_UPDATE_FAILED\") unless the mirrors bring it.",
                "Check the sources: apt-cache policy solvik4-rh");
            return;
        }
        const std::string block = policy.output.substr(own, policy.output.find("\napt:", own) - own);
        const std::string installed = valueAfter(block, "Installed: ").value_or("");
        const std::string candidate = valueAfter(block, "Candidate: ").value_or("");
        mReport.addFact("package_installed", "Package installed", shown(installed), escaped(installed));
        mReport.addFact("package_candidate", "Package offered", shown(candidate) + " as of the last refresh",
                        escaped(candidate));
    }

    /// A size field of the package's record, 0 when unknown.
    static std::uint64_t sizeField(const std::string& record, const std::string& name)
    {
        for (const std::string& line : linesOf(record)) {
            if (line.rfind(name + ": ", 0) == 0) {
                return std::strtoull(line.c_str() + name.size() + 2, nullptr, 10);
            }
        }
        return 0;
    }

    void checkSpace()
    {
        const CommandResult record = mUnit.run({"apt-cache", "show", "--no-all-versions", "solvik4-rh"}, quick);
        const std::uint64_t needed =
            sizeField(record.output, "Size") + sizeField(record.output, "Installed-Size") * 1024; // bytes and KiB
        struct statvfs system = {};
        if (statvfs(mUnit.path("/").c_str(), &system) != 0) {
            add(Severity::UNCHECKED, "space-unknown", "The free space cannot be read: " + errorText(errno) + '.',
                "installs the package there.", "Check it: df /");
            return;
        }
        const std::uint64_t available = std::uint64_t{system.f_bavail} * system.f_frsize;
        mReport.addFact("free_bytes", "Free space", byteCount(available), available);
        if (needed > 0) {
            mReport.addFact("needed_bytes", "Package needs", byteCount(needed) + " without what it depends on", needed);
        }
        if ((system.f_flag & ST_RDONLY) != 0) {
            add(Severity::ERROR, "disk-read-only", "The unit's disk is mounted read-only.",
                "cannot refresh the mirrors nor install anything; the fail pattern is shown.",
                "Look for the reason in the kernel's log: dmesg");
        } else if (available < needed || (system.f_files > 0 && system.f_favail == 0)) {
            add(Severity::ERROR, "disk-full", "The package needs more space than is free.",
                "cannot install the package; the fail pattern is shown, and the package may be left half-installed.",
                "Free some: apt-get clean");
        } else if (available < littleSpace) {
            add(Severity::WARNING, "disk-almost-full", "Little space is free: " + byteCount(available) + '.',
                "may not be able to install what the package depends on.", "Free some: apt-get clean");
        }
    }

    void checkMirrors()
    {
        const CommandResult list = mUnit.run({"apt-get", "update", "--print-uris"}, quick);
        std::vector<std::string> indexes;
        for (const std::string& line : linesOf(list.output)) {
            const std::string address = line.substr(std::min<std::size_t>(1, line.size()), line.find('\'', 1) - 1);
            if (!line.empty() && line.front() == '\'' && indexes.size() < mostMirrors) {
                indexes.push_back(address);
            }
        }
        mReport.addFact("mirrors", "Mirrors", std::to_string(indexes.size()), indexes.size());
        if (!list.started) {
            return; // as missing as apt, which is reported with the tools
        }
        if (indexes.empty()) {
            add(Severity::ERROR, "mirrors-none",
                "The package manager has no sources" +
                    (list.succeeded() ? std::string(".") : ": " + complaint(list) + '.'),
                "refreshes nothing and never finds an update.", "Enter the maker's source in /etc/apt/sources.list.d.");
            return;
        }
        fetchIndexes(indexes);
    }

    /// Fetches the sources' index files with the package manager's own fetcher, proxies and certificates.
    void fetchIndexes(const std::vector<std::string>& indexes)
    {
        std::string folder = std::filesystem::temp_directory_path() / "harl-updater-tool-XXXXXX";
        if (mkdtemp(folder.data()) == nullptr) {
            add(Severity::UNCHECKED, "mirrors-unknown", "No temporary folder can be made: " + errorText(errno) + '.',
                "refreshes the mirrors.", "Check the space in /tmp: df /tmp");
            return;
        }
        std::vector<std::string> arguments = {mUnit.path("/usr/lib/apt/apt-helper"),
                                              "-o",
                                              "APT::Sandbox::User=root",
                                              "-o",
                                              "Acquire::Retries=0",
                                              "-o",
                                              "Acquire::http::Timeout=2",
                                              "-o",
                                              "Acquire::https::Timeout=2",
                                              "download-file"};
        for (std::size_t number = 0; number < indexes.size(); ++number) {
            arguments.insert(arguments.end(), {indexes[number], folder + '/' + std::to_string(number), ""});
        }
        const CommandResult fetch = mUnit.run(arguments, mirrorLimit);
        for (std::size_t number = 0; number < indexes.size(); ++number) {
            if (!std::filesystem::exists(folder + '/' + std::to_string(number))) {
                reportMirror(indexes[number], fetch);
            }
        }
        std::error_code error;
        std::filesystem::remove_all(folder, error);
    }

    void reportMirror(const std::string& address, const CommandResult& fetch)
    {
        if (!fetch.started) {
            add(Severity::UNCHECKED, "mirrors-unknown", "The package manager's fetcher apt-helper cannot be started.",
                "refreshes the mirrors.", "Run this check on the unit.");
            return;
        }
        std::string reason = valueAfter(fetch.errors, "Failed to fetch " + address + ' ').value_or("");
        reason.erase(0, reason.find_first_not_of(' '));
        if (contains(reason, "404") || contains(reason, "not found") || contains(reason, "Not Found")) {
            add(Severity::WARNING, "mirror-index",
                "The mirror answers, but has no " + shown(address) + ": " + shown(reason) + '.',
                "may fail to refresh (log: \"NO_INTERNET_ERROR_CODE\") although the connection is fine.",
                "Check the release's name in the source.");
            return;
        }
        add(Severity::ERROR, "mirror-silent",
            "The mirror of " + shown(address) +
                " does not answer: " + (reason.empty() ? complaint(fetch) : shown(reason)) + '.',
            "does not notice: \"apt update\" ends with 0 when a name is not resolved or a connection refused, and with 100 "
            "for other faults. After a 0 the log says \"OK\", and the comparison uses the list of the last refresh: "
            "\"nothing to update\" then only means that nothing newer was known.",
            "Check the unit's network: getent hosts, ping.");
    }

    const Unit& mUnit;
    Report& mReport;
    bool mUpdaterRuns = false;
};

/// Shows every LED of the panel in every colour, then darkens the panel. The commands that failed.
nlohmann::ordered_json testPanel(const Unit& unit, const UnitSite& site, bool json, std::ostream& out)
{
    const std::array<std::pair<LedManager::Color, const char*>, 4> colors = {{
        {LedManager::COLOR_BLUE, "blue"},
        {LedManager::COLOR_PASS, "in the pass colour"},
        {LedManager::COLOR_FAIL, "in the fail colour"},
        {LedManager::COLOR_OFF, "dark"},
    }};
    const auto send = [&](int value) {
        std::ostringstream byte;
        byte << "0x" << std::hex << value;
        return unit.run({"i2cset", "-y", "0", "0x07", byte.str(), "c"}, quick);
    };
    int leds = 0;
    int failed = 0;
    std::string reason;
    for (const auto& [color, name] : colors) {
        leds = 0;
        for (int led = LedManager::LED_FIRST; led <= LedManager::LED_LAST; ++led, ++leds) {
            for (const int value : {led, static_cast<int>(color)}) {
                const CommandResult result = send(value);
                if (!result.succeeded()) {
                    ++failed;
                    reason = complaint(result);
                }
            }
        }
        if (!json) {
            out << "All " << leds << " LEDs must be " << name << " now." << std::endl;
        }
        if (color != LedManager::COLOR_OFF) {
            site.pause(2);
        }
    }
    return {{"leds", leds}, {"failed_commands", failed}, {"reason", reason}};
}

/// Plays both sounds to their end. The ones that failed.
nlohmann::ordered_json testSound(const Unit& unit, bool json, std::ostream& out)
{
    int failed = 0;
    std::string reason;
    for (const auto& [sound, name] : {std::pair(passSound, "pass"), std::pair(failSound, "fail")}) {
        if (!json) {
            out << "The " << name << " sound must be heard now." << std::endl;
        }
        const CommandResult result = unit.run({"aplay", sound}, soundLimit);
        if (!result.succeeded()) {
            ++failed;
            reason = complaint(result);
        }
    }
    return {{"sounds", 2}, {"failed_commands", failed}, {"reason", reason}};
}

} // namespace

UnitSite thisUnit()
{
    return {"", defaultSearchPath, [](int seconds) { std::this_thread::sleep_for(std::chrono::seconds(seconds)); }};
}

int runUnit(const UnitOptions& options, const UnitSite& site, std::ostream& out, std::ostream& errors)
{
    const Unit unit(site);
    if (!options.panel && !options.sound) {
        Report report("unit", "The unit");
        UnitCheck(unit, report).run();
        report.write(options.json, out);
        return report.status();
    }

    if (unit.updaterRuns()) {
        errors << "harl-updater-tool: the updater is running and uses panel and sound itself. Run the test when it has "
                  "ended.\n";
        return Report::STATUS_UNCHECKED;
    }
    nlohmann::ordered_json result = {{"command", "unit"}};
    int failed = 0;
    const auto take = [&](const char* name, const nlohmann::ordered_json& test) {
        result[name] = test;
        const int count = test["failed_commands"];
        failed += count;
        if (count > 0) {
            errors << "harl-updater-tool: " << counted(static_cast<std::uint64_t>(count), "command") << " of the "
                   << name << " test failed: " << test["reason"].get<std::string>() << '\n';
        }
    };
    if (options.panel) {
        take("panel", testPanel(unit, site, options.json, out));
    }
    if (options.sound) {
        take("sound", testSound(unit, options.json, out));
    }
    if (options.json) {
        out << result.dump(2) << '\n';
    }
    return failed > 0 ? Report::STATUS_NOT_FIT : Report::STATUS_FIT;
}
