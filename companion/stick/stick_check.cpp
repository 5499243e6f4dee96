#include "stick/stick_check.h"

#include "procedure.h"
#include "stick/archive.h"
#include "stick/signature.h"

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <ostream>
#include <utility>
#include <vector>

#include <elf.h>
#include <sys/stat.h>

namespace
{

const char markerFolder[] = "debs";
const char markerName[] = "installTV";

std::string lowerCase(std::string text)
{
    std::transform(text.begin(), text.end(), text.begin(), [](unsigned char letter) { return std::tolower(letter); });
    return text;
}

std::string inFolder(const std::string& folder, const std::string& name)
{
    return folder + '/' + name;
}

bool isLetterOrDigit(char letter)
{
    return std::isalnum(static_cast<unsigned char>(letter)) != 0;
}

/// True when ls(1) lists `name` behind `other` in every locale: they differ in how they order upper and lower case,
/// marks and what is beyond ASCII.
bool surelyBehind(const std::string& name, const std::string& other)
{
    const std::string lowerName = lowerCase(name);
    const std::string lowerOther = lowerCase(other);
    const auto [mine, its] = std::mismatch(lowerName.begin(), lowerName.end(), lowerOther.begin(), lowerOther.end());
    if (name < other || mine == lowerName.end()) {
        return false;
    }
    return its == lowerOther.end() || (isLetterOrDigit(*mine) && isLetterOrDigit(*its) && *mine > *its);
}

const std::size_t firstLineBytes = 255; // what the kernel reads of it, execve(2)

/// The interpreter that `line` names behind its "#!".
std::string_view interpreterOf(std::string_view line)
{
    line.remove_prefix(std::min<std::size_t>(line.size(), 2));
    line.remove_prefix(std::min(line.find_first_not_of(" \t"), line.size()));
    return line.substr(0, line.find_first_of(" \t"));
}

/// The stick check: each operation adds to the report what it finds.
class StickCheck
{
public:
    StickCheck(const StickFolder& stick, bool onUnit, Report& report) : mStick(stick), mOnUnit(onUnit), mReport(report)
    {
    }

    void run()
    {
        if (mOnUnit && !mStick.isMounted()) {
            mReport.add("stick-not-mounted");
        }
        if (checkFolders()) {
            checkBoardFolder();
        }
        checkMarker();
    }

private:
    /// @param effect  name of a text of the catalogue
    void addUnreadable(const std::string& path, int error, const char* effect)
    {
        const bool denied = error == EACCES || error == EPERM;
        mReport.add(denied ? "stick-unreadable.denied" : "stick-unreadable",
                    {{"path", shown(path)}, {"error", std::strerror(error)}, {"effect", sharedText(effect)}});
    }

    /// Reports a link that leads out or nowhere, and a node that cannot be read. False when it is none of these.
    bool reportUnusable(const std::string& path, const Node& node, const char* effect)
    {
        if (node.kind == Node::UNREADABLE) {
            addUnreadable(path, node.error, effect);
        } else if (node.kind == Node::LEADS_OUT || node.kind == Node::LEADS_NOWHERE) {
            mReport.add(node.kind == Node::LEADS_OUT ? "link-leaves-stick" : "link-broken",
                        {{"path", shown(path)}, {"target", shown(node.target)}, {"effect", sharedText(effect)}});
        } else {
            return false;
        }
        return true;
    }

    /// Reports a name in `folder` that differs from `wanted` in upper and lower case only; as a warning when the file
    /// system finds the wanted name all the same. False when there is none.
    bool reportCase(const std::string& folder, const std::string& wanted, bool found, const char* finding,
                    const char* effect)
    {
        const std::vector<std::string> names = mStick.names(folder).names;
        const auto other = std::find_if(names.begin(), names.end(),
                                        [&](const std::string& name) { return lowerCase(name) == lowerCase(wanted); });
        if (other == names.end() || std::find(names.begin(), names.end(), wanted) != names.end()) {
            return false;
        }
        mReport.add(found ? "name-case.found" : finding, {{"name", shown(*other)},
                                                          {"folder", shown(folder)},
                                                          {"wanted", shown(wanted)},
                                                          {"effect", sharedText(effect)}});
        return true;
    }

