#include "ChannelPoolFixture.h"
#include "ControlGroup.h"
#include "CoutCapture.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <type_traits>

namespace {

using namespace VLN::TileTree3D;
using namespace test;

TEST(ChannelPoolOff, RequirementHandsOutNullAndAnswersNothing) {
  ASSERT_FALSE(ChannelPool::enabled());
  auto const ask = [] {
    return ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(1.0f, false, true, 0, 28, 10, nullptr);
  };
  EXPECT_FALSE(ask());
  EXPECT_EQ(ChannelPool::allocationCount(), 0u);
  ChannelPool::enable();
  auto const held = ask();
  ASSERT_TRUE(held);
  EXPECT_EQ(ChannelPool::usedStoreSize(), 1u);
  EXPECT_GT(ChannelPool::allocatedMemory(), 0u);
  ChannelPool::disable();
  EXPECT_EQ(held.useCount(), 1) << "its holder keeps it";
  EXPECT_EQ(ChannelPool::usedStoreSize(), 0u);
  EXPECT_EQ(ChannelPool::freeStoreSize(), 0u);
  EXPECT_EQ(ChannelPool::allocatedMemory(), 0u);
  EXPECT_EQ(ChannelPool::availableMemory(), 0u);
  EXPECT_EQ(ChannelPool::requiredFreeSize(), 0u);
  ChannelPool::dump();
}

template <class Traits, class T, int E, int H> void handsOut(std::uint64_t& stores) {
  auto channel = ChannelPool::allocate<Traits, T, E, H>(T{}, false, true, 1, 12, 10, nullptr);
  ASSERT_TRUE(channel);
  EXPECT_EQ(channel->name(), "channel_pool");
  EXPECT_EQ(channel->minDepth(), 1);
  EXPECT_EQ(channel->depth(), 12);
  EXPECT_EQ(channel->dataElementInitializerType(), kInitializeNone);
  EXPECT_EQ(channel.useCount(), 2);
  EXPECT_EQ(ChannelPool::freeStoreSize(), stores) << "no idle channel of another kind was a candidate";
  void* const address = channel.get();
  channel.reset();
  EXPECT_EQ(ChannelPool::freeStoreSize(), ++stores);
  EXPECT_EQ((ChannelPool::allocate<Traits, T, E, H>(T{}, false, true, 1, 12, 10, nullptr).get()), address);
}

TEST_F(ChannelPoolTest, RequirementEveryKindHasAStoreOfItsOwn) {
  std::uint64_t stores = 0, types = 0;
#define VLN_CHECK(type, name)                                                                                \
  ++types;                                                                                                   \
  handsOut<PowerOfTwoTraits, type, 4, 0>(stores);                                                            \
  handsOut<PowerOfTwoTraits, type, 5, 0>(stores);                                                            \
  handsOut<PowerOfTwoTraits, type, 4, 1>(stores);                                                            \
  handsOut<OddTraits, type, 5, 0>(stores);                                                                   \
  handsOut<OddTraits, type, 6, 0>(stores);                                                                   \
  handsOut<OddTraits, type, 5, 1>(stores);
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_CHECK)
#undef VLN_CHECK
  EXPECT_EQ(stores, 6 * types);
  EXPECT_EQ(ChannelPool::allocationCount(), 12 * types);
}

TEST_F(ChannelPoolTest, RequirementAChannelReturnsWhenItsHolderLetsGo) {
  auto first = density(10), second = density(10);
  EXPECT_NE(first.get(), second.get());
  void* const address = first.get();
  first.reset();
  EXPECT_EQ(ChannelPool::freeStoreSize(), 1u);
  EXPECT_EQ(ChannelPool::usedStoreSize(), 1u);
  EXPECT_EQ(density(10).get(), address);
}

