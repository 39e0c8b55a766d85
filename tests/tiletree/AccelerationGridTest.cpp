// The dense grid that enters the tree at one depth, and the distance measure over depths.
#include "support/Print.h"
#include "support/RandomForest.h"
#include "support/Shapes.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cmath>
#include <limits>
#include <random>
#include <thread>
#include <utility>

using namespace VLN::TileTree3D;
using Support::Access;

VLN_SHAPE_SUITE(AccelerationGrid);

// boundary
TYPED_TEST(AccelerationGrid, EmptyContainerHasNone) {
  using T = TypeParam;
  Container<T> tree;
  for (int d : {std::numeric_limits<int>::min(), -1, 0, 1, T::kMaxDepth, std::numeric_limits<int>::max()}) {
    tree.buildAccessorAccelerationStructure(d);
    EXPECT_EQ(Access::data(tree).m_gridDepth, -1) << d;
  }
  tree.clearAccessorAccelerationStructure();
  EXPECT_EQ(Access::data(tree).m_gridDepth, -1);
}

// boundary: depth 0 never qualifies
TYPED_TEST(AccelerationGrid, WalkEndsAtDepthOne) {
  using T = TypeParam;
  Container<T> tree;
  tree.tileAccessor().addTile(0, 0, 0, 0);
  tree.buildAccessorAccelerationStructure(T::kMaxDepth);
  EXPECT_EQ(Access::data(tree).m_gridDepth, -1);
  tree.tileAccessor().addTile(0, 0, 0, 1);
  tree.buildAccessorAccelerationStructure(0);
  EXPECT_EQ(Access::data(tree).m_gridDepth, -1);
  tree.buildAccessorAccelerationStructure(1);
  EXPECT_EQ(Access::data(tree).m_gridDepth, 1);
}

// requirement
TYPED_TEST(AccelerationGrid, FieldsDescribeTheBoundsOfTheDepth) {
  using T = TypeParam;
  int const w = T::width(T::kMaxDepth), x = T::align(-1000, T::kMaxDepth);
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTile(x, x, x, T::kMaxDepth);
  accessor.addTile(x + 4 * w, x + w, x + 2 * w, T::kMaxDepth);
  tree.buildAccessorAccelerationStructure(std::numeric_limits<int>::max());
  auto const& data = Access::data(tree);
  EXPECT_EQ(data.m_gridDepth, T::kMaxDepth);
  EXPECT_EQ(data.m_gridCellWidth, w);
  EXPECT_EQ(data.m_gridOrigin, (int3{x, x, x}));
  EXPECT_EQ(data.m_gridExtent, (int3{5 * w, 2 * w, 3 * w}));
  EXPECT_EQ(data.m_gridSize, (std::array<std::int32_t, 3>{5, 2, 3}));
  ASSERT_EQ(data.m_gridTable.size(), 30u);
  EXPECT_EQ(data.m_gridTable.front(), 0);
  EXPECT_EQ(data.m_gridTable[(2 * 2 + 1) * 5 + 4], 1) << "(k * ny + j) * nx + i";
  EXPECT_EQ(std::count(data.m_gridTable.begin(), data.m_gridTable.end(), -1), 28);
  tree.clearAccessorAccelerationStructure();
  EXPECT_EQ(data.m_gridDepth, -1);
  EXPECT_TRUE(data.m_gridTable.empty());
}

// boundary: 64 cells along an axis qualify, 65 do not
TYPED_TEST(AccelerationGrid, SixtyFourCellsAreTheLimit) {
  using T = TypeParam;
  for (int d : {T::kMaxDepth, T::kMaxDepth - 2}) {
    for (int axis = 0; axis < 3; ++axis) {
      int const w = T::width(d), x = T::align(0, d);
      Container<T> tree;
      auto accessor = tree.tileAccessor();
      int3 p{x, x, x};
      accessor.addTile(p, d);
      p[axis] += 63 * w;
      accessor.addTile(p, d);
      tree.buildAccessorAccelerationStructure(T::kMaxDepth);
      EXPECT_EQ(Access::data(tree).m_gridDepth, d) << axis;
      p[axis] += w;
      accessor.addTile(p, d);
      tree.buildAccessorAccelerationStructure(T::kMaxDepth);
      EXPECT_EQ(Access::data(tree).m_gridDepth, -1) << axis;
    }
  }
}

