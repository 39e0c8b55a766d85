// The container: naming, counts, creation of tiles, roots, bounds, world space.
#include "support/ContainerAccess.h"
#include "support/Print.h"
#include "support/Shapes.h"

#include "GeometryVolume/core/Const.h"
#include "GeometryVolume/tiletree/TileHalo.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <utility>
#include <vector>

using namespace VLN::TileTree3D;
using Support::Access;
using Box = bbox<int3, int>;

VLN_SHAPE_SUITE(ContainerOf);

namespace {

template <class T> int3 lowCorner() { return {T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord}; }

} // namespace

// requirement
TYPED_TEST(ContainerOf, IsNamedAfterTheStandardContainerUnlessTold) {
  using C = Container<TypeParam>;
  EXPECT_EQ(C().name(), VLN::Const::TileTreeContainerName);
  EXPECT_EQ(C("", 2.0f).name(), VLN::Const::TileTreeContainerName);
  EXPECT_EQ(C("mine", 2.0f).name(), "mine");
  EXPECT_EQ(C("mine", 2.0f).voxelSize(), 2.0f);
}

// requirement
TYPED_TEST(ContainerOf, FreshContainerIsEmpty) {
  using T = TypeParam;
  Container<T> const tree;
  EXPECT_TRUE(tree.empty());
  EXPECT_EQ(tree.size(), 0u);
  EXPECT_EQ(tree.tileCount(-1), 0);
  EXPECT_EQ(tree.rootCount(), 0);
  EXPECT_EQ(tree.cbeginRoots(), tree.cendRoots());
  EXPECT_EQ(tree.dataUseCount(), 1);
  EXPECT_FALSE(tree.invalidTile().valid());
  EXPECT_EQ(tree.invalidTile().depth(), -1);
  EXPECT_EQ(tree.invalidTile().tijk(), (int3{0, 0, 0}));
  EXPECT_EQ(tree.maxRelativeRefinementError(), 0.0f);
  EXPECT_TRUE(tree.compactOnRemoval());
  EXPECT_EQ(tree.neighborData(), nullptr);
  EXPECT_EQ(tree.tileHalo({0, 0}), nullptr);
  EXPECT_TRUE(tree.tileHaloVisitor({0, 0}).end());
  auto const& data = Access::data(tree);
  EXPECT_EQ(data.m_gridDepth, -1);
  EXPECT_EQ(data.m_gridCellWidth, 1);
  EXPECT_EQ(data.m_affinityPartitioners.size(), static_cast<std::size_t>(T::kMaxDepth + 1));
  for (auto const& partitioner : data.m_affinityPartitioners) EXPECT_NE(partitioner, nullptr);
}

// requirement
TYPED_TEST(ContainerOf, CountsFollowTheTiles) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTile(lowCorner<T>(), 2);
  accessor.addTile(lowCorner<T>(), 4);
  EXPECT_EQ(tree.tileCount(2), 1);
  EXPECT_EQ(tree.tileCount(3), 1);
  EXPECT_EQ(tree.tileCount(4), 1);
  EXPECT_EQ(tree.tileCount(-1), 3);
  EXPECT_EQ(tree.size(), 3u * T::kTileSize);
  EXPECT_FALSE(tree.empty());
  EXPECT_EQ(tree.elementCount(3), T::kTDW * T::kTDW * T::kTDW);
  EXPECT_EQ(tree.elementCount(-1), 3 * T::kTDW * T::kTDW * T::kTDW);
  EXPECT_EQ(tree.elementCount(TreeIndex{0, 3}), T::kTDW * T::kTDW * T::kTDW);
  EXPECT_EQ(tree.voxelCount(3), T::kTileSize);
  EXPECT_EQ(tree.voxelDataCount(3), T::kTDW * T::kTDW * T::kTDW);
  EXPECT_EQ(tree.voxelCount(5), 0);
  EXPECT_EQ(tree.depth(), T::kMaxDepth);
  EXPECT_EQ(tree.maxDepth(), T::kMaxDepth);
  EXPECT_EQ(tree.tileWidth(1), T::kTW);
  EXPECT_EQ(tree.tileSize(1), T::kTileSize);
  EXPECT_EQ(tree.tileDataWidth(1), T::kTDW);
  EXPECT_EQ(tree.tileDataSize(1), T::kTDW * T::kTDW * T::kTDW);
}

