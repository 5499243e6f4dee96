#include "stick.h"

#include "descriptor.h"
#include "stick_archive.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <optional>
#include <ostream>
#include <utility>

#include <dirent.h>
#include <fcntl.h>
#include <linux/magic.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/vfs.h>

namespace
{

const std::size_t mostNames = 10'000; // of one folder
const std::size_t prefixLength = 5;   // bytes of the version folder's name, in front of the version

const char boardFolder[] = "debs/QUORB/armhf";
const char archiveName[] = "OSUpgrade.zip";
const char scriptName[] = "unzipUpgrade.sh";
const char markerFolder[] = "debs";
const char markerName[] = "installTV";

const std::string noVersionEffect =
    "finds no version on the stick (log: \"Failed to check candidate QUORB version\" or \"Failed to checkUpdate\") and "
    "leaves the board as it is. The panel shows \"nothing to update\" when the head's package is up to date, and a "
    "failed check when it has just been installed.";
const std::string uploadFailsEffect =
    "tries the upload 20 times, gives up and shows the fail pattern; the board stays as it is.";
const std::string scriptFailsEffect =
    "copies the files and cannot start the script on the board: only the script's status in the log tells so. It waits "
    "13 minutes and shows a finished update, but the board still has its old version.";

/// What a path on the stick is, symbolic links followed within the stick.
struct Node
{
    enum Kind {
        MISSING,
        FOLDER,
        FILE,
        SPECIAL,       ///< a device, pipe or socket
        LEADS_OUT,     ///< a symbolic link that leads out of the stick
        LEADS_NOWHERE, ///< a symbolic link to nothing or to itself
        UNREADABLE,
    };

    Kind kind = MISSING;
    bool present = false; ///< The name itself is there, whatever it leads to.
    int error = 0;        ///< errno of UNREADABLE
    std::string target;   ///< where it leads when it is a symbolic link
    std::uint64_t size = 0;
    mode_t mode = 0;
};

/// The names in a folder, without "." and "..", in byte order as ls(1) sorts them in the C locale.
struct Names
{
    std::vector<std::string> names;
    bool tooMany = false; ///< More than mostNames: the rest was not read.
    int error = 0;        ///< errno when the folder could not be read to its end
};

bool isHidden(const std::string& name)
{
    return name.front() == '.'; // neither ls(1) nor a `*` of the shell shows it
}

std::string lowerCase(std::string text)
{
    std::transform(text.begin(), text.end(), text.begin(), [](char letter) {
        return letter >= 'A' && letter <= 'Z' ? static_cast<char>(letter + 32) : letter;
    });
    return text;
}

std::string errorText(int error)
{
    return std::strerror(error);
}

/// A mounted stick, or a folder that is to become one. Nothing outside it can be reached.
class Stick
{
public:
    explicit Stick(Descriptor root) : mRoot(std::move(root)) {}

    Node node(const std::string& path) const
    {
        Node result;
        struct stat status = {};
        const Descriptor itself = open(path, O_PATH | O_NOFOLLOW);
        if (!itself || fstat(itself.number(), &status) != 0) {
            const bool missing = errno == ENOENT || errno == ENOTDIR;
            result.kind = missing ? Node::MISSING : errno == EXDEV ? Node::LEADS_OUT : Node::UNREADABLE;
            result.error = errno;
            return result;
        }
        result.present = true;
        if (S_ISLNK(status.st_mode)) {
            std::array<char, 4096> target{};
            const ssize_t length = readlinkat(itself.number(), "", target.data(), target.size());
            result.target.assign(target.data(), static_cast<std::size_t>(std::max<ssize_t>(length, 0)));
        }
        const Descriptor followed = open(path, O_PATH);
        if (!followed || fstat(followed.number(), &status) != 0) {
            result.kind = errno == EXDEV                      ? Node::LEADS_OUT
                          : errno == ENOENT || errno == ELOOP ? Node::LEADS_NOWHERE
                                                              : Node::UNREADABLE;
            result.error = errno;
            return result;
        }
        result.kind = S_ISDIR(status.st_mode) ? Node::FOLDER : S_ISREG(status.st_mode) ? Node::FILE : Node::SPECIAL;
        result.size = static_cast<std::uint64_t>(status.st_size);
        result.mode = status.st_mode;
        return result;
    }

