#include "stick/stick_check.h"

#include "procedure.h"
#include "stick/archive.h"
#include "stick/script.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <ostream>
#include <utility>
#include <vector>

namespace
{

const char archiveName[] = "OSUpgrade.zip";
const char scriptName[] = "unzipUpgrade.sh";
const char markerFolder[] = "debs";
const char markerName[] = "installTV";

const std::string noVersionEffect =
    "finds no version on the stick (log: \"Failed to check candidate QUORB version\" or \"Failed to checkUpdate\") and "
    "leaves the board as it is. The panel shows \"nothing to update\" when the head's package is up to date, and a "
    "failed check when it has just been installed.";
const std::string uploadFailsEffect =
    "tries the upload 20 times when the board has another version, gives up and shows the fail pattern; the board "
    "stays as it is.";
const std::string nameFolderRemedy = "Name the folder with its five-character prefix and the version behind it.";

std::string lowerCase(std::string text)
{
    std::transform(text.begin(), text.end(), text.begin(), [](char letter) {
        return letter >= 'A' && letter <= 'Z' ? static_cast<char>(letter + 32) : letter;
    });
    return text;
}

std::string inFolder(const std::string& folder, const std::string& name)
{
    return folder + '/' + name;
}

bool isDigit(char letter)
{
    return letter >= '0' && letter <= '9';
}

bool isLetterOrDigit(char letter)
{
    return isDigit(letter) || (letter >= 'a' && letter <= 'z');
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

/// Reads from `offset` on until `length` bytes, the end or an error.
std::size_t readAt(int descriptor, std::uint64_t offset, char* buffer, std::size_t length)
{
    std::size_t done = 0;
    while (done < length) {
        const ssize_t count = pread(descriptor, buffer + done, length - done, static_cast<off_t>(offset + done));
        if (count < 0 && errno == EINTR) {
            continue;
        }
        if (count <= 0) {
            break;
        }
        done += static_cast<std::size_t>(count);
    }
    return done;
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
            add(Severity::WARNING, "stick-not-mounted",
                "No stick is mounted here: this is a folder of the unit's own disk.",
                "reads this folder, and cannot release it at the end (status 8192 of \"umount\" in the log).",
                "Plug the stick in and wait until it is mounted.");
        }
        if (checkFolders()) {
            checkBoardFolder();
        }
        checkMarker();
    }

private:
    void add(Severity severity, const char* check, std::string what, std::string effect, std::string remedy)
    {
        mReport.add({severity, check, std::move(what), std::move(effect), std::move(remedy)});
    }

    void addUnreadable(const std::string& path, int error, const std::string& effect)
    {
        const bool denied = error == EACCES || error == EPERM;
        add(denied ? Severity::UNCHECKED : Severity::ERROR, "stick-unreadable",
            shown(path) + " cannot be read: " + std::strerror(error) + '.', denied ? "reads it as root." : effect,
            denied ? "Run this check as root." : "Use another stick.");
    }

    /// Reports a link that leads out or nowhere, and a node that cannot be read. False when it is none of these.
    bool reportUnusable(const std::string& path, const Node& node, const std::string& effect)
    {
        const std::string link = shown(path) + " is a symbolic link to " + shown(node.target);
        switch (node.kind) {
        case Node::LEADS_OUT:
            add(Severity::ERROR, "link-leaves-stick", link + ", out of the stick. It was not followed.",
                "follows it on the unit and takes what it finds there, not what is on the stick.",
                "Put the file or folder itself in its place.");
            return true;
        case Node::LEADS_NOWHERE:
            add(Severity::ERROR, "link-broken", link + ", where there is nothing.", effect,
                "Put the file or folder itself in its place.");
            return true;
        case Node::UNREADABLE:
            addUnreadable(path, node.error, effect);
            return true;
        default:
            return false;
        }
    }

