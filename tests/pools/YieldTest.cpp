// Pools and logger while threads give way at chosen places.
#include "support/YieldSeeds.h"

#ifdef VLN_YIELD_POINTS

#include "ChannelPoolFixture.h"
#include "CoutCapture.h"
#include "GeometryVolume/pools/ArrayPool.h"
#include "GeometryVolume/pools/BaseLogger.h"

#include <atomic>
#include <iostream>
#include <random>
#include <sstream>
#include <thread>
#include <vector>

namespace {

using namespace VLN::TileTree3D;
using VLN::BaseLogger;

constexpr int kThreads = 4, kRounds = 25, kSeeds = 12;

struct PoolYields : test::ChannelPoolTest {
  using ChannelPoolTest::density;
};

/// Takes arrays and channels, writes, shares and drops them. What is held must stay the holder's.
class Holder {
public:
  explicit Holder(std::uint64_t seed)
      : m_random(static_cast<std::uint32_t>(seed)) {}

  int work() {
    int wrong = 0;
    for (int round = 0; round < kRounds; ++round) {
      int const mark = static_cast<int>(m_random() % 1000000);
      auto array = ArrayPool::allocate<int>(mark, 50 + m_random() % 200);
      auto channel = PoolYields::density(1 + static_cast<std::int64_t>(m_random() % 6), float(mark));
      auto const shared = array;
      if (m_random() % 4 == 0) ArrayPool::freeMemory(1000);
      if (m_random() % 4 == 0) ChannelPool::freeMemory(1000);
      if (m_random() % 8 == 0) ArrayPool::freeMemoryNotUsedSinceCount(ArrayPool::allocationCount());
      for (int const v : *array) wrong += v == mark ? 0 : 1;
      for (float const v : std::as_const(*channel)) wrong += v == float(mark) ? 0 : 1;
      m_held.push_back(std::move(array));
      if (m_held.size() > 3) m_held.erase(m_held.begin());
    }
    m_held.clear();
    return wrong;
  }

private:
  std::mt19937 m_random;
  std::vector<Ostil::Ptr<Ostil::Array<int>>> m_held;
};

TEST_F(PoolYields, RequirementHoldersPoolsAndReports) {
  test::CoutCapture out;
  std::ostringstream quiet;
  auto* const before = std::cerr.rdbuf(quiet.rdbuf());
  Support::underYieldSeeds(kSeeds, [&](std::uint64_t seed) {
    BaseLogger::enable();
    std::atomic<int> wrong{0}, running{kThreads};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t)
      threads.emplace_back([&, t] {
        wrong += Holder(seed * 31 + static_cast<std::uint64_t>(t)).work();
        --running;
      });
    while (running > 0) {
      BaseLogger::dump();
      ArrayPool::dump();
      ChannelPool::availableMemory();
      out.take();
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(wrong, 0);
    EXPECT_EQ(ArrayPool::usedStoreSize() + ChannelPool::usedStoreSize(), 0u);
    BaseLogger::clear();
    BaseLogger::disable();
  });
  std::cerr.rdbuf(before);
}

} // namespace

#endif