    Names names(const std::string& path) const
    {
        Names result;
        Descriptor folder = open(path, O_RDONLY | O_DIRECTORY);
        const std::unique_ptr<DIR, int (*)(DIR*)> stream(folder ? fdopendir(folder.number()) : nullptr, closedir);
        if (!stream) {
            result.error = errno;
            return result;
        }
        folder.release(); // closedir() closes it
        errno = 0;
        while (const dirent* entry = readdir(stream.get())) {
            const std::string name = entry->d_name;
            if (name == "." || name == "..") {
                continue;
            }
            if (result.names.size() == mostNames) {
                result.tooMany = true;
                break;
            }
            result.names.push_back(name);
        }
        result.error = result.tooMany ? 0 : errno;
        std::sort(result.names.begin(), result.names.end());
        return result;
    }

    /// Opens a plain file for reading; call it for no other kind of node.
    Descriptor openFile(const std::string& path) const { return open(path, O_RDONLY | O_NONBLOCK | O_NOCTTY); }

    /// True when the file system keeps permissions with its files; else the mount's options make them up.
    bool keepsPermissions() const
    {
        const std::array<unsigned long, 5> without = {MSDOS_SUPER_MAGIC, EXFAT_SUPER_MAGIC, 0x7366746e /* ntfs3 */,
                                                      0x5346544e /* ntfs */, FUSE_SUPER_MAGIC};
        struct statfs system = {};
        return fstatfs(mRoot.number(), &system) != 0 ||
               std::find(without.begin(), without.end(), static_cast<unsigned long>(system.f_type)) == without.end();
    }

    /// True when the folder is the root of a mounted file system.
    bool isMounted() const
    {
        struct stat here = {};
        struct stat above = {};
        return fstat(mRoot.number(), &here) == 0 && fstatat(mRoot.number(), "..", &above, 0) == 0 &&
               (here.st_dev != above.st_dev || here.st_ino == above.st_ino);
    }

private:
    /// openat2(2) below the root; the kernel refuses with EXDEV whatever leads out.
    Descriptor open(const std::string& path, int flags) const
    {
        open_how how = {};
        how.flags = static_cast<std::uint64_t>(flags | O_CLOEXEC);
        how.resolve = RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS;
        return Descriptor(static_cast<int>(syscall(SYS_openat2, mRoot.number(), path.c_str(), &how, sizeof how)));
    }