TEST_F(ChannelPoolTest, RequirementBestFitByTiles) {
  // With the tiles of depth 27: 56, 225 and 450.
  auto const channels = idle({50, 200, 400});
  EXPECT_EQ(density(100).get(), channels[1]) << "the smallest sufficient";
  ChannelPool::freeAllMemory();
  auto const falling = idle({400, 200, 50});
  EXPECT_EQ(density(100).get(), falling[1]);
  ChannelPool::freeAllMemory();
  auto const small = idle({50, 200});
  EXPECT_EQ(density(1000).get(), small[1]) << "failing that, the largest";
}

TEST_F(ChannelPoolTest, RequirementAReusedChannelIsReconfigured) {
  auto channel = density(16, 2.5f);
  void* const address = channel.get();
  EXPECT_EQ(channel->tileData(3, 28)[5], 2.5f);
  channel.reset();
  Tiles const tiles(16);
  channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(7.0f, true, true, 28, 28, 16, &tiles);
  ASSERT_EQ(channel.get(), address);
  EXPECT_EQ(channel->defaultValue(), 7.0f);
  EXPECT_EQ(channel->minDepth(), 28);
  EXPECT_EQ(channel->depth(), 28);
  EXPECT_EQ(channel->tileCount(27), 0);
  EXPECT_EQ(channel->tileCount(28), 16);
  for (int t = 0; t < 16; ++t)
    for (int e = 0; e < 216; ++e) ASSERT_EQ(channel->tileData(t, 28)[e], 7.0f) << t << ' ' << e;
  channel.reset();
  channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(8.0f, false, true, 0, 28, 16, &tiles);
  ASSERT_EQ(channel.get(), address);
  EXPECT_EQ(channel->tileCount(27), 2) << "the new depths follow the component";
  EXPECT_EQ(channel->tileData(1, 27)[0], 8.0f);
}

TEST_F(ChannelPoolTest, RequirementWithoutConstructionTheContentsStay) {
  auto channel = density(16, 2.5f);
  void* const address = channel.get();
  channel.reset();
  channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(7.0f, false, false, 0, 28, 16, nullptr);
  ASSERT_EQ(channel.get(), address);
  EXPECT_FALSE(channel->callElementConstructor());
  EXPECT_EQ(channel->defaultValue(), 7.0f);
  EXPECT_EQ(channel->tileData(3, 28)[5], 2.5f);
  channel.reset();
  channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(7.0f, false, true, 0, 28, 16, nullptr);
  EXPECT_TRUE(channel->callElementConstructor());
  EXPECT_EQ(channel->tileData(3, 28)[5], 7.0f);
}

TEST_F(ChannelPoolTest, RequirementStaticAllocationStaysAsItWasMade) {
  QuietErrors const quiet;
  auto channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 0>(1.0f, true, true, 0, 28, 16, nullptr);
  channel->update(Tiles(16));
  float const* const begin = &channel->tileData(0, 28)[0];
  EXPECT_EQ(&channel->tileData(1, 28)[0], begin + 64) << "one block";
  channel.reset();
  channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 0>(2.0f, false, true, 0, 28, 16, nullptr);
  EXPECT_EQ(&channel->tileData(0, 28)[0], begin);
  channel->removeAll();
  channel->update(Tiles(24));
  EXPECT_EQ(&channel->tileData(1, 28)[0], &channel->tileData(0, 28)[0] + 64) << "still one";
  EXPECT_EQ(channel->tileData(20, 28)[63], 2.0f);
}

TEST_F(ChannelPoolTest, BoundaryWithoutAComponentNewDepthsStayEmpty) {
  auto channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(1.0f, false, true, 28, 28, 16, nullptr);
  channel->update(Tiles(16));
  channel.reset();
  channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(3.0f, false, true, 5, 28, 16, nullptr);
  EXPECT_EQ(channel->minDepth(), 5);
  EXPECT_EQ(channel->tileCount(27), 0);
  EXPECT_EQ(channel->tileCount(28), 16) << "old counts, until it is updated";
  EXPECT_EQ(channel->tileData(15, 28)[215], 3.0f);
  channel.reset();
  channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(3.0f, false, true, 5, 20, 16, nullptr);
  EXPECT_EQ(channel->depth(), 20);
  EXPECT_EQ(channel->tileCount(-1), 0);
}

