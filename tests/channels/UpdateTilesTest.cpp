// Tiles added, removed and permuted, and what happens to static blocks.
#include "FakeTree.h"
#include "ProbeChannel.h"

#include <bit>
#include <cstdint>
#include <gtest/gtest.h>
#include <utility>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using namespace VLN::Test;

using Points = ProbeChannel<PowerOfTwoTraits, float, 4, 0>;
using Haloed = ProbeChannel<PowerOfTwoTraits, float, 4, 1>;
using Extended = ProbeChannel<PowerOfTwoTraits, float, 5, 0>;

TEST(TileSlotStride, RequirementPadsToCacheLines) {
  using VLN::TileTree3D::Internal::tileSlotStride;
  EXPECT_EQ(tileSlotStride(216, sizeof(float)), 224);
  EXPECT_EQ(tileSlotStride(216, 1), 256);
  EXPECT_EQ(tileSlotStride(216, 12), 219);
  EXPECT_EQ(tileSlotStride(216, 24), 216);
  EXPECT_EQ(tileSlotStride(343, 24), 345);
  EXPECT_EQ(tileSlotStride(64, 4), 64);
  EXPECT_EQ(tileSlotStride(125, 36), 127);
}

template <class C> void expectSize(C const& channel, int depth, std::int64_t tiles, int elements) {
  ASSERT_EQ(channel.tileCount(depth), tiles);
  for (std::int64_t i = 0; i < tiles; ++i) EXPECT_EQ(channel.elementCount(TreeIndex{i, depth}), elements);
}

TEST(UpdateTiles, RequirementFixedChannelsIgnoreElementCounts) {
  FakeTree tree;
  tree.set(2, 3, 7);
  for (bool useStatic : {false, true}) {
    Haloed haloed(Flags{useStatic});
    haloed.update(tree);
    expectSize(haloed, 2, 3, 216);
    Extended extended(Flags{useStatic});
    extended.update(tree);
    expectSize(extended, 2, 3, 125);
    Points points(Flags{useStatic});
    points.update(tree);
    expectSize(points, 2, 3, 7);
  }
}

TEST(UpdateTiles, RequirementNewTilesHoldTheDefaultValue) {
  for (bool useStatic : {false, true}) {
    Haloed channel(Flags{useStatic}, 2.5f);
    channel.update(FakeTree().set(0, 1).set(28, 300));
    for (float v : std::as_const(channel).tileData(299, 28)) ASSERT_EQ(v, 2.5f);
    EXPECT_EQ(channel.tileCount(-1), 301);
  }
}

TEST(UpdateTiles, RequirementAppendedTilesAreAsThoseOfAnUpdate) {
  Haloed channel(Flags{}, 2.5f);
  channel.update(FakeTree().set(3, 2).set(28, 1));
  Haloed const copy(channel);
  channel.appendTiles(28, 40);
  channel.appendTiles(3, 1);
  expectSize(channel, 28, 41, 216);
  expectSize(channel, 3, 3, 216);
  for (float v : std::as_const(channel).tileData(40, 28)) ASSERT_EQ(v, 2.5f);
  EXPECT_EQ(channel.tileCount(-1), 44);
  EXPECT_EQ(copy.tileCount(-1), 3) << "who shared the tiles keeps what it had";
  channel.update(FakeTree().set(3, 3).set(28, 41));
  EXPECT_EQ(channel.tileCount(-1), 44);
  channel.setDepth(20, FakeTree().set(3, 3));
  channel.appendTiles(28, 1);
  EXPECT_EQ(channel.tileCount(28), 0) << "out of the channel's depths";
}

TEST(UpdateTiles, RequirementExistingElementsAreNeverTouched) {
  for (bool useStatic : {false, true}) {
    Points channel(Flags{useStatic});
    channel.update(FakeTree().set(4, 2, 8));
    channel.tileData(1, 4).set(9.0f);
    float const* const at = channel.tileData(1, 4).data()->data();
    channel.update(FakeTree().set(4, 50, 4).set(5, 50, 3));
    EXPECT_EQ(channel.elementCount(TreeIndex{1, 4}), 8);
    EXPECT_EQ(channel.elementCount(TreeIndex{49, 4}), 4);
    EXPECT_EQ(channel.tileData(1, 4).data()->data(), at);
    EXPECT_EQ(std::as_const(channel).tileData(1, 4)[7], 9.0f);
  }
}

