#pragma once

#include "log/vocabulary.h"

#include <bitset>
#include <iosfwd>
#include <string>
#include <string_view>
#include <vector>

struct Run;

/// By StepKind.
using StepSet = std::bitset<stepKinds>;

/// What a tool says, on standard error most often, in the spelling of Debian 11 to 13, and in which steps it does.
struct Phrase
{
    std::string tool;
    std::string words;
    StepSet steps;
};

/// An entry of the catalogue of failures.
struct Failure
{
    std::string name;            ///< fixed name in kebab-case, for programs and the documents
    std::string reported;        ///< by the updater; empty when it reports nothing
    StepSet steps;               ///< in which it can occur
    std::string code;            ///< explains a step whose command ended with this code, or "any"; empty: neither
    bool general = false;        ///< A tool's phrase makes it more specific.
    std::string cause;           ///< in sentences, with names in braces; see texts.h
    std::string remedy;          ///< likewise
    std::vector<Phrase> phrases; ///< that point to it
};

/// The entry of this name, or null.
const Failure* findFailure(std::string_view name);

/// The entry that a line points to which a tool printed in a step of this kind, or null. Of several lines in a step the
/// one with the lowest entry counts.
const Failure* failureSaid(std::string_view line, StepKind kind);

/// Fills in what went wrong in a run, and what its log leaves open.
void explain(Run& run);

/// True when the log's records prove that the run came to a good outcome and gave the instrument back.
bool wentWell(const Run& run);

/// Prints the entry of this name, or all when it is empty. False when there is none.
bool printCatalogue(const std::string& name, bool json, std::ostream& out);
