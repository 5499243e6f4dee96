#pragma once

#include <iosfwd>
#include <string>
#include <vector>

/// Why a page must not take the place of what is at `path`, in words; empty when it may.
///
/// @param read  the files that the page is made of; "-" or none: standard input
std::string objectionTo(const std::string& path, const std::vector<std::string>& read);

/// Writes `content` into the file at `path`. What is wrong, in words; empty for nothing.
std::string writeFile(const std::string& path, std::iostream& content);
