// Neighbours of tiles, by search and by table, and the collections of all tiles around a tile.
#include "support/Print.h"
#include "support/RandomForest.h"
#include "support/Shapes.h"

#include <gtest/gtest.h>

#include <limits>
#include <set>
#include <utility>
#include <vector>

using namespace VLN::TileTree3D;
using Support::Access;

VLN_SHAPE_SUITE(Neighbors);

namespace {

template <class T> using Model = Support::ForestModel<T>;

template <class TileT> VoxelCoord coordOf(TileT const& t) {
  return t.valid() ? t.voxelCoord() : VoxelCoord{};
}

template <class T>
std::set<VoxelCoord> coordsOf(Container<T> const& tree, std::vector<TreeIndex> const& list) {
  std::set<VoxelCoord> set;
  for (TreeIndex const& at : list)
    EXPECT_TRUE(set.insert(tree.tile(at).voxelCoord()).second) << "twice " << at;
  return set;
}

/// By geometry: the tiles found beside `t` at its depth, and below each those that touch the face, edge or
/// corner towards `t`.
template <class T> std::set<VoxelCoord> aroundTile(Model<T> const& model, VoxelCoord const& t, int depth) {
  std::set<VoxelCoord> set;
  for (int n = 0; n < kNeighborCount; ++n) {
    int3 const o = neighborOffset(n);
    auto const found = model.beside(t, o);
    if (!found) continue;
    set.insert(*found);
    if (found->depth < t.depth) continue;
    for (VoxelCoord const& x : model.tiles()) {
      if (x.depth <= found->depth || x.depth > depth || !model.holds(*found, x.ijk())) continue;
      bool touches = true;
      std::int64_t const w = model.width(found->depth), v = model.width(x.depth);
      for (int a = 0; a < 3; ++a) {
        std::int64_t const low = found->ijk()[a], own = x.ijk()[a];
        if (o[a] > 0) touches &= own == low;
        if (o[a] < 0) touches &= own + v == low + w;
      }
      if (touches) set.insert(x);
    }
  }
  return set;
}

/// The tiles around each leaf voxel, looked up one level deeper, and the tile itself.
template <class T> std::set<VoxelCoord> aroundLeaves(Model<T> const& model, VoxelCoord const& t) {
  if (t.depth == T::kMaxDepth) return aroundTile<T>(model, t, t.depth);
  std::set<VoxelCoord> set;
  std::int64_t const v = model.width(t.depth + 1);
  for (int i = 0; i < T::kTW; ++i) {
    for (int j = 0; j < T::kTW; ++j) {
      for (int k = 0; k < T::kTW; ++k) {
        VoxelCoord const voxel{static_cast<int>(t.i + v * i), static_cast<int>(t.j + v * j),
                               static_cast<int>(t.k + v * k), t.depth + 1};
        if (model.has(voxel)) continue;
        set.insert(t);
        for (int n = 0; n < kNeighborCount; ++n) {
          if (n == kNeighborSelf) continue;
          if (auto const found = model.beside(voxel, neighborOffset(n))) set.insert(*found);
        }
      }
    }
  }
  return set;
}

} // namespace

// boundary
TYPED_TEST(Neighbors, DirectionThirteenIsTheTileItself) {
  using T = TypeParam;
  Support::RandomForest<T> forest(3);
  for (int n = 0; n < 12; ++n) forest.grow();
  auto const& tree = std::as_const(forest.tree());
  for (bool table : {false, true}) {
    if (table) forest.tree().precomputeTileNeighbors();
    auto const accessor = tree.tileAccessor();
    for (std::int64_t n = 0; n < tree.tileCount(-1); ++n) {
      ASSERT_EQ(&accessor.tileNeighbor(tree.tile(n), kNeighborSelf), &tree.tile(n)) << table;
      ASSERT_EQ(accessor.treeIndexNeighbor(tree.tile(n), kNeighborSelf), tree.tile(n).treeIndex());
    }
  }
}