// regression: where no depth qualifies there is no grid, not an older one
TYPED_TEST(AccelerationGrid, NoDepthThatQualifiesLeavesNone) {
  using T = TypeParam;
  Container<T> tree;
  tree.tileAccessor().addTile({0, 0, 0}, T::kMaxDepth);
  tree.buildAccessorAccelerationStructure(T::kMaxDepth);
  ASSERT_EQ(Access::data(tree).m_gridDepth, T::kMaxDepth);
  tree.buildAccessorAccelerationStructure(0);
  EXPECT_EQ(Access::data(tree).m_gridDepth, -1);
  EXPECT_TRUE(Access::data(tree).m_gridTable.empty());
}

// requirement: the deepest depth that qualifies, not above what was asked
TYPED_TEST(AccelerationGrid, DeepestQualifyingDepthIsTaken) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTile(T::kMinTileCoord, 0, 0, 2);
  accessor.addTile(T::kMinTileCoord, 0, 0, T::kMaxDepth);
  accessor.addTile(T::kMaxTileCoord, 0, 0, 2);
  accessor.addTile(T::kMaxTileCoord, 0, 0, T::kMaxDepth);
  tree.buildAccessorAccelerationStructure(T::kMaxDepth);
  int const chosen = Access::data(tree).m_gridDepth;
  int expected = -1;
  for (int d = 1; d <= T::kMaxDepth; ++d) {
    if (tree.tileCount(d) > 0 && std::int64_t(T::width(0)) / T::width(d) <= 64) expected = d;
  }
  EXPECT_EQ(chosen, expected);
  tree.buildAccessorAccelerationStructure(2);
  EXPECT_EQ(Access::data(tree).m_gridDepth, 2);
}

// requirement: every lookup gives what it gave without the grid, at the rim and outside of it too
TYPED_TEST(AccelerationGrid, LookupsAreThoseWithoutTheGrid) {
  using T = TypeParam;
  for (std::uint32_t seed = 1; seed <= 8; ++seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    Support::RandomForest<T> forest(300 + seed);
    auto accessor = forest.tree().tileAccessor();
    int const d0 = T::kMaxDepth - 3, w = T::width(d0), x = T::align(5000, d0);
    for (int n = 0; n < 40; ++n) {
      int3 const p{x + forest.pick(0, 20 * w), x + forest.pick(0, 20 * w), x + forest.pick(0, 20 * w)};
      accessor.addTile(p, d0 + forest.pick(0, 3));
    }
    auto const plain = forest.tree();
    forest.tree().buildAccessorAccelerationStructure(forest.pick(d0, T::kMaxDepth));
    ASSERT_GE(Access::data(forest.tree()).m_gridDepth, 0);
    ASSERT_EQ(Access::data(plain).m_gridDepth, -1);
    auto const withGrid = std::as_const(forest.tree()).tileAccessor(), without = plain.tileAccessor();
    int3 p{x, x, x};
    for (int n = 0; n < 4000; ++n) {
      for (int a = 0; a < 3; ++a)
        p[a] = n % 3 ? p[a] < x + 30 * w && p[a] > x - 30 * w ? p[a] + forest.pick(-w, w) : x
                     : x + forest.pick(-3 * w, 24 * w);
      if (n % 50 == 0) p[n % 3] = n % 100 ? std::numeric_limits<int>::max() : std::numeric_limits<int>::min();
      int const d = forest.pick(d0 - 2, T::kMaxDepth + 1);
      ASSERT_EQ(Access::tileIndex(forest.tree(), p, d), Access::tileIndex(plain, p, d))
          << p << " depth " << d;
      // Cursors too, which go by the table of places; with the corner of the tile found, and near steps
      // between.
      for (bool const exact : {false, true}) {
        auto const found = withGrid.treeIndex(p.x, p.y, p.z, d, exact);
        ASSERT_EQ(found, without.treeIndex(p.x, p.y, p.z, d, exact)) << p << " depth " << d << ' ' << exact;
        if (!found.valid()) continue;
        ASSERT_EQ(withGrid.cursorCorner(), plain.tile(found).tijk());
        ASSERT_EQ(withGrid.current().treeIndex(), found);
      }
    }
  }
}