    Descriptor mRoot;
};

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

std::string listed(const std::vector<std::string>& names)
{
    const std::size_t count = std::min<std::size_t>(names.size(), 5);
    std::string result;
    for (std::size_t index = 0; index < count; ++index) {
        result += (index == 0 ? "" : ", ") + shown(names[index]);
    }
    return names.size() == count ? result : result + " and " + std::to_string(names.size() - count) + " more";
}

/// The stick check: each operation adds to the report what it finds.
class StickCheck
{
public:
    StickCheck(const Stick& stick, bool onUnit, Report& report) : mStick(stick), mOnUnit(onUnit), mReport(report) {}

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
            shown(path) + " cannot be read: " + errorText(error) + '.', denied ? "reads it as root." : effect,
            denied ? "Run this check as root." : "Use another stick.");
    }

    /// Reports a link that leads out or nowhere, and a node that cannot be read. False when there was none of these.
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

    /// Reports a name in `folder` that differs from `wanted` in upper and lower case only. `found` tells whether the
    /// file system finds the wanted name all the same. False when there was none.
    bool reportCase(const std::string& folder, const std::string& wanted, bool found, const std::string& effect)
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
        add(found ? Severity::WARNING : Severity::ERROR, "name-case",
            shown(*other) + " in " + shown(folder) + " must be named " + shown(wanted) +
                ", with these upper and lower case letters.",
            found ? "finds it, but only because this file system takes upper and lower case for the same." : effect,
            "Rename it to " + shown(wanted) + '.');
        return true;
    }

    /// Walks down to the board's folder. True when it is there.
    bool checkFolders()
    {
        std::string parent = ".";
        for (const std::string path : {"debs", "debs/QUORB", "debs/QUORB/armhf"}) {
            const std::string name = path.substr(path.rfind('/') + 1);
            const Node node = mStick.node(path);
            const bool misspelled = (node.kind == Node::MISSING || node.kind == Node::FOLDER) &&
                                    reportCase(parent, name, node.kind == Node::FOLDER, noVersionEffect);
            if (reportUnusable(path, node, noVersionEffect)) {
                return false;
            }
            if (node.kind != Node::FOLDER) {
                if (!misspelled) {
                    add(Severity::ERROR, "no-board-folder",
                        shown(path) + (node.kind == Node::MISSING ? " is missing." : " is no folder."), noVersionEffect,
                        std::string("Put the board's version folder into ") + shown(boardFolder) + " on the stick.");
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
                shown(boardFolder) + " holds more than " + counted(mostNames, "name") + ": they were not looked at.",
                "takes the first of them for the version folder.", "Leave nothing but the version folder in it.");
            return;
        }
        std::vector<std::string> names;
        std::vector<std::string> folders;
        std::vector<std::string> others;
        for (const std::string& name : all.names) {
            if (isHidden(name)) {
                continue;
            }
            const std::string path = std::string(boardFolder) + '/' + name;
            const Node node = mStick.node(path);
            names.push_back(name);
            reportUnusable(path, node, "may take its name for the version folder.");
            (node.kind == Node::FOLDER ? folders : others).push_back(name);
        }
        if (names.empty()) {
            const bool hidden = !all.names.empty();
            add(Severity::ERROR, "no-version-folder",
                shown(boardFolder) +
                    (hidden ? " holds only hidden names: " + listed(all.names) + '.' : std::string(" is empty.")),
                noVersionEffect,
                hidden ? "Give the version folder a name that does not begin with a dot."
                       : "Put the board's version folder into it.");
            return;
        }

        checkOrder(names, folders, others);
        const std::string version = checkVersionName(names.front(), mReport);
        if (!version.empty()) {
            mReport.addFact("version", "Version",
                            shown(version) + ": the board is updated unless it reports exactly this", escaped(version));
        }
        if (folders.empty()) {
            return;
        }
        checkUploads(names);
    }

    /// Checks that the version check and the upload mean the same folder.
    void checkOrder(const std::vector<std::string>& names, const std::vector<std::string>& folders,
                    const std::vector<std::string>& others)
    {
        mReport.addFact("version_folder", "Version folder", shown(names.front()), escaped(names.front()));
        if (folders.empty()) {
            add(Severity::ERROR, "no-version-folder",
                shown(boardFolder) + " holds no folder, only " + listed(others) + '.',
                "takes the name " + shown(names.front()) +
                    " for the version folder. When that differs from the board's "
                    "version it " +
                    uploadFailsEffect,
                "Put the board's version folder into it, and nothing else.");
            return;
        }
        if (folders.size() > 1) {
            add(Severity::ERROR, "several-version-folders",
                shown(boardFolder) + " holds " + std::to_string(folders.size()) + " folders: " + listed(folders) + '.',
                "reads the version from the first in byte order, " + shown(names.front()) +
                    ", but its upload takes the files of every one of them, one over the other: the board gets those of "
                    "the last. It may install another version than it compared with, and do so at every run.",
                "Leave only the folder of the version that is to be installed.");
        }
        if (names.front() != folders.front()) {
            add(Severity::ERROR, "name-before-version-folder",
                shown(names.front()) + " is no folder but comes before the version folder " + shown(folders.front()) +
                    " in byte order.",
                "takes the name " + shown(names.front()) +
                    " for the version folder, and its text behind the first five "
                    "bytes for the version.",
                "Leave nothing but the version folder in " + shown(boardFolder) + '.');
        } else if (!others.empty()) {
            add(Severity::NOTE, "name-beside-version-folder",
                shown(boardFolder) + " also holds " + listed(others) + '.',
                "does not look at it, because it comes behind the version folder.",
                "Leave nothing but the version folder in it.");
        }
    }

    /// Checks both files in the folder that their upload takes them from in the end.
    void checkUploads(const std::vector<std::string>& names)
    {
        const std::optional<std::string> archive = uploadedPath(names, archiveName);
        if (archive) {
            checkFile(*archive, [&](int descriptor, const Node& node) {
                const ArchiveSource source = {node.size,
                                              [descriptor](std::uint64_t offset, char* buffer, std::size_t length) {
                                                  return readAt(descriptor, offset, buffer, length);
                                              }};
                checkArchive(source, shown(*archive), mReport);
            });
        }
        const std::optional<std::string> script = uploadedPath(names, scriptName);
        if (script) {
            checkFile(*script, [&](int descriptor, const Node& node) {
                std::string start(std::min<std::uint64_t>(node.size, scriptBytesChecked), '\0');
                if (readAt(descriptor, 0, start.data(), start.size()) != start.size()) {
                    addUnreadable(*script, EIO, uploadFailsEffect);
                    return;
                }
                checkScript(start, node.size, shown(*script), mReport);
                checkRunBit(*script, node);
            });
        }
    }

    /// What the `*` of the upload's command line finds of `file`: the path that arrives last, so the one that stays.
    std::optional<std::string> uploadedPath(const std::vector<std::string>& names, const std::string& file)
    {
        std::vector<std::string> paths;
        for (const std::string& name : names) {
            const std::string path = std::string(boardFolder) + '/' + name + '/' + file;
            if (mStick.node(path).present) {
                paths.push_back(path);
            }
        }
        if (paths.size() > 1) {
            add(Severity::ERROR, "several-uploads",
                counted(paths.size(), "folder") + " hold " + shown(file) + ": " + listed(paths) + '.',
                "copies all of them to the same place on the board: " + shown(paths.back()) + " is the one that stays.",
                "Leave only the folder of the version that is to be installed.");
        }
        bool misspelled = false;
        std::vector<std::string> similar;
        const std::string stem = lowerCase(file.substr(0, file.find('.')));
        for (const std::string& name : names) {
            const std::string folder = std::string(boardFolder) + '/' + name;
            if (mStick.node(folder).kind != Node::FOLDER) {
                continue;
            }
            const bool found = mStick.node(folder + '/' + file).present;
            misspelled = reportCase(folder, file, found, uploadFailsEffect) || misspelled;
            for (const std::string& neighbour : mStick.names(folder).names) {
                if (lowerCase(neighbour).find(stem) != std::string::npos) {
                    similar.push_back(neighbour);
                }
            }
        }
        if (!paths.empty()) {
            return paths.back();
        }
        if (!misspelled) {
            add(Severity::ERROR, "file-missing",
                shown(file) + " is missing in the version folder" +
                    (similar.empty() ? "." : ", which holds " + listed(similar) + '.'),
                "when the board has another version: " + uploadFailsEffect,
                similar.empty() ? "Copy it into the version folder." : "Rename it to " + shown(file) + '.');
        }
        return std::nullopt;
    }

    /// Opens the plain, not empty file at `path` for `check`; reports anything else.
    template <typename Check>
    void checkFile(const std::string& path, Check check)
    {
        const Node node = mStick.node(path);
        if (reportUnusable(path, node, "when the board has another version: " + uploadFailsEffect)) {
            return;
        }
        if (node.kind != Node::FILE) {
            add(Severity::ERROR, "no-plain-file",
                shown(path) + (node.kind == Node::FOLDER ? " is a folder, no file." : " is no plain file."),
                "when the board has another version: " + uploadFailsEffect, "Put the file itself in its place.");
            return;
        }
        if (node.size == 0) {
            add(Severity::ERROR, "file-empty", shown(path) + " is empty.",
                "copies it. Nothing is installed on the board, and after 13 minutes the update counts as done.",
                "Copy the file to the stick again, and release the stick before pulling it out.");
            return;
        }
        const Descriptor file = mStick.openFile(path);
        if (!file) {
            addUnreadable(path, errno, uploadFailsEffect);
            return;
        }
        check(file.number(), node);
    }

    void checkRunBit(const std::string& path, const Node& node)
    {
        const mode_t runBits = S_IXUSR | S_IXGRP | S_IXOTH;
        if ((node.mode & runBits) != 0) {
            return;
        }
        if (mOnUnit || mStick.keepsPermissions()) {
            add(Severity::ERROR, "script-run-bit", shown(path) + " has no run bit.",
                scriptFailsEffect + " A board that has the script from an earlier update keeps that one's run bit.",
                mStick.keepsPermissions() ? "Set it: chmod +x unzipUpgrade.sh"
                                          : "Mount the stick with the option fmask=0022.");
            return;
        }
        add(Severity::WARNING, "script-run-bit",
            shown(path) + " has no run bit here. This file system keeps none: the mount's options decide on the unit.",
            "copies the script with the run bit that the unit's mount gives it.",
            "Run this check on the unit as well.");
    }

    void checkMarker()
    {
        const std::string path = std::string(markerFolder) + '/' + markerName;
        const std::string effect = "installs no TeamViewer.";
        const Node node = mStick.node(path);
        const bool misspelled = mStick.node(markerFolder).kind == Node::FOLDER &&
                                reportCase(markerFolder, markerName, node.present, effect);
        if (node.kind == Node::FOLDER) {
            add(Severity::WARNING, "marker-is-folder",
                shown(path) + " is a folder. Only a plain file requests TeamViewer.", effect,
                "Replace the folder by an empty file of this name, or remove it.");
        } else if (node.present && node.kind == Node::LEADS_OUT) {
            reportUnusable(path, node, effect);
        } else if (!node.present && !misspelled) {
            checkMarkerLookalikes(effect);
        }
        const bool requested = node.present && node.kind != Node::FOLDER;
        mReport.addFact("teamviewer_requested", "TeamViewer",
                        requested ? "requested; only the main head installs it" : "not requested", requested);
    }

    /// A text editor or Windows adds an extension to the marker's name.
    void checkMarkerLookalikes(const std::string& effect)
    {
        for (const std::string& name : mStick.names(markerFolder).names) {
            if (lowerCase(name).rfind(lowerCase(markerName) + std::string("."), 0) == 0) {
                add(Severity::WARNING, "marker-name", shown(name) + " is not the name that requests TeamViewer.",
                    effect, "Rename it to " + shown(markerName) + ", or remove it.");
            }
        }
    }

    const Stick& mStick;
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
    Descriptor root(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!root) {
        errors << "harl-updater-tool: " << shown(path) << " cannot be read: " << errorText(errno)
               << ". Name the folder that the stick is mounted at, the one that holds \"debs\".\n";
        return Report::STATUS_UNCHECKED;
    }
    Report report("stick", "The stick at " + shown(path));
    StickCheck(Stick(std::move(root)), isUnitMountPoint(path), report).run();
    report.write(json, out);
    return report.status();
}

