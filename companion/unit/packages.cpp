#include "unit/packages.h"

#include "descriptor.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <system_error>
#include <utility>

#include <fcntl.h>

namespace
{

const auto mirrorLimit = 15s; // for all mirrors together
const std::size_t mostMirrors = 32;
const std::uint64_t littleSpace = 100'000'000; // bytes

void checkLocks(const Unit& unit, Report& report)
{
    const std::string waits = "waits with its installation until the other one has ended.";
    const std::pair<const char*, std::string> locks[] = {
        {"/var/lib/apt/lists/lock",
         "cannot refresh the mirrors (log: \"NO_INTERNET_ERROR_CODE\") and " + unit.failure() + '.'},
        {"/var/lib/dpkg/lock-frontend", waits},
        {"/var/lib/dpkg/lock", waits},
        {"/var/cache/apt/archives/lock", "cannot install the package and " + unit.failure() + '.'},
    };
    for (const auto& [path, effect] : locks) {
        const Descriptor file(open(unit.path(path).c_str(), O_RDONLY | O_CLOEXEC));
        if (!file) {
            if (errno != ENOENT) {
                report.add({Severity::UNCHECKED, "package-lock",
                            shown(path) + " cannot be read: " + errorText(errno) + '.', effect,
                            "Run this check as root."});
            }
            continue;
        }
        struct flock lock = {};
        lock.l_type = F_WRLCK;
        lock.l_whence = SEEK_SET;
        if (fcntl(file.number(), F_GETLK, &lock) == 0 && lock.l_type != F_UNLCK) {
            report.add(
                {Severity::ERROR, "package-lock",
                 "Process " + std::to_string(lock.l_pid) + " holds the package manager's lock " + shown(path) + '.',
                 effect, "Wait until it has ended: ps " + std::to_string(lock.l_pid)});
        }
    }
}

/// True when a run of dpkg(1) was interrupted: it keeps what is to be done in files named by numbers.
bool dpkgWasInterrupted(const Unit& unit)
{
    std::error_code error;
    const std::filesystem::directory_iterator files(unit.path("/var/lib/dpkg/updates"), error);
    return std::any_of(begin(files), end(files), [](const auto& file) {
        return file.path().filename().string().find_first_not_of("0123456789") == std::string::npos;
    });
}

/// Checks both versions as the updater will see them, in the words that the service's locale gives.
void checkPolicy(const Unit& unit, Report& report)
{
    const CommandResult policy = unit.run({"apt-cache", "policy", unit.package(), "apt"}, quick);
    if (!policy.started) {
        return; // reported with the tools
    }
    const std::string locale = unit.locale();
    if (!locale.empty()) {
        report.addFact("locale", "Locale", escaped(locale));
    }
    const std::string& text = policy.output;
    if (!text.empty() && !(contains(text, "Installed: ") && contains(text, "Candidate: "))) {
        report.add({Severity::ERROR, "policy-words",
                    "apt-cache does not print \"Installed: \" and \"Candidate: \" under the service's locale " +
                        shown(locale) + '.',
                    "finds no versions (log: \"NWM_UM_CHECK_UPDATE_FAILED\") and " + unit.failure() + '.',
                    "Set LC_ALL=C in the service's unit file."});
        return;
    }
    const std::size_t own = text.find(unit.package() + ":\n");
    if (own == std::string::npos) {
        report.add({text.empty() ? Severity::UNCHECKED : Severity::WARNING, "package-unknown",
                    "The package manager does not know the package " + shown(unit.package()) +
                        " before its mirrors are refreshed.",
                    unit.failure() + " (log: \"NWM_UM_CHECK_UPDATE_FAILED\") unless the mirrors bring it.",
                    "Check the sources: apt-cache policy solvik4-rh, on a main head solvik4-dh"});
        return;
    }
    const std::string block = text.substr(own, text.find("\napt:", own) - own);
    const std::string installed = valueAfter(block, "Installed: ");
    const std::string candidate = valueAfter(block, "Candidate: ");
    report.addFact("package_installed", "Package installed", shown(installed), escaped(installed));
    report.addFact("package_candidate", "Package offered", shown(candidate) + " as of the last refresh",
                   escaped(candidate));
    if (candidate == "(none)") {
        report.add({Severity::WARNING, "package-not-offered",
                    "No source offers the package " + shown(unit.package()) + '.',
                    "compares \"(none)\" with the installed version like any other text unless the mirrors bring the "
                    "package: equal means nothing to update, different an installation that fails.",
                    "Check the sources: apt-cache policy " + unit.package()});
    }
}

/// A number field of the package's record, 0 when it has none.
std::uint64_t numberField(const std::string& record, const std::string& name)
{
    for (const std::string& line : linesOf(record)) {
        if (line.rfind(name + ": ", 0) == 0) {
            return std::strtoull(line.c_str() + name.size() + 2, nullptr, 10);
        }
    }
    return 0;
}

void checkSpace(const Unit& unit, Report& report)
{
    const CommandResult record = unit.run({"apt-cache", "show", "--no-all-versions", unit.package()}, quick);
    const std::uint64_t needed = numberField(record.output, "Size") + // bytes
                                 numberField(record.output, "Installed-Size") * 1024;
    struct statvfs system = {};
    if (statvfs(unit.path("/").c_str(), &system) != 0) {
        report.add({Severity::UNCHECKED, "space-unknown", "The free space cannot be read: " + errorText(errno) + '.',
                    "installs the package there.", "Check it: df /"});
        return;
    }
    checkFreeSpace(system, needed, report);
}

void reportMirror(const std::string& address, const CommandResult& fetch, Report& report)
{
    std::string reason = valueAfter(fetch.errors, "Failed to fetch " + address + ' ');
    reason.erase(0, reason.find_first_not_of(' '));
    if (contains(reason, "404") || contains(reason, "not found") || contains(reason, "Not Found")) {
        report.add({Severity::WARNING, "mirror-index",
                    "The mirror answers, but has no " + shown(address) + ": " + shown(reason) + '.',
                    "may fail to refresh (log: \"NO_INTERNET_ERROR_CODE\") although the connection is fine.",
                    "Check the release's name in the source."});
        return;
    }
    report.add(
        {Severity::ERROR, "mirror-silent",
         "The mirror of " + shown(address) +
             " does not answer: " + (reason.empty() ? complaint(fetch) : shown(reason)) + '.',
         "does not notice: \"apt update\" ends with 0 when a name is not resolved or a connection refused, and "
         "with 100 for other faults. After a 0 the log says \"OK\", and the comparison uses the list of the last "
         "refresh: \"nothing to update\" then only means that nothing newer was known.",
         "Check the unit's network: getent hosts, ping."});
}

/// Fetches the sources' index files with the package manager's own fetcher, proxies and certificates.
void fetchIndexes(const std::vector<std::string>& indexes, const Unit& unit, Report& report)
{
    const HeldSignals signals; // until the folder is gone
    std::string folder = unit.path("/tmp/harl-updater-tool-XXXXXX");
    if (mkdtemp(folder.data()) == nullptr) {
        report.add({Severity::UNCHECKED, "mirrors-unknown",
                    "No temporary folder can be made: " + errorText(errno) + '.', "refreshes the mirrors.",
                    "Check the space in /tmp: df /tmp"});
        return;
    }
    std::vector<std::string> arguments = {unit.path("/usr/lib/apt/apt-helper"), "-o", "APT::Sandbox::User=root"};
    for (const char* option : {"Acquire::Retries=0", "Acquire::http::Timeout=2", "Acquire::https::Timeout=2"}) {
        arguments.insert(arguments.end(), {"-o", option});
    }
    arguments.push_back("download-file");
    const auto target = [&](std::size_t number) { return folder + '/' + std::to_string(number); };
    for (std::size_t number = 0; number < indexes.size(); ++number) {
        arguments.insert(arguments.end(), {indexes[number], target(number), ""}); // no checksum is known
    }
    const CommandResult fetch = unit.run(arguments, mirrorLimit);
    for (std::size_t number = 0; fetch.started && number < indexes.size(); ++number) {
        if (!std::filesystem::exists(target(number))) {
            reportMirror(indexes[number], fetch, report);
        }
    }
    if (!fetch.started) {
        report.add({Severity::UNCHECKED, "mirrors-unknown",
                    "The package manager's fetcher apt-helper cannot be started.", "refreshes the mirrors.",
                    "Run this check on the unit."});
    }
    std::error_code error;
    std::filesystem::remove_all(folder, error);
}

void checkMirrors(const Unit& unit, Report& report)
{
    const CommandResult list = unit.run({"apt-get", "update", "--print-uris"}, quick);
    if (!list.succeeded()) {
        report.add(
            {list.started ? Severity::ERROR : Severity::UNCHECKED, "mirrors-unreadable",
             "The package manager cannot tell its sources: " + complaint(list) + '.',
             "cannot refresh the mirrors (log: \"NO_INTERNET_ERROR_CODE\" or \"NOT OK\") and " + unit.failure() + '.',
             "Mend the sources: apt-get update --print-uris"});
        return;
    }
    std::vector<std::string> indexes;
    for (const std::string& line : linesOf(list.output)) {
        if (!line.empty() && line.front() == '\'' && indexes.size() < mostMirrors) {
            indexes.push_back(line.substr(1, line.find('\'', 1) - 1));
        }
    }
    report.addFact("mirrors", "Mirrors", std::to_string(indexes.size()), indexes.size());
    if (indexes.empty()) {
        report.add({Severity::ERROR, "mirrors-none", "The package manager has no sources.",
                    "refreshes nothing and never finds an update.",
                    "Enter the maker's source in /etc/apt/sources.list.d."});
        return;
    }
    fetchIndexes(indexes, unit, report);
}

} // namespace

