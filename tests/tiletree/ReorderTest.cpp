// Permutation of tiles, and Morton order.
#include "support/Shapes.h"
#include "support/TreeModel.h"

#include "GeometryVolume/core/Parallel.h"
#include <array>

using namespace Support;
using namespace VLN::TileTree3D;

namespace {

template <class TraitsT> class Reorder : public ::testing::Test {
public:
  using T = TraitsT;
  using Perms = std::vector<std::vector<std::int64_t>>;

  /// Bits of the offsets, i lowest, most significant first: what the order must be sorted by.
  static std::vector<bool> mortonBits(int3 const& p) {
    std::vector<bool> bits;
    for (int b = 31; b >= 0; --b) {
      for (int a = 2; a >= 0; --a)
        bits.push_back((static_cast<std::int64_t>(p[a]) - T::kMinTileCoord) >> b & 1);
    }
    return bits;
  }
  static void expectMorton(Container<T> const& tree) {
    for (int d = 0; d <= T::kMaxDepth; ++d) {
      for (std::int64_t n = 1; n < tree.tileCount(d); ++n)
        ASSERT_LT(mortonBits(tree.tile(n - 1, d).tijk()), mortonBits(tree.tile(n, d).tijk()))
            << d << ' ' << n;
    }
  }
  static Container<T> randomTree(std::uint32_t seed, int tiles) {
    Container<T> tree;
    TilePlaces<T> places(seed);
    auto accessor = tree.tileAccessor();
    for (VoxelCoord const& at : places.some(tiles)) accessor.addTile(at);
    accessor.addTiles(typename Container<T>::TileLists{}); // branch sizes
    return tree;
  }
  static TreeModel<T> modelOf(Container<T> const& tree) {
    TreeModel<T> model;
    typename TreeModel<T>::Set set;
    for (auto t = tree.cbeginTiles(); t != tree.cendTiles(); ++t) set.insert((*t).voxelCoord());
    model.add(set);
    return model;
  }
};
TYPED_TEST_SUITE(Reorder, Shapes, ShapeNames);

TYPED_TEST(Reorder, SortingKeepsTheTreeAndItsCounts) {
  for (int const tiles : {0, 1, 40, 2000}) {
    auto tree = this->randomTree(21, tiles);
    auto const model = this->modelOf(tree);
    std::array<std::int64_t, 29> counts{};
    for (int d = 0; d <= TypeParam::kMaxDepth; ++d) counts[static_cast<std::size_t>(d)] = tree.tileCount(d);
    tree.sortIntoMortonOrder();
    EXPECT_TRUE(tree.checkConsistency(false));
    EXPECT_TRUE(tree.checkBranchSizes(false));
    model.compare(tree, false);
    for (int d = 0; d <= TypeParam::kMaxDepth; ++d)
      EXPECT_EQ(tree.tileCount(d), counts[static_cast<std::size_t>(d)]);
    this->expectMorton(tree);
  }
}

TYPED_TEST(Reorder, SerialAndParallelSortsAgree) {
  // A depth with 500 tiles takes the parallel sort.
  for (int const tiles : {499, 500, 501}) {
    Container<TypeParam> tree;
    auto accessor = tree.tileAccessor();
    std::mt19937 random(5);
    while (tree.tileCount(TypeParam::kMaxDepth) < tiles)
      accessor.addTile(static_cast<int>(random() % 4000) - 2000, static_cast<int>(random() % 4000) - 2000,
                       static_cast<int>(random() % 4000) - 2000, TypeParam::kMaxDepth);
    tree.sortIntoMortonOrder();
    this->expectMorton(tree);
    EXPECT_TRUE(tree.checkConsistency(false)) << tiles;
  }
}

TYPED_TEST(Reorder, PermutationsMapOldToNew) {
  auto tree = this->randomTree(22, 700);
  auto const before = tree;
  typename TestFixture::Perms perms, computed;
  tree.computeMortonPermutations(computed);
  EXPECT_EQ(treeContents(tree), treeContents(before)) << "computing changes nothing";
  tree.sortIntoMortonOrder(&perms);
  EXPECT_EQ(perms, computed);
  for (int d = 0; d <= TypeParam::kMaxDepth; ++d) {
    auto const& perm = perms[static_cast<std::size_t>(d)];
    ASSERT_EQ(static_cast<std::int64_t>(perm.size()), before.tileCount(d));
    for (std::int64_t n = 0; n < before.tileCount(d); ++n)
      EXPECT_EQ(tree.tile(perm[static_cast<std::size_t>(n)], d).voxelCoord(), before.tile(n, d).voxelCoord());
  }
  // Sorted once, sorting finds the identity.
  tree.sortIntoMortonOrder(&perms);
  for (auto const& perm : perms) EXPECT_TRUE(std::is_sorted(perm.begin(), perm.end()));
}

TYPED_TEST(Reorder, AnEmptyPermutationLeavesItsDepth) {
  for (int const moved : {0, 3, TypeParam::kMaxDepth - 1, TypeParam::kMaxDepth}) {
    auto tree = this->randomTree(23, 500);
    auto const before = tree;
    auto const model = this->modelOf(tree);
    typename TestFixture::Perms perms(static_cast<std::size_t>(TypeParam::kDepths));
    for (std::int64_t n = before.tileCount(moved) - 1; n >= 0; --n)
      perms[static_cast<std::size_t>(moved)].push_back(n);
    tree.permute(perms.data());
    model.compare(tree, false);
    EXPECT_TRUE(tree.checkBranchSizes(false));
    for (int d = 0; d <= TypeParam::kMaxDepth; ++d) {
      for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
        std::int64_t const old = d == moved ? tree.tileCount(d) - 1 - n : n;
        EXPECT_EQ(tree.tile(n, d).voxelCoord(), before.tile(old, d).voxelCoord());
      }
    }
  }
}

