#pragma once

#include "Procedure.h"

#include <string>
#include <vector>

/// A unit and the faults of one run on it.
struct Case
{
    Unit unit;
    std::vector<Injection> injections;

    /// As a test's name: letters, digits and underscores.
    std::string name() const;
};

/// Steps besides those of the procedure: all LED commands of the remote head together, and its sound. The name of a
/// step may also be one LED command line.
const char panelStep[] = "panel";
const char soundStep[] = "sound";

/// Every LED command of a run that ends in one of `reports`, which represent all panels.
platform::Lines ledCommands(const std::vector<std::string>& reports = {"result 0", "result 1", "error 0", "error 2"});

/// Every step on `unit`, panel and sound included, with every fault.
std::vector<Injection> procedureInjections(const Unit& unit);

/// Whether each of `injections` reaches its step in a run on `unit`: the run may skip a step, or another fault may keep
/// it from running.
bool allHappen(const Unit& unit, const std::vector<Injection>& injections);

/// Those that reach their step, as cases of all units.
std::vector<Case> faultsOfTheProcedure();

/// These cases, one without a fault for each unit, and every fault of each single LED command.
std::vector<Case> everyFault();
