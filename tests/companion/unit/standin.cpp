#include "unit/standin.h"

#include "little_endian.h"

#include <csignal>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

namespace fs = std::filesystem;

namespace
{

const char* const tools[] = {"systemctl", "umount", "rm",         "ls",        "apt",       "apt-cache",
                             "ssh",       "scp",    "i2cset",     "aplay",     "i2cdetect", "apt-config",
                             "apt-get",   "dpkg",   "dpkg-query", "journalctl"};

std::string quoted(std::string text)
{
    for (std::size_t position = 0; (position = text.find('\'', position)) != std::string::npos; position += 4) {
        text.replace(position, 1, "'\\''");
    }
    return '\'' + text + '\'';
}

} // namespace

LockHolder::LockHolder(const std::string& path) : mProcess(-1)
{
    int ready[2];
    if (pipe(ready) != 0 || (mProcess = fork()) < 0) {
        throw std::runtime_error("no process for a lock");
    }
    if (mProcess == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        struct flock lock = {};
        lock.l_type = F_WRLCK;
        const int file = open(path.c_str(), O_RDWR);
        if (fcntl(file, F_SETLK, &lock) == 0 && write(ready[1], "", 1) == 1) {
            pause();
        }
        _exit(1);
    }
    close(ready[1]);
    char byte = 0;
    const bool held = read(ready[0], &byte, 1) == 1;
    close(ready[0]);
    if (!held) {
        throw std::runtime_error("no lock on " + path);
    }
}

LockHolder::~LockHolder()
{
    kill(mProcess, SIGKILL);
    waitpid(mProcess, nullptr, 0);
}

StandInUnit::StandInUnit()
    : mSettings({{"UNIT", folder.path()},
                 {"HEAD_HARL", "known"},
                 {"HEAD_PANEL", "present"},
                 {"HEAD_SOUND", "present"},
                 {"BOARD_LINK", "up"},
                 {"BOARD_LOGIN", "accepted"},
                 {"BOARD_INSTALLED", "2.1.0"},
                 {"BOARD_VERSION_FILE", "Name\tQuorb\r\nBrimvale\t{version}\r\n"},
                 {"PACKAGE_KNOWN", "true"},
                 {"PACKAGE_INSTALLED", "1.2.0"},
                 {"PACKAGE_OFFERED", "1.3.0"},
                 {"MIRRORS_REFRESH", "works"},
                 {"TOOLS_KILLED", ""},
                 {"UPDATER_PROGRAM", "remote"},
                 {"UNIT_ENVIRONMENT", ""},
                 {"UNIT_HARL", "active"},
                 {"UNIT_JOURNAL", ""},
                 {"UNIT_PACKAGE", "ii"},
                 {"UNIT_SERVICE_ENVIRONMENT", ""},
                 {"UNIT_UPDATER", "inactive"},
                 {"UNIT_UPDATER_LOADED", "loaded"}})
{
    for (const std::string tool : tools) {
        folder.makeLink("bin/" + tool, UNIT_STANDINS);
    }
    folder.makeFolder("root/tmp");
    folder.makeFolder("root/var/log/journal");
    for (const char* file : {"dev/i2c-0", "var/lib/apt/lists/lock", "var/lib/dpkg/lock-frontend", "var/lib/dpkg/lock",
                             "var/cache/apt/archives/lock", "usr/sbin/harl-updater"}) {
        put(file, "");
    }
    put("proc/asound/pcm", "00-00: Dummy PCM : Dummy PCM : playback 8 : capture 8\n");
    for (const char* sound : {"PASS", "FAIL"}) {
        put("root/RESOURCES/SOUNDS/SND_RESULT_" + std::string(sound) + ".wav", waveFile(1000));
    }
    writeSettings();
}

void StandInUnit::set(const std::string& name, const std::string& value)
{
    mSettings[name] = value;
    writeSettings();
    if (name == "HEAD_SOUND" && value == "absent") {
        remove("proc/asound/pcm");
    }
    if (name == "PACKAGE_INSTALL" && value == "locked") {
        mLock = std::make_unique<LockHolder>(folder.path("root/var/lib/dpkg/lock-frontend"));
    }
    if (name == "TOOLS_MISSING") {
        std::istringstream names(value);
        for (std::string tool; names >> tool;) {
            removeTool(tool);
        }
    }
}

void StandInUnit::removeTool(const std::string& name) const
{
    fs::remove(folder.path("bin/" + name));
}

void StandInUnit::replaceTool(const std::string& name, const std::string& script) const
{
    removeTool(name);
    folder.put("bin/" + name, "#!/bin/sh\n" + script + '\n', 0755);
}

void StandInUnit::remove(const std::string& path) const
{
    fs::remove_all(folder.path("root/" + path));
}

UnitSite StandInUnit::site() const
{
    const auto pause = [this](int seconds) {
        std::ofstream(folder.path("calls"), std::ios::app) << "pause " << seconds << '\n';
    };
    return {folder.path("root"), folder.path("bin"), true, pause};
}

std::vector<std::string> StandInUnit::calls() const
{
    std::vector<std::string> lines;
    std::ifstream file(folder.path("calls"));
    for (std::string line; std::getline(file, line);) {
        lines.push_back(line);
    }
    return lines;
}

void StandInUnit::writeSettings() const
{
    std::string text;
    for (const auto& [name, value] : mSettings) {
        text += name + '=' + quoted(value) + '\n';
    }
    folder.put("settings", text);
}

std::string waveFile(std::size_t samples)
{
    // One channel of 8-bit samples, 8000 each second.
    const std::string format = littleEndian(1, 2) + littleEndian(1, 2) + littleEndian(8000, 4) + littleEndian(8000, 4) +
                               littleEndian(1, 2) + littleEndian(8, 2);
    return "RIFF" + littleEndian(36 + samples, 4) + "WAVEfmt " + littleEndian(16, 4) + format + "data" +
           littleEndian(samples, 4) + std::string(samples, '\x80');
}