// boundary
TYPED_TEST(Neighbors, TableIsGoneAfterAdditionAndSearchStillAnswers) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  int const w = T::width(6), x = T::align(0, 6);
  TreeIndex const a = accessor.addTile(x, x, x, 6).treeIndex();
  TreeIndex const b = accessor.addTile(x + w, x, x, 6).treeIndex();
  tree.precomputeTileNeighbors();
  auto const right = neighborDirection(1, 0, 0), up = neighborDirection(0, 0, 1);
  EXPECT_EQ(accessor.treeIndexNeighbor(tree.tile(a), right), b);
  EXPECT_FALSE(accessor.tileNeighbor(tree.tile(a), up).valid());
  TreeIndex const c = accessor.addTile(x, x, x + w, 6).treeIndex();
  EXPECT_EQ(tree.neighborData(), nullptr);
  EXPECT_EQ(accessor.treeIndexNeighbor(tree.tile(a), right), b);
  EXPECT_EQ(accessor.treeIndexNeighbor(tree.tile(a), up), c);
}

// requirement: steps of any depth, also from a tile of another depth
TYPED_TEST(Neighbors, StepsCountInWidthsOfTheAskedDepth) {
  using T = TypeParam;
  std::uint32_t const seed = 9;
  Support::RandomForest<T> forest(seed);
  for (int n = 0; n < 20; ++n) forest.grow();
  auto const& tree = std::as_const(forest.tree());
  auto const accessor = tree.tileAccessor();
  for (int n = 0; n < 3000; ++n) {
    auto const& t =
        tree.tile(static_cast<std::int64_t>(forest.pick(0, static_cast<int>(tree.tileCount(-1)) - 1)));
    int const d = forest.pick(0, T::kMaxDepth);
    int3 const step{forest.pick(-3, 3), forest.pick(-3, 3), forest.pick(-3, 3)};
    bool const exact = n % 2;
    std::int64_t const w = T::width(d);
    std::int64_t const p[3] = {t.ti() + w * step.x, t.tj() + w * step.y, t.tk() + w * step.z};
    VoxelCoord expected;
    if (Model<T>::inDomain(p[0]) && Model<T>::inDomain(p[1]) && Model<T>::inDomain(p[2])) {
      auto const found =
          forest.model().find({static_cast<int>(p[0]), static_cast<int>(p[1]), static_cast<int>(p[2])}, d);
      if (found && (!exact || found->depth == d)) expected = *found;
    }
    ASSERT_EQ(coordOf(accessor.tileNeighbor(t, step, d, exact)), expected)
        << t.voxelCoord() << " step " << step << " depth " << d << " seed " << seed;
  }
}

// boundary
TYPED_TEST(Neighbors, StepsOutOfTheDomainFindTheInvalidTile) {
  using T = TypeParam;
  int const lowest = std::numeric_limits<int>::min(), highest = std::numeric_limits<int>::max();
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTile(0, 0, 0, 0);
  TreeIndex const low = accessor.addTile(T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord, 5).treeIndex();
  TreeIndex const high =
      accessor.addTile(T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxTileCoord, 5).treeIndex();
  for (bool table : {false, true}) {
    if (table) tree.precomputeTileNeighbors();
    for (int n = 0; n < kNeighborCount; ++n) {
      int3 const o = neighborOffset(n);
      bool const below = o.x < 0 || o.y < 0 || o.z<0, above = o.x> 0 || o.y > 0 || o.z > 0;
      EXPECT_EQ(accessor.tileNeighbor(tree.tile(low), static_cast<NeighborDirection>(n)).valid(), !below)
          << n;
      EXPECT_EQ(accessor.tileNeighbor(tree.tile(high), static_cast<NeighborDirection>(n)).valid(), !above)
          << n;
    }
    for (int far : {lowest, highest}) {
      for (int d : {0, 5, T::kMaxDepth}) {
        EXPECT_FALSE(accessor.tileNeighbor(tree.tile(low), far, far, far, d, false).valid());
        EXPECT_FALSE(accessor.tileNeighbor(tree.tile(high), int3{far, 0, 0}, d, true).valid());
      }
    }
  }
}

// negative: lookups that failed may be passed on
TYPED_TEST(Neighbors, InvalidTileHasNoNeighbors) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTile(0, 0, 0, 3);
  for (bool table : {false, true}) {
    if (table) tree.precomputeTileNeighbors();
    EXPECT_FALSE(accessor.tileNeighbor(tree.invalidTile(), neighborDirection(1, 0, 0)).valid()) << table;
    EXPECT_FALSE(accessor.treeIndexNeighbor(tree.invalidTile(), kNeighborSelf).valid()) << table;
    std::vector<TreeIndex> list;
    accessor.tileNeighbors(tree.invalidTile(), list, 3, false);
    accessor.tileNeighbors(tree.invalidTile(), list, 3, true);
    EXPECT_TRUE(list.empty()) << table;
  }
}

