// Keeping memory free in both pools: every way that freeMemory() can end, with a pretended control group that
// says how much is free at each step.
#include "ChannelPoolFixture.h"
#include "PoolScript.h"

namespace {

using namespace test;

class ChannelPoolFree : public ChannelPoolTest {
protected:
  ChannelPoolFree() {
    ArrayPool::disable();
    ChannelPool::enableLog();
    script.group.setFree(10 * kMB);
  }
  int tries() { return script.out.count("ChannelPool:Attempting freeing of memory, try #"); }
  int flushes() {
    return script.out.count(
        "ChannelPool: Flushing jemalloc because not enough physical memory was available");
  }
  bool ok() { return script.out.count("ChannelPool:OK: Enough physical memory now available (") == 1; }
  bool warned() {
    return script.out.count("ChannelPool:Warning: NOT enough physical memory available (") == 1;
  }
  /// Idle arrays of a megabyte each, without a word.
  static void idleArrays(int n) {
    ArrayPool::enable();
    std::vector<Ostil::Ptr<Ostil::Array<unsigned char>>> held;
    for (int i = 0; i < n; ++i) held.push_back(ArrayPool::allocate<unsigned char>(0, kMB));
  }
  static constexpr char const* kRemoving = "ChannelPool: removing ";
  static constexpr char const* kFlushed = "ChannelPool: jemalloc stats after flushing:";
  PoolScript script;
};

TEST_F(ChannelPoolFree, RequirementDropsTheSmallestUntilTheirSumIsEnough) {
  auto const channels = idle({400, 100, 200});
  std::uint64_t const all = ChannelPool::allocatedMemory();
  script.out.take();
  script.free(kRemoving, 13);
  ChannelPool::freeMemory(200 * 864);
  EXPECT_EQ(tries(), 1);
  EXPECT_EQ(flushes(), 0) << "it showed at once";
  EXPECT_TRUE(script.out.after(kRemoving).starts_with("2 channels of total size "))
      << script.out.after(kRemoving);
  EXPECT_TRUE(ok());
  EXPECT_EQ(ChannelPool::freeStoreSize(), 1u);
  EXPECT_LT(ChannelPool::allocatedMemory(), all - 337 * 864);
  EXPECT_EQ(density(400).get(), channels[0]) << "the largest is left";
}

TEST_F(ChannelPoolFree, RequirementEnoughOnlyAfterTheFlush) {
  idle({100, 200});
  script.out.take();
  script.free(kFlushed, 13);
  ChannelPool::freeMemory(100 * 864);
  EXPECT_TRUE(script.done());
  EXPECT_EQ(tries(), 1);
  EXPECT_EQ(flushes(), 1);
  EXPECT_TRUE(ok());
  EXPECT_EQ(ChannelPool::freeStoreSize(), 1u);
}

TEST_F(ChannelPoolFree, RequirementATryTakesTheWholeAmountAgain) {
  idle({100, 100, 100, 100, 100});
  script.out.take();
  script.free(kFlushed, 10).free(kFlushed, 10).free(kFlushed, 11);
  ChannelPool::freeMemory(150 * 864); // a channel has 112 tiles
  EXPECT_EQ(tries(), 3);
  EXPECT_EQ(flushes(), 3);
  EXPECT_EQ(script.out.count("ChannelPool: removing 2 channels of total size "), 2);
  EXPECT_EQ(script.out.count("ChannelPool: removing 1 channels of total size "), 1);
  EXPECT_EQ(
      script.out.count("ChannelPool: Enough physical memory is still not available, need to try again..."),
      2);
  EXPECT_TRUE(ok());
}

TEST_F(ChannelPoolFree, NegativeNotEnough) {
  auto const used = density(300, 4.0f);
  idle({100, 100});
  script.out.take();
  ChannelPool::freeMemory(20 * kMB);
  EXPECT_EQ(tries(), 1);
  EXPECT_EQ(flushes(), 1);
  EXPECT_TRUE(warned());
  EXPECT_EQ(ChannelPool::freeStoreSize(), 0u);
  EXPECT_EQ(ChannelPool::usedStoreSize(), 1u) << "channels in use survive";
  EXPECT_EQ(used->tileData(299, 28)[0], 4.0f);
}

TEST_F(ChannelPoolFree, NegativeUnreadableFiguresDropEverythingTryByTry) {
  idle({100, 100, 100});
  ArrayPool::enable();
  script.out.take();
  script.unreadable(kRemoving);
  ChannelPool::freeMemory(100 * 864);
  EXPECT_EQ(tries(), 3);
  EXPECT_EQ(flushes(), 0) << "nothing is known";
  EXPECT_EQ(script.out.count("ChannelPool:Unable to retrieve memory stats"), 3) << "a dump for each try";
  EXPECT_EQ(script.out.count("ChannelPool: Not enough physical memory available. Calling"), 0);
  EXPECT_TRUE(warned());
  EXPECT_EQ(ChannelPool::freeStoreSize(), 0u);
}

TEST_F(ChannelPoolFree, NegativeUnreadableAfterTheFlushIsNotEnough) {
  idle({100});
  script.out.take();
  script.unreadable(kFlushed);
  ChannelPool::freeMemory(100 * 864);
  EXPECT_EQ(flushes(), 1);
  EXPECT_TRUE(warned());
}

TEST_F(ChannelPoolFree, RequirementEnoughOnlyAfterTheArrays) {
  idle({100});
  idleArrays(3);
  script.out.take();
  // The channel's own flush, then the flush of the last resort; then the arrays go.
  script.free(kFlushed, 10)
      .free(kFlushed, 10.5)
      .on("ChannelPool: Not enough physical memory available. Calling recursively into ArrayPool.",
          [] { ArrayPool::enableLog(); });
  script.free("ArrayPool: removing ", 12);
  ChannelPool::freeMemory(2 * kMB);
  ArrayPool::disableLog();
  EXPECT_TRUE(script.done());
  EXPECT_EQ(flushes(), 2);
  EXPECT_EQ(script.out.after("ArrayPool:freeMemory of "), "1.5MB") << "what was still missing";
  EXPECT_EQ(script.out.count(
                "ChannelPool: Enough physical memory available after calling recursively into ArrayPool."),
            1);
  EXPECT_TRUE(ok());
  EXPECT_EQ(ArrayPool::freeStoreSize(), 1u);
}

TEST_F(ChannelPoolFree, NegativeNotEnoughAfterTheArraysEither) {
  idleArrays(2);
  script.out.take();
  script.free(kFlushed, 9); // less than before: the whole amount is asked of the arrays
  ArrayPool::enableLog();
  ChannelPool::freeMemory(3 * kMB);
  ArrayPool::disableLog();
  EXPECT_EQ(tries(), 0);
  EXPECT_EQ(script.out.after("ArrayPool:freeMemory of "), "3MB");
  EXPECT_EQ(script.out.count("ChannelPool: Still not enough physical memory available after calling "
                             "recursively into ArrayPool."),
            1);
  EXPECT_EQ(script.out.count("ChannelPool: Terminating freeMemory early as freeing is already in progress"),
            1)
      << "the arrays ask the channels in turn, which are at it already";
  EXPECT_TRUE(warned());
  EXPECT_EQ(ArrayPool::freeStoreSize(), 0u);
}

TEST_F(ChannelPoolFree, BoundaryEnoughAfterTheLastFlushIsNotCounted) {
  idle({100});
  idleArrays(1);
  script.out.take();
  script.free(kFlushed, 10).free(kFlushed, 13);
  ChannelPool::freeMemory(2 * kMB);
  EXPECT_TRUE(script.done());
  EXPECT_EQ(flushes(), 2);
  EXPECT_EQ(script.out.count("ChannelPool: Not enough physical memory available. Calling"), 0);
  EXPECT_TRUE(warned());
  EXPECT_EQ(ArrayPool::freeStoreSize(), 1u) << "the arrays were not asked";
}

TEST_F(ChannelPoolFree, BoundaryUnreadableAtTheLastResortAsksNobody) {
  idleArrays(1);
  script.group.makeUnreadable();
  script.out.take();
  ChannelPool::freeMemory(kMB);
  EXPECT_EQ(flushes(), 0);
  EXPECT_TRUE(warned());
  EXPECT_EQ(ArrayPool::freeStoreSize(), 1u);
}

TEST_F(ChannelPoolFree, BoundaryUnreadableAfterTheLastFlushAsksTheArrays) {
  idleArrays(1);
  script.out.take();
  script.unreadable(kFlushed);
  ChannelPool::freeMemory(kMB);
  EXPECT_EQ(script.out.count("ChannelPool: Not enough physical memory available. Calling"), 1);
  EXPECT_TRUE(warned());
  EXPECT_EQ(ArrayPool::freeStoreSize(), 0u);
}

// The arrays' last resort are the channels.

TEST_F(ChannelPoolFree, RequirementArraysHaveEnoughOnlyAfterTheChannels) {
  idle({100});
  idleArrays(1);
  script.out.take();
  ArrayPool::enableLog();
  script.free("ArrayPool: removing ", 11).free(kRemoving, 12);
  ArrayPool::freeMemory(2 * kMB);
  ArrayPool::disableLog();
  EXPECT_TRUE(script.done());
  EXPECT_EQ(script.out.after("ChannelPool:freeMemory of "), "1MB");
  EXPECT_EQ(script.out.count(
                "ArrayPool: Enough physical memory available after calling recursively into ChannelPool."),
            1);
  EXPECT_EQ(script.out.count("ArrayPool:OK: Enough physical memory now available ("), 1);
  EXPECT_EQ(ChannelPool::freeStoreSize(), 0u);
}

TEST_F(ChannelPoolFree, NegativeArraysHaveNotEnoughAfterTheChannelsEither) {
  idle({100});
  idleArrays(1);
  script.out.take();
  ArrayPool::enableLog();
  ArrayPool::freeMemory(2 * kMB);
  ArrayPool::disableLog();
  EXPECT_EQ(script.out.count("ArrayPool: Terminating freeMemory early as freeing is already in progress"), 1);
  EXPECT_EQ(script.out.count("ArrayPool: Not enough physical memory available. Calling recursively into "
                             "ChannelPool."),
            1);
  EXPECT_EQ(
      script.out.count("ArrayPool: Still not enough physical memory available after calling recursively "
                       "into ChannelPool."),
      1);
  EXPECT_EQ(script.out.count("ArrayPool:Warning: NOT enough physical memory available ("), 1);
  EXPECT_EQ(ChannelPool::freeStoreSize(), 0u);
}

TEST_F(ChannelPoolFree, BoundaryArraysFindEnoughAtTheLastResort) {
  idle({100});
  idleArrays(1);
  script.out.take();
  ArrayPool::enableLog();
  // What another process gave back between the two readings.
  script.free("ArrayPool: Enough physical memory is still not available: ", 20);
  ArrayPool::freeMemory(2 * kMB);
  ArrayPool::disableLog();
  EXPECT_TRUE(script.done());
  EXPECT_EQ(script.out.count("ArrayPool:Warning: NOT enough physical memory available ("), 1);
  EXPECT_EQ(ChannelPool::freeStoreSize(), 1u) << "the channels were not asked";
}

// The required size

TEST_F(ChannelPoolFree, RequirementAllocationMakesRoomFirst) {
  idle({100});
  ChannelPool::enableRequiredFreeSize();
  ChannelPool::setRequiredFreeSize(10 * kMB);
  script.out.take();
  script.free(kRemoving, 11);
  auto const channel = ChannelPool::allocate<OddTraits, float, 5, 0>(1.0f, false, true, 0, 12, 1000, nullptr);
  EXPECT_TRUE(script.done());
  EXPECT_EQ(script.out.after("ChannelPool: estimatedExtraMemUsage = "),
            "500000, data.m_requiredFreeSize = 10485760");
  EXPECT_EQ(script.out.after("ChannelPool: Inserting into pool = "), "1");
  EXPECT_EQ(ChannelPool::usedStoreSize(), 1u);
}

TEST_F(ChannelPoolFree, NegativeWithoutRoomAChannelStaysOutside) {
  ChannelPool::enableRequiredFreeSize();
  ChannelPool::setRequiredFreeSize(10 * kMB);
  script.out.take();
  auto const channel =
      ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(1.0f, false, true, 0, 28, 100, nullptr);
  ASSERT_TRUE(channel);
  EXPECT_EQ(script.out.after("ChannelPool: estimatedExtraMemUsage = "),
            "86400, data.m_requiredFreeSize = 10485760");
  EXPECT_EQ(script.out.after("ChannelPool: Inserting into pool = "), "0");
  EXPECT_EQ(channel.useCount(), 1);
  EXPECT_EQ(ChannelPool::usedStoreSize() + ChannelPool::freeStoreSize(), 0u);
  EXPECT_EQ(ChannelPool::allocationCount(), 1u);
}

TEST_F(ChannelPoolFree, NegativeWithoutRoomAReusedChannelLeavesThePool) {
  auto const channels = idle({50, 100, 200});
  ChannelPool::enableRequiredFreeSize();
  ChannelPool::setRequiredFreeSize(10 * kMB);
  script.out.take();
  auto const fits = density(100);
  EXPECT_EQ(fits.get(), channels[1]);
  EXPECT_EQ(script.out.after("ChannelPool: estimatedExtraMemUsage = "),
            "0, data.m_requiredFreeSize = 10485760")
      << "what fits needs no room";
  EXPECT_EQ(fits.useCount(), 2);
  auto const grown = density(500);
  EXPECT_EQ(grown.get(), channels[2]) << "the channel chosen is not among those dropped for it";
  EXPECT_EQ(grown.useCount(), 1);
  EXPECT_EQ(ChannelPool::freeStoreSize(), 0u);
  EXPECT_EQ(ChannelPool::usedStoreSize(), 1u);
}

TEST_F(ChannelPoolFree, RequirementSettingFreesAtOnce) {
  idle({100});
  ChannelPool::enableRequiredFreeSize();
  ChannelPool::setRequiredFreeSize(10 * kMB);
  EXPECT_EQ(ChannelPool::freeStoreSize(), 1u);
  ChannelPool::addRequiredFreeSize(1);
  EXPECT_EQ(ChannelPool::freeStoreSize(), 0u);
  ChannelPool::disableRequiredFreeSize();
  script.out.take();
  auto const channel = density(10);
  EXPECT_EQ(script.out.count("ChannelPool: Warning - memStats NOT OK"), 1) << "the check is skipped";
  EXPECT_EQ(ChannelPool::usedStoreSize(), 1u);
}

} // namespace
