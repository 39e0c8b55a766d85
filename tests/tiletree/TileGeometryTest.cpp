// Geometry of a single tile: slots, positions, containment, boxes, and the walk over occupied slots.
#include "support/ContainerAccess.h"
#include "support/Print.h"
#include "support/Shapes.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <vector>

using namespace VLN::TileTree3D;
using Support::OpenTile;
using Box = bbox<int3, int>;

VLN_SHAPE_SUITE(TileGeometry);

namespace {

/// The tile of a depth that holds a point.
template <class T> OpenTile<T> tileAt(int i, int j, int k, int depth) {
  return OpenTile<T>(T::align(i, depth), T::align(j, depth), T::align(k, depth), depth, 0,
                     depth > 0 ? 0 : -1);
}

} // namespace

// requirement
TEST(TileSlots, SlotFiveOfEightIsOneZeroOne) {
  EXPECT_EQ((OpenTile<PowerOfTwoTraits>::childIJK(5)), (int3{1, 0, 1}));
}

// requirement
TYPED_TEST(TileGeometry, SlotsCountWithTheFirstAxisFastest) {
  using T = TypeParam;
  OpenTile<T> t(0, 0, 0, 1);
  int slot = 0;
  for (int k = 0; k < T::kTW; ++k) {
    for (int j = 0; j < T::kTW; ++j) {
      for (int i = 0; i < T::kTW; ++i, ++slot) {
        EXPECT_EQ(t.childIJK(slot), (int3{i, j, k}));
        EXPECT_EQ(&t.childIndex(i, j, k), &t.childIndex(slot));
        EXPECT_EQ(&t.childIndex(int3{i, j, k}), &t.childIndex(slot));
      }
    }
  }
  EXPECT_EQ(slot, T::kTileSize);
}

// requirement
TYPED_TEST(TileGeometry, ChildrenAndTheirPositionsAgree) {
  using T = TypeParam;
  for (int d : {0, 1, T::kMaxDepth / 2, T::kMaxDepth - 1}) {
    SCOPED_TRACE(d);
    auto t = tileAt<T>(-17, 5, T::kMaxTileCoord, d);
    int const v = t.voxelWidth();
    for (int slot = 0; slot < T::kTileSize; ++slot) {
      int3 const ijk = t.childIJK(slot);
      int3 const corner{t.ti() + v * ijk.x, t.tj() + v * ijk.y, t.tk() + v * ijk.z};
      ASSERT_EQ(t.childTIJK(ijk), corner);
      ASSERT_EQ(t.childTIJK(ijk.x, ijk.y, ijk.z), corner);
      OpenTile<T> const child(corner.x, corner.y, corner.z, d + 1, 30 + slot, 0);
      ASSERT_EQ(t.childI(child), slot);
      ASSERT_EQ(t.childIJK(child), ijk);
      ASSERT_EQ(t.childIJK(corner), ijk);
      ASSERT_EQ(t.childIJK(corner + int3{v - 1, v - 1, v - 1}), ijk);
      ASSERT_EQ(&t.childIndex(child), &t.childIndex(slot));
      t.childIndex(child) = child.index();
      ASSERT_EQ(t.childTreeIndex(slot), child.treeIndex());
      ASSERT_EQ(t.childTreeIndex(ijk), child.treeIndex());
      ASSERT_EQ(t.childTreeIndex(ijk.x, ijk.y, ijk.z), child.treeIndex());
      ASSERT_EQ(t.childTreeIndex(child), child.treeIndex());
      ASSERT_FALSE(t.isLeaf(ijk));
      ASSERT_EQ(child.parentIJK(), ijk);
      ASSERT_EQ(child.parentVoxelCoord(), t.voxelCoord());
      ASSERT_TRUE(t.isAncestorOf(child));
      ASSERT_FALSE(child.isAncestorOf(t));
      ASSERT_EQ(t.childCount(), slot + 1);
      ASSERT_EQ(t.hasLeaves(), slot + 1 < T::kTileSize);
    }
    EXPECT_FALSE(t.isLeaf());
  }
}

