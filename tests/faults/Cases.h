#pragma once

#include "Procedure.h"

#include <string>
#include <vector>

/// A unit and what goes wrong in one run on it.
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

/// Every LED command of a run.
platform::Lines ledCommands();

/// Every step on `unit`, panel and sound included, with every fault.
std::vector<Injection> procedureInjections(const Unit& unit);

/// The same as cases, of all units.
std::vector<Case> faultsOfTheProcedure();

/// These, a case without a fault for each unit, and every fault of each single LED command.
std::vector<Case> everyFault();
