#pragma once

#include <functional>
#include <iosfwd>
#include <string>

/// What runUnit() is to do.
struct UnitOptions
{
    bool json = false;  ///< Print one JSON object instead of text.
    bool panel = false; ///< Test the lamps instead of checking.
    bool sound = false; ///< Play both sounds instead of checking.
};

/// Where a unit is: the machine itself, or a prepared tree and tools of a test.
struct UnitSite
{
    std::string root;       ///< Goes in front of every absolute path that is read; empty for the machine itself.
    std::string searchPath; ///< The services' PATH where the service manager does not tell it.
    bool isRoot = true;     ///< The check has root's rights.
    std::function<void(int seconds)> pause; ///< Waits while a lamp colour is shown.
};

/// The unit that the program runs on.
UnitSite thisUnit();

/// Checks whether the unit is fit for an update, and prints the report to `out`.
///
/// Starts no service and lights no LED; writes only a temporary folder, which it removes, and what the package tool
/// caches of its own accord. A board or mirror that does not answer costs the same 2 s as it costs the updater. With
/// `panel` or `sound` it does what these ask for instead, unless the updater is running.
///
/// @return a Report::Status; STATUS_UNCHECKED, with a message on `errors`, when a test is refused
int runUnit(const UnitOptions& options, const UnitSite& site, std::ostream& out, std::ostream& errors);
