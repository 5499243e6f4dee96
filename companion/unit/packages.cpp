#include "descriptor.h"
#include "unit/unit_check.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>
#include <system_error>
#include <utility>

#include <fcntl.h>
#include <sys/statvfs.h>

namespace
{

const std::uint64_t littleSpace = 100'000'000; // bytes

void checkLocks(const Unit& unit, Report& report)
{
    const std::pair<const char*, const char*> locks[] = {
        {"/var/lib/apt/lists/lock", "lists-locked"},
        {"/var/lib/dpkg/lock-frontend", "waits-for-lock"},
        {"/var/lib/dpkg/lock", "waits-for-lock"},
        {"/var/cache/apt/archives/lock", "archives-locked"},
    };
    for (const auto& [path, name] : locks) {
        const Descriptor file(open(unit.path(path).c_str(), O_RDONLY | O_CLOEXEC));
        const int error = errno; // of open(), when it failed
        struct flock lock = {};
        lock.l_type = F_WRLCK;
        const bool held = file && fcntl(file.number(), F_GETLK, &lock) == 0 && lock.l_type != F_UNLCK;
        if (held || (!file && error != ENOENT)) {
            report.add(held ? "package-lock" : "package-lock.unknown",
                       {{"path", shown(path)},
                        {"process", std::to_string(lock.l_pid)},
                        {"error", std::strerror(error)},
                        {"effect", sharedText(name, {{"failure", unit.failure()}})}});
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
    if (!unit.locale().empty()) {
        report.addFact("locale", "Locale", escaped(unit.locale()));
    }
    const std::string& text = policy.output;
    if (!text.empty() && !(contains(text, "Installed: ") && contains(text, "Candidate: "))) {
        report.add("policy-words", {{"locale", shown(unit.locale())}});
        return;
    }
    const std::size_t own = text.find(unit.package() + ":\n");
    if (own == std::string::npos) {
        report.add(text.empty() ? "package-unknown.silent" : "package-unknown");
        return;
    }
    const std::string block = text.substr(own, text.find("\napt:", own) - own);
    const std::string installed = valueAfter(block, "Installed: ");
    const std::string candidate = valueAfter(block, "Candidate: ");
    report.addFact("package_installed", "Package installed", shown(installed), escaped(installed));
    report.addFact("package_candidate", "Package offered", shown(candidate) + " as of the last refresh",
                   escaped(candidate));
    if (candidate == "(none)") {
        report.add("package-not-offered");
    }
}

/// Looks for settings in /etc/apt that contradict the service's own (service/apt-last.conf).
void checkSettings(const Unit& unit, Report& report)
{
    static const std::array<const char*, 4> contradicting = {
        R"(DPkg::Options:: "--force-confnew";)", R"(DPkg::Options:: "--force-confask";)",
        R"(APT::Update::Error-Mode "any";)", R"(Binary::apt::APT::Update::Error-Mode "any";)"};
    std::vector<std::string> found = linesOf(unit.run({"apt-config", "dump"}, quick).output);
    const auto others = std::remove_if(found.begin(), found.end(), [](const std::string& line) {
        return std::find(contradicting.begin(), contradicting.end(), line) == contradicting.end();
    });
    found.erase(others, found.end());
    if (!found.empty()) {
        report.add("apt-settings", {{"settings", listed(found)}});
    }
}

void checkSpace(const Unit& unit, Report& report)
{
    const std::string record =
        '\n' + unit.run({"apt-cache", "show", "--no-all-versions", unit.package()}, quick).output;
    const auto number = [&](const std::string& field) -> std::uint64_t { // 0 without the field
        const std::size_t begin = record.find('\n' + field);
        return begin == std::string::npos ? 0 : std::strtoull(&record[begin + 1 + field.size()], nullptr, 10);
    };
    const std::uint64_t needed = number("Size: ") + number("Installed-Size: ") * 1024; // bytes
    struct statvfs system = {};
    if (statvfs(unit.path("/").c_str(), &system) != 0) {
        report.add("space-unknown", {{"error", std::strerror(errno)}});
        return;
    }
    checkFreeSpace(system, needed, report);
}

/// "mirror.example" of "http://mirror.example/dists/stable/InRelease".
std::string hostOf(const std::string& address)
{
    const std::size_t begin = address.find("//");
    return begin == std::string::npos ? address : address.substr(begin + 2, address.find('/', begin + 2) - begin - 2);
}

/// Makes lists of the package manager's own in `folder`, with what the unit's lists hold: only what is new has to be
/// fetched. False when they cannot be made.
bool makeLists(const Unit& unit, const std::string& folder)
{
    std::error_code error;
    std::filesystem::create_directories(folder + "/lists/partial", error);
    for (const auto& list : std::filesystem::directory_iterator(unit.path("/var/lib/apt/lists"), error)) {
        if (list.is_regular_file(error) && list.path().filename() != "lock") {
            std::filesystem::create_symlink(list.path(), folder + "/lists/" + list.path().filename().string(), error);
        }
    }
    // The last word on settings, apt.conf(5): also on the unit's hooks, which may do anything.
    std::ofstream settings(folder + "/apt.conf");
    settings << "#clear APT::Update::Pre-Invoke;\n#clear APT::Update::Post-Invoke;\n"
             << "#clear APT::Update::Post-Invoke-Success;\n"
             << "Dir::State::lists \"" << folder << "/lists\";\nDir::Cache \"" << folder << "\";\n"
             << "APT::Sandbox::User \"root\";\nAcquire::Retries \"0\";\n"
             << "Acquire::http::Timeout \"10\";\nAcquire::https::Timeout \"10\";\n";
    return settings.flush().good();
}

/// Reports what a refresh could not fetch: each list that its mirror does not have, each other mirror once. False when
/// there is nothing of that.
bool reportUnfetched(const std::string& errors, Report& report)
{
    static const std::string words = "Failed to fetch ";
    std::set<std::string> told;
    for (const std::string& line : linesOf(errors)) {
        const std::size_t begin = line.find(words);
        if (begin == std::string::npos) {
            continue;
        }
        std::istringstream rest(line.substr(begin + words.size()));
        std::string address;
        std::string reason;
        std::getline(rest >> address >> std::ws, reason);
        const bool none = contains(reason, "404") || contains(reason, "not found") || contains(reason, "Not Found");
        if (told.insert(none ? address : hostOf(address)).second) {
            report.add(none ? "mirror-index" : "mirror-silent",
                       {{"address", shown(address)}, {"host", shown(hostOf(address))}, {"reason", shown(reason)}});
        }
    }
    return !told.empty();
}

/// Bytes of the lists in `folder`, which grow while one is fetched.
std::uint64_t bytesFetched(const std::string& folder)
{
    std::uint64_t bytes = 0;
    std::error_code error;
    for (const auto& list : std::filesystem::recursive_directory_iterator(folder + "/lists", error)) {
        bytes += list.is_regular_file(error) ? list.file_size(error) : 0;
    }
    return bytes;
}

/// Refreshes the mirrors into lists of its own, so that nothing changes on the unit: the fact "package_now", or what
/// keeps the updater from its refresh.
void refreshPrivately(const Unit& unit, const std::vector<std::string>& hosts, Report& report)
{
    const TemporaryFolder folder(unit);
    if (folder.path().empty() || !makeLists(unit, folder.path())) {
        report.add("mirrors-unknown.folder", {{"error", std::strerror(errno)}});
        return;
    }
    const std::string settings = folder.path() + "/apt.conf";
    std::uint64_t bytes = 0;
    std::chrono::milliseconds since{0};
    bool silent = false;
    const CommandResult refresh = unit.run({"apt-get", "-c", settings, "update"}, unit.site().refresh, [&](auto time) {
        const std::uint64_t now = bytesFetched(folder.path());
        since = std::exchange(bytes, now) == now ? since : time;
        silent = time - since >= unit.site().silence;
        return !silent;
    });
    const bool fetched = !reportUnfetched(refresh.errors, report);
    if (!refresh.succeeded()) {
        report.add(silent             ? "mirrors-unknown.silent"
                   : refresh.timedOut ? "mirrors-unknown.slow"
                                      : "refresh-fails",
                   {{"complaint", complaint(refresh)}, {"hosts", listed(hosts)}});
    } else if (fetched) {
        const std::string policy = unit.run({"apt-cache", "-c", settings, "policy", unit.package()}, quick).output;
        if (const std::string candidate = valueAfter(policy, "Candidate: "); !candidate.empty()) {
            report.addFact("package_now", "Package offered now", shown(candidate), escaped(candidate));
        }
    }
}

void checkMirrors(const Unit& unit, Report& report)
{
    const CommandResult list = unit.run({"apt-get", "update", "--print-uris"}, quick);
    if (!list.succeeded()) {
        report.add(list.started ? "mirrors-unreadable" : "mirrors-unreadable.unknown",
                   {{"complaint", complaint(list)}});
        return;
    }
    std::set<std::string> hosts;
    for (const std::string& line : linesOf(list.output)) {
        if (startsWith(line, "'")) {
            hosts.insert(hostOf(line.substr(1, line.find('\'', 1) - 1)));
        }
    }
    report.addFact("mirrors", "Mirrors", std::to_string(hosts.size()), hosts.size());
    if (hosts.empty()) {
        report.add("mirrors-none");
        return;
    }
    refreshPrivately(unit, {hosts.begin(), hosts.end()}, report);
}

} // namespace

void checkPackageManager(const Unit& unit, Report& report)
{
    checkLocks(unit, report);
    checkUnfinishedWork(unit, report);
    checkPolicy(unit, report);
    checkSettings(unit, report);
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
    const bool noFiles = system.f_files > 0 && system.f_favail == 0; // some file systems do not count them
    if ((system.f_flag & ST_RDONLY) != 0) {
        report.add("disk-read-only");
    } else if (available < needed || noFiles) {
        report.add(noFiles ? "disk-full.files" : "disk-full");
    } else if (available < littleSpace) {
        report.add("disk-almost-full", {{"size", byteCount(available)}});
    }
}

void checkUnfinishedWork(const Unit& unit, Report& report)
{
    const CommandResult packages =
        unit.run({"dpkg-query", "--show", "--showformat=${db:Status-Abbrev}\\t${binary:Package}\\n"}, quick);
    if (!packages.succeeded()) {
        report.add("packages-unknown", {{"complaint", complaint(packages)}});
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
    if (interrupted || !pending.empty()) {
        const char* const run = !interrupted ? "" : pending.empty() ? "an interrupted run" : " and an interrupted run";
        report.add("package-half-configured", {{"work", listed(pending) + run}});
    }
}