    /// Reports a name in `folder` that differs from `wanted` in upper and lower case only; as a warning when the file
    /// system finds the wanted name all the same. False when there is none.
    bool reportCase(const std::string& folder, const std::string& wanted, bool found, Severity severity,
                    const std::string& effect)
    {
        const std::vector<std::string> names = mStick.names(folder).names;
        if (std::find(names.begin(), names.end(), wanted) != names.end()) {
            return false;
        }
        const auto other = std::find_if(names.begin(), names.end(),
                                        [&](const std::string& name) { return lowerCase(name) == lowerCase(wanted); });
        if (other == names.end()) {
            return false;
        }
        add(found ? Severity::WARNING : severity, "name-case",
            shown(*other) + " in " + shown(folder) + " must be named " + shown(wanted) +
                ", with these upper and lower case letters.",
            found ? "finds it, but only because this file system takes upper and lower case for the same." : effect,
            "Rename it to " + shown(wanted) + '.');
        return true;
    }

    /// The names in `folder` that someone may have meant to be `wanted`, such as "OSUpgrade (1).zip".
    std::vector<std::string> lookalikes(const std::string& folder, const std::string& wanted) const
    {
        const std::string stem = lowerCase(wanted.substr(0, wanted.find('.')));
        std::vector<std::string> result;
        for (const std::string& name : mStick.names(folder).names) {
            if (lowerCase(name).find(stem) != std::string::npos) {
                result.push_back(name);
            }
        }
        return result;
    }

    /// Walks down to the board's folder. True when it is there.
    bool checkFolders()
    {
        std::string parent = ".";
        for (const std::string path : {"debs", "debs/QUORB", "debs/QUORB/armhf"}) {
            const Node node = mStick.node(path);
            const bool misspelled = reportCase(parent, path.substr(path.rfind('/') + 1), node.kind != Node::MISSING,
                                               Severity::ERROR, noVersionEffect);
            if (node.kind != Node::FOLDER) {
                if (!reportUnusable(path, node, noVersionEffect) && !misspelled) {
                    add(Severity::ERROR, "no-board-folder",
                        shown(path) + (node.kind == Node::MISSING ? " is missing." : " is no folder."), noVersionEffect,
                        "Put the board's version folder into " + shown(boardFolder) + " on the stick.");
                }
                return false;
            }
            parent = path;
        }
        return true;
    }

    void checkBoardFolder()
    {
        const Names all = mStick.names(boardFolder);
        if (all.error != 0) {
            addUnreadable(boardFolder, all.error, noVersionEffect);
            return;
        }
        if (all.tooMany) {
            add(Severity::ERROR, "too-many-names",
                shown(boardFolder) + " holds more than " + counted(Names::most, "name") + ": they were not looked at.",
                "takes the first of them for the version folder.", "Leave nothing but the version folder in it.");
            return;
        }
        // Neither ls(1) nor a `*` of the shell shows a name that begins with a dot.
        std::vector<std::string> names = all.names;
        names.erase(std::remove_if(names.begin(), names.end(), [](const auto& name) { return name.front() == '.'; }),
                    names.end());
        if (names.empty()) {
            const bool hidden = !all.names.empty();
            add(Severity::ERROR, "no-version-folder",
                shown(boardFolder) + (hidden ? " holds only hidden names: " + listed(all.names) + '.' : " is empty."),
                noVersionEffect,
                hidden ? "Give the version folder a name that does not begin with a dot."
                       : "Put the board's version folder into it.");
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
            checkArchiveFile(names);
            checkScriptFile(names);
        }
    }