// requirement
TYPED_TEST(TileGeometry, SamplesAndTheirPositionsAgree) {
  using T = TypeParam;
  for (int d : {0, 1, T::kMaxDepth}) {
    auto const t = tileAt<T>(12345, -6789, 0, d);
    int const s = t.voxelDataWidth();
    for (int n = 0; n < T::kTDW; ++n) {
      int3 const ijk{n, T::kTDW - 1 - n, (n + 1) % T::kTDW};
      int3 const corner = t.childDataTIJK(ijk);
      EXPECT_EQ(corner, (int3{t.ti() + s * ijk.x, t.tj() + s * ijk.y, t.tk() + s * ijk.z}));
      EXPECT_EQ(t.childDataTIJK(ijk.x, ijk.y, ijk.z), corner);
      EXPECT_EQ(t.childDataIJK(corner), ijk);
      EXPECT_EQ(t.childDataIJK(corner.x + s - 1, corner.y + s - 1, corner.z + s - 1), ijk);
    }
  }
}

// requirement: the member forms take the tile's own depth
TYPED_TEST(TileGeometry, WidthsOfATileAreThoseOfItsDepth) {
  using T = TypeParam;
  using TileT = typename Container<T>::TileType;
  for (int d = 0; d <= T::kMaxDepth; ++d) {
    SCOPED_TRACE(d);
    auto const t = tileAt<T>(0, 0, 0, d);
    TileT const& base = t;
    EXPECT_EQ(base.tileVoxelWidth(), T::width(d));
    EXPECT_EQ(base.voxelWidth(), TileT::voxelWidth(d));
    EXPECT_EQ(base.voxelDataWidth(), TileT::voxelDataWidth(d));
    EXPECT_EQ(base.childTileVoxelWidth(), TileT::childTileVoxelWidth(d));
    EXPECT_EQ(base.childVoxelWidth(), TileT::childVoxelWidth(d));
    EXPECT_EQ(base.childVoxelDataWidth(), TileT::childVoxelDataWidth(d));
    EXPECT_EQ(base.parentTileVoxelWidth(), TileT::parentTileVoxelWidth(d));
    EXPECT_EQ(base.parentVoxelWidth(), TileT::parentVoxelWidth(d));
    EXPECT_EQ(base.parentVoxelDataWidth(), TileT::parentVoxelDataWidth(d));
    EXPECT_EQ(base.voxelCoord(), (VoxelCoord{t.ti(), t.tj(), t.tk(), d}));
  }
}

// requirement: division truncates towards zero on the low side
TYPED_TEST(TileGeometry, PointsOutsideDivideByTruncation) {
  using T = TypeParam;
  auto const t = tileAt<T>(0, 0, 0, 4);
  int const v = t.voxelWidth(), s = t.voxelDataWidth();
  EXPECT_EQ(t.childIJK(t.ti() - v + 1, t.tj() - v, t.tk() + t.tileVoxelWidth()), (int3{0, -1, T::kTW}));
  EXPECT_EQ(t.childDataIJK(t.ti() - s + 1, t.tj() - s, t.tk() + t.tileVoxelWidth()), (int3{0, -1, T::kTDW}));
}

// boundary
TYPED_TEST(TileGeometry, RootAtDepthZeroHasNoParentPlace) {
  using T = TypeParam;
  auto const t = tileAt<T>(0, 0, 0, 0);
  EXPECT_EQ(t.parentIJK(), (int3{0, 0, 0}));
  EXPECT_EQ(t.parentVoxelCoord(), VoxelCoord{});
  EXPECT_EQ(t.parentVoxelCoord().depth, -1);
  Tile<T, T::kTileSize> const dead;
  EXPECT_EQ(dead.parentIJK(), (int3{0, 0, 0}));
  EXPECT_EQ(dead.parentVoxelCoord(), VoxelCoord{});
}

