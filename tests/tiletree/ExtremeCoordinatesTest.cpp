// Every operation that takes coordinates, at the corners of the domain, just outside of it, and at the ends
// of int. Run under the undefined-behaviour sanitizer these are the tests of the arithmetic.
#include "support/CaptureStream.h"
#include "support/Print.h"
#include "support/RandomForest.h"
#include "support/Shapes.h"

#include "GeometryVolume/tiletree/TileHalo.h"

#include <gtest/gtest.h>

#include <limits>
#include <sstream>
#include <utility>
#include <vector>

using namespace VLN::TileTree3D;
using Support::Access;

VLN_SHAPE_SUITE(ExtremeCoordinates);

namespace {

constexpr int kLowest = std::numeric_limits<int>::min(), kHighest = std::numeric_limits<int>::max();

template <class T> std::vector<int3> corners() {
  std::vector<int3> list;
  for (int i : {T::kMinTileCoord, T::kMaxTileCoord}) {
    for (int j : {T::kMinTileCoord, T::kMaxTileCoord}) {
      for (int k : {T::kMinTileCoord, T::kMaxTileCoord}) list.push_back({i, j, k});
    }
  }
  return list;
}

template <class T> std::vector<int3> outside() {
  std::vector<int3> list;
  for (int c : {kLowest, kLowest + 1, T::kMinTileCoord - 1, T::kMaxTileCoord + 1, kHighest - 1, kHighest}) {
    list.push_back({c, c, c});
    list.push_back({c, 0, 0});
    list.push_back({0, c, T::kMaxTileCoord});
    list.push_back({T::kMinTileCoord, 0, c});
  }
  return list;
}

/// Tiles of three depths at every corner of the domain, as a forest or as one tree.
template <class T> Container<T> cornerForest(bool oneTree) {
  Container<T> tree;
  for (int3 const& p : corners<T>()) {
    Access::addTile(tree, p, T::kMaxDepth);
    Access::addTile(tree, p, T::kMaxDepth - 1);
  }
  if (oneTree) Access::addTile(tree, {0, 0, 0}, 0);
  return tree;
}

} // namespace

// boundary
TYPED_TEST(ExtremeCoordinates, CornersOfTheDomainAreFoundAtEveryDepth) {
  using T = TypeParam;
  for (bool oneTree : {false, true}) {
    Container<T> tree = cornerForest<T>(oneTree);
    EXPECT_TRUE(tree.checkConsistency(false));
    EXPECT_EQ(tree.rootCount(), oneTree ? 1 : 8);
    for (int caches = 0; caches < 4; ++caches) {
      if (caches & 1) tree.precomputeTileNeighbors();
      if (caches & 2) tree.buildAccessorAccelerationStructure(T::kMaxDepth);
      auto const accessor = std::as_const(tree).tileAccessor();
      for (int3 const& p : corners<T>()) {
        for (int d = 0; d <= T::kMaxDepth; ++d) {
          bool const exists = oneTree || d >= T::kMaxDepth - 1;
          TreeIndex const at = Access::tileIndex(tree, p, d);
          ASSERT_EQ(at.valid(), exists) << p << " depth " << d;
          ASSERT_EQ(accessor.tile(p, d, true).valid(), exists);
          if (exists) {
            ASSERT_EQ(at.depth, d);
            ASSERT_TRUE(tree.tile(at).contains(p));
            ASSERT_EQ(accessor.tile(p, d, true).treeIndex(), at);
          }
        }
      }
    }
  }
}

// boundary
TYPED_TEST(ExtremeCoordinates, PointsOutsideFindNothing) {
  using T = TypeParam;
  for (bool oneTree : {false, true}) {
    Container<T> tree = cornerForest<T>(oneTree);
    std::int64_t const total = tree.tileCount(-1);
    for (int caches = 0; caches < 4; ++caches) {
      if (caches & 1) tree.precomputeTileNeighbors();
      if (caches & 2) tree.buildAccessorAccelerationStructure(T::kMaxDepth);
      auto accessor = tree.tileAccessor();
      for (int3 const& inside : corners<T>()) {
        accessor.tile(inside, T::kMaxDepth, true); // the cursor stands at a corner
        for (int3 const& p : outside<T>()) {
          for (int d : {0, 1, T::kMaxDepth}) {
            ASSERT_FALSE(Access::tileIndex(tree, p, d).valid()) << p;
            ASSERT_FALSE(accessor.tile(p, d, false).valid()) << p;
            ASSERT_FALSE(accessor.tile(p, d, true).valid()) << p;
            ASSERT_FALSE(accessor.addTile(p, d).valid()) << p;
            ASSERT_FALSE(accessor.addTile(p, inside).valid()) << p;
            ASSERT_FALSE(accessor.addTile(inside, p).valid()) << p;
            accessor.addTiles(p, p, d);
          }
        }
      }
    }
    EXPECT_EQ(tree.tileCount(-1), total);
  }
}

