// All pools together, from many threads, with little memory and a host that cancels.
#include "ChannelPoolFixture.h"
#include "ControlGroup.h"
#include "CoutCapture.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/pools/BaseLogger.h"
#include "GeometryVolume/pools/ChannelMemoryPool.h"
#include "GeometryVolume/pools/Jemalloc.h"
#include "Ostil/Job.h"
#include "PoolScript.h"
#include "Watchdog.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <fstream>
#include <random>
#include <stdexcept>
#include <thread>
#include <unistd.h>

namespace {

using namespace test;
using namespace std::chrono_literals;
namespace Blocks = VLN::TileTree3D::ChannelMemoryPool;
using VLN::TileTree3D::OddTraits;
using Clock = std::chrono::steady_clock;

/// How long a load lasts; longer and shorter runs are asked for by the environment.
std::chrono::milliseconds loadTime(double usual) {
  char const* const seconds = std::getenv("VLN_TEST_LOAD_SECONDS");
  return std::chrono::milliseconds(static_cast<long>(1000 * (seconds ? std::atof(seconds) : usual)));
}

class PoolLoad : public ChannelPoolTest {
protected:
  PoolLoad() {
    Blocks::enable();
    ArrayPool::enableRequiredFreeSize();
    ChannelPool::enableRequiredFreeSize();
  }
  ~PoolLoad() override {
    Ostil::setJobCancelled(false);
    ArrayPool::freeAllMemory();
    ChannelPool::freeAllMemory();
    Blocks::freeAllMemory();
    Blocks::disable();
  }

  struct Counts {
    std::atomic<long> channels{0}, arrays{0}, cancelled{0}, wrong{0}, failures{0};
  };

  /// One channel: taken, brought into step, written, read back, dropped.
  template <class Traits, int E, int H> static void useChannel(std::mt19937& random, Counts& counts) {
    auto const tiles = std::int64_t(random() % 60);
    float const value = float(random() % 1000);
    int const deepest = Traits::kMaxDepth;
    auto channel = ChannelPool::allocate<Traits, float, E, H>(value, random() % 2, true, 0, deepest,
                                                              std::uint64_t(tiles), nullptr);
    int const elements = VLN::TileTree3D::Channel<Traits, float, E, H>::kSize;
    channel->update(OneDepth(deepest, tiles, elements));
    for (std::int64_t t = 0; t < tiles; ++t)
      for (int e = 0; e < elements; ++e) {
        auto tile = channel->tileData(t, deepest);
        if (tile[e] != value) ++counts.wrong;
        tile[e] = value + float(e);
      }
    auto const copy = *channel;
    channel.reset();
    for (std::int64_t t = 0; t < tiles; ++t)
      if (copy.tileData(t, deepest)[elements - 1] != value + float(elements - 1)) ++counts.wrong;
    ++counts.channels;
  }
  static void useArray(std::mt19937& random, Counts& counts) {
    std::uint64_t const n = random() % 20000;
    int const value = int(random());
    auto const array = ArrayPool::allocate<int>(value, n);
    if (std::count(array->begin(), array->end(), value) != std::ptrdiff_t(n)) ++counts.wrong;
    std::fill(array->begin(), array->end(), ~value);
    ++counts.arrays;
  }
  static void useSomething(std::mt19937& random, Counts& counts) {
    switch (random() % 4) {
    case 0:
      return useArray(random, counts);
    case 1:
      return useChannel<PowerOfTwoTraits, 4, 1>(random, counts);
    case 2:
      return useChannel<PowerOfTwoTraits, 4, 0>(random, counts);
    default:
      return useChannel<OddTraits, 5, 0>(random, counts);
    }
  }
  /// As a tree operation does: a parallel pass that ends when the host cancels, with pools inside.
  static void usePass(std::mt19937& random, Counts& counts) {
    unsigned const seed = random();
    try {
      VLN::ParallelOptions options;
      options.cancellation = VLN::Cancellation::kPoll;
      VLN::parallelFor(
          0, 16,
          [&](std::int64_t begin, std::int64_t end) {
            for (std::int64_t i = begin; i < end; ++i) {
              std::mt19937 own(seed + unsigned(i));
              useSomething(own, counts);
            }
          },
          options);
    } catch (std::runtime_error const&) { ++counts.cancelled; }
  }

  class OneDepth final : public VLN::TileTree3D::Component {
  public:
    OneDepth(int depth, std::int64_t tiles, int elements)
        : m_depth(depth)
        , m_tiles(tiles)
        , m_elements(elements) {}
    std::uint64_t size() const override { return static_cast<std::uint64_t>(elementCount(-1)); }
    void update(VLN::Component const&) override {}
    std::int64_t elementCount(int depth) const override { return tileCount(depth) * m_elements; }
    int elementCount(VLN::TileTree3D::TreeIndex const&) const override { return m_elements; }
    std::int64_t tileCount(int depth) const override { return depth == -1 || depth == m_depth ? m_tiles : 0; }

