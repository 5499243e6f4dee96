#include "stick_folder.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <memory>

#include <dirent.h>
#include <fcntl.h>
#include <linux/magic.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/vfs.h>

StickFolder::StickFolder(const std::string& path) : mRoot(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC))
{
    // The second one fails on a kernel before Linux 5.6, which cannot confine the reading to the stick.
    if (!mRoot || !open(".", O_PATH)) {
        mError = errno;
    }
}

Node StickFolder::node(const std::string& path) const
{
    Node result;
    struct stat status = {};
    const Descriptor itself = open(path, O_PATH | O_NOFOLLOW);
    if (!itself || fstat(itself.number(), &status) != 0) {
        result.error = errno;
        const bool missing = errno == ENOENT || errno == ENOTDIR;
        result.kind = missing ? Node::MISSING : errno == EXDEV ? Node::LEADS_OUT : Node::UNREADABLE;
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
        result.error = errno;
        const bool nowhere = errno == ENOENT || errno == ENOTDIR || errno == ELOOP;
        result.kind = nowhere ? Node::LEADS_NOWHERE : errno == EXDEV ? Node::LEADS_OUT : Node::UNREADABLE;
        return result;
    }
    result.kind = S_ISDIR(status.st_mode) ? Node::FOLDER : S_ISREG(status.st_mode) ? Node::FILE : Node::SPECIAL;
    result.size = static_cast<std::uint64_t>(status.st_size);
    result.mode = status.st_mode;
    return result;
}

Names StickFolder::names(const std::string& path) const
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
        if (result.names.size() == Names::most) {
            result.tooMany = true;
            break;
        }
        result.names.push_back(name);
    }
    result.error = result.tooMany ? 0 : errno;
    std::sort(result.names.begin(), result.names.end());
    return result;
}

Descriptor StickFolder::openFile(const std::string& path) const
{
    return open(path, O_RDONLY | O_NONBLOCK | O_NOCTTY);
}

bool StickFolder::keepsPermissions() const
{
    const std::array<unsigned long, 5> without = {MSDOS_SUPER_MAGIC, EXFAT_SUPER_MAGIC, 0x7366746e /* ntfs3 */,
                                                  0x5346544e /* ntfs */, FUSE_SUPER_MAGIC};
    struct statfs system = {};
    return fstatfs(mRoot.number(), &system) != 0 ||
           std::find(without.begin(), without.end(), static_cast<unsigned long>(system.f_type)) == without.end();
}

bool StickFolder::isMounted() const
{
    struct stat here = {};
    struct stat above = {};
    return fstat(mRoot.number(), &here) == 0 && fstatat(mRoot.number(), "..", &above, 0) == 0 &&
           (here.st_dev != above.st_dev || here.st_ino == above.st_ino);
}

/// openat2(2) below the root; the kernel refuses with EXDEV whatever leads out.
Descriptor StickFolder::open(const std::string& path, int flags) const
{
    open_how how = {};
    how.flags = static_cast<std::uint64_t>(flags | O_CLOEXEC);
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS;
    return Descriptor(static_cast<int>(syscall(SYS_openat2, mRoot.number(), path.c_str(), &how, sizeof how)));
}
