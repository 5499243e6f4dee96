#pragma once

#include "log/run.h"

#include <string>
#include <utility>
#include <vector>

/// What the operator saw and heard at the end of a run, as far as its log tells.
struct OperatorView
{
    std::vector<std::pair<std::string, std::string>> leds; ///< name and colour: "REMOTE", "pass"; all others are dark
    std::string sound;                                     ///< "pass", "fail", or empty for none
    std::string seen;                                      ///< both in words
    std::string meaning;                                   ///< in words
};

OperatorView operatorView(const Run& run);

/// True when the run came to a good outcome and gave the instrument back.
bool wentWell(const Run& run);

/// Fills in why the run came out as it did, what to do next, and what its log cannot tell.
void explain(Run& run);
