#include "stick/folder.h"

#include "procedure.h"
#include "texts.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <filesystem>

#include <fcntl.h>
#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/vfs.h>

namespace fs = std::filesystem;

namespace
{

const int mostLinks = 40; // on the way to a file, as the kernel has it: path_resolution(7)
const std::string onUnit = std::string(stickMountPoint) + '/';

/// Where the symbolic link leads; empty for anything else.
std::string targetOf(const Descriptor& node)
{
    std::array<char, 4096> target{};
    const ssize_t length = readlinkat(node.number(), "", target.data(), target.size());
    return {target.data(), static_cast<std::size_t>(std::max<ssize_t>(length, 0))};
}

} // namespace

StickFolder::StickFolder(const std::string& path) : mRoot(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC))
{
    if (!mRoot || !open(".", O_PATH)) { // the second one when it may be listed, but not entered
        mError = errno;
    }
}

Node StickFolder::node(const std::string& path) const
{
    Node result;
    struct stat status = {};
    const Descriptor itself = open(path, O_PATH | O_NOFOLLOW);
    result.present = itself && fstat(itself.number(), &status) == 0;
    if (result.present && S_ISLNK(status.st_mode)) {
        result.target = targetOf(itself);
    }
    const Descriptor followed = open(path, O_PATH);
    if (!followed || fstat(followed.number(), &status) != 0) {
        result.error = errno;
        const bool nowhere = errno == ENOENT || errno == ENOTDIR || (result.present && errno == ELOOP);
        result.kind = errno == EXDEV ? Node::LEADS_OUT
                      : !nowhere     ? Node::UNREADABLE
                                     : (result.present ? Node::LEADS_NOWHERE : Node::MISSING);
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
    const Descriptor folder = open(path, O_RDONLY | O_DIRECTORY);
    if (!folder) {
        result.error = errno;
        return result;
    }
    std::error_code error;
    fs::directory_iterator entry("/proc/self/fd/" + std::to_string(folder.number()), error);
    for (; !error && entry != fs::directory_iterator(); entry.increment(error)) {
        if (result.names.size() == Names::most) {
            result.tooMany = true;
            break;
        }
        result.names.push_back(entry->path().filename());
    }
    result.error = error.value();
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

/// Opens the relative `path` step by step, so that no link and no ".." can lead above the root. openat2(2) would do the
/// same, but only from Linux 5.6 on.
///
/// @return none with EXDEV when it would lead out of the stick
Descriptor StickFolder::open(const std::string& path, int flags) const
{
    std::vector<Descriptor> folders; // from the root to where the walk is
    folders.emplace_back(openat(mRoot.number(), ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
    std::string rest = path;
    int links = 0;
    while (folders.back() && links <= mostLinks) {
        const std::size_t slash = rest.find('/');
        const bool last = slash == std::string::npos;
        const std::string name = rest.substr(0, slash);
        rest.erase(0, last ? slash : slash + 1);
        if (name == "..") {
            folders.pop_back();
        }
        if (folders.empty()) {
            errno = EXDEV;
            return Descriptor();
        }
        const bool stays = name.empty() || name == "." || name == "..";
        const char* const step = stays ? "." : name.c_str();
        const int here = folders.back().number();

        std::string target = targetOf(Descriptor(openat(here, step, O_PATH | O_NOFOLLOW | O_CLOEXEC)));
        if (!target.empty() && (!last || (flags & O_NOFOLLOW) == 0)) {
            if (startsWith(target, onUnit)) { // the stick itself, on the unit
                folders.resize(1);
                target.erase(0, onUnit.size());
            } else if (target.front() == '/') {
                errno = EXDEV;
                return Descriptor();
            }
            rest.insert(0, last ? "" : "/").insert(0, target);
            ++links;
        } else if (last) {
            return Descriptor(openat(here, step, flags | O_NOFOLLOW | O_CLOEXEC));
        } else if (!stays) {
            folders.emplace_back(openat(here, step, O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        }
    }
    errno = links > mostLinks ? ELOOP : errno;
    return Descriptor();
}
