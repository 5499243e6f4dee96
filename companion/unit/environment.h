#pragma once

#include "command.h"
#include "findings.h"
#include "procedure.h"

#include <chrono>
#include <functional>
#include <map>
#include <string>
#include <vector>

using namespace std::chrono_literals;

inline constexpr auto quick = 10s; ///< limit for a command that only looks something up

/// Where a unit is: the machine itself, or a prepared tree and tools of a test.
struct UnitSite
{
    std::string root;       ///< Goes in front of every absolute path that is read; empty for the machine itself.
    std::string searchPath; ///< The services' PATH where the service manager does not tell it.
    bool isRoot = true;     ///< The check has root's rights.
    std::function<void(int seconds)> pause;   ///< Waits while a lamp colour is shown.
    std::ostream* waits = nullptr;            ///< A terminal, which is told what is waited for.
    std::chrono::milliseconds silence = 25s;  ///< A refresh ends when nothing comes for longer,
    std::chrono::milliseconds refresh = 2min; ///< and when it takes longer.
};

/// The unit that the program runs on.
UnitSite thisUnit();

/// A unit as the updater's service finds it: its services, and the environment that the service's commands get.
class Unit
{
public:
    /// Asks the service manager, and the package manager which head it is.
    explicit Unit(const UnitSite& site);

    /// Runs `arguments` with the service's search path and locale; see runCommand().
    CommandResult run(const std::vector<std::string>& arguments, std::chrono::milliseconds limit,
                      const std::function<bool(std::chrono::milliseconds)>& goesOn = {}) const;

    /// The program that the service's search path leads to; empty when there is none.
    std::string program(const std::string& name) const { return findProgram(name, searchPath()); }
    std::string searchPath() const { return mEnvironment.at("PATH"); }

    /// The service's variables for the locale, for a message.
    std::string locale() const;

    /// Where the unit's file `absolute` is to be read.
    std::string path(const std::string& absolute) const { return mSite.root + absolute; }
    const UnitSite& site() const { return mSite; }

    /// True for a main head: its package is installed and the remote head's is not. Its own program shows the outcome;
    /// the panel and the sounds are the remote head's.
    bool isMainHead() const { return mMainHead; }
    std::string package() const { return packageOf(mMainHead); }

    /// What the updater does when it cannot go on, for a message.
    const char* failure() const
    {
        return mMainHead ? "reports a failure to the main head's program" : "shows the fail pattern";
    }

    /// Gives the catalogue's texts what depends on the unit.
    void defineTexts(Report& report) const;

    /// False when the service manager cannot be asked.
    bool servicesKnown() const { return mServicesKnown; }

    /// A property of a service, systemctl(1), such as "ActiveState"; empty when it is not known.
    std::string property(const std::string& service, const std::string& name) const;

    /// The journal of the update's services, as far as it is kept of a command's output.
    std::string journal() const;

    /// True when the updater runs, as its service or started by hand.
    bool updaterRuns() const;

private:
    void takeVariables(const std::vector<std::string>& texts);
    void takeServices(const std::string& output);
    bool isInstalled(const std::string& package) const;

    const UnitSite& mSite;
    std::map<std::string, std::string> mEnvironment;
    std::map<std::pair<std::string, std::string>, std::string> mProperties; // of a service, and its name
    bool mServicesKnown = false;
    bool mMainHead = false;
};

/// A folder for a while; nothing is left of it when the program is ended before.
class TemporaryFolder
{
public:
    explicit TemporaryFolder(const Unit& unit);
    ~TemporaryFolder();
    TemporaryFolder(const TemporaryFolder&) = delete;
    TemporaryFolder& operator=(const TemporaryFolder&) = delete;

    /// Empty, and errno tells why, when it cannot be made.
    const std::string& path() const { return mPath; }

private:
    HeldSignals mSignals;
    std::string mPath;
};

/// What follows `key` in the last line of `text` that holds it, as the updater reads its versions; empty without one.
std::string valueAfter(const std::string& text, const std::string& key);

/// What a command said of its failure, for a message.
std::string complaint(const CommandResult& result);
