#pragma once

#include "findings.h"

/// Ends the process unless all that the report shows is fit for a terminal and for JSON.
void expectPrintable(const Report& report);
