// Accessors: lookups, additions, and what the cursor changes of neither.
#include "support/Print.h"
#include "support/RandomForest.h"
#include "support/Shapes.h"
#include "support/TreeModel.h"

#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/TileHalo.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <limits>
#include <random>
#include <utility>
#include <vector>

using namespace VLN::TileTree3D;
using Support::Access;

VLN_SHAPE_SUITE(Accessor);

namespace {

template <class T> struct OpenAccessor : Container<T>::ConstTileAccessor {
  using Base = typename Container<T>::ConstTileAccessor;
  explicit OpenAccessor(Base const& accessor)
      : Base(accessor) {}
  using Base::tiles;
};

} // namespace

// boundary
TYPED_TEST(Accessor, FreshOneOnAnEmptyContainerFindsTheInvalidTile) {
  using T = TypeParam;
  Container<T> tree;
  auto const reader = std::as_const(tree).tileAccessor();
  for (bool exact : {true, false}) {
    for (int d : {0, 5, T::kMaxDepth}) {
      EXPECT_EQ(&reader.tile(0, 0, 0, d, exact), &tree.invalidTile());
      EXPECT_EQ(&reader.tile(T::kMinTileCoord, T::kMaxTileCoord, 0, d, exact), &tree.invalidTile());
    }
  }
  EXPECT_EQ(&reader.current(), &tree.invalidTile());
  EXPECT_FALSE(reader.treeIndex(0, 0, 0, 3, false).valid());
}

// boundary
TYPED_TEST(Accessor, DefaultOneHasNoContainerAndFindsNothing) {
  using T = TypeParam;
  typename Container<T>::ConstTileAccessor const reader;
  EXPECT_EQ(reader.container(), nullptr);
  EXPECT_FALSE(reader.tile(0, 0, 0, 3, true).valid());
  EXPECT_FALSE(reader.tile(0, 0, 0, 3, false).valid());
  EXPECT_FALSE(reader.tile(0, 0, 0, -1, false).valid());
  EXPECT_FALSE(reader.current().valid());
  typename Container<T>::TileAccessor const writer;
  EXPECT_EQ(writer.container(), nullptr);
}

// boundary
TYPED_TEST(Accessor, ExactDeeperThanTheDeepestTileIsInvalid) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  TreeIndex const at = accessor.addTile(0, 0, 0, 4).treeIndex();
  for (int d = 5; d <= T::kMaxDepth; ++d) {
    auto const fresh = tree.tileAccessor();
    EXPECT_FALSE(fresh.tile(0, 0, 0, d, true).valid()) << d;
    EXPECT_FALSE(accessor.tile(0, 0, 0, d, true).valid()) << d;
    EXPECT_EQ(fresh.tile(0, 0, 0, d, false).treeIndex(), at) << d;
    EXPECT_EQ(accessor.tile(0, 0, 0, d, false).treeIndex(), at) << d;
  }
  EXPECT_EQ(accessor.tile(0, 0, 0, 4, true).treeIndex(), at);
  for (int d = 0; d < 4; ++d) EXPECT_FALSE(accessor.tile(0, 0, 0, d, false).valid()) << d;
}

// boundary: a depth of -1 or -2 is what an unset cursor could be mistaken for
TYPED_TEST(Accessor, DepthsThatDoNotExistFindNothingExactly) {
  using T = TypeParam;
  Container<T> tree;
  for (bool withTile : {false, true}) {
    auto accessor = tree.tileAccessor();
    if (withTile) accessor.addTile(0, 0, 0, T::kMaxDepth);
    for (int d : {std::numeric_limits<int>::min(), -3, -2, -1}) {
      EXPECT_FALSE(accessor.tile(0, 0, 0, d, true).valid()) << d;
      EXPECT_FALSE(accessor.tile(0, 0, 0, d, false).valid()) << d;
    }
    for (int d : {T::kMaxDepth + 1, T::kMaxDepth + 3, std::numeric_limits<int>::max()}) {
      EXPECT_FALSE(accessor.tile(0, 0, 0, d, true).valid()) << d;
      EXPECT_EQ(accessor.tile(0, 0, 0, d, false).valid(), withTile) << d;
    }
  }
}