    /// Checks that the version check and the upload mean the same folder. False when there is none at all.
    bool checkOrder(const std::vector<std::string>& names)
    {
        std::vector<std::string> folders;
        std::vector<std::string> others;
        for (const std::string& name : names) {
            const std::string path = inFolder(boardFolder, name);
            const Node node = mStick.node(path);
            reportUnusable(path, node, "may take its name for the version folder.");
            (node.kind == Node::FOLDER ? folders : others).push_back(name);
        }
        if (folders.empty()) {
            add(Severity::ERROR, "no-version-folder",
                shown(boardFolder) + " holds no folder, only " + listed(others) + '.',
                "takes the name " + shown(names.front()) + " for the version folder and " + uploadFailsEffect,
                "Put the board's version folder into it, and nothing else.");
            return false;
        }
        if (folders.size() > 1) {
            add(Severity::ERROR, "several-version-folders",
                shown(boardFolder) + " holds " + std::to_string(folders.size()) + " folders: " + listed(folders) + '.',
                "reads the version from the first name in byte order, " + shown(names.front()) +
                    ", but its upload takes the files of every one of them, one over the other: the board gets those of "
                    "the last. It may install another version than it compared with, and do so at every run.",
                "Leave only the folder of the version that is to be installed.");
        }
        const auto first = std::find_if(others.begin(), others.end(),
                                        [&](const auto& name) { return !surelyBehind(name, folders[0]); });
        if (first != others.end()) {
            add(Severity::ERROR, "name-before-version-folder",
                shown(*first) + " is no folder but comes before the version folder " + shown(folders.front()) +
                    (*first < folders.front() ? " in byte order." : " in the order of some locales."),
                "takes the name that its \"ls\" lists first for the version folder, and the text behind its first five "
                "bytes for the version. The board never has that one: it installs at every run, 13 minutes each, or never "
                "when the name is too short.",
                "Leave nothing but the version folder in " + shown(boardFolder) + '.');
        } else if (!others.empty()) {
            add(Severity::NOTE, "name-beside-version-folder",
                shown(boardFolder) + " also holds " + listed(others) + '.',
                "does not look at it, because it comes behind the version folder.",
                "Leave nothing but the version folder in it.");
        }
        return true;
    }

    void checkArchiveFile(const std::vector<std::string>& names)
    {
        const std::string path = uploadedPath(names, archiveName);
        const Node node = mStick.node(path);
        const Descriptor file = openFile(path, node);
        if (file) {
            const auto read = [&](std::uint64_t offset, char* buffer, std::size_t length) {
                return readAt(file.number(), offset, buffer, length);
            };
            checkArchive({node.size, read}, shown(path), mReport);
        }
    }

    void checkScriptFile(const std::vector<std::string>& names)
    {
        const std::string path = uploadedPath(names, scriptName);
        const Node node = mStick.node(path);
        const Descriptor file = openFile(path, node);
        if (!file) {
            return;
        }
        std::string start(static_cast<std::size_t>(std::min<std::uint64_t>(node.size, scriptBytesChecked)), '\0');
        if (readAt(file.number(), 0, start.data(), start.size()) != start.size()) {
            addUnreadable(path, EIO, uploadFailsEffect);
            return;
        }
        checkScript(start, node.size, shown(path), mReport);
        checkRunBit(node.mode, mStick.keepsPermissions(), mOnUnit, shown(path), mReport);
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
            misspelled = reportCase(folder, file, found, Severity::ERROR, uploadFailsEffect) || misspelled;
            if (found) {
                last = path;
                continue;
            }
            const std::vector<std::string> likes = lookalikes(folder, file);
            similar.insert(similar.end(), likes.begin(), likes.end());
        }
        if (last.empty() && !misspelled) {
            add(Severity::ERROR, "file-missing",
                shown(file) + " is missing in the version folder" +
                    (similar.empty() ? "." : ", which holds " + listed(similar) + '.'),
                uploadFailsEffect,
                similar.empty() ? "Copy it into the version folder." : "Rename it to " + shown(file) + '.');
        }
        return last;
    }

    /// Opens the file at `path` when it is a plain and not an empty one, and reports anything else. An empty path has
    /// been reported before.
    Descriptor openFile(const std::string& path, const Node& node)
    {
        if (path.empty() || reportUnusable(path, node, uploadFailsEffect)) {
            return Descriptor();
        }
        if (node.kind != Node::FILE) {
            add(Severity::ERROR, "no-plain-file",
                shown(path) + (node.kind == Node::FOLDER ? " is a folder, no file." : " is no plain file."),
                uploadFailsEffect, "Put the file itself in its place.");
            return Descriptor();
        }
        if (node.size == 0) {
            add(Severity::ERROR, "file-empty", shown(path) + " is empty.",
                "copies it. Nothing is installed on the board, and after 13 minutes the update counts as done.",
                "Copy the file to the stick again, and release the stick before pulling it out.");
            return Descriptor();
        }
        Descriptor file = mStick.openFile(path);
        if (!file) {
            addUnreadable(path, errno, uploadFailsEffect);
        }
        return file;
    }

    /// ls(1) prints the path of anything but a folder, and only its path requests TeamViewer.
    void checkMarker()
    {
        const std::string effect = "installs no TeamViewer.";
        const std::string path = inFolder(markerFolder, markerName);
        const Node node = mStick.node(path);
        const bool requested = node.present && node.kind != Node::FOLDER;
        mReport.addFact("teamviewer_requested", "TeamViewer",
                        requested ? "requested; only the main head installs it" : "not requested", requested);

        const bool misspelled = reportCase(markerFolder, markerName, node.present, Severity::WARNING, effect);
        if (node.kind == Node::FOLDER) {
            add(Severity::WARNING, "marker-is-folder",
                shown(path) + " is a folder. Only a plain file requests TeamViewer.", effect,
                "Replace the folder by an empty file of this name, or remove it.");
        } else if (node.kind == Node::UNREADABLE || (node.present && node.kind == Node::LEADS_OUT)) {
            reportUnusable(path, node, effect);
        } else if (!node.present && !misspelled) {
            // A text editor or Windows adds an extension to the marker's name.
            for (const std::string& name : lookalikes(markerFolder, markerName)) {
                add(Severity::WARNING, "marker-name", shown(name) + " is not the name that requests TeamViewer.",
                    effect, "Rename it to " + shown(markerName) + ", or remove it.");
            }
        }
    }

    const StickFolder& mStick;
    bool mOnUnit;
    Report& mReport;
};