TEST_F(ChannelPoolTest, RequirementACopyOfAPooledChannelKeepsItsValues) {
  auto channel = density(16, 2.5f);
  void* const address = channel.get();
  auto const copy = *channel;
  channel.reset();
  channel = density(16, 9.0f);
  ASSERT_EQ(channel.get(), address);
  EXPECT_EQ(channel->tileData(3, 28)[5], 9.0f);
  EXPECT_EQ(copy.tileData(3, 28)[5], 2.5f);
}

TEST_F(ChannelPoolTest, RequirementResettingIsTheSameAtEveryThreadCount) {
  for (int threads : {1, 2, 8}) {
    VLN::withThreads(threads, [&] {
      auto const channel = density(800, float(threads));
      for (int t = 0; t < 800; ++t) {
        auto const tile = std::as_const(*channel).tileData(t, 28);
        for (int e = 0; e < 216; ++e) ASSERT_EQ(tile[e], float(threads));
      }
    });
  }
  EXPECT_EQ(ChannelPool::freeStoreSize(), 1u);
}

TEST_F(ChannelPoolTest, RequirementAmounts) {
  ControlGroup group;
  group.setFree(5000000);
  auto const used = density(50);
  idle({20});
  std::uint64_t const usedBytes = allocatedBy(*used), all = ChannelPool::allocatedMemory();
  EXPECT_GE(usedBytes, 56u * 864u);
  EXPECT_GE(all, usedBytes + 22u * 864u);
  EXPECT_EQ(ChannelPool::availablePhysicalMemory(), 5000000u);
  EXPECT_EQ(ChannelPool::totalPhysicalMemory(), ControlGroup::kLimit);
  EXPECT_EQ(ChannelPool::availableMemory(), 5000000u + all - usedBytes);
  ChannelPool::enableRequiredFreeSize();
  ChannelPool::addRequiredFreeSize(1000);
  EXPECT_EQ(ChannelPool::requiredFreeSize(), 1000u);
  EXPECT_EQ(ChannelPool::availableMemory(), 4999000u + all - usedBytes);
  ChannelPool::subtractRequiredFreeSize(2000);
  EXPECT_EQ(ChannelPool::requiredFreeSize(), 0u);
  group.makeUnreadable();
  EXPECT_EQ(ChannelPool::availablePhysicalMemory(), 0u);
  EXPECT_EQ(ChannelPool::totalPhysicalMemory(), 0u);
}

TEST_F(ChannelPoolTest, RequirementTheRequiredSizeIsLostWhileItIsOff) {
  ChannelPool::setRequiredFreeSize(500);
  ChannelPool::enableRequiredFreeSize();
  EXPECT_EQ(ChannelPool::requiredFreeSize(), 0u);
}

TEST_F(ChannelPoolTest, RequirementAgeing) {
  auto const channels = idle({8, 16, 32});
  ChannelPool::freeMemoryNotUsedSinceCount(0);
  EXPECT_EQ(ChannelPool::freeStoreSize(), 3u);
  auto const used = density(8);
  EXPECT_EQ(used.get(), channels[0]);
  EXPECT_EQ(ChannelPool::allocationCount(), 4u);
  ChannelPool::freeMemoryNotUsedSinceCount(3);
  EXPECT_EQ(ChannelPool::freeStoreSize(), 1u);
  EXPECT_EQ(ChannelPool::usedStoreSize(), 1u);
  ChannelPool::resetAllocationCount();
  ChannelPool::freeMemoryNotUsedSinceCount(0);
  EXPECT_EQ(ChannelPool::usedStoreSize() + ChannelPool::freeStoreSize(), 0u);
  EXPECT_EQ(used.useCount(), 1);
  EXPECT_EQ(used->tileCount(28), 8) << "it stays whole";
}

} // namespace