// boundary
TYPED_TEST(ExtremeCoordinates, NeighborsAtTheRimAreThoseInside) {
  using T = TypeParam;
  Container<T> tree = cornerForest<T>(true);
  for (bool table : {false, true}) {
    if (table) tree.precomputeTileNeighbors();
    auto const accessor = std::as_const(tree).tileAccessor();
    for (int3 const& p : corners<T>()) {
      for (int d : {0, 1, T::kMaxDepth - 1, T::kMaxDepth}) {
        auto const& t = accessor.tile(p, d, true);
        for (int n = 0; n < kNeighborCount; ++n) {
          int3 const o = neighborOffset(n);
          bool inside = true;
          for (int a = 0; a < 3; ++a) {
            std::int64_t const c = std::int64_t(t.tijk()[a]) + std::int64_t(T::width(d)) * o[a];
            inside &= c >= T::kMinTileCoord && c <= T::kMaxTileCoord;
          }
          ASSERT_EQ(accessor.tileNeighbor(t, static_cast<NeighborDirection>(n)).valid(), inside)
              << p << " depth " << d << " direction " << n;
        }
        for (int step : {kLowest, kHighest}) {
          for (int depth : {kLowest, -1, 0, 1, T::kMaxDepth, T::kMaxDepth + 1, kHighest}) {
            if (T::isDepth(depth)) {
              ASSERT_FALSE(accessor.tileNeighbor(t, step, step, step, depth, false).valid());
            } else {
              accessor.tileNeighbor(t, step, step, step, depth, false);
            }
          }
        }
        std::vector<TreeIndex> list;
        for (int depth : {kLowest, d, T::kMaxDepth, kHighest}) {
          accessor.tileNeighbors(t, list, depth, false);
          accessor.tileNeighbors(t, list, depth, true);
        }
        ASSERT_FALSE(list.empty());
      }
    }
  }
}

// boundary
TYPED_TEST(ExtremeCoordinates, DerivedTablesCoverTheWholeDomain) {
  using T = TypeParam;
  for (bool oneTree : {false, true}) {
    Container<T> tree = cornerForest<T>(oneTree);
    tree.precomputeTileHalos();
    tree.precomputeCompressedTileHalos();
    for (std::int64_t n = 0; n < tree.tileCount(-1); ++n) {
      int count = 0;
      for (auto v = tree.tileHaloVisitor(tree.tile(n).treeIndex()); !v.end(); v.next()) {
        EXPECT_GT(v.weight(), 0.0f);
        ++count;
      }
      EXPECT_LE(count, 26);
    }
    EXPECT_GT(tree.tileSpaceMaxTileDistance(), 1 << 26);
    bbox<int3, int> box;
    tree.tileSpaceBounds(box);
    EXPECT_EQ(box.min, (int3{T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord}));
    EXPECT_EQ(box.max, (int3{T::kMaxTileCoord + 1, T::kMaxTileCoord + 1, T::kMaxTileCoord + 1}));
    bbox<float3> world;
    tree.setVoxelSize(1e-3f);
    tree.worldSpaceBounds(world);
    EXPECT_LT(world.min.x, -500000.0f);
    std::ostringstream os;
    tree.dump(os);
    EXPECT_GT(os.str().size(), 1000u);
  }
}

// boundary: a grid over the whole domain, entered at its rim and missed just outside
TYPED_TEST(ExtremeCoordinates, GridOverTheWholeDomain) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTiles({kLowest, kLowest, kLowest}, {kHighest, kHighest, kHighest}, 1);
  for (int3 const& p : corners<T>()) accessor.addTile(p, T::kMaxDepth);
  tree.buildAccessorAccelerationStructure(1);
  ASSERT_EQ(Access::data(tree).m_gridDepth, 1);
  for (int3 const& p : corners<T>()) EXPECT_EQ(Access::tileIndex(tree, p, T::kMaxDepth).depth, T::kMaxDepth);
  for (int3 const& p : outside<T>()) EXPECT_FALSE(Access::tileIndex(tree, p, T::kMaxDepth).valid()) << p;
  EXPECT_EQ(Access::tileIndex(tree, {0, 0, 0}, T::kMaxDepth).depth, 1);
}

// boundary: additions that wrap round would land at the other end
TYPED_TEST(ExtremeCoordinates, BoxesOverTheEndsOfIntAddWhatLiesInside) {
  using T = TypeParam;
  int const w = T::width(T::kMaxDepth);
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTiles({T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxTileCoord}, {kHighest, kHighest, kHighest},
                    T::kMaxDepth);
  accessor.addTiles({kLowest, kLowest, kLowest},
                    {T::kMinTileCoord + w, T::kMinTileCoord + 1, T::kMinTileCoord + 1}, T::kMaxDepth);
  EXPECT_EQ(tree.tileCount(-1), 2);
  EXPECT_TRUE(
      accessor.tile(T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxDepth, true).valid());
  EXPECT_TRUE(
      accessor.tile(T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord, T::kMaxDepth, true).valid());
  EXPECT_TRUE(tree.checkConsistency(false));
}

// boundary: both ends in one box need the depth-0 tile
TYPED_TEST(ExtremeCoordinates, BoxOverTheWholeDomainIsOneTile) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  int3 const low{T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord};
  int3 const high{T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxTileCoord};
  EXPECT_EQ(accessor.addTile(low, high).depth(), 0);
  EXPECT_EQ(accessor.addTile(high, high).depth(), T::kMaxDepth);
  EXPECT_EQ(accessor.addTile(low, low).depth(), T::kMaxDepth);
  EXPECT_EQ(tree.rootCount(), 1);
  EXPECT_EQ(tree.tileCount(-1), 2 * T::kMaxDepth + 1);
}
