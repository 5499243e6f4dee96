#pragma once

#include "log/step.h"

#include <bitset>
#include <iosfwd>
#include <string>
#include <string_view>

struct Run;

/// An entry of the catalogue of failures.
struct Failure
{
    const char* name;     ///< fixed name in kebab-case, for programs and the documents
    const char* reported; ///< by the updater; empty when it reports nothing
    const char* cause;    ///< in sentences, which may hold {package}, {status} and {afterwards}
    const char* remedy;   ///< likewise
};

/// The entry of this name, or null.
const Failure* findFailure(std::string_view name);

/// The phrases of other tools that a step's lines hold, as indexes of the catalogue's.
using PhraseSet = std::bitset<64>;

/// The phrases in a line that a tool printed in a step of this kind.
PhraseSet phrasesIn(std::string_view line, StepKind kind);

/// Fills in what went wrong in a run, and what its log leaves open.
void explain(Run& run);

/// True when the log's records prove that the run came to a good outcome and gave the instrument back.
bool wentWell(const Run& run);

/// Prints the entry of this name, or all when it is empty. False when there is none.
bool printCatalogue(const std::string& name, bool json, std::ostream& out);
