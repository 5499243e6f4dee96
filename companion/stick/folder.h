#pragma once

#include "descriptor.h"

#include <cstdint>
#include <string>
#include <vector>

#include <sys/types.h>

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

/// The names in a folder, without "." and "..", in byte order.
struct Names
{
    static constexpr std::size_t most = 1'000;

    std::vector<std::string> names;
    bool tooMany = false; ///< More than `most`: the rest was not read.
    int error = 0;        ///< errno when the folder could not be read to its end
};

/// A mounted stick, or a folder that is to become one. Reads only; nothing outside it can be reached.
class StickFolder
{
public:
    /// Opens the folder at `path`. When that fails, error() is its errno, and nothing else is to be called.
    explicit StickFolder(const std::string& path);
    int error() const { return mError; }

    /// What the relative `path` is.
    Node node(const std::string& path) const;

    /// The names in the folder `path`, which is opened without waiting whatever it is.
    Names names(const std::string& path) const;

    /// Opens a plain file for reading; call it for no other kind of node. errno tells why there is none.
    Descriptor openFile(const std::string& path) const;

    /// True when the file system keeps permissions with its files; else the mount's options make them up.
    bool keepsPermissions() const;

    /// True when the folder is the root of a mounted file system.
    bool isMounted() const;

private:
    Descriptor open(const std::string& path, int flags) const;

    Descriptor mRoot;
    int mError = 0;
};