  private:
    int m_depth;
    std::int64_t m_tiles;
    int m_elements;
  };

  /// Eight threads of work and two that make it hard, for a while.
  Counts& runLoad(std::chrono::milliseconds time) {
    Watchdog const watchdog("the load", time + 120s);
    ControlGroup group;
    std::atomic<bool> stop{false};
    std::vector<std::thread> threads;
    for (unsigned t = 0; t < 8; ++t)
      threads.emplace_back([&, t] {
        std::mt19937 random(t);
        try {
          while (!stop) random() % 8 == 0 ? usePass(random, m_counts) : useSomething(random, m_counts);
        } catch (...) { ++m_counts.failures; }
      });
    threads.emplace_back([&] {
      std::mt19937 random(99);
      while (!stop) {
        // Free memory comes and goes round what is required; now and then nobody knows.
        random() % 10 == 0 ? group.makeUnreadable() : group.setFree(random() % (8 * 1024 * 1024));
        std::this_thread::sleep_for(std::chrono::microseconds(random() % 3000));
      }
    });
    threads.emplace_back([&] {
      std::mt19937 random(98);
      while (!stop) {
        Ostil::setJobCancelled(random() % 3 == 0);
        switch (random() % 6) {
        case 0:
          ArrayPool::setRequiredFreeSize(random() % (8 * 1024 * 1024));
          break;
        case 1:
          ChannelPool::setRequiredFreeSize(random() % (8 * 1024 * 1024));
          break;
        case 2:
          ArrayPool::freeMemory(1 + random() % 100000);
          break;
        case 3:
          ChannelPool::freeMemory(1 + random() % 100000);
          break;
        case 4:
          ChannelPool::freeMemoryNotUsedSinceCount(ChannelPool::allocationCount() / 2);
          break;
        default:
          Blocks::freeMemoryNotUsedSinceCount(Blocks::allocationCount() / 2);
          break;
        }
        std::this_thread::sleep_for(std::chrono::microseconds(random() % 3000));
      }
    });
    std::this_thread::sleep_for(time);
    stop = true;
    for (auto& thread : threads) thread.join();
    Ostil::setJobCancelled(false);
    return m_counts;
  }