// requirement
TYPED_TEST(Accessor, IndexFormsDoNotMoveTheCursor) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  TreeIndex const a = accessor.addTile(0, 0, 0, 3).treeIndex();
  TreeIndex const b = accessor.addTile(0, 0, 0, 5).treeIndex();
  accessor.tile(0, 0, 0, 3, true);
  EXPECT_EQ(accessor.current().treeIndex(), a);
  EXPECT_EQ(accessor.tile(b).treeIndex(), b);
  EXPECT_EQ(accessor.tile(b.index, b.depth).treeIndex(), b);
  EXPECT_EQ(accessor.tile(tree.tileIndex(b)).treeIndex(), b);
  EXPECT_EQ(accessor.current().treeIndex(), a);
  accessor.tile(0, 0, 0, 5, true);
  EXPECT_EQ(accessor.current().treeIndex(), b);
}

// requirement
TYPED_TEST(Accessor, CopiesHaveTheSameCursorAndCompareByContainer) {
  using T = TypeParam;
  Container<T> tree, other;
  auto accessor = tree.tileAccessor();
  accessor.addTile(0, 0, 0, 3);
  auto const copy = accessor;
  EXPECT_EQ(copy.current().treeIndex(), accessor.current().treeIndex());
  EXPECT_TRUE(copy == accessor);
  EXPECT_TRUE(tree.tileAccessor() == accessor) << "the cursor does not count";
  EXPECT_FALSE(other.tileAccessor() == accessor);
  EXPECT_EQ(accessor.container(), &tree);
  typename Container<T>::ConstTileAccessor reader;
  reader = std::as_const(tree).tileAccessor();
  EXPECT_EQ(reader.container(), &tree);
}

// requirement
TYPED_TEST(Accessor, AddTileFormsAgree) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  TreeIndex const at = accessor.addTile(7, -8, 9, 6).treeIndex();
  EXPECT_EQ(accessor.addTile(int3{7, -8, 9}, 6).treeIndex(), at);
  EXPECT_EQ(accessor.addTile(VoxelCoord{7, -8, 9, 6}).treeIndex(), at);
  EXPECT_EQ(tree.tileCount(-1), 1);
  EXPECT_EQ(accessor.current().treeIndex(), at);
  EXPECT_TRUE(tree.tile(at).contains(7, -8, 9));
}

// requirement: from the cursor up to a common ancestor and down again
TYPED_TEST(Accessor, AddTileWalksThroughTheTreeItStandsIn) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTile(0, 0, 0, 2);
  TreeIndex const deep = accessor.addTile(0, 0, 0, T::kMaxDepth).treeIndex();
  EXPECT_EQ(tree.tileCount(-1), T::kMaxDepth - 1);
  int3 const beside = tree.tile(deep).tijk() + int3{T::width(T::kMaxDepth), 0, 0};
  TreeIndex const next = accessor.addTile(beside, T::kMaxDepth).treeIndex();
  EXPECT_EQ(tree.tile(next).tijk(), beside);
  EXPECT_EQ(tree.rootCount(), 1);
  EXPECT_EQ(accessor.addTile(0, 0, 0, 5).depth(), 5);
  EXPECT_TRUE(tree.checkConsistency(false));
}

// requirement: the answer of an added tile is current after the arrays moved
TYPED_TEST(Accessor, AddedTileIsReadAfterGrowth) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  for (int n = 0; n < 300; ++n) {
    int3 const p{n * T::width(10), 0, -n * T::width(10)};
    auto const& t = accessor.addTile(p, 10);
    ASSERT_TRUE(t.valid());
    ASSERT_TRUE(t.contains(p));
    ASSERT_EQ(t.depth(), 10);
    ASSERT_EQ(&t, &tree.tile(t.treeIndex()));
  }
  EXPECT_TRUE(tree.checkConsistency(false));
}

// boundary
TYPED_TEST(Accessor, BoxAcrossTheCentreNeedsTheWholeDomain) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  auto const& t = accessor.addTile(int3{-1, -1, -1}, int3{0, 0, 0});
  EXPECT_TRUE(t.valid());
  if (T::kTW == 2) {
    EXPECT_EQ(t.depth(), 0);
  } else {
    // The odd shape has a middle tile at each depth, down to the deepest one.
    EXPECT_EQ(t.depth(), T::kMaxDepth);
  }
  EXPECT_TRUE(t.contains(-1, -1, -1));
  EXPECT_TRUE(t.contains(0, 0, 0));
}

