#include "GeometryVolume/sampling/VoxelSamplerLogger.h"

#include "GeometryVolume/core/Parallel.h"
#include "support/Threads.h"

#include <gtest/gtest.h>

#include <sstream>

namespace VLN::Test {
namespace {

using TileTree3D::TreeIndex;
using TileTree3D::VoxelSamplerLogger;

std::string report() {
  testing::internal::CaptureStdout();
  VoxelSamplerLogger::endLog();
  return testing::internal::GetCapturedStdout();
}
void log(std::string const& tiles, std::uint64_t key = 0) {
  for (char const c : tiles) VoxelSamplerLogger::logTile({c - 'A', 3}, key);
}
// The number behind "size <n> = ".
double ratio(std::string const& text, int size) {
  std::string const head = "LRU cache size " + std::to_string(size) + " = ";
  return std::stod(text.substr(text.find(head) + head.size()));
}

// boundary
TEST(SamplerLoggerTest, NothingLogged) {
  VoxelSamplerLogger::beginLog();
  EXPECT_EQ(report(), "Found 0 number of logs\n");
}

// requirement: the wording, line by line
TEST(SamplerLoggerTest, Report) {
  VoxelSamplerLogger::beginLog();
  log("ABA");
  std::ostringstream expected;
  expected << "Found 1 number of logs\n num accesses per tile = 1.5\n";
  for (int size = 0; size < 20; ++size)
    expected << " cache miss percentage with LRU cache size " << size << " = " << (size < 2 ? 0.5 : 0.0)
             << "\n";
  EXPECT_EQ(report(), expected.str());
  EXPECT_EQ(report(), "Found 0 number of logs\n");
}

// requirement: entries leave by age of insertion; a hit does not refresh one
TEST(SamplerLoggerTest, EvictionByAge) {
  VoxelSamplerLogger::beginLog();
  log("ABCA");
  std::string text = report();
  EXPECT_NEAR(ratio(text, 2), 4.0 / 3 - 1, 1e-6);
  EXPECT_NEAR(ratio(text, 3), 0, 1e-6);
  log("ABACA"); // A is hit, and still the first to go
  text = report();
  EXPECT_NEAR(ratio(text, 2), 4.0 / 3 - 1, 1e-6);
}

// requirement: each key is a sequence of its own
TEST(SamplerLoggerTest, KeysAreApart) {
  VoxelSamplerLogger::beginLog();
  log("AB", 1), log("A", 2), log("B", 1);
  std::string const text = report();
  EXPECT_EQ(text.rfind("Found 2 number of logs\n", 0), 0u);
  EXPECT_NE(text.find("per tile = " +
                      [] {
                        std::ostringstream s;
                        s << 4.0f / 3.0f;
                        return s.str();
                      }()),
            std::string::npos);
  EXPECT_NEAR(ratio(text, 1), 0, 1e-6);
  EXPECT_NEAR(ratio(text, 0), 4.0 / 3 - 1, 1e-6);
}

// requirement: depth tells tiles apart; beginLog() drops what was logged
TEST(SamplerLoggerTest, TilesByDepthAndIndex) {
  log("AAAA");
  VoxelSamplerLogger::beginLog();
  VoxelSamplerLogger::logTile({1, 2}, 0);
  VoxelSamplerLogger::logTile({1, 3}, 0);
  std::string const text = report();
  EXPECT_NE(text.find("per tile = 1\n"), std::string::npos);
  EXPECT_EQ(ratio(text, 0), 0);
}

// requirement: any number of threads
TEST(SamplerLoggerTest, Threads) {
  VoxelSamplerLogger::beginLog();
  withThreads(8, [] {
    parallelFor(0, 4000, [](std::int64_t begin, std::int64_t end) {
      for (std::int64_t n = begin; n < end; ++n)
        VoxelSamplerLogger::logTile({n / 4, 3}, static_cast<std::uint64_t>(n % 3));
    });
  });
  std::string const text = report();
  EXPECT_EQ(text.rfind("Found 3 number of logs\n", 0), 0u);
}

} // namespace
} // namespace VLN::Test