void checkPackageManager(const Unit& unit, Report& report)
{
    checkLocks(unit, report);
    checkUnfinishedWork(unit, report);
    checkPolicy(unit, report);
    checkSpace(unit, report);
    checkMirrors(unit, report);
}

void checkFreeSpace(const struct statvfs& system, std::uint64_t needed, Report& report)
{
    const std::uint64_t available = std::uint64_t{system.f_bavail} * system.f_frsize;
    report.addFact("free_bytes", "Free space", byteCount(available), available);
    if (needed > 0) {
        report.addFact("needed_bytes", "Package needs", byteCount(needed) + " without what it depends on", needed);
    }
    if ((system.f_flag & ST_RDONLY) != 0) {
        report.add({Severity::ERROR, "disk-read-only", "The unit's disk is mounted read-only.",
                    "cannot refresh the mirrors nor install anything: the update fails.",
                    "Look for the reason in the kernel's log: dmesg"});
        return;
    }
    const bool noFiles = system.f_files > 0 && system.f_favail == 0; // some file systems do not count them
    if (available < needed || noFiles) {
        report.add(
            {Severity::ERROR, "disk-full",
             noFiles ? "The unit's disk has no room for another file." : "The package needs more space than is free.",
             "cannot install the package: the update fails, and the package may be left "
             "half-installed.",
             "Free some: apt-get clean"});
    } else if (available < littleSpace) {
        report.add({Severity::WARNING, "disk-almost-full", "Little space is free: " + byteCount(available) + '.',
                    "may not be able to install what the package depends on.", "Free some: apt-get clean"});
    }
}