TEST(UpdateTiles, BoundarySameCountsChangeNothingAndAddNoBlock) {
  FakeTree tree;
  tree.set(1, 3, 10).set(9, 4, 10);
  for (bool useStatic : {false, true}) {
    Points channel(Flags{useStatic});
    channel.update(tree);
    std::size_t const blocks = channel.blockCount();
    EXPECT_EQ(blocks, useStatic ? 1u : 0u);
    Points const copy(channel);
    channel.update(tree);
    EXPECT_EQ(channel.blockCount(), blocks);
    EXPECT_EQ(channel.dataPtr(), copy.dataPtr());
  }
}

TEST(UpdateTiles, NegativeStrangersAreIgnored) {
  Points channel;
  channel.update(FakeTree().set(1, 3, 10));
  channel.update(Stranger());
  EXPECT_EQ(channel.tileCount(1), 3);
}

TEST(UpdateTiles, RequirementEachGrowingUpdateAddsOneBlock) {
  Haloed channel(Flags{true});
  FakeTree tree;
  for (std::size_t n = 1; n <= 4; ++n) {
    tree.set(3, n).set(7, 2 * n);
    channel.update(tree);
    EXPECT_EQ(channel.blockCount(), n);
  }
  for (std::int64_t i = 0; i < 8; ++i) {
    ASSERT_TRUE(channel.isStatic({i, 7}));
    EXPECT_EQ(reinterpret_cast<std::uintptr_t>(channel.tileData(i, 7).data()->data()) % 64, 0u);
  }
  channel.update(FakeTree().set(3, 1));
  EXPECT_EQ(channel.tileCount(3), 1);
  EXPECT_EQ(channel.tileCount(7), 0);
  EXPECT_EQ(channel.blockCount(), 4u);
}

TEST(UpdateTiles, RequirementStaticPointTilesLieOneBehindTheOther) {
  Points channel(Flags{true}, 1.0f);
  FakeTree tree;
  tree.elements[3] = {5, 0, 7};
  tree.elements[9] = {2};
  channel.update(tree);
  float const* const first = channel.tileData(0, 3).data()->data();
  EXPECT_EQ(channel.tileData(2, 3).data()->data(), first + 5);
  EXPECT_EQ(channel.tileData(0, 9).data()->data(), first + 12);
  EXPECT_EQ(channel.elementCount(TreeIndex{1, 3}), 0);
  EXPECT_FALSE(channel.isStatic({1, 3}));
}

TEST(UpdateTiles, RequirementStaticPointTilesOfOneSizeLieBehindThoseThatDiffer) {
  Points channel(Flags{true}, 1.0f);
  FakeTree tree;
  tree.elements[3] = {5, 7};
  tree.elements[9] = {2, 2, 2};
  channel.update(tree);
  float const* const first = channel.tileData(0, 3).data()->data();
  for (std::int64_t n = 0; n < 3; ++n) EXPECT_EQ(channel.tileData(n, 9).data()->data(), first + 12 + 2 * n);
  EXPECT_EQ(channel.tileData(2, 9)[1], 1.0f);
  tree.elements[9] = {2, 2, 2, 6, 6, 1};
  channel.update(tree);
  EXPECT_EQ(channel.elementCount(TreeIndex{4, 9}), 6);
  EXPECT_EQ(channel.elementCount(TreeIndex{5, 9}), 1);
  EXPECT_EQ(channel.tileData(4, 9).data()->data(), channel.tileData(3, 9).data()->data() + 6);
  for (std::int64_t n = 0; n < 6; ++n)
    for (float v : std::as_const(channel).tileData(n, 9)) EXPECT_EQ(v, 1.0f);
}

// Blocks of many megabytes are made in other ways than small ones.
template <class C> void expectLargeGrowth(int elements) {
  constexpr std::size_t kTiles = 40000;
  for (float const value : {0.0f, -0.0f, 2.5f}) {
    auto const bits = std::bit_cast<std::uint32_t>(value);
    C channel(Flags{true}, value);
    for (std::size_t n : {kTiles, kTiles + 1, 2 * kTiles}) {
      auto const before = channel.tileCount(20);
      channel.update(FakeTree().set(20, n, elements).set(28, 3, elements));
      expectSize(channel, 28, 3, elements);
      ASSERT_EQ(channel.tileCount(20), static_cast<std::int64_t>(n));
      for (auto i = before; i < channel.tileCount(20); ++i) {
        ASSERT_EQ(channel.elementCount(TreeIndex{i, 20}), elements);
        ASSERT_TRUE(channel.isStatic({i, 20}));
        for (float v : std::as_const(channel).tileData(i, 20))
          ASSERT_EQ(std::bit_cast<std::uint32_t>(v), bits);
        channel.tileData(i, 20).set(static_cast<float>(i));
      }
    }
    for (std::int64_t i = 0; i < channel.tileCount(20); ++i)
      for (float v : std::as_const(channel).tileData(i, 20)) ASSERT_EQ(v, static_cast<float>(i));
  }
}
TEST(UpdateTiles, RequirementLargeStaticGrowthHoldsTheDefaultValue) {
  expectLargeGrowth<Points>(64);
  expectLargeGrowth<Haloed>(216);
}