// requirement
TYPED_TEST(Accessor, AddTileOfABoxFindsTheSmallestThatHoldsIt) {
  using T = TypeParam;
  using Model = Support::ForestModel<T>;
  std::uint32_t const seed = 77;
  Support::RandomForest<T> random(seed);
  for (int n = 0; n < 300; ++n) {
    int3 const p = random.point(), q = random.near(p, random.pick(0, T::kMaxDepth));
    int depth = 0;
    for (int d = 1; d <= T::kMaxDepth && Model::holds(Model::place(p, d), q); ++d) depth = d;
    Container<T> tree;
    auto accessor = tree.tileAccessor();
    auto const& t = accessor.addTile(p, q);
    ASSERT_EQ(t.voxelCoord(), Model::place(p, depth)) << p << q << " seed " << seed;
    ASSERT_EQ(tree.tileCount(-1), 1);
    ASSERT_EQ(accessor.addTile(q, p).treeIndex(), t.treeIndex());
  }
}

// boundary
TYPED_TEST(Accessor, AddTileOfABoxOutsideGivesTheInvalidTile) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  for (int extreme : {std::numeric_limits<int>::min(), T::kMinTileCoord - 1, T::kMaxTileCoord + 1,
                      std::numeric_limits<int>::max()}) {
    EXPECT_EQ(&accessor.addTile(int3{0, extreme, 0}, int3{0, 0, 0}), &tree.invalidTile());
    EXPECT_EQ(&accessor.addTile(int3{0, 0, 0}, int3{0, 0, extreme}), &tree.invalidTile());
  }
  EXPECT_EQ(tree.tileCount(-1), 0);
}

// requirement: lists are taken in parts, by several threads; neither they nor the order of the list show
TYPED_TEST(Accessor, RequirementManyTilesInAnyOrderMakeOneTree) {
  using T = TypeParam;
  Support::TilePlaces<T> places(31);
  typename Container<T>::TileLists ordered;
  for (VoxelCoord const& at : places.some(30000))
    ordered[static_cast<std::size_t>(at.depth)].append(at.ijk());
  auto shuffled = ordered;
  for (auto& list : shuffled) {
    auto const twice = list;
    for (int3 const& p : twice) list.append(p);
    std::shuffle(list.begin(), list.end(), places.random());
  }
  Container<T> first;
  VLN::withThreads(1, [&] { first.tileAccessor().addTiles(ordered); });
  EXPECT_TRUE(first.checkConsistency(false));
  for (int const threads : {1, 2, 8}) {
    for (auto const* lists : {&ordered, &shuffled}) {
      Container<T> tree;
      VLN::withThreads(threads, [&] { tree.tileAccessor().addTiles(*lists); });
      EXPECT_EQ(Support::treeContents(tree), Support::treeContents(first)) << threads;
    }
  }
}

// requirement: what is there already, and roots that come to lie below new tiles, are found by all threads
TYPED_TEST(Accessor, ManyTilesAtOnceOnATreeMakeThoseOfSingleAdditions) {
  using T = TypeParam;
  for (unsigned const seed : {1u, 2u, 3u}) {
    Support::TilePlaces<T> places(seed);
    Container<T> start;
    for (VoxelCoord const& at : places.some(400)) start.tileAccessor().addTile(at);
    auto wanted = places.some(4000);
    typename Container<T>::TileLists lists;
    for (VoxelCoord const& at : wanted) lists[at.depth].append(at.ijk());
    Container<T> single = start;
    std::stable_sort(wanted.begin(), wanted.end(),
                     [](auto const& a, auto const& b) { return a.depth < b.depth; });
    for (VoxelCoord const& at : wanted) single.tileAccessor().addTile(at);
    std::vector<std::int64_t> first;
    for (int const threads : {1, 2, 8}) {
      Container<T> tree = start;
      typename Container<T>::TileLists made;
      VLN::withThreads(threads, [&] { tree.tileAccessor().addTiles(lists, &made); });
      EXPECT_TRUE(tree.checkConsistency(true)) << seed;
      EXPECT_TRUE(tree.checkBranchSizes(true)) << seed;
      auto const reader = std::as_const(tree).tileAccessor();
      for (int d = 0; d <= T::kMaxDepth; ++d) {
        ASSERT_EQ(tree.tileCount(d), single.tileCount(d)) << seed << " depth " << d;
        ASSERT_EQ(static_cast<std::int64_t>(made[d].size()), tree.tileCount(d) - start.tileCount(d));
        for (std::int64_t n = 0; n < single.tileCount(d); ++n)
          ASSERT_TRUE(reader.tile(single.tile(n, d).voxelCoord(), true).valid()) << seed << " depth " << d;
      }
      auto const contents = Support::treeContents(tree);
      if (first.empty()) first = contents;
      EXPECT_EQ(contents, first) << seed << ", threads " << threads;
    }
  }
}