  Counts m_counts;
  QuietErrors m_quiet;
};

TEST_F(PoolLoad, RequirementEightThreadsUnderPressure) {
  Counts& counts = runLoad(loadTime(4));
  EXPECT_EQ(counts.wrong, 0) << "a channel or an array was shared";
  EXPECT_EQ(counts.failures, 0);
  EXPECT_GT(counts.channels, 100);
  EXPECT_GT(counts.arrays, 30);
  EXPECT_GT(counts.cancelled, 0);
  EXPECT_EQ(ArrayPool::usedStoreSize(), 0u);
  EXPECT_EQ(ChannelPool::usedStoreSize(), 0u);
  ArrayPool::freeAllMemory();
  ChannelPool::freeAllMemory();
  EXPECT_EQ(Blocks::usedStoreSize(), 0u) << "every block came back";
  Blocks::freeAllMemory();
  RecordProperty("channels", int(counts.channels));
  RecordProperty("arrays", int(counts.arrays));
  RecordProperty("cancelled", int(counts.cancelled));
  std::printf("channels %ld, arrays %ld, cancelled passes %ld in %ld ms\n", counts.channels.load(),
              counts.arrays.load(), counts.cancelled.load(), long(loadTime(4).count()));
}

/// @units Bytes.
std::int64_t residentMemory() {
  std::ifstream file("/proc/self/statm");
  std::int64_t total = 0, resident = 0;
  file >> total >> resident;
  return resident * sysconf(_SC_PAGESIZE);
}

TEST_F(PoolLoad, RequirementNoGrowth) {
  if (std::string(VLN_TEST_ALLOCATOR) == "system") GTEST_SKIP() << "sanitizers keep freed memory";
  auto const settle = [] {
    ArrayPool::freeAllMemory();
    ChannelPool::freeAllMemory();
    Blocks::freeAllMemory();
    VLN::jemalloc_flushCache();
    return residentMemory();
  };
  runLoad(1s);
  std::int64_t const before = settle();
  for (int round = 0; round < 3; ++round) runLoad(1s);
  std::int64_t const after = settle();
  std::printf("resident after one round %.1f MB, after four %.1f MB\n", double(before) / double(kMB),
              double(after) / double(kMB));
  EXPECT_LT(after, before + std::int64_t(24 * kMB));
}

TEST_F(PoolLoad, RequirementTheSameWithLogsAndReports) {
  CoutCapture out;
  VLN::BaseLogger::enable();
  VLN::BaseLogger::clear();
  ArrayPool::enableLog();
  Blocks::enableLog();
  std::atomic<bool> stop{false};
  std::thread reporter([&] {
    while (!stop) {
      VLN::BaseLogger::numberOfActiveCopies();
      out.take();
      std::this_thread::sleep_for(5ms);
    }
  });
  Counts& counts = runLoad(loadTime(2));
  stop = true;
  reporter.join();
  Blocks::disableLog();
  ArrayPool::disableLog();
  VLN::BaseLogger::clear();
  VLN::BaseLogger::disable();
  EXPECT_EQ(counts.wrong, 0);
  EXPECT_EQ(counts.failures, 0);
  EXPECT_EQ(ChannelPool::usedStoreSize() + ArrayPool::usedStoreSize(), 0u);
}

TEST(PoolFlush, RequirementAFlushReturnsWhileEveryWorkerIsBlocked) {
  Watchdog const watchdog("the flush", 60s);
  std::atomic<bool> release{false};
  std::atomic<int> blocked{0};
  int const workers = std::max(1, VLN::parallelThreads() - 1);
  std::thread blocker([&] {
    VLN::withThreads(workers + 1, [&] {
      VLN::parallelFor(0, 4 * (workers + 1), [&](std::int64_t, std::int64_t) {
        ++blocked;
        while (!release) std::this_thread::sleep_for(1ms);
      });
    });
  });
  while (blocked < workers + 1) std::this_thread::sleep_for(1ms); // the thread of the loop, and all workers
  auto const begin = Clock::now();
  VLN::jemalloc_flushCache();
  auto const took = Clock::now() - begin;
  // Else some worker ran the flush's task, or the loop, to its end.
  EXPECT_EQ(blocked, workers + 1);
  EXPECT_LT(took, 5s);
  release = true;
  blocker.join();
}

TEST_F(ChannelPoolTest, RequirementAFlushUnderTheLockReturnsWhileWorkersWaitForIt) {
  Watchdog const watchdog("freeing under the lock", 60s);
  ControlGroup group;
  ChannelPool::enableRequiredFreeSize();
  ChannelPool::setRequiredFreeSize(ControlGroup::kLimit);
  group.setFree(1000);
  // Every allocation flushes: nothing can ever be freed.
  VLN::parallelFor(0, 64, [](std::int64_t begin, std::int64_t end) {
    for (std::int64_t i = begin; i < end; ++i) density(4);
  });
  EXPECT_EQ(ChannelPool::allocationCount(), 64u);
}

TEST_F(ChannelPoolTest, RequirementStaticBlocksThroughEnableAndDisable) {
  QuietErrors const quiet;
  auto const make = [] {
    auto channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(1.5f, true, true, 0, 28, 40, nullptr);
    channel->update(Tiles(40));
    return channel;
  };
  auto const right = [](auto const& channel) {
    for (int t = 0; t < 40; ++t)
      if (channel->tileData(t, 28)[t] != 1.5f) return false;
    return true;
  };
  auto const before = make(); // its block is the allocator's own
  Blocks::enable();
  auto during = make();
  EXPECT_EQ(Blocks::usedStoreSize(), 1u);
  auto kept = make();
  EXPECT_EQ(Blocks::usedStoreSize(), 2u);
  EXPECT_TRUE(right(before) && right(during) && right(kept));
  ChannelPool::freeAllMemory();
  during.reset();
  EXPECT_EQ(Blocks::usedStoreSize(), 1u);
  EXPECT_EQ(Blocks::freeStoreSize(), 1u);
  auto again = make();
  EXPECT_EQ(Blocks::freeStoreSize(), 0u) << "the block serves the next channel";
  EXPECT_TRUE(right(again) && right(kept));
  ChannelPool::freeAllMemory();
  again.reset();
  kept.reset();
  EXPECT_EQ(Blocks::usedStoreSize(), 0u);
  Blocks::freeAllMemory();
  Blocks::disable();
  auto const after = make();
  EXPECT_TRUE(right(before) && right(after));
}

/// Leaves channels, arrays, blocks and accounts behind, some of them in statics that are destroyed after
/// those of the pools.
[[noreturn]] void exitWithEverythingInUse() {
  Blocks::enable();
  ArrayPool::enable();
  ChannelPool::enable();
  VLN::BaseLogger::enable();
  static auto channel =
      ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(1.5f, true, true, 0, 28, 40, nullptr);
  channel->update(Tiles(40));
  static auto array = ArrayPool::allocate<float>(1.0f, 100000);
  static auto copy = *channel;
  auto const held = ChannelPool::allocate<OddTraits, float, 5, 0>(0.0f, false, true, 0, 12, 4, nullptr);
  std::exit(0);
}

TEST(PoolExit, RequirementExitWithEverythingInUse) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(exitWithEverythingInUse(), ::testing::ExitedWithCode(0), "");
}

} // namespace
