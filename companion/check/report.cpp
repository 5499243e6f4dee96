#include "check/check.h"

#include "descriptor.h"
#include "embedded.h"
#include "findings.h"
#include "log/log_command.h"
#include "stick/folder.h"
#include "unit/unit_check.h"

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <ostream>
#include <sstream>

#include <fcntl.h>

namespace
{

namespace fs = std::filesystem;

const auto packLimit = 120s;
const char folderName[] = "harl-updater-report";
const char keptLogs[] = "/var/lib/harl-updater"; // where the service keeps the runs that the journal loses

/// Commands that look something up, for system.txt.
const std::vector<std::string> lookups[] = {
    {"uname", "-a"},
    {"cat", "/etc/os-release", "/etc/debian_version"},
    {"date", "--iso-8601=seconds"},
    {"timedatectl", "status"},
    {"df", "-h", "/", "/var", "/tmp"},
    {"systemctl", "--no-pager", "--lines=0", "status", "harl", "harl-updater", "harl-updater-give-back",
     "harl-updater-verify"},
    {"dpkg", "--audit"},
    {"dpkg-query", "--list"},
};

/// Without what stands between "//" and "@": a login in an address.
std::string withoutLogins(std::string text)
{
    for (std::size_t begin = 0; (begin = text.find("//", begin)) != std::string::npos; begin += 2) {
        const std::size_t end = text.find_first_of("@/ \n\"'", begin + 2);
        if (end != std::string::npos && text[end] == '@') {
            text.replace(begin + 2, end - begin - 2, "(login)");
        }
    }
    return text;
}

/// Gathers the files in `folder`.
void gather(const fs::path& folder, const std::string& stickPath, const Unit& unit)
{
    const UnitSite& site = unit.site();
    const auto save = [&](const std::string& name, auto print) {
        std::ostringstream text;
        print(text);
        std::ofstream(folder / name) << withoutLogins(text.str());
    };
    save("README.txt", [](std::ostream& out) { out << embeddedReadMe; });
    save("journal.txt", [&](std::ostream& out) { out << unit.journal(); });
    save("log.txt", [&](std::ostream& out) {
        LogOptions options;
        options.files = {(folder / "journal.txt").string()};
        runLog(options, out, out);
    });
    if (!isUnit(unit) || StickFolder(stickPath).error() != 0) {
        save("unit.txt", [&](std::ostream& out) { runUnit({}, site, out, out); });
    }
    save("check.txt", [&](std::ostream& out) { runCheck(stickPath, false, site, out, out); });
    save("verify.txt", [&](std::ostream& out) { runVerify({}, site, out); });
    save("system.txt", [&](std::ostream& out) {
        out << "harl-updater-tool " << TOOL_VERSION << '\n';
        for (const std::vector<std::string>& lookup : lookups) {
            const CommandResult result = unit.run(lookup, quick);
            out << "\n# " << lookup[0] << ' ' << lookup[1] << '\n' << result.output << result.errors;
        }
    });
    std::error_code error;
    for (const auto& log : fs::directory_iterator(unit.path(keptLogs), error)) {
        fs::create_directory(folder / "kept-logs");
        save("kept-logs" / log.path().filename(), [&](std::ostream& out) { out << std::ifstream(log.path()).rdbuf(); });
    }
}

} // namespace

int runReport(const ReportOptions& options, const UnitSite& site, std::ostream& out, std::ostream& errors)
{
    const auto refused = [&](const std::string& text) {
        return refuse("report", options.json, escaped(options.file) + ": " + text, out, errors);
    };
    const Descriptor made(open(options.file.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    if (!made) {
        return refused(errno == EEXIST ? "exists already; name another file"
                                       : std::string("cannot be written: ") + std::strerror(errno));
    }
    const Unit unit(site);
    const TemporaryFolder temporary(unit);
    std::error_code error;
    const fs::path folder = fs::path(temporary.path()) / folderName;
    if (temporary.path().empty() || !fs::create_directory(folder, error)) {
        fs::remove(options.file, error);
        return refused("no temporary folder can be made; check the space in /tmp: df /tmp");
    }
    gather(folder, options.stick, unit);
    const CommandResult packed = unit.run({"tar", "--create", "--gzip", "--file", fs::absolute(options.file).string(),
                                           "--directory", temporary.path(), folderName},
                                          packLimit);
    if (!packed.succeeded()) {
        fs::remove(options.file, error);
        return refused("cannot be written: " + complaint(packed));
    }
    if (options.json) {
        out << nlohmann::ordered_json{{"command", "report"}, {"version", jsonVersion}, {"file", escaped(options.file)}}
                   .dump(2)
            << '\n';
    } else {
        out << escaped(options.file) << " holds what support needs, and nothing secret: its README.txt says what is "
            << "left out.\nRead it with: tar -xzf " << escaped(options.file) << '\n';
    }
    return Report::STATUS_FIT;
}