// boundary
TYPED_TEST(TileGeometry, ContainsIsHalfOpen) {
  using T = TypeParam;
  for (int d = 0; d <= T::kMaxDepth; ++d) {
    SCOPED_TRACE(d);
    for (int c : {T::kMinTileCoord, 0, T::kMaxTileCoord}) {
      auto const t = tileAt<T>(c, c, c, d);
      int const w = t.tileVoxelWidth();
      int3 const low = t.tijk();
      ASSERT_TRUE(t.contains(low));
      ASSERT_TRUE(t.contains(low + int3{w - 1, w - 1, w - 1}));
      for (int axis = 0; axis < 3; ++axis) {
        int3 outside = low;
        outside[axis] = low[axis] + w;
        ASSERT_FALSE(t.contains(outside));
        outside[axis] = low[axis] - 1;
        ASSERT_FALSE(t.contains(outside));
      }
    }
  }
}

// boundary: the same rule in floating point, on corners that float holds
TYPED_TEST(TileGeometry, ContainsOfFloatsIsHalfOpen) {
  using T = TypeParam;
  OpenTile<T> const t(0, 0, 0, T::kMaxDepth - 2, 0, 0);
  float const w = static_cast<float>(t.tileVoxelWidth());
  EXPECT_TRUE(t.contains(float3{0.0f, 0.0f, 0.0f}));
  EXPECT_TRUE(t.contains(float3{w - 0.25f, 0.5f, 0.0f}));
  EXPECT_FALSE(t.contains(float3{w, 0.0f, 0.0f}));
  EXPECT_FALSE(t.contains(float3{0.0f, w, 0.0f}));
  EXPECT_FALSE(t.contains(float3{0.0f, 0.0f, -0.25f}));
  EXPECT_FALSE(t.contains(float3{std::nanf(""), 0.0f, 0.0f}));
  EXPECT_FALSE(t.contains(float3{std::numeric_limits<float>::infinity(), 0.0f, 0.0f}));
}

// requirement: the far faces count for a tile and do not for a voxel
TYPED_TEST(TileGeometry, TileAndVoxelTreatTheFarFaceDifferently) {
  using T = TypeParam;
  auto const t = tileAt<T>(0, 0, 0, 3);
  int const w = t.tileVoxelWidth();
  for (int axis = 0; axis < 3; ++axis) {
    int3 const low = t.tijk();
    int3 max = low + int3{w, w, w};
    int3 min = low;
    min[axis] = max[axis];
    EXPECT_TRUE(t.intersects(Box{min, max})) << axis;
    int3 far{0, 0, 0};
    far[axis] = T::kTW - 1;
    EXPECT_FALSE(t.childIntersects(Box{min, max}, far)) << axis;
    min[axis] -= 1;
    EXPECT_TRUE(t.childIntersects(Box{min, max}, far)) << axis;
    min[axis] += 2;
    max[axis] += 2;
    EXPECT_FALSE(t.intersects(Box{min, max})) << axis;
    Box below{low, low};
    EXPECT_TRUE(t.intersects(below));
    below.min[axis] -= 5, below.max[axis] -= 1;
    EXPECT_FALSE(t.intersects(below)) << axis;
    EXPECT_FALSE(t.childIntersects(below, int3{0, 0, 0})) << axis;
  }
}

// requirement
TYPED_TEST(TileGeometry, ContainmentInABoxUsesTheSameFarCorners) {
  using T = TypeParam;
  auto const t = tileAt<T>(0, 0, 0, 3);
  int const w = t.tileVoxelWidth(), v = t.voxelWidth();
  int3 const low = t.tijk(), high = low + int3{w, w, w};
  EXPECT_TRUE(t.isContainedWithin(Box{low, high}));
  int3 const first{0, 0, 0};
  EXPECT_TRUE(t.childIsContainedWithin(Box{low, low + int3{v - 1, v - 1, v - 1}}, first));
  for (int axis = 0; axis < 3; ++axis) {
    Box box{low, high};
    box.max[axis] -= 1;
    EXPECT_FALSE(t.isContainedWithin(box)) << axis;
    box = {low, high};
    box.min[axis] += 1;
    EXPECT_FALSE(t.isContainedWithin(box)) << axis;
    box = {low, low + int3{v - 1, v - 1, v - 1}};
    box.max[axis] -= 1;
    EXPECT_FALSE(t.childIsContainedWithin(box, first)) << axis;
    box = {low, low + int3{v - 1, v - 1, v - 1}};
    box.min[axis] += 1;
    EXPECT_FALSE(t.childIsContainedWithin(box, first)) << axis;
  }
}

