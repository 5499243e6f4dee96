#include "stick/signature.h"

#include "command.h"

#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <vector>

#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

namespace
{

namespace fs = std::filesystem;
using namespace std::chrono_literals;

const auto readingLimit = 1h; // of a whole slow stick

std::vector<std::string> ownEnvironment()
{
    std::vector<std::string> variables;
    for (char** variable = environ; *variable != nullptr; ++variable) {
        variables.emplace_back(*variable);
    }
    return variables;
}

/// Runs a program on this terminal: gpg asks for the passphrase there. True when it exited with 0.
bool runHere(const std::vector<std::string>& arguments)
{
    pid_t child = -1;
    int status = -1;
    return posix_spawnp(&child, arguments.front().c_str(), nullptr, nullptr, pointersTo(arguments).data(), environ) ==
               0 &&
           waitpid(child, &status, 0) == child && status == 0;
}

std::string sha256(const fs::path& file)
{
    const CommandResult sum = runCommand({"sha256sum", "--", file.string()}, ownEnvironment(), readingLimit);
    if (!sum.succeeded() || sum.output.size() < 64 || sum.output.front() == '\\') { // it marks names with line breaks
        throw std::runtime_error(shown(file.string()) + " cannot be listed in a manifest. " + escaped(sum.errors));
    }
    return sum.output.substr(0, 64);
}

/// The text behind `field` in the manifest; empty when there is none.
std::string fieldOf(const std::string& stick, const std::string& field)
{
    std::ifstream manifest(fs::path(stick) / manifestName);
    for (std::string line; std::getline(manifest, line);) {
        if (startsWith(line, field + ": ")) {
            return line.substr(field.size() + 2);
        }
    }
    return "";
}

bool isOlder(const std::string& version, const std::string& other)
{
    return runCommand({"dpkg", "--compare-versions", version, "lt", other}, ownEnvironment(), 10s).succeeded();
}

} // namespace

void signStick(const std::string& stick, const std::string& version, const std::string& oldest, const std::string& key)
{
    std::vector<fs::path> files;
    for (const fs::directory_entry& entry : fs::recursive_directory_iterator(fs::path(stick) / "debs")) {
        if (entry.is_regular_file() && !entry.is_symlink()) {
            files.push_back(entry.path());
        } else if (!entry.is_directory()) {
            throw std::runtime_error(shown(entry.path().string()) + " is no plain file: it cannot be signed.");
        }
    }
    std::sort(files.begin(), files.end());
    std::ostringstream text;
    const std::time_t now = std::time(nullptr);
    char date[40];
    std::strftime(date, sizeof date, "%Y-%m-%dT%H:%M:%SZ", std::gmtime(&now));
    text << "Format: 1\nVersion: " << version << '\n';
    if (!oldest.empty()) {
        text << "Oldest: " << oldest << '\n';
    }
    text << "Date: " << date << "\nSHA256:\n";
    for (const fs::path& file : files) {
        text << ' ' << sha256(file) << ' ' << fs::file_size(file) << ' ' << file.lexically_relative(stick).string()
             << '\n';
    }
    const fs::path manifest = fs::path(stick) / manifestName;
    std::ofstream out(manifest, std::ios::trunc);
    out << text.str() << std::flush;
    if (!out) {
        throw std::runtime_error(shown(manifest.string()) + " cannot be written. Make room on the stick.");
    }
    const std::string signature = fs::path(stick) / signatureName;
    if (!runHere({"gpg", "--yes", "--local-user", key, "--output", signature, "--detach-sign", manifest.string()})) {
        throw std::runtime_error("gpg did not sign with the key " + shown(key) + ".");
    }
}

void checkSignature(const std::string& stick, const std::string& keyring, Report& report)
{
    const bool isSigned = fs::exists(fs::path(stick) / manifestName);
    const bool isInstalled = fs::exists(installedKeyring);
    if (keyring.empty() && !isInstalled) {
        if (isSigned) {
            report.addFact("signature", "Signature", "not checked: no keyring is installed or named", nullptr);
        }
        return;
    }
    std::error_code error;
    const fs::path verifier =
        fs::read_symlink("/proc/self/exe", error).parent_path() / "../lib/harl-updater/verify-stick";
    const std::string keys = fs::absolute(keyring.empty() ? installedKeyring : keyring);
    const CommandResult result = runCommand({verifier.string(), stick, keys}, ownEnvironment(), readingLimit);
    if (result.exitCode != 0 && result.exitCode != 1) {
        report.add("stick-signature.unknown", {{"program", shown(verifier.lexically_normal().string())}});
        return;
    }
    std::istringstream lines(result.output);
    for (std::string line; std::getline(lines, line);) {
        const bool isFile = contains(line, ": ") && contains(line, "debs/");
        report.add(isFile ? "stick-signature.file" : "stick-signature", {{"complaint", escaped(line)}});
    }
    if (result.succeeded() && isSigned) {
        const std::string date = escaped(fieldOf(stick, "Date"));
        report.addFact("signature", "Signature", "good, of " + date, date);
    }
}

void checkReplaced(const std::string& stick, Report& report)
{
    const std::string board = report.fact("board_version");
    const std::string version = fieldOf(stick, "Version");
    const std::string oldest = fieldOf(stick, "Oldest");
    if (board.empty() || version.empty()) {
        return;
    }
    const Values values = {{"board", shown(board)}, {"version", shown(version)}, {"oldest", shown(oldest)}};
    if (isOlder(version, board)) {
        report.add("stick-older", values);
    } else if (!oldest.empty() && isOlder(board, oldest)) {
        report.add("stick-older.board", values);
    }
}