// boundary: channels ask for depths that a shape does not have
TYPED_TEST(ContainerOf, CountsOfDepthsThatTheShapeLacksAreZero) {
  using T = TypeParam;
  Container<T> tree;
  tree.tileAccessor().addTile(lowCorner<T>(), 0);
  for (int d : {std::numeric_limits<int>::min(), -2, T::kMaxDepth + 1, 29, std::numeric_limits<int>::max()}) {
    EXPECT_EQ(tree.tileCount(d), 0) << d;
    EXPECT_EQ(tree.elementCount(d), 0) << d;
  }
  EXPECT_EQ(tree.elementCount(-1), T::kTileDataSize);
}

// boundary
TYPED_TEST(ContainerOf, AddTileOutOfRangeGivesTheInvalidTileAndAllocatesNothing) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  for (int extreme : {std::numeric_limits<int>::min(), T::kMinTileCoord - 1, T::kMaxTileCoord + 1,
                      std::numeric_limits<int>::max()}) {
    for (int axis = 0; axis < 3; ++axis) {
      int3 p{0, 0, 0};
      p[axis] = extreme;
      for (int d : {0, 5, T::kMaxDepth}) {
        EXPECT_FALSE(Access::addTile(tree, p, d).valid()) << p;
        EXPECT_EQ(&accessor.addTile(p, d), &tree.invalidTile()) << p;
      }
    }
  }
  for (int d : {std::numeric_limits<int>::min(), -1, T::kMaxDepth + 1, std::numeric_limits<int>::max()}) {
    EXPECT_FALSE(Access::addTile(tree, {0, 0, 0}, d).valid()) << d;
    EXPECT_FALSE(accessor.addTile(0, 0, 0, d).valid()) << d;
  }
  EXPECT_EQ(tree.tileCount(-1), 0);
  for (int d = 0; d <= T::kMaxDepth; ++d) EXPECT_EQ(Access::tileCapacity(tree, d), 0);
}

// boundary
TYPED_TEST(ContainerOf, AddingTheSameTileTwiceChangesNothing) {
  using T = TypeParam;
  Container<T> tree;
  TreeIndex const first = Access::addTile(tree, {0, 0, 0}, 3);
  std::int64_t const total = tree.tileCount(-1);
  int3 const corner = tree.tile(first).tijk();
  EXPECT_EQ(Access::addTile(tree, {0, 0, 0}, 3), first);
  EXPECT_EQ(Access::addTile(tree, corner, 3), first);
  int const last = T::width(3) - 1;
  EXPECT_EQ(Access::addTile(tree, corner + int3{last, last, last}, 3), first);
  EXPECT_EQ(tree.tileCount(-1), total);
  EXPECT_EQ(tree.rootCount(), 1);
}

// boundary
TYPED_TEST(ContainerOf, AncestorAddedLaterAdoptsTheDeeperRoot) {
  using T = TypeParam;
  Container<T> tree;
  TreeIndex const deep = Access::addTile(tree, {0, 0, 0}, 3);
  EXPECT_EQ(tree.rootCount(3), 1);
  TreeIndex const top = Access::addTile(tree, {0, 0, 0}, 1);
  EXPECT_EQ(tree.rootCount(), 1);
  EXPECT_EQ(tree.rootCount(1), 1);
  EXPECT_EQ(tree.rootCount(3), 0);
  EXPECT_EQ(tree.cbeginRoots()->second, top);
  EXPECT_EQ(tree.tileCount(1), 1);
  EXPECT_EQ(tree.tileCount(2), 1);
  EXPECT_EQ(tree.tileCount(3), 1);
  auto const& between = tree.tile(0, 2);
  EXPECT_EQ(between.parentTreeIndex(), top);
  EXPECT_EQ(tree.tile(deep).parentTreeIndex(), between.treeIndex());
  EXPECT_EQ(between.branchSize(), 2 * T::kTileSize);
  EXPECT_EQ(tree.tile(top).branchSize(), 3 * T::kTileSize);
  EXPECT_TRUE(tree.checkConsistency(false));
  EXPECT_TRUE(tree.checkBranchSizes(false));
}