// requirement: accessors that search far and often make a table of places: answers stay the same, the grid
// stays off, and any change of the tree drops it
TYPED_TEST(AccelerationGrid, FarSearchesMakeTheTableOfPlaces) {
  using T = TypeParam;
  Support::RandomForest<T> forest(77);
  auto& tree = forest.tree();
  auto adding = tree.tileAccessor();
  int const d0 = T::kMaxDepth - 4, w = T::width(d0), x = T::align(5000, d0);
  auto const point = [&] {
    return int3{x + forest.pick(-w, 7 * w), x + forest.pick(-w, 7 * w), x + forest.pick(-w, 7 * w)};
  };
  adding.addTile({x, x, x}, d0 - 1);
  for (int n = 0; n < 300; ++n) adding.addTile(point(), d0 + forest.pick(1, 4));
  auto const& data = Access::data(tree);
  for (int round = 0; round < 3; ++round) {
    auto const plain = tree; // a copy of its own, which nobody searches
    ASSERT_EQ(data.m_lookup.loadAcquire(), nullptr);
    auto const cursor = std::as_const(tree).tileAccessor();
    int searches = 0;
    for (; searches < 200000 && !data.m_lookup.loadAcquire(); ++searches) {
      int3 const p = point();
      ASSERT_EQ(cursor.treeIndex(p.x, p.y, p.z, T::kMaxDepth, false),
                Access::tileIndex(plain, p, T::kMaxDepth));
    }
    EXPECT_GT(searches, 10000) << "not for a few searches";
    ASSERT_NE(data.m_lookup.loadAcquire(), nullptr);
    EXPECT_EQ(data.m_gridDepth, -1);
    auto const copy = tree;
    EXPECT_EQ(Access::data(copy).m_lookup.loadAcquire(), data.m_lookup.loadAcquire()) << "copies share it";
    for (int n = 0; n < 4000; ++n) {
      int3 const p = point();
      int const d = forest.pick(d0 - 2, T::kMaxDepth + 1);
      bool const exact = n % 2;
      ASSERT_EQ(cursor.treeIndex(p.x, p.y, p.z, d, exact),
                plain.tileAccessor().treeIndex(p.x, p.y, p.z, d, exact));
    }
    switch (round) {
    case 0:
      adding.addTile({x - 5 * w, x, x}, T::kMaxDepth);
      break;
    case 1: {
      auto const [index, depth] = std::as_const(tree).tile(tree.tileCount(-1) - 1).treeIndex();
      adding.removeTile({index, depth}, true);
      break;
    }
    default:
      tree.sortIntoMortonOrder();
    }
    EXPECT_NE(Access::data(copy).m_lookup.loadAcquire(), nullptr) << "what a copy has stays";
  }
  EXPECT_EQ(data.m_lookup.loadAcquire(), nullptr);
}

// requirement: reading tile by tile and branch by branch, again and again, makes the table as well
TYPED_TEST(AccelerationGrid, PassesInOrderMakeTheTableOfPlaces) {
  using T = TypeParam;
  Support::RandomForest<T> forest(79);
  auto adding = forest.tree().tileAccessor();
  constexpr int kLevels = T::kTW == 2 ? 5 : 2;
  int const w = T::width(T::kMaxDepth), x = T::align(5000, T::kMaxDepth - kLevels);
  std::vector<int3> places;
  for (int n = 0, count = T::width(T::kMaxDepth - kLevels) / w; n < count * count * count; ++n) {
    int3 p{0, 0, 0};
    for (int digits = n, scale = w; digits > 0; scale *= T::kTW)
      for (int a = 0; a < 3; ++a, digits /= T::kTW) p[a] += digits % T::kTW * scale;
    places.push_back(p + int3{x, x, x});
  }
  adding.addTile({x, x, x}, T::kMaxDepth - kLevels - 1);
  for (int3 const& p : places) adding.addTile(p, T::kMaxDepth);
  auto const& tree = std::as_const(forest.tree());
  auto const plain = tree; // a copy of its own, which nobody searches
  auto const cursor = tree.tileAccessor();
  int passes = 0;
  for (; passes < 200 && !Access::data(tree).m_lookup.loadAcquire(); ++passes)
    for (int3 const& p : places)
      ASSERT_EQ(cursor.treeIndex(p.x, p.y, p.z, T::kMaxDepth, false),
                Access::tileIndex(plain, p, T::kMaxDepth));
  EXPECT_GT(passes, 1);
  EXPECT_NE(Access::data(tree).m_lookup.loadAcquire(), nullptr);
}

