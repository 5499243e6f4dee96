#pragma once

#include "log/run.h"

#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include <gtest/gtest.h>

using Lines = std::vector<std::string>;

/// The names of the golden logs, in order. Their folder is the tests' working directory.
Lines goldenLogs();

/// The names of the files in `folder` with this extension, without it, in order.
Lines namesOfFiles(const std::string& folder, const std::string& extension);

std::string content(const std::string& file);

/// Reads a log and hands over each of its runs, explained.
void readRuns(std::string_view log, const std::function<void(const Run&)>& take);

/// A golden log's name as one of a test.
std::string goldenLogName(const testing::TestParamInfo<std::string>& test);