// boundary: adoption takes the roots inside alone, however the ancestor test rounds
TYPED_TEST(ContainerOf, AdoptionLeavesRootsJustBelowTheNewTile) {
  using T = TypeParam;
  int const d = T::kMaxDepth - 4;
  for (int axis = 0; axis < 3; ++axis) {
    Container<T> tree;
    int3 const inside{T::align(0, d), T::align(0, d), T::align(0, d)};
    int3 below = inside;
    below[axis] -= T::width(T::kMaxDepth);
    TreeIndex const outer = Access::addTile(tree, below, T::kMaxDepth);
    TreeIndex const inner = Access::addTile(tree, inside, T::kMaxDepth);
    Access::addTile(tree, inside, d);
    EXPECT_EQ(tree.rootCount(), 2) << axis;
    EXPECT_TRUE(tree.tile(outer).isRoot());
    EXPECT_FALSE(tree.tile(inner).isRoot());
    EXPECT_TRUE(tree.checkConsistency(false));
    EXPECT_EQ(Access::tileIndex(tree, below, T::kMaxDepth), outer);
  }
}

// boundary
TYPED_TEST(ContainerOf, LookupAboveADeeperRootFindsNothing) {
  using T = TypeParam;
  Container<T> tree;
  Access::addTile(tree, {0, 0, 0}, 5);
  for (int d = 0; d < 5; ++d) EXPECT_FALSE(Access::tileIndex(tree, {0, 0, 0}, d).valid()) << d;
  for (int d = 5; d <= T::kMaxDepth; ++d)
    EXPECT_EQ(Access::tileIndex(tree, {0, 0, 0}, d), (TreeIndex{0, 5})) << d;
  EXPECT_FALSE(Access::tileIndex(tree, {0, 0, 0}, -1).valid());
}

// regression: roots of three depths whose overlaps form a cycle under a pairwise order
TEST(ContainerRoots, LookupFindsRootsOfMixedDepths) {
  using T = PowerOfTwoTraits;
  Container<T> tree;
  TreeIndex const first = Access::addTile(tree, {0, 16, 0}, 28);
  TreeIndex const wide = Access::addTile(tree, {0, 0, 0}, 26);
  EXPECT_EQ(tree.tile(wide).tileVoxelWidth(), 16);
  EXPECT_EQ(Access::tileIndex(tree, {8, 0, 0}, 26), wide);
  EXPECT_EQ(Access::tileIndex(tree, {8, 0, 0}, 28), wide);
  EXPECT_EQ(Access::tileIndex(tree, {0, 16, 0}, 28), first);
  TreeIndex const third = Access::addTile(tree, {20, 4, 4}, 27);
  for (TreeIndex const& at : {first, wide, third}) {
    int3 const p = tree.tile(at).tijk();
    EXPECT_EQ(Access::tileIndex(tree, p, 28), at) << p;
  }
  EXPECT_EQ(tree.rootCount(), 3);
}

// requirement: a branch grown under an existing tile is exact on its new chain alone
TYPED_TEST(ContainerOf, BranchSizesAboveTheNewChainWaitForTheBulkPass) {
  using T = TypeParam;
  Container<T> tree;
  TreeIndex const root = Access::addTile(tree, {0, 0, 0}, 0);
  Access::addTile(tree, {0, 0, 0}, 2);
  EXPECT_EQ(tree.tile(root).branchSize(), 3 * T::kTileSize);
  Access::addTile(tree, {0, 0, 0}, 4);
  EXPECT_FALSE(tree.checkBranchSizes(false));
  Access::setBranchSizes(tree);
  EXPECT_TRUE(tree.checkBranchSizes(false));
  EXPECT_EQ(tree.tile(root).branchSize(), 5 * T::kTileSize);
}