void checkScript(std::string_view start, std::uint64_t size, const std::string& name, Report& report)
{
    const std::size_t firstLineBytes = 255; // what the kernel reads of it, execve(2)
    const auto refuse = [&](const std::string& what, const std::string& remedy) {
        report.add({Severity::ERROR, "script-first-line", name + ": " + what, scriptFailsEffect, remedy});
    };

    if (start.substr(0, 4) == "\x7f"
                              "ELF") {
        report.addFact("script_interpreter", "Script", byteCount(size) + ", a compiled program", nullptr);
        return;
    }
    const std::string_view firstLine = start.substr(0, start.find('\n'));
    if (start.substr(0, 2) != "#!") {
        refuse("the first line must begin with \"#!\" but is " + shown(firstLine.substr(0, 60)) + '.',
               "Save it as plain text without a byte order mark, with \"#!/bin/sh\" as its first line.");
        return;
    }
    if (firstLine.find('\r') != std::string_view::npos) {
        refuse("the first line ends as Windows ends lines: the kernel looks for an interpreter " +
                   shown(firstLine.substr(2, 60)) + '.',
               "Save it with Unix line ends: sed -i 's/\\r$//' unzipUpgrade.sh");
        return;
    }
    std::string_view interpreter = firstLine.substr(2);
    interpreter.remove_prefix(std::min(interpreter.find_first_not_of(" \t"), interpreter.size()));
    interpreter = interpreter.substr(0, interpreter.find_first_of(" \t"));
    if (interpreter.substr(0, 1) != "/" || firstLine.size() > firstLineBytes ||
        interpreter.find('\0') != std::string_view::npos) {
        refuse("the first line names no interpreter by its whole path: " + shown(firstLine.substr(0, 60)) + '.',
               "Begin the script with \"#!/bin/sh\".");
        return;
    }
    report.addFact("script_interpreter", "Script", byteCount(size) + ", run by " + shown(interpreter),
                   escaped(interpreter));

    // Behind a zero byte a script carries data, not lines.
    const std::string_view text = start.substr(0, start.find('\0'));
    const std::size_t carriageReturn = text.find("\r\n");
    if (carriageReturn != std::string_view::npos) {
        const auto line =
            1 + std::count(text.begin(), text.begin() + static_cast<std::ptrdiff_t>(carriageReturn), '\n');
        report.add(
            {Severity::ERROR, "script-line-ends",
             name + ": line " + std::to_string(line) + " ends as Windows ends lines (carriage return, line feed).",
             "copies it; the board's shell takes the carriage return for a part of the line's last word. The "
             "script fails or does something else, and the update still counts as done.",
             "Save it with Unix line ends: sed -i 's/\\r$//' unzipUpgrade.sh"});
    }
}

