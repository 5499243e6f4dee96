/// The check of a stick's layout against glob(3) and scandir(3). Input: names on the stick, separated by the byte 0x1E.
/// Each is a letter, a path, and after the byte 0x1F its content: d a folder, f a file, x one with its run bit, z an
/// intact archive, l a symbolic link to its content, p a pipe.

#include "Input.h"
#include "Printable.h"
#include "stick/stick_check.h"
#include "stick/zip_file.h"

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <fstream>

#include <dirent.h>
#include <fcntl.h>
#include <glob.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace
{

namespace fs = std::filesystem;
const std::string intactArchive = zipArchive({{"a", "x"}});

/// The fuzzer's own empty folder, removed at its end.
const std::string& temporaryFolder()
{
    static const std::string path = [] {
        std::string name = fs::temp_directory_path() / "fuzz-stick-XXXXXX";
        expect(mkdtemp(name.data()) != nullptr, "a temporary folder");
        return fs::canonical(name).string();
    }();
    static const int registered = std::atexit([] { fs::remove_all(temporaryFolder()); });
    expect(registered == 0, "a clean end");
    return path;
}

/// Puts one name on the stick. The kernel keeps it there: no link is followed on the way.
void put(int root, const std::string& text)
{
    const std::size_t end = std::min(text.find('\x1F'), text.size());
    const std::string path = text.substr(0, end).substr(std::min<std::size_t>(1, end));
    const std::string content = end < text.size() ? text.substr(end + 1) : "";
    const std::size_t slash = path.rfind('/');
    const std::string above = slash == std::string::npos ? "." : path.substr(0, slash);
    const std::string name = slash == std::string::npos ? path : path.substr(slash + 1);

    open_how how = {};
    how.flags = O_PATH | O_DIRECTORY | O_CLOEXEC;
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS;
    const int folder = static_cast<int>(syscall(SYS_openat2, root, above.c_str(), &how, sizeof how));
    if (folder < 0) {
        return;
    }
    const char kind = text.empty() ? ' ' : text.front();
    if (kind == 'd') {
        mkdirat(folder, name.c_str(), 0755);
    } else if (kind == 'l') {
        [[maybe_unused]] const int done = symlinkat(content.c_str(), folder, name.c_str());
    } else if (kind == 'p') {
        mkfifoat(folder, name.c_str(), 0644);
    } else if (kind == 'f' || kind == 'x' || kind == 'z') {
        const int flags = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
        const int file = openat(folder, name.c_str(), flags, kind == 'x' ? 0755 : 0644);
        const std::string& bytes = kind == 'z' ? intactArchive : content;
        if (file >= 0) {
            expect(write(file, bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size()), "a written file");
            close(file);
        }
    }
    close(folder);
}

/// The names that ls(1) prints of the board's folder, in byte order.
std::vector<std::string> listing(const std::string& folder)
{
    std::vector<std::string> names;
    dirent** entries = nullptr;
    const int count = scandir(
        folder.c_str(), &entries, [](const dirent* entry) { return entry->d_name[0] == '.' ? 0 : 1; }, nullptr);
    for (int index = 0; index < count; ++index) {
        names.emplace_back(entries[index]->d_name);
        std::free(entries[index]);
    }
    std::free(entries);
    std::sort(names.begin(), names.end());
    return names;
}

/// The paths that the upload's command line names.
std::vector<std::string> uploaded(const std::string& folder, const std::string& file)
{
    glob_t found = {};
    const int status = glob((folder + "/*/" + file).c_str(), 0, nullptr, &found);
    std::vector<std::string> paths;
    if (status == 0) {
        paths.assign(found.gl_pathv, found.gl_pathv + found.gl_pathc);
    }
    globfree(&found);
    return paths;
}

/// True for a plain file on the stick that is not empty, whatever links lead to it.
bool isFileOn(const std::string& root, const std::string& path)
{
    std::error_code error;
    const std::string real = fs::canonical(path, error).string();
    return !error && real.rfind(root + '/', 0) == 0 && fs::is_regular_file(real) && fs::file_size(real) > 0;
}

std::string contentOf(const std::string& path)
{
    std::ifstream file(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size)
{
    const std::string root = temporaryFolder() + "/stick";
    fs::create_directory(root);
    const int rootFolder = open(root.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
    const std::string input(reinterpret_cast<const char*>(data), size);
    for (std::size_t begin = 0; begin < input.size();) {
        const std::size_t end = std::min(input.find('\x1E', begin), input.size());
        put(rootFolder, input.substr(begin, end - begin));
        begin = end + 1;
    }
    close(rootFolder);

    Report report("stick", "A stick");
    checkStick(StickFolder(root), false, report);
    expectPrintable(report);

    const std::string folder = root + "/debs/QUORB/armhf";
    const std::vector<std::string> names = listing(folder);
    const std::vector<std::string> archives = uploaded(folder, "OSUpgrade.zip");
    const std::vector<std::string> scripts = uploaded(folder, "unzipUpgrade.sh");
    const bool found = !names.empty() && archives == std::vector{folder + '/' + names.front() + "/OSUpgrade.zip"} &&
                       scripts == std::vector{folder + '/' + names.front() + "/unzipUpgrade.sh"} &&
                       isFileOn(root, archives.front()) && isFileOn(root, scripts.front()) &&
                       access(scripts.front().c_str(), X_OK) == 0;
    const std::string name = names.empty() ? "" : names.front();
    const bool versioned = name.size() > 5 && name.find_first_of("\r\n") == std::string::npos;
    if (report.status() == Report::STATUS_FIT) {
        expect(found && versioned, "what is fit can be uploaded");
        expect(report.toJson()["facts"]["version"] == escaped(name.substr(5)), "the version");
    } else if (found && versioned && names.size() == 1) {
        const std::string script = contentOf(scripts.front());
        const bool linked =
            fs::canonical(archives.front()) != archives.front() || fs::canonical(scripts.front()) != scripts.front();
        const bool good = !linked && script.rfind("#!/bin/sh\n", 0) == 0 && script.find('\r') == std::string::npos;
        expect(!good || contentOf(archives.front()) != intactArchive, "what can be uploaded is fit");
    }
    fs::remove_all(root);
    return 0;
}
