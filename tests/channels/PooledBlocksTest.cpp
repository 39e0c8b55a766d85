// Static tiles take their blocks from the pool while it is enabled.
#include "FakeTree.h"
#include "GeometryVolume/pools/ChannelMemoryPool.h"
#include "ProbeChannel.h"

#include <gtest/gtest.h>
#include <memory>
#include <utility>

namespace {

using namespace VLN::TileTree3D;
using namespace VLN::Test;

using C = ProbeChannel<PowerOfTwoTraits, float, 4, 1>;

class PooledBlocks : public ::testing::Test {
protected:
  PooledBlocks() { ChannelMemoryPool::enable(); }
  ~PooledBlocks() override {
    ChannelMemoryPool::disable();
    ChannelMemoryPool::freeAllMemory();
  }
};

TEST_F(PooledBlocks, RequirementBlocksComeFromAndReturnToThePool) {
  std::uint64_t const before = ChannelMemoryPool::usedStoreSize();
  {
    C channel(Flags{true});
    channel.update(FakeTree().set(3, 5));
    channel.update(FakeTree().set(3, 9));
    EXPECT_EQ(ChannelMemoryPool::usedStoreSize(), before + 2);
    TilePermutation p(kChannelDepths);
    p[3] = {8, 7, 6, 5, 4, 3, 2, 1, 0};
    channel.permute(&p);
    EXPECT_EQ(ChannelMemoryPool::usedStoreSize(), before + 1);
  }
  EXPECT_EQ(ChannelMemoryPool::usedStoreSize(), before);
  EXPECT_GE(ChannelMemoryPool::freeStoreSize(), 1u);
}

// What the pool keeps was written before, by another channel.
TEST_F(PooledBlocks, RequirementLargeBlocksHoldTheDefaultValueOfTheirNextChannel) {
  FakeTree const tree = FakeTree().set(3, 12000);
  for (float const value : {7.0f, 0.0f, 3.0f, 0.0f}) {
    C channel(Flags{true}, value);
    channel.update(tree);
    for (std::int64_t n = 0; n < channel.tileCount(3); ++n)
      for (float v : std::as_const(channel).tileData(n, 3)) ASSERT_EQ(v, value);
  }
  EXPECT_EQ(ChannelMemoryPool::freeStoreSize(), 1u);
}

TEST_F(PooledBlocks, RequirementHandedOverBlocksReturnWithTheStorage) {
  std::uint64_t const before = ChannelMemoryPool::usedStoreSize();
  auto original = std::make_unique<C>(Flags{true}, 4.0f);
  original->update(FakeTree().set(3, 5));
  auto copy = std::make_unique<C>(*original);
  original.reset();
  EXPECT_EQ(ChannelMemoryPool::usedStoreSize(), before + 1);
  EXPECT_EQ(std::as_const(*copy).tileData(4, 3)[215], 4.0f);
  // Tiles that move to new storage take their block along.
  TilePermutation p(kChannelDepths);
  p[3] = {4, 3, 2, 1, 0};
  void const* const storage = copy->dataPtr();
  copy->permute(&p);
  EXPECT_NE(copy->dataPtr(), storage);
  EXPECT_TRUE(copy->isStatic({0, 3}));
  EXPECT_EQ(ChannelMemoryPool::usedStoreSize(), before + 1);
  copy.reset();
  EXPECT_EQ(ChannelMemoryPool::usedStoreSize(), before);
}

} // namespace