// requirement: truncating division lets deeper tiles less than one voxel below pass
TYPED_TEST(TileGeometry, AncestorTestPassesTilesLessThanAVoxelBelow) {
  using T = TypeParam;
  int const d = T::kMaxDepth - 3;
  auto const t = tileAt<T>(0, 0, 0, d);
  int const v = t.voxelWidth(), w = t.tileVoxelWidth(), small = T::width(T::kMaxDepth);
  auto const deeper = [&](int offset) {
    return OpenTile<T>(t.ti() + offset, t.tj(), t.tk(), T::kMaxDepth, 0, 0);
  };
  EXPECT_TRUE(t.isAncestorOf(deeper(0)));
  EXPECT_TRUE(t.isAncestorOf(deeper(w - small)));
  EXPECT_FALSE(t.isAncestorOf(deeper(w)));
  EXPECT_TRUE(t.isAncestorOf(deeper(-small))) << "not contained, yet passes";
  EXPECT_FALSE(t.contains(deeper(-small).tijk()));
  EXPECT_FALSE(t.isAncestorOf(deeper(-v)));
  EXPECT_FALSE(t.isAncestorOf(t)) << "needs a deeper tile";
  EXPECT_FALSE(t.isAncestorOf(tileAt<T>(0, 0, 0, d - 1)));
}

// requirement
TYPED_TEST(TileGeometry, BoundsGrowByTheTileAndByAVoxel) {
  using T = TypeParam;
  auto const t = tileAt<T>(0, 0, 0, 2);
  int const w = t.tileVoxelWidth(), v = t.voxelWidth();
  Box box;
  t.tileSpaceBounds(box);
  EXPECT_EQ(box, (Box{t.tijk(), t.tijk() + int3{w, w, w}}));
  Box voxel;
  t.tileSpaceBounds(int3{1, 0, 1}, voxel);
  EXPECT_EQ(voxel, (Box{t.tijk() + int3{v, 0, v}, t.tijk() + int3{2 * v, v, 2 * v}}));
  t.tileSpaceBounds(voxel);
  EXPECT_EQ(voxel, box);
}

// boundary: the last tile of the domain ends one beyond the last coordinate
TYPED_TEST(TileGeometry, BoundsOfTheLastTileReachBeyondTheDomain) {
  using T = TypeParam;
  for (int d : {0, 1, T::kMaxDepth}) {
    auto const t = tileAt<T>(T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxTileCoord, d);
    Box box;
    t.tileSpaceBounds(box);
    EXPECT_EQ(box.max, (int3{T::kMaxTileCoord + 1, T::kMaxTileCoord + 1, T::kMaxTileCoord + 1}));
    Box voxel;
    t.tileSpaceBounds(int3{T::kTW - 1, T::kTW - 1, T::kTW - 1}, voxel);
    EXPECT_EQ(voxel.max, box.max) << d;
  }
}