// requirement: whoever searches meanwhile, on any thread, gets the same answers
TYPED_TEST(AccelerationGrid, ThreadsSearchWhileTheTableOfPlacesIsMade) {
  using T = TypeParam;
  Support::RandomForest<T> forest(78);
  auto adding = forest.tree().tileAccessor();
  int const d0 = T::kMaxDepth - 4, w = T::width(d0), x = T::align(5000, d0);
  for (int n = 0; n < 200; ++n)
    adding.addTile({x + forest.pick(-w, 7 * w), x + forest.pick(-w, 7 * w), x + forest.pick(-w, 7 * w)},
                   d0 + forest.pick(1, 4));
  auto const& tree = std::as_const(forest.tree());
  std::atomic<int> wrong{0};
  std::vector<std::thread> threads;
  for (std::uint32_t t = 0; t < 4; ++t)
    threads.emplace_back([&, t] {
      std::mt19937 random(t);
      auto const cursor = tree.tileAccessor();
      for (int n = 0; n < 20000; ++n) {
        auto const c = [&] { return x - w + static_cast<int>(random() % static_cast<unsigned>(8 * w)); };
        int3 const p{c(), c(), c()};
        wrong +=
            cursor.treeIndex(p.x, p.y, p.z, T::kMaxDepth, false) != Access::tileIndex(tree, p, T::kMaxDepth);
        if (n % 1000 == 0) Container<T> const copy(tree);
      }
    });
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(wrong, 0);
  EXPECT_NE(Access::data(tree).m_lookup.loadAcquire(), nullptr);
}

// boundary: positions around the grid and at the ends of all integers, for grids at either end of the domain
TYPED_TEST(AccelerationGrid, PositionsAroundTheGridHaveNoTile) {
  using T = TypeParam;
  constexpr int kLow = std::numeric_limits<int>::min(), kTop = std::numeric_limits<int>::max();
  for (int const depth : {T::kMaxDepth, T::kMaxDepth - 1, T::kMaxDepth - 2})
    for (int const end : {T::kMinTileCoord, T::kMaxTileCoord, -1, 0}) {
      Container<T> tree;
      // The grid's depth, and by turns as many levels below it as a table holds.
      int3 const corner = tree.tileAccessor().addTile(end, end, end, depth).tijk();
      tree.tileAccessor().addTile(end, end, end, T::kMaxDepth);
      Container<T> const plain = tree;
      tree.buildAccessorAccelerationStructure(depth);
      ASSERT_EQ(Access::data(tree).m_gridDepth, depth);
      auto const accessor = std::as_const(tree).tileAccessor();
      std::int64_t const w = T::width(depth);
      for (std::int64_t const step :
           {std::int64_t(0), std::int64_t(1), std::int64_t(-1), w - 1, w, -w, std::int64_t(1) << 29,
            -(std::int64_t(1) << 29), std::int64_t(1) << 30, -(std::int64_t(1) << 30), std::int64_t(1) << 31})
        for (int axis = 0; axis < 3; ++axis)
          for (int d : {T::kMaxDepth, depth, T::kMaxDepth + 1}) {
            int3 p = corner;
            p[axis] =
                static_cast<int>(std::clamp<std::int64_t>(std::int64_t(corner[axis]) + step, kLow, kTop));
            for (bool const exact : {false, true}) {
              auto const expected = plain.tileAccessor().treeIndex(p.x, p.y, p.z, d, exact);
              auto const found = accessor.treeIndex(p.x, p.y, p.z, d, exact);
              ASSERT_EQ(found, expected) << end << ", depth " << d << ", step " << step;
              if (!found.valid()) continue;
              EXPECT_EQ(accessor.cursorCorner(), tree.tile(found).tijk());
              EXPECT_EQ(&accessor.current(), &tree.tile(found));
            }
          }
    }
}

