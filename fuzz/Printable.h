#pragma once

#include "findings.h"

/// Ends the process if `text` has control characters other than line feeds.
void expectPrintable(const std::string& text);

/// Ends the process unless everything in the report is fit for a terminal and for JSON.
void expectPrintable(const Report& report);
