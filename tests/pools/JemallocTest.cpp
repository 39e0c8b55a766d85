#include "GeometryVolume/pools/Jemalloc.h"

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <cstdlib>
#include <fstream>
#include <gtest/gtest.h>
#include <sched.h>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace {

using namespace VLN;

TEST(BulkAllocation, RequirementPadsToMultiplesOf64Bytes) {
  EXPECT_EQ(bulkBytes(3, 4), 64u);
  EXPECT_EQ(bulkBytes(16, 4), 64u);
  EXPECT_EQ(bulkBytes(17, 4), 128u);
  EXPECT_EQ(bulkBytes(0, 4), 0u);
  EXPECT_EQ(bulkBytes(64, 1), 64u);
  EXPECT_EQ(bulkBytes(65, 1), 128u);
}

TEST(BulkAllocation, RequirementIsAlignedAndWritable) {
  for (std::uint64_t count : {1u, 3u, 16u, 17u, 1000u, 100000u}) {
    void* const block = allocate_jemalloc(count, 12);
    ASSERT_NE(block, nullptr);
    EXPECT_EQ(reinterpret_cast<std::uintptr_t>(block) % 64, 0u) << count;
    std::fill_n(static_cast<unsigned char*>(block), bulkBytes(count, 12), 0xab);
    deallocate_jemalloc(block);
  }
}

TEST(BulkAllocation, RequirementZerosAreAlignedAndZeroAgain) {
  for (int round = 0; round < 2; ++round)
    for (std::uint64_t count : {1u, 17u, 1000u, 100000u, 2000000u}) {
      auto* const block = static_cast<unsigned char*>(allocateZeros_jemalloc(count, 12));
      ASSERT_NE(block, nullptr);
      EXPECT_EQ(reinterpret_cast<std::uintptr_t>(block) % 64, 0u) << count;
      std::uint64_t const bytes = bulkBytes(count, 12);
      EXPECT_TRUE(std::all_of(block, block + bytes, [](unsigned char b) { return b == 0; })) << count;
      std::fill_n(block, bytes, 0xab); // the next round may meet this memory
      deallocate_jemalloc(block);
    }
}

/// Whether the mapping of an address is to be made of huge pages.
bool asksForHugePages(void const* address) {
  std::ifstream maps("/proc/self/smaps");
  auto const at = reinterpret_cast<std::uintptr_t>(address);
  bool here = false;
  for (std::string line; std::getline(maps, line);) {
    std::uintptr_t low = 0, high = 0;
    char dash = 0;
    std::istringstream range(line);
    if (range >> std::hex >> low >> dash >> high && dash == '-')
      here = low <= at && at < high;
    else if (here && line.starts_with("VmFlags:"))
      return line.find(" hg") != std::string::npos;
  }
  return false;
}

TEST(BulkAllocation, RequirementLargeBlocksAskForHugePages) {
  if (!std::ifstream("/sys/kernel/mm/transparent_hugepage/enabled")) GTEST_SKIP() << "the system has none";
  std::uint64_t const bytes = 64 << 20;
  auto* const block = static_cast<char*>(allocate_jemalloc(bytes, 1));
  ASSERT_NE(block, nullptr);
  EXPECT_TRUE(asksForHugePages(block + bytes / 2));
  deallocate_jemalloc(block);
}

TEST(FlushCache, RequirementReturnsFromManyThreadsAtOnce) {
  std::vector<std::thread> threads;
  std::atomic<int> returned{0};
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&] {
      for (int n = 0; n < 5; ++n) {
        deallocate_jemalloc(allocate_jemalloc(1000, 8));
        jemalloc_flushCache();
      }
      ++returned;
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(returned, 4);
}

TEST(FlushCache, BoundaryReturnsOnOneProcessor) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        cpu_set_t one;
        CPU_ZERO(&one);
        CPU_SET(sched_getcpu(), &one);
        sched_setaffinity(0, sizeof(one), &one);
        jemalloc_flushCache();
        std::_Exit(0);
      },
      ::testing::ExitedWithCode(0), "");
}

class Text final : public Internal::jemalloc_stream {
public:
  void write(char const* text, std::uint64_t length) override {
    ++calls;
    all.append(text, length);
  }
  int calls = 0;
  std::string all;
};

TEST(DumpStats, RequirementWritesTheWholeTextOnce) {
  Text text;
  Internal::jemalloc_dumpStats(text);
  EXPECT_EQ(text.calls, 1);
  EXPECT_FALSE(text.all.empty());
  EXPECT_EQ(text.all.find('\0'), std::string::npos);
}

TEST(DumpStats, BoundaryCopyingAStreamHasNoEffect) {
  Text a, b;
  a.all = "a";
  b.all = "b";
  static_cast<Internal::jemalloc_stream&>(b) = a;
  EXPECT_EQ(b.all, "b");
}

} // namespace
