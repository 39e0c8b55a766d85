// Who owns the elements behind a handle, and what growth does to them.
#include "GeometryVolume/channels/TileData.h"

#include <gtest/gtest.h>
#include <stdexcept>
#include <vector>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;

using TD = TileData<int, 4, 0>;
using CTD = ConstTileData<int, 4, 0>;
using Dynamic = DynamicTileData<TD>;

TileVector<int> counted(int n) {
  TileVector<int> v;
  v.reserve(n);
  for (int i = 0; i < n; ++i) v.push_back(i);
  return v;
}

TEST(TileDataOwnership, RequirementSizedHandlesOwnZerosOrTheValue) {
  EXPECT_FALSE(bool(TD()));
  TD const zeros(5);
  EXPECT_EQ(zeros.size(), 5);
  EXPECT_EQ(zeros[4], 0);
  CTD const filled(3, 7);
  EXPECT_EQ(filled[2], 7);
  EXPECT_TRUE(TD(0).empty());
}

TEST(TileDataOwnership, RequirementCopyOfAViewIsAView) {
  auto v = counted(64);
  TD view(&v);
  {
    TD copy(view);
    EXPECT_EQ(copy.data(), &v);
    copy[3] = 99;
  }
  EXPECT_EQ(v[3], 99);
  CTD const read(view);
  EXPECT_EQ(read.data(), &v);
}

TEST(TileDataOwnership, RequirementCopyOfAnOwnerIsDeep) {
  TD owner(64, 5);
  {
    TD copy(owner);
    EXPECT_NE(copy.data(), owner.data());
    copy.set(6);
  }
  EXPECT_EQ(owner[63], 5);
  TD assigned(2, 1);
  assigned = owner;
  EXPECT_EQ(assigned.size(), 64);
  EXPECT_NE(assigned.data(), owner.data());
  TD& self = assigned;
  assigned = self;
  EXPECT_EQ(assigned[0], 5);
}

TEST(TileDataOwnership, RequirementAfterAMoveTheSourceStillReads) {
  TD source(64, 5);
  {
    TD target(std::move(source));
    EXPECT_EQ(target[1], 5);
    EXPECT_EQ(source.data(), target.data());
    EXPECT_EQ(source[1], 5);
  }
  TD owner(8, 1), taker(8, 2);
  taker = std::move(owner);
  EXPECT_EQ(owner.data(), taker.data());
  EXPECT_EQ(taker[7], 1);
}

TEST(TileDataOwnership, RequirementDeepCopyIsNeverStatic) {
  std::vector<int> block(64);
  TD owner(4, 3);
  *owner.data() = TileVector<int>(4, 8, TileDataAllocator<int>(block.data(), 64, true));
  TD const copy(owner);
  EXPECT_FALSE(copy.data()->get_allocator().isStatic());
  EXPECT_EQ(copy[3], 8);
}

TEST(TileDataOwnership, RequirementSetByMoveTakesBufferAndAllocator) {
  std::vector<int> block(64);
  TileVector<int> a(64, 1), b(64, 2, TileDataAllocator<int>(block.data(), 64, true));
  TD ta(&a), tb(&b);
  ta.set(std::move(tb));
  EXPECT_EQ(a.data(), block.data());
  EXPECT_TRUE(a.get_allocator().isStatic());
  EXPECT_EQ(b.data(), nullptr);
  EXPECT_EQ(tb.data(), &b);
}

TEST(TileDataOwnership, RequirementMemUsageCountsCapacity) {
  Dynamic tile(10);
  tile.reserve(40);
  EXPECT_EQ(tile.memUsage(), 40 * sizeof(int) + sizeof(TileVector<int>));
}

TEST(DynamicTileData, RequirementCapacityGrowsByHalf) {
  Dynamic tile(0);
  std::vector<std::size_t> capacities;
  for (int n = 0; n < 30; ++n) {
    tile.push(n);
    if (capacities.empty() || capacities.back() != tile.data()->capacity())
      capacities.push_back(tile.data()->capacity());
  }
  EXPECT_EQ(capacities, (std::vector<std::size_t>{1, 2, 3, 4, 6, 9, 13, 19, 28, 42}));
  for (int n = 0; n < 30; ++n) ASSERT_EQ(tile[n], n);
  tile.resize(50, 7);
  EXPECT_EQ(tile.data()->capacity(), 63u);
  tile.resize(200, 8);
  EXPECT_EQ(tile.data()->capacity(), 200u);
  EXPECT_EQ(tile[29], 29);
  EXPECT_EQ(tile[49], 7);
  EXPECT_EQ(tile.back(), 8);
  tile.resize(2, 0);
  EXPECT_EQ(tile.size(), 2);
  tile.pop();
  EXPECT_EQ(tile.back(), 0);
}

