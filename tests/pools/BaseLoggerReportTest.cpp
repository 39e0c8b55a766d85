// The layout of the report.
#include "ControlGroup.h"
#include "LoggerFixture.h"

#include "GeometryVolume/pools/PoolUtils.h"

#include <algorithm>
#include <regex>
#include <vector>

namespace {

using test::Base;
using test::BaseLogger;
using test::block;
using test::Sized;
using Lines = std::vector<std::string>;
constexpr std::uint64_t kMB = std::uint64_t(1) << 20;

class LoggerReport : public test::LoggerTest {
protected:
  LoggerReport() { group.setFree(48 * kMB); }
  Lines report() {
    out.take();
    BaseLogger::dump();
    return out.take();
  }
  /// Lines between two others.
  static Lines between(Lines const& lines, std::string const& first, std::string const& last) {
    auto const begin = std::find(lines.begin(), lines.end(), first);
    auto const end = std::find(begin, lines.end(), last);
    if (begin == lines.end() || end == lines.end()) return {"(no such section)"};
    return Lines(begin + 1, end);
  }
  test::ControlGroup group;
};

TEST_F(LoggerReport, RequirementCounters) {
  Base const a("a"), b("b");
  { Base const c("c"); }
  BaseLogger::pointerAllocated(block(1), &a);
  BaseLogger::pointerDeAllocated(block(1), &a);
  BaseLogger::pointerDeAllocated(block(1), &a);
  Lines const lines = report();
  ASSERT_GT(lines.size(), 10u);
  EXPECT_EQ(lines.front(), "BaseLogger.allocationStats.begin");
  EXPECT_EQ(between(lines, "BaseLogger.allocationStats.begin", "BaseLogger.allocationStats.end"),
            (Lines{" numAllocOK = 3", " numAllocNotOK = 0", " numDeAllocOK = 1", " numDeAllocNotOK = 0",
                   " numVoidAllocOK = 1", " numVoidAllocNotOK = 0", " numVoidDeAllocOK = 1",
                   " numVoidDeAllocNotOK = 1"}));
}

TEST_F(LoggerReport, RequirementNames) {
  Sized const a("voxel_a", 2 * kMB, 3 * kMB), copy("voxel_a", kMB, kMB), b("density", 512 * 1024, kMB);
  BaseLogger::pointerAllocated(block(1), &a);
  BaseLogger::pointerAllocated(block(2), &copy);
  BaseLogger::pointerAllocated(block(3), &copy);
  EXPECT_EQ(
      between(report(), "BaseLogger.names.begin", "BaseLogger.names.end"),
      (Lines{"size = 0.5MB base = density, #shallow copies (incl orig) = 1, #deep copies (excl orig) = 0, "
             "total mem usage (incl all deep copies) = 0.5MB",
             "size = 2MB base = voxel_a, #shallow copies (incl orig) = 2, #deep copies (excl orig) = 2, "
             "total mem usage (incl all deep copies) = 3MB"}));
}

TEST_F(LoggerReport, RequirementStatistics) {
  Sized const a("voxel_a", kMB, 2 * kMB), b("density", kMB / 2, kMB);
  Sized const scratch("voxel_tile_tree_thread_local", 7 * kMB, 7 * kMB), pooled("channel_pool", kMB, kMB);
  BaseLogger::pointerAllocated(block(1), &a);
  BaseLogger::pointerAllocated(block(2), &a);
  Lines const lines = between(report(), "BaseLogger.stats.begin", "BaseLogger.stats.end");
  ASSERT_GE(lines.size(), 8u);
  EXPECT_EQ(lines[0], "Total mem occupied by data: used = 1.5MB (allocated = 3)");
  EXPECT_EQ(lines[1], "Total mem occupied by channel pool = 0");
  Lines const end(lines.end() - 6, lines.end());
  EXPECT_EQ(end, (Lines{"Total physical mem available = 48MB", "Total used mem not used by data = 13MB",
                        "Number of copies registered = " + std::to_string(BaseLogger::numberOfCopies()),
                        "Number of active copies = 1", "=================", "================="}));
}

TEST_F(LoggerReport, RequirementAllocator) {
  Lines const lines = between(report(), "BaseLogger.stats.begin", "BaseLogger.stats.end");
  if (std::string(VLN_TEST_ALLOCATOR) == "system") {
    EXPECT_EQ(lines.size(), 8u) << "this back end has no statistics";
    return;
  }
  std::string const n = "[0-9.e+-]+";
  std::string const expected[] = {"Total jemalloc mem active = " + n + "MB",
                                  "Total jemalloc mem mapped = " + n + "MB",
                                  "Total jemalloc mem occupied by data: used = " + n +
                                      "MB \\(allocated = " + n + "\\)",
                                  "Total jemalloc mem overhead \\(active\\) = " + n + "MB",
                                  "Total jemalloc mem overhead \\(mapped\\) = " + n + "MB",
                                  "Total mem occupied by data and jemalloc overhead = " + n +
                                      "MB \\(active\\),  " + n + "MB \\(mapped\\)"};
  ASSERT_EQ(lines.size(), 14u);
  for (std::size_t i = 0; i < 6; ++i)
    EXPECT_TRUE(std::regex_match(lines[2 + i], std::regex(expected[i]))) << lines[2 + i];
  EXPECT_NE(lines[2], "Total jemalloc mem active = 0MB");
}

TEST_F(LoggerReport, RequirementDataThatDoesNotLiveInJemalloc) {
  if (std::string(VLN_TEST_ALLOCATOR) == "system") GTEST_SKIP() << "this back end has no statistics";
  Sized const a("a", 1, std::uint64_t(1) << 45);
  Lines const lines = between(report(), "BaseLogger.stats.begin", "BaseLogger.stats.end");
  ASSERT_EQ(lines.size(), 11u);
  EXPECT_EQ(lines[4], "Jemalloc does not appear to be used by data");
}

TEST_F(LoggerReport, NegativeWithoutFigures) {
  group.makeUnreadable();
  Lines const lines = report();
  EXPECT_EQ(std::count(lines.begin(), lines.end(), "Total physical mem available = 0MB"), 1);
  EXPECT_EQ(std::count(lines.begin(), lines.end(), "Total used mem not used by data = 0MB"), 1);
  EXPECT_EQ(lines.back(), "BaseLogger.stats.end");
}

} // namespace