// requirement
TYPED_TEST(ContainerOf, TilesCountAcrossDepths) {
  using T = TypeParam;
  Container<T> tree;
  for (int n = 0; n < 3; ++n) Access::addTile(tree, {n * T::width(4), 0, 0}, 4);
  Access::addTile(tree, {0, 0, T::kMaxTileCoord}, 2);
  Access::addTile(tree, {T::kMaxTileCoord, 0, T::kMaxTileCoord}, T::kMaxDepth);
  std::int64_t n = 0;
  for (int d = 0; d <= T::kMaxDepth; ++d) {
    for (std::int64_t i = 0; i < tree.tileCount(d); ++i, ++n) {
      EXPECT_EQ(&tree.tile(n), &tree.tile(i, d));
      EXPECT_EQ(tree.tileIndex(TreeIndex{i, d}), n);
    }
  }
  EXPECT_EQ(n, 5);
  EXPECT_FALSE(tree.tile(n).valid());
}

// boundary
TYPED_TEST(ContainerOf, TotalFollowsAllocationButNotResize) {
  using T = TypeParam;
  Container<T> tree;
  EXPECT_EQ(Access::allocateTile(tree, 3), 0);
  EXPECT_EQ(Access::allocateTile(tree, 3), 1);
  Access::allocateTiles(tree, T::kMaxDepth, 5);
  EXPECT_EQ(tree.tileCount(3), 2);
  EXPECT_EQ(tree.tileCount(T::kMaxDepth), 5);
  EXPECT_EQ(tree.tileCount(-1), 7);
  EXPECT_FALSE(tree.tile(1, 3).valid());
  EXPECT_EQ(tree.tile(1, 3).depth(), -1);
  Access::resize(tree, 1, 3);
  EXPECT_EQ(tree.tileCount(3), 1);
  EXPECT_EQ(tree.tileCount(-1), 7) << "the caller mends the total";
  Access::resize(tree, 9, 3);
  EXPECT_EQ(tree.tileCount(3), 9);
  EXPECT_GE(Access::tileCapacity(tree, 3), 9);
}

// requirement
TYPED_TEST(ContainerOf, ReallocatedTileHasATableOfItsOwn) {
  using T = TypeParam;
  Container<T> tree;
  TreeIndex const a = Access::addTile(tree, {0, 0, 0}, 2);
  TreeIndex const b = Access::addTile(tree, {T::width(2), 0, 0}, 2);
  Access::editTile(tree, b).childIndex(1) = 77;
  Access::reallocateTile(tree, a.index, b.index, 2);
  EXPECT_EQ(tree.tile(a).voxelCoord(), tree.tile(b).voxelCoord());
  EXPECT_EQ(tree.tile(a).childIndex(1), 77);
  EXPECT_NE(tree.tile(a).children(), tree.tile(b).children());
}

// requirement: a tile index outlives growth, and so do all fields
TYPED_TEST(ContainerOf, GrowthKeepsIndicesAndTables) {
  using T = TypeParam;
  Container<T> tree;
  TreeIndex const first = Access::addTile(tree, lowCorner<T>(), 2);
  TreeIndex const child = Access::addTile(tree, lowCorner<T>(), 3);
  for (int n = 0; n < 200; ++n)
    Access::addTile(tree, {T::kMaxTileCoord - n * T::width(7), T::kMaxTileCoord, T::kMaxTileCoord}, 7);
  EXPECT_EQ(tree.tile(first).tijk(), lowCorner<T>());
  EXPECT_EQ(tree.tile(first).childIndex(0), child.index);
  EXPECT_EQ(tree.tile(first).childCount(), 1);
}