TEST(UpdateTiles, BoundaryStaticGrowthByEmptyTilesNeedsNoBlock) {
  Points channel(Flags{true});
  channel.update(FakeTree().set(3, 5, 0));
  EXPECT_EQ(channel.tileCount(3), 5);
  EXPECT_EQ(channel.blockCount(), 0u);
}

TEST(UpdateTiles, RequirementWithoutConstructorTilesKeepWhatMemoryHeld) {
  for (bool useStatic : {false, true}) {
    Haloed channel(Flags{useStatic, false}, 5.0f);
    channel.update(FakeTree().set(0, 2));
    expectSize(channel, 0, 2, 216);
    channel.tileData(0, 0).set(1.0f);
    channel.tileData(1, 0).set(2.0f);
    // The growing array of tiles must carry unconstructed elements along.
    channel.update(FakeTree().set(0, 100));
    channel.update(FakeTree().set(0, 2));
    EXPECT_EQ(std::as_const(channel).tileData(0, 0)[215], 1.0f);
    EXPECT_EQ(std::as_const(channel).tileData(1, 0)[0], 2.0f);
  }
}

TEST(UpdateTiles, RequirementEmptyTileDataHasCountsButNoElements) {
  for (bool useStatic : {false, true}) {
    Haloed channel(Flags{useStatic, true, true});
    channel.update(FakeTree().set(0, 1).set(6, 4));
    EXPECT_EQ(channel.tileCount(6), 4);
    EXPECT_EQ(channel.tileCount(-1), 5);
    EXPECT_EQ(channel.size(), 0u);
    EXPECT_EQ(channel.blockCount(), 0u);
    channel.disableAllocateEmptyTileData();
    channel.update(FakeTree().set(0, 1).set(6, 5));
    EXPECT_EQ(channel.elementCount(TreeIndex{3, 6}), 0);
    EXPECT_EQ(channel.elementCount(TreeIndex{4, 6}), 216);
  }
}

TEST(UpdateTiles, RequirementOnlyDepthsInRangeHaveTiles) {
  FakeTree tree;
  for (int d = 0; d < kChannelDepths; ++d) tree.set(d, 2, 3);
  for (bool useStatic : {false, true}) {
    Points channel(Flags{useStatic, true, false, 4, 6});
    channel.update(tree);
    EXPECT_EQ(channel.tileCount(-1), 6);
    EXPECT_EQ(channel.size(), 18u);
    EXPECT_EQ(channel.tileCount(3), 0);
    EXPECT_EQ(channel.tileCount(7), 0);
  }
}

TEST(UpdateTiles, BoundaryShrinkingGivesCapacityBackPastAFactorOfTwo) {
  Points channel;
  channel.update(FakeTree().set(1, 100, 1));
  auto const& tiles = (*channel.dataPtr())[1];
  channel.update(FakeTree().set(1, 50, 1));
  EXPECT_EQ(tiles.capacity(), 100u);
  channel.update(FakeTree().set(1, 49, 1));
  EXPECT_EQ(tiles.capacity(), 49u);
}

TEST(UpdateResize, RequirementAnswersTrueAndDoesNothing) {
  Points channel;
  EXPECT_TRUE(channel.updateResize());
  EXPECT_EQ(channel.tileCount(-1), 0);
}

// Removal

TEST(TilesRemoved, RequirementMovesFollowTheCompaction) {
  for (bool useStatic : {false, true}) {
    Haloed channel(Flags{useStatic});
    channel.update(FakeTree().set(5, 8));
    for (std::int64_t i = 0; i < 8; ++i) channel.tileData(i, 5).set(float(i));
    TileRemovalList list(kChannelDepths);
    list[5] = {{1, 7}, {3, 6}};
    channel.updateTilesRemoved(list, FakeTree().set(5, 6));
    std::vector<float> kept;
    for (std::int64_t i = 0; i < 6; ++i) kept.push_back(std::as_const(channel).tileData(i, 5)[215]);
    EXPECT_EQ(kept, (std::vector<float>{0, 7, 2, 6, 4, 5}));
  }
}

