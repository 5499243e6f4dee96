#pragma once

#include <string>

/// Compares `text`, temporary folders and process numbers apart, with what golden/reports keeps of the running test,
/// which fails when they differ. Identical texts count once.
void compareWithKept(const std::string& text);
