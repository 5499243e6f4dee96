#include "page_file.h"

#include "command.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>

std::string objectionTo(const std::string& path, const std::vector<std::string>& read)
{
    namespace fs = std::filesystem;
    std::error_code error;
    const fs::file_status page = fs::symlink_status(path, error);
    if (error || !fs::exists(page)) {
        return "";
    }
    if (!fs::is_regular_file(page)) {
        return "not a plain file; name another one for the page";
    }
    const auto isPage = [&](const std::string& file) {
        return fs::equivalent(path, file == "-" ? "/proc/self/fd/0" : file, error);
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