// requirement: where the cursor stands, and where it was, only shortens the way
TYPED_TEST(Accessor, AdditionsThroughOneCursorAreThoseOfFreshOnes) {
  using T = TypeParam;
  constexpr int kDeep = T::kMaxDepth;
  for (unsigned const seed : {1u, 2u, 3u, 4u}) {
    std::mt19937 random(seed);
    auto const pick = [&](int low, int high) {
      return std::uniform_int_distribution<int>(low, high)(random);
    };
    Container<T> tree, fresh;
    auto accessor = tree.tileAccessor();
    int const wide = T::width(kDeep - 5);
    int3 place{0, 0, 0};
    for (int n = 0; n < 3000; ++n) {
      // Mostly close to the place before, so that paths are shared; at times in another tree.
      int const reach = pick(0, 9) == 0 ? 3 * wide : T::width(kDeep - pick(0, 4));
      for (int a = 0; a < 3; ++a) place[a] = std::clamp(place[a] + pick(-reach, reach), -4 * wide, 4 * wide);
      int const what = pick(0, 99), depth = kDeep - (what < 60 ? 0 : pick(0, 5));
      if (what == 99) {
        TreeIndex const at = fresh.tileAccessor().treeIndex(place.x, place.y, place.z, depth, false);
        if (!at.valid()) continue;
        accessor.removeTile(at, true);
        fresh.tileAccessor().removeTile(at, true);
      } else if (what >= 90) {
        EXPECT_EQ(accessor.tile(place, depth, true).treeIndex(),
                  fresh.tileAccessor().tile(place, depth, true).treeIndex());
      } else {
        TreeIndex const added = accessor.addTile(place, depth).treeIndex();
        ASSERT_EQ(added, fresh.tileAccessor().addTile(place, depth).treeIndex())
            << "seed " << seed << ", " << n;
        ASSERT_EQ(accessor.current().treeIndex(), added);
        ASSERT_TRUE(tree.tile(added).contains(place));
      }
    }
    EXPECT_EQ(Support::treeContents(tree), Support::treeContents(fresh)) << seed;
    EXPECT_TRUE(tree.checkConsistency(true)) << seed;
  }
}

// boundary
TYPED_TEST(Accessor, AddTilesOfAnEmptyBoxAddsNothing) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  for (int c : {0, 1, 3, -7, T::kMinTileCoord, T::kMaxTileCoord}) {
    int3 const p{c, c, c};
    for (int d : {0, 5, T::kMaxDepth}) accessor.addTiles(p, p, d);
  }
  accessor.addTiles({0, 0, 0}, {-100, 10, 10}, T::kMaxDepth);
  EXPECT_EQ(tree.tileCount(-1), 0);
}

// requirement: the start is aligned, the end is exclusive
TYPED_TEST(Accessor, AddTilesCoversTheBox) {
  using T = TypeParam;
  int const w = T::width(T::kMaxDepth), base = T::align(1000, T::kMaxDepth);
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTiles({base + 1, base, base}, {base + 2 * w, base + 1, base + w}, T::kMaxDepth);
  EXPECT_EQ(tree.tileCount(T::kMaxDepth), 2);
  accessor.addTiles({base + 1, base, base}, {base + 2 * w + 1, base + 1, base + w + 1}, T::kMaxDepth);
  EXPECT_EQ(tree.tileCount(T::kMaxDepth), 6);
  EXPECT_EQ(accessor.current().tijk(), (int3{base + 2 * w, base, base + w})) << "k is innermost, i outermost";
  EXPECT_TRUE(tree.checkConsistency(false));
}