TEST(DynamicTileData, BoundaryPushOfAnElementOfTheTileSurvivesGrowth) {
  Dynamic tile(1, 42);
  for (int n = 0; n < 20; ++n) tile.push(tile[0]);
  EXPECT_EQ(tile.back(), 42);
}

TEST(DynamicTileData, BoundaryResizeWithoutVectorMakesAnOwner) {
  Dynamic tile;
  tile.resize(3, 9);
  EXPECT_EQ(tile.size(), 3);
  Dynamic const copy(tile);
  EXPECT_NE(copy.data(), tile.data());
}

/// Two slots of one block, as a channel has them: the second belongs to another tile.
class StaticSlots : public ::testing::Test {
protected:
  static constexpr int kSlot = 8;
  std::vector<int> block = std::vector<int>(2 * kSlot, -1);
  TileVector<int> slot() {
    return TileVector<int>(kSlot, 5, TileDataAllocator<int>(block.data(), kSlot, true));
  }
  void expectNeighbourUntouched() const {
    for (int n = kSlot; n < 2 * kSlot; ++n) EXPECT_EQ(block[n], -1) << n;
  }
};

TEST_F(StaticSlots, NegativePushPastTheLimitThrows) {
  auto v = slot();
  Dynamic tile(&v);
  EXPECT_THROW(tile.push(1), std::length_error);
  EXPECT_THROW(tile.resize(kSlot + 1, 1), std::length_error);
  EXPECT_THROW(tile.reserve(kSlot + 1), std::length_error);
  EXPECT_EQ(tile.size(), kSlot);
  expectNeighbourUntouched();
}

TEST_F(StaticSlots, RequirementClearLeavesTheTileNonStatic) {
  auto v = slot();
  Dynamic tile(&v);
  tile.clear();
  EXPECT_FALSE(v.get_allocator().isStatic());
  EXPECT_EQ(v.capacity(), 0u);
  for (int n = 0; n < 3 * kSlot; ++n) tile.push(n);
  EXPECT_EQ(tile.size(), 3 * kSlot);
  expectNeighbourUntouched();
}

TEST_F(StaticSlots, RequirementRepackMovesOutOfTheSlot) {
  auto v = slot();
  Dynamic tile(&v);
  tile.resize(3, 0);
  EXPECT_EQ(v.data(), block.data());
  tile.repack(0.0f);
  EXPECT_FALSE(v.get_allocator().isStatic());
  EXPECT_EQ(v.capacity(), 3u);
  EXPECT_EQ(tile[2], 5);
  expectNeighbourUntouched();
}

TEST_F(StaticSlots, RequirementGrowthInsideALargerBlockAbandonsTheOldRange) {
  std::vector<int> large(20, -1);
  TileVector<int> v(TileDataAllocator<int>(large.data(), 20, true));
  Dynamic tile(&v);
  for (int n = 0; n < 4; ++n) tile.push(n);
  // Capacities 1, 2, 3 and 4 lie one after the other.
  EXPECT_EQ(v.data(), large.data() + 6);
  EXPECT_EQ(large[5], 2);
  tile.push(4);
  EXPECT_EQ(v.data(), large.data() + 10);
  tile.push(5);
  // The next capacity is 9, and 16 of 20 elements are handed out: the tile leaves the block.
  tile.push(6);
  EXPECT_FALSE(v.get_allocator().isStatic());
  for (int n = 0; n < 7; ++n) EXPECT_EQ(tile[n], n);
}

TEST(DynamicTileData, BoundaryRepackThresholds) {
  Dynamic exact(8, 1);
  int const* before = exact.data()->data();
  exact.repack(0.0f);
  EXPECT_EQ(exact.data()->data(), before);
  Dynamic tile(8, 1);
  tile.reserve(16);
  tile.repack(1.0f);
  EXPECT_EQ(tile.data()->capacity(), 16u);
  tile.reserve(17);
  tile.repack(1.0f);
  EXPECT_EQ(tile.data()->capacity(), 8u);
  tile.resize(0, 0);
  tile.repack(0.0f);
  EXPECT_EQ(tile.data()->capacity(), 0u);
}

TEST(DynamicTileData, RequirementClearConstructFlagLosesValuesOnReallocation) {
  std::vector<int> block(64, -5);
  TileVector<int> v(TileDataAllocator<int>(block.data(), 64, false));
  v.resize(2);
  v[0] = 1;
  v[1] = 2;
  Dynamic tile(&v);
  tile.push(3);
  EXPECT_EQ(v.data(), block.data() + 2);
  EXPECT_EQ(tile.size(), 3);
  EXPECT_EQ(tile[0], -5);
  EXPECT_EQ(tile[2], -5);
}

} // namespace
