#pragma once

#include "findings.h"

/// Ends the process unless `text` has no control characters but line feeds.
void expectPrintable(const std::string& text);

/// Ends the process unless all that the report shows is fit for a terminal and for JSON.
void expectPrintable(const Report& report);
