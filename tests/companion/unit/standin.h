#pragma once

#include "test_folder.h"
#include "unit/unit_check.h"

#include <map>
#include <memory>
#include <string>
#include <vector>

/// Holds a lock on a file as another package tool would, from a process of its own, as long as it lives.
class LockHolder
{
public:
    explicit LockHolder(const std::string& path);
    ~LockHolder();
    LockHolder(const LockHolder&) = delete;
    LockHolder& operator=(const LockHolder&) = delete;

    pid_t process() const { return mProcess; }

private:
    pid_t mProcess;
};

/// A unit that is fit for an update, in a temporary folder: the tools of standins.sh and a few files. Everything
/// that the check reads is there; nothing of this machine is.
class StandInUnit
{
public:
    StandInUnit();

    /// Changes a setting of standins.sh. The bench's settings HEAD_SOUND, TOOLS_MISSING and PACKAGE_INSTALL=locked
    /// also change files.
    void set(const std::string& name, const std::string& value);

    void removeTool(const std::string& name) const;

    /// Puts a shell script in the place of a tool.
    void replaceTool(const std::string& name, const std::string& script) const;

    /// Changes a file of the unit, such as "proc/asound/pcm"; `remove` takes it away.
    void put(const std::string& path, const std::string& content) const { folder.put("root/" + path, content); }
    void remove(const std::string& path) const;

    /// The unit for runUnit(). Pauses are noted as calls and not waited for.
    UnitSite site() const;

    /// Every call of a tool and every pause up to now, in order.
    std::vector<std::string> calls() const;

    const TestFolder folder;

private:
    void writeSettings() const;

    std::map<std::string, std::string> mSettings;
    std::unique_ptr<LockHolder> mLock;
};

/// A WAV file of `samples` bytes of sound.
std::string waveFile(std::size_t samples);