// regression: a cell of the grid without a tile of its depth may still hold a deeper root
TYPED_TEST(AccelerationGrid, DeeperRootsAreFound) {
  using T = TypeParam;
  int const d = T::kMaxDepth - 2, w = T::width(d), x = T::align(1000, d);
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTile(x, x, x, d);
  accessor.addTile(x + 3 * w, x, x, d);
  TreeIndex const deep = accessor.addTile(x + w, x, x, T::kMaxDepth).treeIndex();
  tree.buildAccessorAccelerationStructure(d);
  ASSERT_EQ(Access::data(tree).m_gridDepth, d);
  auto const cursor = std::as_const(tree).tileAccessor();
  EXPECT_EQ(cursor.treeIndex(x + w, x, x, T::kMaxDepth, false), deep);
  EXPECT_EQ(cursor.treeIndex(x + 2 * w, x, x, T::kMaxDepth, false), TreeIndex{});
  EXPECT_EQ(cursor.treeIndex(x + 2 * w - 1, x, x, T::kMaxDepth, false), TreeIndex{});
  EXPECT_EQ(cursor.treeIndex(x + w, x, x, T::kMaxDepth, true), deep);
  EXPECT_EQ(cursor.treeIndex(x + 3 * w, x, x, T::kMaxDepth, false).depth, d);
  // Growth drops what the grid knew.
  TreeIndex const grown = accessor.addTile(x + 2 * w, x, x, T::kMaxDepth).treeIndex();
  EXPECT_EQ(cursor.treeIndex(x + 2 * w, x, x, T::kMaxDepth, false), grown);
}

// requirement
TYPED_TEST(AccelerationGrid, DeadTilesAreLeftOut) {
  using T = TypeParam;
  int const w = T::width(T::kMaxDepth), x = T::align(0, T::kMaxDepth);
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTile(x, x, x, T::kMaxDepth);
  TreeIndex const gone = accessor.addTile(x + w, x, x, T::kMaxDepth).treeIndex();
  TreeIndex const far = accessor.addTile(T::kMaxTileCoord, x, x, T::kMaxDepth).treeIndex();
  Access::killLeafTile(tree, gone);
  Access::killLeafTile(tree, far);
  tree.buildAccessorAccelerationStructure(T::kMaxDepth);
  ASSERT_EQ(Access::data(tree).m_gridDepth, T::kMaxDepth) << "the far tile no longer counts";
  EXPECT_FALSE(Access::tileIndex(tree, {x + w, x, x}, T::kMaxDepth).valid());
  EXPECT_TRUE(Access::tileIndex(tree, {x, x, x}, T::kMaxDepth).valid());
}

// boundary
TYPED_TEST(AccelerationGrid, TileDistanceIsZeroForAnEmptyTreeAndAtLeastOneElse) {
  using T = TypeParam;
  Container<T> tree;
  EXPECT_EQ(tree.tileSpaceMaxTileDistance(), 0);
  for (int d : {0, 1, T::kMaxDepth}) {
    Container<T> one;
    one.tileAccessor().addTile(0, 0, 0, d);
    EXPECT_EQ(one.tileSpaceMaxTileDistance(), 2) << "a cube's diagonal is 1.73 widths";
  }
}

// requirement
TYPED_TEST(AccelerationGrid, TileDistanceIsTheLongestDiagonalInTiles) {
  using T = TypeParam;
  int const w = T::width(T::kMaxDepth), x = T::align(0, T::kMaxDepth);
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTile(x, x, x, T::kMaxDepth);
  accessor.addTile(x + 9 * w, x + 4 * w, x, T::kMaxDepth);
  EXPECT_EQ(tree.tileSpaceMaxTileDistance(), static_cast<int>(std::ceil(std::sqrt(100.0 + 25 + 1))));
  Container<T> wide;
  auto ends = wide.tileAccessor();
  ends.addTile(T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord, T::kMaxDepth);
  ends.addTile(T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxDepth);
  double const cells = double(T::width(0)) / w;
  EXPECT_EQ(wide.tileSpaceMaxTileDistance(), static_cast<int>(std::ceil(cells * std::sqrt(3.0))));
}