// requirement
TYPED_TEST(Neighbors, CollectionsAgreeWithTheModel) {
  using T = TypeParam;
  for (std::uint32_t seed = 1; seed <= 12; ++seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    Support::RandomForest<T> forest(500 + seed);
    for (int n = 0; n < 14; ++n) forest.grow();
    if (seed % 3 == 0) forest.tree().precomputeTileNeighbors();
    auto const& tree = std::as_const(forest.tree());
    auto const accessor = tree.tileAccessor();
    if (tree.empty()) continue;
    for (int n = 0; n < 25; ++n) {
      auto const& t =
          tree.tile(static_cast<std::int64_t>(forest.pick(0, static_cast<int>(tree.tileCount(-1)) - 1)));
      int const d = std::min(T::kMaxDepth, t.depth() + forest.pick(-1, 3));
      std::vector<TreeIndex> list;
      accessor.tileNeighbors(t, list, d, false);
      ASSERT_EQ(coordsOf(tree, list), aroundTile<T>(forest.model(), t.voxelCoord(), std::max(d, t.depth())))
          << t.voxelCoord() << " to depth " << d;
      list.clear();
      accessor.tileNeighbors(t, list, d, true);
      ASSERT_EQ(coordsOf(tree, list), aroundLeaves<T>(forest.model(), t.voxelCoord())) << t.voxelCoord();
    }
  }
}

// requirement: the tile comes last, after what surrounds its leaf voxels, and lists are appended to
TYPED_TEST(Neighbors, RecursiveCollectionEndsWithTheTile) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  int const w = T::width(4), x = T::align(0, 4);
  TreeIndex const a = accessor.addTile(x, x, x, 4).treeIndex();
  TreeIndex const b = accessor.addTile(x + w, x, x, 4).treeIndex();
  std::vector<TreeIndex> list{{77, 3}};
  accessor.tileNeighbors(tree.tile(a), list, 4, true);
  // The voxels of the tile around a voxel find the tile itself first.
  EXPECT_EQ(list.front(), (TreeIndex{77, 3}));
  EXPECT_EQ((std::set<TreeIndex>{list.begin() + 1, list.end()}), (std::set<TreeIndex>{a, b}));
  for (int slot = 0; slot < T::kTileSize; ++slot) {
    int3 const child = tree.tile(a).childTIJK(tree.tile(a).childIJK(slot));
    accessor.addTile(child, 5);
  }
  list.clear();
  accessor.tileNeighbors(tree.tile(a), list, 4, true);
  EXPECT_TRUE(list.empty()) << "no voxel is a leaf";
}

// requirement: 27 offsets with k fastest
TYPED_TEST(Neighbors, CollectionAtTheDeepestDepthFollowsTheDirections) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  int const w = T::width(T::kMaxDepth), x = T::align(100, T::kMaxDepth);
  accessor.addTiles({x - w, x - w, x - w}, {x + 2 * w, x + 2 * w, x + 2 * w}, T::kMaxDepth);
  auto const& centre = accessor.tile(x, x, x, T::kMaxDepth, true);
  for (bool recursive : {false, true}) {
    std::vector<TreeIndex> list;
    accessor.tileNeighbors(centre, list, T::kMaxDepth, recursive);
    ASSERT_EQ(list.size(), 27u);
    for (int n = 0; n < kNeighborCount; ++n)
      EXPECT_EQ(tree.tile(list[static_cast<std::size_t>(n)]).tijk(), centre.tijk() + w * neighborOffset(n))
          << n;
  }
}

// requirement: dead tiles have no records worth reading, live ones never point at them
TYPED_TEST(Neighbors, TableSkipsDeadTiles) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  int const w = T::width(6), x = T::align(0, 6);
  TreeIndex const a = accessor.addTile(x, x, x, 6).treeIndex();
  TreeIndex const b = accessor.addTile(x + w, x, x, 6).treeIndex();
  Access::killLeafTile(tree, b);
  tree.precomputeTileNeighbors();
  tree.precomputeTileHalos();
  tree.precomputeCompressedTileHalos();
  EXPECT_FALSE(tree.tileAccessor().tileNeighbor(tree.tile(a), neighborDirection(1, 0, 0)).valid());
}
