#pragma once

#include <filesystem>
#include <string>

#include <sys/types.h>

/// A temporary folder of one test, readable for everybody. It goes with the object.
class TestFolder
{
public:
    TestFolder();
    ~TestFolder();
    TestFolder(const TestFolder&) = delete;
    TestFolder& operator=(const TestFolder&) = delete;

    std::filesystem::path path(const std::string& relative = "") const { return mRoot / relative; }

    /// Makes the file `relative` and the folders above it.
    void put(const std::string& relative, const std::string& content, mode_t mode = 0644) const;

    void makeFolder(const std::string& relative) const;
    void makeLink(const std::string& relative, const std::string& target) const;

private:
    std::filesystem::path mRoot;
};

/// Gives up root's rights as long as it lives; nothing happens to who has none.
class AsNobody
{
public:
    AsNobody();
    ~AsNobody();
    AsNobody(const AsNobody&) = delete;
    AsNobody& operator=(const AsNobody&) = delete;

private:
    uid_t mUser;
};