void checkUnfinishedWork(const Unit& unit, Report& report)
{
    const CommandResult packages =
        unit.run({"dpkg-query", "--show", "--showformat=${db:Status-Abbrev}\\t${binary:Package}\\n"}, quick);
    if (!packages.succeeded()) {
        report.add({Severity::UNCHECKED, "packages-unknown",
                    "The installed packages cannot be listed: " + complaint(packages) + '.',
                    "installs the head's package.", "Run this check on the unit."});
        return;
    }
    std::vector<std::string> pending;
    for (const std::string& line : linesOf(packages.output)) {
        // The second letter is the state: not installed, configuration files, installed; the third an error flag.
        const bool settled = line.size() > 3 && std::strchr("nci", line[1]) != nullptr && line[2] == ' ';
        if (!settled) {
            pending.push_back(line.substr(line.find('\t') + 1));
        }
    }
    const bool interrupted = dpkgWasInterrupted(unit);
    if (pending.empty() && !interrupted) {
        return;
    }
    report.add({Severity::ERROR, "package-half-configured",
                "The package manager has unfinished work: " + listed(pending) +
                    (pending.empty() ? ""
                     : interrupted   ? " and "
                                     : "") +
                    (interrupted ? "an interrupted run." : "."),
                "may see the version as installed that never got configured, and then finds nothing to update; or its "
                "installation fails.",
                "Finish it: dpkg --configure -a"});
}
