#pragma once

#include "findings.h"
#include "unit/environment.h"

/// Asks the board for its version as the updater does: the fact "board_version", or what is wrong.
void checkBoard(const Unit& unit, Report& report);