    /// The names in `folder` that someone may have meant to be `wanted`, such as "OSUpgrade (1).zip".
    std::vector<std::string> lookalikes(const std::string& folder, const std::string& wanted) const
    {
        const std::string stem = lowerCase(wanted.substr(0, wanted.find('.')));
        std::vector<std::string> names = mStick.names(folder).names;
        const auto others = std::remove_if(names.begin(), names.end(),
                                           [&](const auto& name) { return !contains(lowerCase(name), stem); });
        names.erase(others, names.end());
        return names;
    }

    /// Walks down to the board's folder. True when it is there.
    bool checkFolders()
    {
        std::string parent = ".";
        for (const std::string path : {"debs", "debs/QUORB", "debs/QUORB/armhf"}) {
            const Node node = mStick.node(path);
            const bool missing = node.kind == Node::MISSING;
            const bool misspelled =
                reportCase(parent, path.substr(path.rfind('/') + 1), !missing, "name-case", "no-version");
            if (node.kind != Node::FOLDER) {
                if (!reportUnusable(path, node, "no-version") && !misspelled) {
                    const std::string deeper = missing ? oneLevelDeeper(path) : "";
                    mReport.add(deeper.empty() ? "no-board-folder" : "no-board-folder.deeper",
                                {{"path", shown(path)},
                                 {"state", missing ? "is missing" : "is no folder"},
                                 {"found", shown(deeper)},
                                 {"board-folder", shown(boardFolder)}});
                }
                return false;
            }
            parent = path;
        }
        return true;
    }

    /// Where `path` is in a folder that should not be there, as when an archive was unpacked into a folder of its own;
    /// empty when it is not.
    std::string oneLevelDeeper(const std::string& path) const
    {
        for (const std::string& outer : mStick.names(".").names) {
            if (mStick.node(inFolder(outer, path)).kind == Node::FOLDER) {
                return inFolder(outer, path);
            }
        }
        return "";
    }

    void checkBoardFolder()
    {
        const Names all = mStick.names(boardFolder);
        mReport.define({{"folder", shown(boardFolder)}});
        if (all.error != 0) {
            addUnreadable(boardFolder, all.error, "no-version");
            return;
        }
        if (all.tooMany) {
            mReport.add("too-many-names", {{"names", counted(Names::most, "name")}});
            return;
        }
        // Neither ls(1) nor a `*` of the shell shows a name that begins with a dot.
        std::vector<std::string> names = all.names;
        names.erase(std::remove_if(names.begin(), names.end(), [](const auto& name) { return name.front() == '.'; }),
                    names.end());
        if (names.empty()) {
            const bool isUnfinished = std::any_of(all.names.begin(), all.names.end(), [](const std::string& name) {
                return startsWith(name, unfinishedPrefix);
            });
            mReport.add(all.names.empty() ? "no-version-folder.empty"
                        : isUnfinished    ? "no-version-folder.unfinished"
                                          : "no-version-folder.hidden",
                        {{"names", listed(all.names)}});
            return;
        }

        mReport.addFact("version_folder", "Version folder", shown(names.front()), escaped(names.front()));
        const bool hasFolder = checkOrder(names);
        const std::string version = checkVersionName(names.front(), mReport);
        if (!version.empty()) {
            mReport.addFact("version", "Version",
                            shown(version) + ": the board is updated unless it reports exactly this", escaped(version));
        }
        if (hasFolder) {
            checkFile(names, archiveName);
            checkFile(names, scriptName);
        }
    }

    /// Checks that the version check and the upload mean the same folder. False when there is none at all, or none that
    /// this user may look into.
    bool checkOrder(const std::vector<std::string>& names)
    {
        std::vector<std::string> folders;
        std::vector<std::string> others;
        for (const std::string& name : names) {
            const std::string path = inFolder(boardFolder, name);
            const Node node = mStick.node(path);
            const Node inside = node.kind == Node::FOLDER ? mStick.node(inFolder(path, ".")) : node;
            if (reportUnusable(path, inside, "takes-name") && inside.kind == Node::UNREADABLE) {
                return false;
            }
            (node.kind == Node::FOLDER ? folders : others).push_back(name);
        }
        if (folders.empty()) {
            mReport.add("no-version-folder.files", {{"names", listed(others)}, {"first", shown(names.front())}});
            return false;
        }
        if (folders.size() > 1) {
            mReport.add("several-version-folders", {{"number", std::to_string(folders.size())},
                                                    {"names", listed(folders)},
                                                    {"first", shown(names.front())}});
        }
        const auto first = std::find_if(others.begin(), others.end(),
                                        [&](const auto& name) { return !surelyBehind(name, folders[0]); });
        if (first != others.end()) {
            mReport.add("name-before-version-folder",
                        {{"name", shown(*first)},
                         {"version-folder", shown(folders.front())},
                         {"order", *first < folders.front() ? "byte order" : "the order of some locales"}});
        } else if (!others.empty()) {
            mReport.add("name-beside-version-folder", {{"names", listed(others)}});
        }
        return true;
    }