// requirement
TYPED_TEST(ContainerOf, RootsAreAddedAndRemovedByTheirKey) {
  using T = TypeParam;
  Container<T> tree;
  TreeIndex const a = Access::addTile(tree, {0, 0, 0}, 3);
  TreeIndex const b = Access::addTile(tree, {T::width(3), 0, 0}, 3);
  Access::removeRoot(tree, a);
  EXPECT_EQ(tree.rootCount(), 1);
  EXPECT_EQ(tree.rootCount(3), 1);
  EXPECT_EQ(tree.cbeginRoots()->second, b);
  Access::removeRoot(tree, a);
  EXPECT_EQ(tree.rootCount(3), 1);
  Access::addRoot(tree, a);
  Access::addRoot(tree, a);
  EXPECT_EQ(tree.rootCount(3), 2);
  EXPECT_EQ(tree.rootCount(), 2);
}

// requirement
TYPED_TEST(ContainerOf, VoxelSizeKeepsItsInverse) {
  Container<TypeParam> tree("t", 0.25f);
  EXPECT_EQ(tree.voxelSize(), 0.25f);
  EXPECT_EQ(tree.toTileSpace({1.0f, 2.0f, -3.0f}), (float3{4.0f, 8.0f, -12.0f}));
  EXPECT_EQ(tree.toWorldSpace({4.0f, 8.0f, -12.0f}), (float3{1.0f, 2.0f, -3.0f}));
  tree.setVoxelSize(2.0f);
  EXPECT_EQ(tree.toTileSpace({1.0f, 0.0f, 0.0f}).x, 0.5f);
}

// boundary
TYPED_TEST(ContainerOf, VoxelSizeZeroStoresAnInverseOfOne) {
  Container<TypeParam> tree("t", 0.25f);
  tree.setVoxelSize(0.0f);
  EXPECT_EQ(tree.voxelSize(), 0.0f);
  EXPECT_EQ(tree.toTileSpace({3.0f, 0.0f, 0.0f}).x, 3.0f);
  tree.setVoxelSize(-2.0f);
  EXPECT_EQ(tree.voxelSize(), -2.0f);
  EXPECT_EQ(tree.toTileSpace({3.0f, 0.0f, 0.0f}).x, 3.0f);
}

// requirement
TYPED_TEST(ContainerOf, DiagonalsScaleWithTheVoxelSize) {
  Container<TypeParam> const tree("t", 0.5f);
  // Half a world unit for each of 2^30, 2^27 and 4 units of tile space, or of 5^13, 5^10 and 5.
  bool const powerOfTwo = TypeParam::kTW == 2;
  std::pair<int, double> const widths[] = {{0, powerOfTwo ? 1073741824 : 1220703125},
                                           {3, powerOfTwo ? 134217728 : 9765625},
                                           {TypeParam::kMaxDepth, powerOfTwo ? 4 : 5}};
  for (auto const& [depth, width] : widths) {
    double const expected = std::sqrt(3.0) * 0.5 * width;
    EXPECT_NEAR(tree.worldSpaceTileVoxelDiagonal(depth), expected, 2e-7 * expected) << depth;
  }
}

// boundary
TYPED_TEST(ContainerOf, BoundsOfAnEmptyContainerAreTheEmptyBox) {
  Container<TypeParam> const tree;
  Box box{{1, 2, 3}, {4, 5, 6}};
  tree.tileSpaceBounds(box);
  EXPECT_EQ(box.min, (int3{2147483647, 2147483647, 2147483647}));
  EXPECT_EQ(box.max, (int3{-2147483647, -2147483647, -2147483647}));
  box = {{1, 2, 3}, {4, 5, 6}};
  tree.tileSpaceBounds(4, box);
  EXPECT_EQ(box, Box());
  bbox<float3> floats{{1, 2, 3}, {4, 5, 6}};
  tree.worldSpaceBounds(floats);
  EXPECT_EQ(floats.min.x, 3.4028235e38f);
  EXPECT_EQ(floats.max.y, -3.4028235e38f);
  bbox<double3> doubles{{1, 2, 3}, {4, 5, 6}};
  tree.worldSpaceBounds(2, doubles);
  EXPECT_TRUE(doubles.empty());
}

