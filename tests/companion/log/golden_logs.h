#pragma once

#include <string>
#include <vector>

#include <gtest/gtest.h>

using Lines = std::vector<std::string>;

/// The names of the golden logs, in order. Their folder is the tests' working directory.
Lines goldenLogs();

/// The names of the files in `folder` with this extension, without it, in order.
Lines namesOfFiles(const std::string& folder, const std::string& extension);

std::string content(const std::string& file);

/// A golden log's name as one of a test.
std::string goldenLogName(const testing::TestParamInfo<std::string>& test);
