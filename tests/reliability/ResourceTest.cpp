/// What ten thousand commands leave in the process.

#include "UpdateManager.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <string>
#include <sys/wait.h>

namespace
{

namespace fs = std::filesystem;

std::ptrdiff_t openDescriptors()
{
    return std::distance(fs::directory_iterator("/proc/self/fd"), fs::directory_iterator());
}

TEST(Resources, TenThousandCommandsLeaveNoDescriptorAndNoProcess)
{
    std::cout.rdbuf(nullptr);
    const char* variable = std::getenv("PATH");
    ASSERT_NE(variable, nullptr);
    const std::string path = variable;
    std::string tools = testing::TempDir() + "resources-XXXXXX";
    ASSERT_NE(mkdtemp(tools.data()), nullptr);
    fs::create_symlink("/bin/true", fs::path(tools) / "systemctl"); // the machine's own must not be reached
    setenv("PATH", tools.c_str(), 1);
    const std::ptrdiff_t before = openDescriptors();
    std::string output;
    for (int i = 0; i < 5000; ++i) {
        ASSERT_EQ(UpdateManager::runProcess("echo text; exit 3", output), 3);
        ASSERT_EQ(output, "text\n");
        UpdateManager::stopHARL();
    }
    setenv("PATH", path.c_str(), 1);
    fs::remove_all(tools);
    EXPECT_EQ(openDescriptors(), before);
    EXPECT_EQ(waitpid(-1, nullptr, WNOHANG), -1);
    EXPECT_EQ(errno, ECHILD);
}

} // namespace