// requirement
TYPED_TEST(ContainerOf, BoundsCoverTheRootsOrTheTilesOfADepth) {
  using T = TypeParam;
  Container<T> tree("t", 0.5f);
  TreeIndex const root = Access::addTile(tree, {0, 0, 0}, 4);
  TreeIndex const child = Access::addTile(tree, {0, 0, 0}, 5);
  TreeIndex const last = Access::addTile(tree, {T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxTileCoord}, 5);
  int const w4 = T::width(4), w5 = T::width(5), end = T::kMaxTileCoord + 1;
  int3 const low = tree.tile(root).tijk(), childLow = tree.tile(child).tijk();
  Box box;
  tree.tileSpaceBounds(box);
  EXPECT_EQ(box, (Box{low, {end, end, end}}));
  tree.tileSpaceBounds(4, box);
  EXPECT_EQ(box, (Box{low, low + int3{w4, w4, w4}}));
  tree.tileSpaceBounds(5, box);
  EXPECT_EQ(box, (Box{childLow, {end, end, end}}));
  bbox<float3> floats;
  tree.worldSpaceBounds(4, floats);
  EXPECT_EQ(floats.min.x, static_cast<float>(low.x) * 0.5f);
  EXPECT_EQ(floats.max.z, static_cast<float>(low.z + w4) * 0.5f);
  tree.worldSpaceBounds(floats);
  EXPECT_EQ(floats.max.x, static_cast<float>(end) * 0.5f);
  bbox<double3> doubles;
  tree.worldSpaceBounds(doubles);
  EXPECT_EQ(doubles.max.x, static_cast<double>(end) * 0.5);
  tree.worldSpaceBounds(5, doubles);
  EXPECT_EQ(doubles.min.y, static_cast<double>(childLow.y) * 0.5);
  Access::killLeafTile(tree, last);
  tree.tileSpaceBounds(5, box);
  EXPECT_EQ(box, (Box{childLow, childLow + int3{w5, w5, w5}})) << "dead tiles do not count";
}

// requirement
TYPED_TEST(ContainerOf, RefinementErrorIsNeverNegative) {
  Container<TypeParam> tree;
  tree.setMaxRelativeRefinementError(0.25f);
  EXPECT_EQ(tree.maxRelativeRefinementError(), 0.25f);
  tree.setMaxRelativeRefinementError(-1.0f);
  EXPECT_EQ(tree.maxRelativeRefinementError(), 0.0f);
  tree.setCompactOnRemoval(false);
  EXPECT_FALSE(tree.compactOnRemoval());
}

// requirement: a tree follows no other component
TYPED_TEST(ContainerOf, UpdateDoesNothing) {
  Container<TypeParam> tree;
  Access::addTile(tree, {0, 0, 0}, 3);
  tree.update(Container<TypeParam>());
  EXPECT_EQ(tree.tileCount(-1), 1);
}

// requirement
TYPED_TEST(ContainerOf, QuickMemoryEstimateCountsRecordsRootsAndRoom) {
  using T = TypeParam;
  Container<T> tree;
  EXPECT_EQ(tree.memUsage(), sizeof(typename Container<T>::TileType));
  for (int n = 0; n < 5; ++n) Access::addTile(tree, {n * T::width(6), 0, 0}, 6);
  std::int64_t room = 0;
  for (int d = 0; d <= T::kMaxDepth; ++d) room += Access::tileCapacity(tree, d) - tree.tileCount(d);
  EXPECT_EQ(tree.memUsage(), static_cast<std::uint64_t>(tree.rootCount() + 1 + tree.tileCount(-1) + room) *
                                 sizeof(typename Container<T>::TileType));
}