std::string checkVersionName(const std::string& name, Report& report)
{
    const auto isDigit = [](char letter) { return letter >= '0' && letter <= '9'; };
    const std::string line = name.substr(0, name.find('\n'));
    const std::string version = line.size() > prefixLength ? line.substr(prefixLength) : "";
    if (version.empty()) {
        report.add({Severity::ERROR, "version-missing",
                    shown(line) + " is too short: five bytes are the prefix, and behind them is no version.",
                    noVersionEffect, "Name the folder with its five-character prefix and the version behind it."});
        return version;
    }
    if (line != name || version.find('\r') != std::string::npos) {
        report.add({Severity::ERROR, "version-line-break", "The name " + shown(name) + " holds a line break.",
                    "reads the version only up to a line feed, and never finds a board's version equal to one with a "
                    "carriage return: it installs at every run.",
                    "Name the folder with its five-character prefix and the version behind it."});
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
    const char lastOfPrefix = line[prefixLength - 1];
    if (!isDigit(version.front()) || isDigit(lastOfPrefix) || lastOfPrefix == '.') {
        report.add({Severity::WARNING, "version-start",
                    "The prefix would be " + shown(line.substr(0, prefixLength)) + " and the version " +
                        shown(version) + ": the prefix seems to have more or fewer than five bytes.",
                    "drops the first five bytes whatever they are and compares the rest with the board's version. It "
                    "installs at every run, 13 minutes each, when the two never become equal.",
                    "Name the folder with its five-character prefix and the version behind it."});
    }
    return version;
}