TEST(TilesRemoved, BoundaryPairOfOneTileLeavesItAlone) {
  Haloed channel;
  channel.update(FakeTree().set(5, 8));
  channel.tileData(5, 5).set(3.0f);
  float const* const at = channel.tileData(5, 5).data()->data();
  TileRemovalList list(kChannelDepths);
  list[5] = {{5, 5}};
  channel.updateTilesRemoved(list, FakeTree().set(5, 8));
  EXPECT_EQ(channel.tileData(5, 5).data()->data(), at);
  EXPECT_EQ(std::as_const(channel).tileData(5, 5)[0], 3.0f);
}

TEST(TilesRemoved, RequirementTilesThatStayKeepTheirElements) {
  Points channel(Flags{true});
  FakeTree tree;
  tree.elements[5] = {4, 2, 6};
  channel.update(tree);
  for (std::int64_t i = 0; i < 3; ++i) channel.tileData(i, 5).set(float(i + 1));
  TileRemovalList list(6);
  list[5] = {{0, 1}, {1, 2}};
  // Overlapping pairs on tiles that all stay: each target takes what its source held at its turn.
  list[5].pop_back();
  channel.updateTilesNoDispatch(&list);
  EXPECT_EQ(channel.elementCount(TreeIndex{0, 5}), 2);
  EXPECT_EQ(std::as_const(channel).tileData(0, 5)[1], 2.0f);
  EXPECT_EQ(channel.elementCount(TreeIndex{1, 5}), 2);
  EXPECT_EQ(std::as_const(channel).tileData(1, 5)[1], 2.0f);
  EXPECT_EQ(std::as_const(channel).tileData(2, 5)[5], 3.0f);
  // A larger source does not fit the target's slot.
  list[5] = {{0, 2}};
  channel.updateTilesNoDispatch(&list);
  EXPECT_EQ(channel.elementCount(TreeIndex{0, 5}), 6);
  EXPECT_EQ(std::as_const(channel).tileData(1, 5)[0], 2.0f);
  EXPECT_EQ(std::as_const(channel).tileData(2, 5)[0], 3.0f);
}

TEST(TilesRemoved, NegativePairsOutsideTheDepthAreSkipped) {
  Points channel;
  channel.update(FakeTree().set(5, 2, 4));
  TileRemovalList list(kChannelDepths);
  list[5] = {{0, 9}, {-1, 1}, {7, 0}};
  list[20] = {{0, 1}};
  channel.updateTilesNoDispatch(&list);
  expectSize(channel, 5, 2, 4);
}

// Permutation

TEST(TilesPermuted, RequirementNewTilesAreTheNamedOldOnes) {
  for (bool useStatic : {false, true}) {
    for (bool shared : {false, true}) {
      Points channel(Flags{useStatic});
      FakeTree tree;
      tree.elements[3] = {1, 2, 3, 4};
      tree.elements[8] = {70, 200};
      channel.update(tree);
      channel.update([&] {
        tree.elements[8].push_back(0);
        return tree;
      }());
      for (std::int64_t i = 0; i < 4; ++i) channel.tileData(i, 3).set(float(i));
      channel.tileData(1, 8).set(8.0f);
      Points const copy(channel);
      if (!shared) channel.cloneData();
      TilePermutation p(kChannelDepths);
      p[3] = {2, 0, 3, 1};
      p[8] = {2, 1, 0};
      EXPECT_TRUE(channel.permute(&p));
      for (std::int64_t i = 0; i < 4; ++i) {
        EXPECT_EQ(channel.elementCount(TreeIndex{i, 3}), p[3][std::size_t(i)] + 1);
        EXPECT_EQ(std::as_const(channel).tileData(i, 3)[0], float(p[3][std::size_t(i)]));
      }
      EXPECT_EQ(channel.elementCount(TreeIndex{1, 8}), 200);
      EXPECT_EQ(std::as_const(channel).tileData(1, 8)[199], 8.0f);
      EXPECT_EQ(channel.elementCount(TreeIndex{0, 8}), 0);
      EXPECT_EQ(channel.blockCount(), useStatic ? 1u : 0u);
      EXPECT_EQ(copy.tileData(2, 3)[0], 2.0f);
    }
  }
}

TEST(TilesPermuted, BoundaryRepeatedSourceIsCopied) {
  Points channel;
  channel.update(FakeTree().set(2, 3, 4));
  channel.tileData(1, 2).set(5.0f);
  TilePermutation p(3);
  p[2] = {1, 1, 1};
  channel.permute(&p);
  for (std::int64_t i = 0; i < 3; ++i) EXPECT_EQ(std::as_const(channel).tileData(i, 2)[3], 5.0f);
}

