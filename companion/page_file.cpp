#include "page_file.h"

#include "command.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>

#include <sys/stat.h>
#include <unistd.h>

std::string objectionTo(const std::string& path, const std::vector<std::string>& read)
{
    struct stat page = {};
    if (lstat(path.c_str(), &page) != 0) {
        return "";
    }
    if (!S_ISREG(page.st_mode)) {
        return "not a plain file; name another one for the page";
    }
    const auto isPage = [&](const std::string& file) {
        struct stat log = {};
        const int result = file == "-" ? fstat(STDIN_FILENO, &log) : stat(file.c_str(), &log);
        return result == 0 && page.st_dev == log.st_dev && page.st_ino == log.st_ino;
    };
    const bool same = read.empty() ? isPage("-") : std::any_of(read.begin(), read.end(), isPage);
    return same ? "the log itself; name another file for the page" : "";
}

std::string writeFile(const std::string& path, std::iostream& content)
{
    const HeldSignals signals; // until all of it is there
    std::ofstream file(path, std::ios::binary);
    if (!file) {
        return std::strerror(errno);
    }
    content.seekg(0);
    file << content.rdbuf();
    file.close();
    if (!content || !file) {
        std::string wrong = std::strerror(errno);
        std::remove(path.c_str());
        return wrong;
    }
    return "";
}