TYPED_TEST(Reorder, DeadTilesWithOldLinksAreMovedAlong) {
  // The dead tile's parent has left the array of its depth by the time of the permutation.
  Container<TypeParam> tree;
  auto accessor = tree.tileAccessor();
  using M = TreeModel<TypeParam>;
  int const d = 4;
  int const w = TypeParam::width(d);
  VoxelCoord const origin = M::holder({0, 0, 0}, d);
  for (int n = 0; n < 4; ++n) {
    accessor.addTile(origin.i + n * w, origin.j, origin.k, d);
    accessor.addTile(origin.i + n * w, origin.j, origin.k, d + 1);
  }
  tree.setCompactOnRemoval(false);
  accessor.removeTile({3, d + 1}, true);
  tree.setCompactOnRemoval(true);
  accessor.removeTiles({1, 2}, d, false); // their children become roots
  accessor.removeTile({1, d}, false);
  ASSERT_EQ(tree.tileCount(d), 1);
  ASSERT_EQ(tree.tileCount(d + 1), 4);
  tree.sortIntoMortonOrder();
  tree.compact();
  EXPECT_TRUE(tree.checkConsistency(false));
  EXPECT_EQ(tree.tileCount(-1), 4);
}

TYPED_TEST(Reorder, CachesAreDropped) {
  auto tree = this->randomTree(24, 50);
  tree.precomputeTileNeighbors();
  tree.buildAccessorAccelerationStructure(TypeParam::kMaxDepth);
  tree.sortIntoMortonOrder();
  EXPECT_EQ(tree.neighborData(), nullptr);
  for (auto t = tree.cbeginTiles(); t != tree.cendTiles(); ++t)
    EXPECT_EQ(tree.tileAccessor().tile((*t).voxelCoord(), true).treeIndex(), (*t).treeIndex());
}

TYPED_TEST(Reorder, BytesAreEqualAtAnyNumberOfThreads) {
  auto const source = this->randomTree(25, 4000);
  std::vector<std::int64_t> first;
  for (int const threads : {1, 2, 8}) {
    Container<TypeParam> tree = source;
    VLN::withThreads(threads, [&] { tree.sortIntoMortonOrder(); });
    if (first.empty()) first = treeContents(tree);
    EXPECT_EQ(treeContents(tree), first) << threads;
  }
  EXPECT_NE(first, treeContents(source));
}

} // namespace
