// That the thread sanitizer sees into loop bodies: one that races on purpose is reported, its tidy sister is
// not. Each runs in a child, so that the report is what is tested.
#include "GeometryVolume/core/Parallel.h"

#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <gtest/gtest.h>
#include <numeric>
#include <thread>
#include <vector>

#if defined(__SANITIZE_THREAD__)

using namespace VLN;

namespace {

constexpr int kReported = 66;

/// Waits for the other chunk without ordering itself behind it. Gives up where there is one thread only.
void meet(std::atomic<int>& arrived, int all) {
  arrived.fetch_add(1, std::memory_order_relaxed);
  auto const until = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (arrived.load(std::memory_order_relaxed) < all && std::chrono::steady_clock::now() < until)
    std::this_thread::yield();
}

/// Two chunks that run at the same time, each of which adds to a cell: to its own, or both to the first.
[[noreturn]] void addInChunks(bool racy) {
  std::array<long, 2> cells{};
  std::atomic<int> arrived{0};
  withThreads(2, [&] {
    parallelFor(0, 2, [&](std::int64_t begin, std::int64_t end) {
      meet(arrived, 2);
      for (std::int64_t n = begin; n < end; ++n) ++cells[racy ? 0 : static_cast<std::size_t>(n)];
    });
  });
  std::exit(std::accumulate(cells.begin(), cells.end(), 0L) == 0 ? 1 : 0);
}

/// Loops of several kinds whose hand-over is sound: vectors filled, read, joined and sorted.
[[noreturn]] void tidyLoops() {
  withThreads(4, [] {
    for (int round = 0; round < 50; ++round) {
      std::vector<std::int64_t> values(3000);
      parallelFor(0, 3000,
                  [&](std::int64_t begin, std::int64_t end) {
                    for (std::int64_t n = begin; n < end; ++n) values[static_cast<std::size_t>(n)] = 3000 - n;
                  },
                  {.grain = 50});
      auto const sum = parallelReduce(
          0, 3000, 100, std::int64_t(0),
          [&](std::int64_t begin, std::int64_t end) {
            return std::accumulate(values.begin() + begin, values.begin() + end, std::int64_t(0));
          },
          [](std::int64_t a, std::int64_t b) { return a + b; });
      if (sum != 3000LL * 3001 / 2) std::exit(1);
      std::vector<std::uint64_t> order(3000);
      std::iota(order.begin(), order.end(), 0);
      parallelSortPositions(order.data(), 3000,
                            [&](std::uint64_t a, std::uint64_t b) { return values[a] < values[b]; });
      if (order.front() != 2999) std::exit(1);
      // The memory of one loop's bodies is that of the next one's.
      parallelFor(0, 64, [&](std::int64_t begin, std::int64_t end) {
        std::vector<std::int64_t> own(values.begin() + begin, values.begin() + end);
        parallelFor(0, 4, [&](std::int64_t b, std::int64_t) { values[static_cast<std::size_t>(begin)] += b; },
                    {.grain = 8});
      });
    }
  });
  std::exit(0);
}

class ThreadSanitizer : public ::testing::Test {
protected:
  ThreadSanitizer() { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

} // namespace

TEST_F(ThreadSanitizer, RequirementARacyLoopBodyIsReported) {
  EXPECT_EXIT(addInChunks(true), ::testing::ExitedWithCode(kReported), "data race.*ThreadSanitizerTest.cpp");
}
TEST_F(ThreadSanitizer, RequirementATidyOneIsNot) {
  EXPECT_EXIT(addInChunks(false), ::testing::ExitedWithCode(0), "");
  EXPECT_EXIT(tidyLoops(), ::testing::ExitedWithCode(0), "");
}

#endif
