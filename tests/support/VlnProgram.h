// The program vln as a process, for the tests of tests/vln.
#pragma once

#include "support/RunProgram.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <algorithm>

namespace VLN::Test {

inline RunResult vln(std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), VLN_PROGRAM);
  return runProgram(arguments);
}

/// Every failure: exit code 1, nothing on standard output, one line on standard error.
inline void expectFailure(RunResult const& run, std::string const& line) {
  EXPECT_EQ(run.code, 1);
  EXPECT_EQ(run.out, "");
  EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1) << run.err;
  EXPECT_EQ(run.err, "vln: " + line + "\n");
}

inline std::vector<std::string> keysOf(nlohmann::ordered_json const& object) {
  std::vector<std::string> keys;
  for (auto const& item : object.items()) keys.push_back(item.key());
  return keys;
}

} // namespace VLN::Test