bool isUnitMountPoint(const std::string& path)
{
    const std::unique_ptr<char, void (*)(void*)> real(realpath(path.c_str(), nullptr), std::free);
    return real && std::strcmp(real.get(), stickMountPoint) == 0;
}

} // namespace

int runStick(const std::string& path, bool json, std::ostream& out, std::ostream& errors)
{
    const StickFolder stick(path);
    if (stick.error() != 0) {
        if (json) {
            out << refusal("stick", std::string("the stick cannot be read: ") + std::strerror(stick.error())).dump(2)
                << '\n';
        }
        errors << "harl-updater-tool: " << shown(path) << " cannot be read: " << std::strerror(stick.error()) << ". "
               << (stick.error() == EACCES ? "Run this check as root.\n"
                                           : "Name the folder that the stick is mounted at, the one that holds "
                                             "\"debs\".\n");
        return Report::STATUS_UNCHECKED;
    }
    Report report("stick", "The stick at " + shown(path));
    checkStick(stick, isUnitMountPoint(path), report);
    report.write(json, out);
    return report.status();
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
        report.add({Severity::ERROR, "version-missing",
                    shown(line) + " is too short: five bytes are the prefix, and behind them is no version.",
                    noVersionEffect, nameFolderRemedy});
        return version;
    }
    if (line != name || version.find('\r') != std::string::npos) {
        report.add({Severity::ERROR, "version-line-break", "The name " + shown(name) + " holds a line break.",
                    "reads the version only up to a line feed, and never finds a board's version equal to one with a "
                    "carriage return: it installs at every run.",
                    nameFolderRemedy});
        return version;
    }
    const bool usual = version.find_first_not_of(
                           "0123456789abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ.+~_-") == std::string::npos;
    if (!usual) {
        report.add(
            {Severity::WARNING, "version-unusual", "The version " + shown(version) + " holds unusual characters.",
             "compares it with the board's byte for byte. Unless the board reports exactly this text afterwards, it "
             "installs again at every run, 13 minutes each.",
             "Compare the folder's name with the maker's, blanks at its end included."});
    }
    const char lastOfPrefix = line[versionPrefixLength - 1];
    if (!isDigit(version.front()) || isDigit(lastOfPrefix) || lastOfPrefix == '.') {
        report.add({Severity::WARNING, "version-start",
                    "The prefix would be " + shown(line.substr(0, versionPrefixLength)) + " and the version " +
                        shown(version) + ": the prefix seems to have more or fewer than five bytes.",
                    "drops the first five bytes whatever they are and compares the rest with the board's version. It "
                    "installs at every run, 13 minutes each, when the two never become equal.",
                    nameFolderRemedy});
    }
    return version;
}