// requirement
TYPED_TEST(TileGeometry, IteratorsVisitTheOccupiedSlots) {
  using T = TypeParam;
  int const last = T::kTileSize - 1;
  for (std::vector<int> const& slots :
       {std::vector<int>{}, {0}, {last}, {0, last}, {1, 2, 5}, {0, 1, 2, 3, 4, 5, 6, 7}}) {
    OpenTile<T> t(0, 0, 0, 1);
    for (int slot : slots) t.childIndex(slot) = 100 + slot;
    std::vector<int> forward, backward;
    for (auto it = t.begin(); it != t.end(); ++it) {
      forward.push_back(*it);
      EXPECT_EQ(it.treeIndex(), (TreeIndex{100 + *it, 2}));
    }
    for (auto it = t.rbegin(); it != t.rend(); --it) backward.insert(backward.begin(), *it);
    EXPECT_FALSE(t.begin().reverse());
    EXPECT_TRUE(t.rbegin().reverse());
    EXPECT_EQ(forward, slots);
    EXPECT_EQ(backward, slots);
    if (!slots.empty()) {
      auto it = t.end();
      --it;
      EXPECT_EQ(*it, slots.back()) << "-- from the end reaches the last slot";
      EXPECT_TRUE(it == t.rbegin());
    }
  }
}

// boundary
TYPED_TEST(TileGeometry, ReverseBeginOfAChildlessTileIsItsEnd) {
  OpenTile<TypeParam> const t(0, 0, 0, 1);
  EXPECT_TRUE(t.rbegin() == t.rend());
  EXPECT_EQ(*t.rbegin(), -1);
  EXPECT_TRUE(t.begin() == t.end());
  EXPECT_EQ(*t.begin(), TypeParam::kTileSize);
}

// boundary: stepping never reads outside the table, nor a table that is not there
TYPED_TEST(TileGeometry, IteratorsStepSafelyBeyondTheEnds) {
  using T = TypeParam;
  OpenTile<T> full(0, 0, 0, 1);
  for (int slot = 0; slot < T::kTileSize; ++slot) full.childIndex(slot) = slot;
  auto it = full.end();
  ++it;
  auto before = full.rend();
  --before;
  OpenTile<T> const deepest(0, 0, 0, T::kMaxDepth, 0, 0);
  auto end = deepest.end();
  --end;
  EXPECT_LT(*end, 0) << "no slot of a tile without a table is occupied";
  auto rend = deepest.rend();
  ++rend;
  EXPECT_GE(*rend, T::kTileSize);
}

// boundary
TYPED_TEST(TileGeometry, ExtremeArgumentsAreDefined) {
  using T = TypeParam;
  int const lowest = std::numeric_limits<int>::min(), highest = std::numeric_limits<int>::max();
  Box const everything{{lowest, lowest, lowest}, {highest, highest, highest}};
  for (int d = 0; d <= T::kMaxDepth; ++d) {
    SCOPED_TRACE(d);
    for (int c : {T::kMinTileCoord, T::kMaxTileCoord}) {
      auto const t = tileAt<T>(c, c, c, d);
      int3 const far{T::kTW - 1, T::kTW - 1, T::kTW - 1};
      for (int p : {lowest, highest}) {
        EXPECT_FALSE(t.contains(p, p, p));
        EXPECT_FALSE(t.contains(p, t.tj(), t.tk()));
        EXPECT_FALSE(t.intersects(Box{{p, p, p}, {p, p, p}}));
        EXPECT_FALSE(t.childIntersects(Box{{p, p, p}, {p, p, p}}, far));
        t.childIJK(p, p, p);
        t.childDataIJK(p, p, p);
      }
      EXPECT_TRUE(t.intersects(everything));
      EXPECT_TRUE(t.childIntersects(everything, far));
      EXPECT_TRUE(t.isContainedWithin(everything));
      EXPECT_TRUE(t.childIsContainedWithin(everything, far));
      EXPECT_FALSE(t.isContainedWithin(Box()));
      EXPECT_FALSE(t.childIsContainedWithin(Box(), far));
      EXPECT_FALSE(t.intersects(Box())) << "the empty box";
      EXPECT_TRUE(t.contains(t.tijk()));
      for (int other : {T::kMinTileCoord, T::kMaxTileCoord}) {
        auto const deepest = tileAt<T>(other, other, other, T::kMaxDepth);
        EXPECT_EQ(t.isAncestorOf(deepest), d < T::kMaxDepth && t.contains(deepest.tijk()));
      }
    }
  }
}