// boundary: parts of the box out of the domain are left out
TYPED_TEST(Accessor, AddTilesStaysInsideTheDomain) {
  using T = TypeParam;
  int const lowest = std::numeric_limits<int>::min(), highest = std::numeric_limits<int>::max();
  int const w = T::width(T::kMaxDepth);
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTiles({lowest, lowest, lowest},
                    {T::kMinTileCoord + 1, T::kMinTileCoord + w, T::kMinTileCoord + w + 1}, T::kMaxDepth);
  EXPECT_EQ(tree.tileCount(-1), 2);
  accessor.addTiles({T::kMaxTileCoord - w, T::kMaxTileCoord, T::kMaxTileCoord}, {highest, highest, highest},
                    T::kMaxDepth);
  EXPECT_EQ(tree.tileCount(-1), 4);
  accessor.addTiles({T::kMaxTileCoord + 1, 0, 0}, {highest, 10, 10}, T::kMaxDepth);
  accessor.addTiles({lowest, 0, 0}, {T::kMinTileCoord, 10, 10}, T::kMaxDepth);
  accessor.addTiles({highest, highest, highest}, {highest, highest, highest}, 0);
  EXPECT_EQ(tree.tileCount(-1), 4);
  Container<T> whole;
  auto all = whole.tileAccessor();
  all.addTiles({lowest, lowest, lowest}, {highest, highest, highest}, 0);
  EXPECT_EQ(whole.tileCount(-1), 1);
  all.addTiles({lowest, lowest, lowest}, {highest, highest, highest}, 1);
  EXPECT_EQ(whole.tileCount(1), T::kTileSize);
  for (int d : {-1, T::kMaxDepth + 1, lowest, highest}) all.addTiles({0, 0, 0}, {9, 9, 9}, d);
  EXPECT_EQ(whole.tileCount(-1), T::kTileSize + 1);
}

// requirement
TYPED_TEST(Accessor, AdditionDropsEachDerivedCache) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTiles({0, 0, 0}, {20, 20, 20}, T::kMaxDepth);
  int next = 30;
  auto const build = [&] {
    tree.precomputeTileNeighbors();
    tree.precomputeTileHalos();
    tree.precomputeCompressedTileHalos();
    tree.buildAccessorAccelerationStructure(T::kMaxDepth);
    EXPECT_NE(tree.neighborData(), nullptr);
    EXPECT_NE(tree.tileHalo({0, T::kMaxDepth}), nullptr);
    EXPECT_FALSE(tree.tileHaloVisitor({0, T::kMaxDepth}).count() == 0);
    EXPECT_GE(Access::data(tree).m_gridDepth, 0);
  };
  auto const expectDropped = [&] {
    EXPECT_EQ(tree.neighborData(), nullptr);
    EXPECT_EQ(tree.tileHalo({0, T::kMaxDepth}), nullptr);
    EXPECT_TRUE(tree.tileHaloVisitor({0, T::kMaxDepth}).end());
    EXPECT_EQ(Access::data(tree).m_gridDepth, -1);
    EXPECT_EQ(Access::data(tree).m_gridSize, (std::array<std::int32_t, 3>{0, 0, 0}));
    EXPECT_TRUE(Access::data(tree).m_gridTable.empty());
  };
  build();
  accessor.addTile(5, 5, 5, T::kMaxDepth);
  EXPECT_NE(tree.neighborData(), nullptr) << "an existing tile changes nothing";
  accessor.addTile(next += 10, 0, 0, T::kMaxDepth);
  expectDropped();
  build();
  Access::addTile(tree, {next += 10, 0, 0}, T::kMaxDepth);
  expectDropped();
  build();
  accessor.addTiles({next + 10, 0, 0}, {next + 11, 1, 1}, T::kMaxDepth);
  expectDropped();
  build();
  Access::tilesAdded(tree);
  expectDropped();
  build();
  Access::tilesRemoved(tree, nullptr);
  expectDropped();
}

// requirement: the live tiles of a range of depths, appended
TYPED_TEST(Accessor, ListsTheTilesOfADepthRange) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTile(0, 0, 0, 2);
  accessor.addTile(0, 0, 0, 4);
  TreeIndex const other = accessor.addTile(T::kMaxTileCoord, 0, 0, 4).treeIndex();
  accessor.addTile(T::kMaxTileCoord, 0, 0, 6);
  TreeIndex const far = accessor.addTile(T::kMinTileCoord, 0, 0, 4).treeIndex();
  Access::killLeafTile(tree, far);
  OpenAccessor<T> const open(std::as_const(tree).tileAccessor());
  std::vector<TreeIndex> list{{9, 9}};
  open.tiles(list, 3, 4);
  EXPECT_EQ(list, (std::vector<TreeIndex>{{9, 9}, {0, 3}, {0, 4}, other}));
  list.clear();
  open.tiles(list, std::numeric_limits<int>::min(), std::numeric_limits<int>::max());
  EXPECT_EQ(static_cast<std::int64_t>(list.size()), tree.tileCount(-1) - 1);
  list.clear();
  open.tiles(list, 4, 3);
  EXPECT_TRUE(list.empty());
}
