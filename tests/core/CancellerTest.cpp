// The armed checkpoint, and what the environment sets at load.
#include "GeometryVolume/core/Canceller.h"
#include "Velorn/ExceptionMessage.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <exception>
#include <string>
#include <unistd.h>
#include <utility>

using VLN::Canceller;

namespace {

/// What a command writes to its output.
std::string outputOf(std::string const& command) {
  std::string text;
  FILE* pipe = popen(command.c_str(), "r");
  if (!pipe) return "cannot run: " + command;
  char buffer[256];
  while (std::fgets(buffer, sizeof buffer, pipe)) text += buffer;
  pclose(pipe);
  return text;
}

} // namespace

// requirement: the two values that the tree's checkpoints pass are settled
TEST(Canceller, CheckpointsHaveFixedNumbers) {
  EXPECT_EQ(Canceller::kNone, 0);
  EXPECT_EQ(Canceller::kTest, 1);
  EXPECT_EQ(Canceller::kTraverse, 2);
  EXPECT_EQ(Canceller::kRefine, 3);
}

// boundary
TEST(Canceller, ArmedCheckpointThrowsAndOthersReturn) {
  int const before = Canceller::getCancelID();
  Canceller::setCancelID(Canceller::kTest);
  EXPECT_EQ(Canceller::getCancelID(), 1);
  EXPECT_NO_THROW(Canceller::cancelID(Canceller::kTraverse));
  EXPECT_NO_THROW(Canceller::cancelID(Canceller::kRefine));
  try {
    Canceller::cancelID(Canceller::kTest);
    ADD_FAILURE() << "the armed checkpoint did not throw";
  } catch (std::exception const& e) { EXPECT_STREQ(e.what(), VLN::exceptionMessage); }
  Canceller::setCancelID(before);
}

// Run by the next test in a process of its own.
TEST(CancellerInProcess, DISABLED_TellsArmedID) { std::printf("armed %d\n", Canceller::getCancelID()); }

// requirement: the environment arms at load, by atoi; unset arms nothing
TEST(Canceller, EnvironmentArmsAtLoad) {
  std::string const run = "/proc/self/exe";
  char path[4096];
  auto const length = readlink(run.c_str(), path, sizeof path - 1);
  if (length <= 0) GTEST_SKIP() << "cannot find this program's own file";
  path[length] = '\0';
  std::string const self =
      std::string(path) +
      " --gtest_also_run_disabled_tests --gtest_filter=CancellerInProcess.DISABLED_TellsArmedID 2>&1";
  std::pair<char const*, char const*> const cases[] = {{"env -u VELORN_TERMINATION_TEST ", "armed 0\n"},
                                                       {"VELORN_TERMINATION_TEST=3 ", "armed 3\n"},
                                                       {"VELORN_TERMINATION_TEST=2x ", "armed 2\n"},
                                                       {"VELORN_TERMINATION_TEST=none ", "armed 0\n"}};
  for (auto const& [environment, expected] : cases)
    EXPECT_NE(outputOf(environment + self).find(expected), std::string::npos) << environment;
}

// boundary
TEST(Canceller, VersionIsNotPrintedWhenTheVariableIsZero) {
  char path[4096];
  auto const length = readlink("/proc/self/exe", path, sizeof path - 1);
  if (length <= 0) GTEST_SKIP() << "cannot find this program's own file";
  path[length] = '\0';
  EXPECT_EQ(
      outputOf("KERRATE_DUMP_VERSION_INFO=0 " + std::string(path) + " --gtest_filter=none 2>&1 >/dev/null"),
      "");
}