    /// Checks the file that the upload takes when it is a plain and not an empty one, and reports anything else.
    void checkFile(const std::vector<std::string>& names, const std::string& name)
    {
        const std::string path = uploadedPath(names, name);
        const Node node = mStick.node(path);
        if (path.empty() || reportUnusable(path, node, "upload-fails")) {
            return;
        }
        if (node.kind != Node::FILE || node.size == 0) {
            mReport.add(node.kind == Node::FILE ? "file-empty" : "no-plain-file",
                        {{"path", shown(path)},
                         {"state", node.kind == Node::FOLDER ? "is a folder, no file" : "is no plain file"}});
            return;
        }
        const Descriptor file = mStick.openFile(path);
        std::string start(static_cast<std::size_t>(std::min<std::uint64_t>(node.size, scriptBytesChecked)), '\0');
        if (!file) {
            addUnreadable(path, errno, "upload-fails");
        } else if (name == archiveName) {
            checkArchive(file.number(), node.size, shown(path), mReport);
        } else if (read(file.number(), start.data(), start.size()) != static_cast<ssize_t>(start.size())) {
            addUnreadable(path, EIO, "upload-fails");
        } else {
            checkScript(start, node.size, shown(path), mReport);
            checkRunBit(node.mode, mStick.keepsPermissions(), mOnUnit, shown(path), mReport);
        }
    }

    /// What the `*` of the upload's command line finds of `file`: of several paths the one that arrives last and so
    /// stays. Reported, and empty, when there is none.
    std::string uploadedPath(const std::vector<std::string>& names, const std::string& file)
    {
        std::string last;
        std::vector<std::string> similar;
        bool misspelled = false;
        for (const std::string& name : names) {
            const std::string folder = inFolder(boardFolder, name);
            const std::string path = inFolder(folder, file);
            const bool found = mStick.node(path).present;
            misspelled = reportCase(folder, file, found, "name-case", "upload-fails") || misspelled;
            if (found) {
                last = path;
                continue;
            }
            const std::vector<std::string> likes = lookalikes(folder, file);
            similar.insert(similar.end(), likes.begin(), likes.end());
        }
        if (last.empty() && !misspelled) {
            mReport.add(similar.empty() ? "file-missing" : "file-missing.similar",
                        {{"file", shown(file)}, {"names", listed(similar)}});
        }
        return last;
    }

    /// ls(1) prints the path of anything but a folder, and only its path requests TeamViewer. It prints nothing of a
    /// link that leads to itself.
    void checkMarker()
    {
        const std::string path = inFolder(markerFolder, markerName);
        const Node node = mStick.node(path);
        const bool loops = node.kind == Node::LEADS_NOWHERE && node.error == ELOOP;
        const bool requested = node.present && node.kind != Node::FOLDER && !loops;
        mReport.addFact("teamviewer_requested", "TeamViewer",
                        requested ? "requested; only the main head installs it" : "not requested", requested);

        const bool misspelled = reportCase(markerFolder, markerName, node.present, "name-case.marker", "no-teamviewer");
        if (node.kind == Node::FOLDER) {
            mReport.add("marker-is-folder", {{"path", shown(path)}});
        } else if (node.kind == Node::UNREADABLE || (node.present && node.kind == Node::LEADS_OUT) || loops) {
            reportUnusable(path, node, "no-teamviewer");
        } else if (!node.present && !misspelled) {
            // A text editor or Windows adds an extension to the marker's name.
            for (const std::string& name : lookalikes(markerFolder, markerName)) {
                mReport.add("marker-name", {{"name", shown(name)}, {"wanted", shown(markerName)}});
            }
            if (mStick.node(markerName).present) {
                mReport.add("marker-name.place", {{"wanted", shown(markerName)}, {"folder", shown(markerFolder)}});
            }
        }
    }

