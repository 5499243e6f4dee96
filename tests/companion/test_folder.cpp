#include "test_folder.h"

#include <cstdlib>
#include <fstream>
#include <stdexcept>

#include <sys/stat.h>
#include <unistd.h>

namespace fs = std::filesystem;

TestFolder::TestFolder()
{
    std::string pattern = fs::temp_directory_path() / "harl-updater-test-XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr || chmod(pattern.c_str(), 0755) != 0) {
        throw std::runtime_error("no temporary folder: " + pattern);
    }
    mRoot = pattern;
}

TestFolder::~TestFolder()
{
    std::error_code error;
    fs::remove_all(mRoot, error);
}

void TestFolder::put(const std::string& relative, const std::string& content, mode_t mode) const
{
    fs::create_directories(path(relative).parent_path());
    std::ofstream file(path(relative), std::ios::binary);
    file << content;
    file.close();
    if (!file || chmod(path(relative).c_str(), mode) != 0) {
        throw std::runtime_error("cannot be written: " + path(relative).string());
    }
}

void TestFolder::makeFolder(const std::string& relative) const
{
    fs::create_directories(path(relative));
}

void TestFolder::makeLink(const std::string& relative, const std::string& target) const
{
    fs::create_directories(path(relative).parent_path());
    fs::create_symlink(target, path(relative));
}

AsNobody::AsNobody() : mUser(geteuid())
{
    if (mUser == 0 && seteuid(65534) != 0) {
        throw std::runtime_error("root's rights cannot be given up");
    }
}

AsNobody::~AsNobody()
{
    if (mUser == 0 && seteuid(0) != 0) {
        std::abort();
    }
}
