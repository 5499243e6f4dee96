#include "unit/environment.h"

#include "findings.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>
#include <sstream>
#include <system_error>
#include <thread>

#include <unistd.h>

static const char defaultSearchPath[] =
    "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin"; // systemd.exec(5)
static const auto patience = 2s;                                    // before a word on what is waited for

UnitSite thisUnit()
{
    return {"", defaultSearchPath, geteuid() == 0,
            [](int seconds) { std::this_thread::sleep_for(std::chrono::seconds(seconds)); },
            isatty(STDERR_FILENO) == 1 ? &std::cerr : nullptr};
}

Unit::Unit(const UnitSite& site) : mSite(site)
{
    mEnvironment["PATH"] = site.searchPath;
    const CommandResult services =
        run({"systemctl", "show", "--property=Id,LoadState,ActiveState,Environment,NeedDaemonReload", "harl",
             "harl-updater"},
            quick);
    mServicesKnown = services.succeeded();
    takeServices(services.output);
    // A service has the manager's variables and, over them, its own.
    takeVariables(linesOf(run({"systemctl", "show-environment"}, quick).output));
    std::istringstream own(property("harl-updater", "Environment"));
    takeVariables({std::istream_iterator<std::string>(own), {}});
    mMainHead = isInstalled(packageOf(true)) && !isInstalled(packageOf(false));
}

CommandResult Unit::run(const std::vector<std::string>& arguments, std::chrono::milliseconds limit,
                        const std::function<bool(std::chrono::milliseconds)>& goesOn) const
{
    std::vector<std::string> environment = {"RES_OPTIONS=timeout:1 attempts:2"}; // resolv.conf(5)
    for (const auto& [name, value] : mEnvironment) {
        environment.push_back(std::string(name).append("=").append(value));
    }
    bool told = mSite.waits == nullptr;
    return runCommand(arguments, environment, limit, [&](std::chrono::milliseconds time) {
        if (!told && time > patience) {
            const auto most = std::chrono::duration_cast<std::chrono::seconds>(limit).count();
            *mSite.waits << "harl-updater-tool: waiting for " << arguments.front() << ", " << most << " s at most\n";
            told = true;
        }
        return !goesOn || goesOn(time);
    });
}

std::string Unit::locale() const
{
    std::string result;
    for (const auto& [name, value] : mEnvironment) {
        if (name != "PATH") {
            result.append(result.empty() ? "" : " ").append(name).append("=").append(value);
        }
    }
    return result;
}

void Unit::defineTexts(Report& report) const
{
    const char* const notRead = mMainHead ? "board-not-read-main" : "board-not-read-remote";
    report.define({{"failure", failure()},
                   {"package", shown(package())},
                   {"package-name", package()},
                   {"board-not-read", sharedText(notRead, {{"failure", failure()}})},
                   {"without-version", mMainHead ? "installs nothing" : "leaves the board as it is"}});
}

std::string Unit::property(const std::string& service, const std::string& name) const
{
    const auto value = mProperties.find({service + ".service", name});
    return value == mProperties.end() ? "" : value->second;
}

std::string Unit::journal() const
{
    std::vector<std::string> command = journalCommand;
    command.emplace_back("--lines=1000");
    return run(command, quick).output;
}

bool Unit::updaterRuns() const
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

/// Takes over the search path and the locale from NAME=value texts.
void Unit::takeVariables(const std::vector<std::string>& texts)
{
    for (const std::string& text : texts) {
        const std::size_t equals = text.find('=');
        const std::string name = text.substr(0, equals);
        if (equals != std::string::npos &&
            (name == "PATH" || name == "LANG" || name == "LANGUAGE" || startsWith(name, "LC_"))) {
            mEnvironment[name] = text.substr(equals + 1);
        }
    }
}

/// Takes the services' properties: a NAME=value line each, with an empty line between two services.
void Unit::takeServices(const std::string& output)
{
    std::map<std::string, std::string> properties;
    for (const std::string& line : linesOf(output + "\n\n")) {
        const std::size_t equals = line.find('=');
        if (equals != std::string::npos) {
            properties[line.substr(0, equals)] = line.substr(equals + 1);
        } else if (!properties.empty()) {
            const std::string service = properties["Id"];
            for (const auto& [name, value] : properties) {
                mProperties[{service, name}] = value;
            }
            properties.clear();
        }
    }
}

/// True when anything but configuration files is there of the package, configured or not.
bool Unit::isInstalled(const std::string& package) const
{
    const std::string state = run({"dpkg-query", "--show", "--showformat=${db:Status-Status}", package}, quick).output;
    return !state.empty() && state != "not-installed" && state != "config-files";
}

TemporaryFolder::TemporaryFolder(const Unit& unit) : mPath(unit.path("/tmp/harl-updater-tool-XXXXXX"))
{
    if (mkdtemp(mPath.data()) == nullptr) {
        mPath.clear();
    }
}

TemporaryFolder::~TemporaryFolder()
{
    std::error_code error;
    std::filesystem::remove_all(mPath, error);
}

std::string valueAfter(const std::string& text, const std::string& key)
{
    std::string value;
    for (const std::string& line : linesOf(text)) {
        if (const std::size_t position = line.find(key); position != std::string::npos) {
            value = line.substr(position + key.size());
        }
    }
    return value;
}

std::string complaint(const CommandResult& result)
{
    if (!result.started) {
        return "the command could not be started";
    }
    if (result.timedOut) {
        return "the command did not end in time";
    }
    std::string last;
    std::string error; // i2cset(8) explains its usage behind it
    for (const std::string& line : linesOf(result.errors)) {
        const std::string text = line.substr(0, line.find('\r')); // ssh(1) ends its lines so
        last = text.empty() ? last : text;
        error = startsWith(text, "Error: ") ? text : error;
    }
    if (!last.empty()) {
        return shown(error.empty() ? last : error);
    }
    return result.exitCode < 0 ? "a signal ended the command"
                               : "the command ended with status " + std::to_string(result.exitCode);
}