    const StickFolder& mStick;
    bool mOnUnit;
    Report& mReport;
};

} // namespace

int runStick(const std::string& path, bool json, std::ostream& out, std::ostream& errors, const std::string& keyring)
{
    const StickFolder stick(path);
    if (stick.error() != 0) {
        return refuseStick("stick", path, stick.error(), json, out, errors);
    }
    Report report("stick", "The stick at " + shown(path));
    std::error_code error;
    checkStick(stick, std::filesystem::canonical(path, error) == stickMountPoint, report);
    checkSignature(path, keyring, report);
    report.write(json, out);
    return report.status();
}

Report::Status refuseStick(const char* command, const std::string& path, int error, bool json, std::ostream& out,
                           std::ostream& errors)
{
    return refuse(command, json,
                  shown(path) + " cannot be read: " + std::strerror(error) + ". " +
                      (error == EACCES ? "Run this check as root."
                                       : "Name the folder that the stick is mounted at, the one that holds \"debs\"."),
                  out, errors);
}

void checkStick(const StickFolder& stick, bool onUnit, Report& report)
{
    StickCheck(stick, onUnit, report).run();
}

std::string checkVersionName(const std::string& name, Report& report)
{
    const std::string line = name.substr(0, name.find('\n'));
    std::string version = line.size() > versionPrefixLength ? line.substr(versionPrefixLength) : "";
    if (version.empty()) {
        report.add("version-missing", {{"name", shown(line)}});
        return version;
    }
    if (line != name || contains(version, "\r")) {
        report.add("version-line-break", {{"name", shown(name)}});
        return version;
    }
    const bool usual = version.find_first_not_of(
                           "0123456789abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ.+~_-") == std::string::npos;
    if (!usual) {
        report.add("version-unusual", {{"version", shown(version)}});
    }
    const std::string lastOfPrefix = line.substr(versionPrefixLength - 1, 1);
    if (!contains("0123456789", version.substr(0, 1)) || contains("0123456789.", lastOfPrefix)) {
        report.add("version-start",
                   {{"prefix", shown(line.substr(0, versionPrefixLength))}, {"version", shown(version)}});
    }
    return version;
}

void checkScript(std::string_view start, std::uint64_t size, const std::string& name, Report& report)
{
    if (startsWith(start, ELFMAG)) {
        report.addFact("script_interpreter", "Script", byteCount(size) + ", a compiled program", nullptr);
        return;
    }
    const std::string_view firstLine = start.substr(0, start.find('\n'));
    const std::string_view interpreter = interpreterOf(firstLine);
    const Values values = {
        {"name", name}, {"start", shown(firstLine.substr(0, 60))}, {"interpreter", shown(interpreter)}};
    const bool names = startsWith(firstLine, "#!");
    const bool windows = contains(firstLine, "\r");
    if (names && (windows || !startsWith(interpreter, "/") || firstLine.size() > firstLineBytes ||
                  firstLine.find('\0') != std::string_view::npos)) {
        report.add(windows ? "script-first-line.windows" : "script-first-line.interpreter", values);
        return;
    }
    if (names) {
        report.addFact("script_interpreter", "Script", byteCount(size) + ", run by " + shown(interpreter),
                       escaped(interpreter));
    } else {
        report.add("script-first-line", values);
    }

    // Behind a zero byte a script carries data, not lines.
    const std::string_view text = start.substr(0, start.find('\0'));
    const std::string_view before = text.substr(0, text.find("\r\n"));
    if (before.size() < text.size()) {
        const auto line = 1 + std::count(before.begin(), before.end(), '\n');
        report.add("script-line-ends", {{"name", name}, {"line", std::to_string(line)}});
    }
}

void checkRunBit(mode_t mode, bool keepsPermissions, bool onUnit, const std::string& name, Report& report)
{
    if ((mode & (S_IXUSR | S_IXGRP | S_IXOTH)) == 0) {
        report.add(keepsPermissions ? "script-run-bit"
                   : onUnit         ? "script-run-bit.mount"
                                    : "script-run-bit.elsewhere",
                   {{"name", name}});
    }
}
