#pragma once

#include <iosfwd>
#include <string>
#include <vector>

struct FleetOptions
{
    std::vector<std::string> paths; ///< files, folders, or "-" for standard input
    std::string since;              ///< "2026-11-21"; empty: all runs count
    std::string failed;             ///< only the units that met this failure; empty: all
    bool json = false;              ///< for programs: one object for the fleet, then one for each unit, a line each
    bool csv = false;               ///< a line for each unit
    std::string htmlFile;           ///< also write a page there; empty for none
};

/// What is wrong with `options`, in words; empty for nothing.
std::string conflictIn(const FleetOptions& options);

/// Explains the last runs of many units: harl-updater-tool fleet.
///
/// @return STATUS_FIT when no unit needs somebody, STATUS_NOT_FIT when one does, STATUS_UNCHECKED when something could
///         not be read
int runFleet(const FleetOptions& options, std::ostream& out, std::ostream& err);