TEST(TilesPermuted, RequirementInversionOfAPermutation) {
  TilePermutation p(3);
  p[1] = {2, 0, 1};
  auto const inverse = invertPermutation(p);
  EXPECT_TRUE(inverse[0].empty());
  EXPECT_EQ(inverse[1], (std::vector<std::int64_t>{1, 2, 0}));
  EXPECT_EQ(invertPermutation(inverse), p);
}

// Direct resizing

TEST(ChannelResize, RequirementOneDepth) {
  Points channel(Flags{}, 3.0f);
  channel.update(FakeTree().set(4, 2, 8));
  EXPECT_FALSE(channel.resize(4, 2, 5));
  EXPECT_TRUE(channel.resize(4, 4, 5));
  EXPECT_EQ(channel.tileCount(-1), 4);
  EXPECT_EQ(channel.elementCount(TreeIndex{0, 4}), 8);
  EXPECT_EQ(channel.elementCount(TreeIndex{3, 4}), 5);
  EXPECT_EQ(std::as_const(channel).tileData(3, 4)[4], 0.0f);
  EXPECT_TRUE(channel.resize(4, 1, 5));
  EXPECT_EQ(channel.tileCount(-1), 1);
  EXPECT_FALSE(channel.resize(29, 1, 5));
  EXPECT_FALSE(channel.resize(-1, 1, 5));
}

TEST(ChannelResize, RequirementAllDepths) {
  for (bool useStatic : {false, true}) {
    Points channel(Flags{useStatic}, 3.0f);
    channel.update(FakeTree().set(4, 2, 8).set(6, 5, 8));
    std::int64_t counts[kChannelDepths] = {};
    counts[4] = 6;
    counts[6] = 1;
    counts[28] = 2;
    EXPECT_TRUE(channel.resize(counts, 10));
    EXPECT_EQ(channel.elementCount(4), 2 * 8 + 4 * 10);
    EXPECT_EQ(channel.elementCount(6), 8);
    EXPECT_EQ(channel.elementCount(28), 20);
    EXPECT_EQ(std::as_const(channel).tileData(5, 4)[9], 3.0f);
    EXPECT_EQ(channel.tileCount(-1), 9);
  }
}

TEST(ChannelRemove, RequirementDropsDepthsAndKeepsBlocks) {
  Haloed channel(Flags{true});
  FakeTree tree;
  tree.set(1, 2).set(2, 3).set(3, 4);
  channel.update(tree);
  channel.remove(1, 2);
  EXPECT_EQ(channel.tileCount(-1), 4);
  EXPECT_EQ(channel.tileCount(1), 0);
  EXPECT_EQ(channel.blockCount(), 1u);
  EXPECT_TRUE(channel.removeAll());
  EXPECT_EQ(channel.tileCount(-1), 0);
  EXPECT_TRUE(channel.empty());
  channel.update(tree);
  EXPECT_EQ(channel.tileCount(-1), 9);
}

TEST(ElementResize, RequirementGrowsButNeverShrinks) {
  for (bool useStatic : {false, true}) {
    Points channel(Flags{useStatic});
    FakeTree tree;
    tree.elements[5] = {4, 9, 0};
    channel.update(tree);
    channel.tileData(0, 5).set(2.0f);
    channel.tileData(1, 5).set(3.0f);
    tree.elements[5] = {30, 2, 5};
    channel.updateElementResizeNoDispatch(tree);
    EXPECT_EQ(channel.elementCount(TreeIndex{0, 5}), 30);
    EXPECT_EQ(channel.elementCount(TreeIndex{1, 5}), 9);
    EXPECT_EQ(channel.elementCount(TreeIndex{2, 5}), 5);
    EXPECT_EQ(std::as_const(channel).tileData(0, 5)[3], 2.0f);
    EXPECT_EQ(std::as_const(channel).tileData(0, 5)[29], 0.0f);
    // The tile outgrew its slot; its neighbour in the block is whole.
    EXPECT_EQ(std::as_const(channel).tileData(1, 5)[0], 3.0f);
  }
}

TEST(CompactStorage, RequirementCapacitiesBecomeSizes) {
  Points channel;
  channel.update(FakeTree().set(5, 10, 4));
  channel.tileData(3, 5).data()->reserve(100);
  (*channel.dataPtr())[5].reserve(50);
  channel.tileData(3, 5).set(6.0f);
  channel.compactStorage();
  EXPECT_EQ((*channel.dataPtr())[5].capacity(), 10u);
  EXPECT_EQ(channel.tileData(3, 5).data()->capacity(), 4u);
  EXPECT_EQ(std::as_const(channel).tileData(3, 5)[3], 6.0f);
}

} // namespace
