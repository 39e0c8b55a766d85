// Iterators over all tiles and over all voxels.
#include "support/Print.h"
#include "support/RandomForest.h"
#include "support/Shapes.h"

#include <gtest/gtest.h>

#include <type_traits>
#include <utility>
#include <vector>

using namespace VLN::TileTree3D;
using Support::Access;

VLN_SHAPE_SUITE(Iterators);

namespace {

/// Depths 2, 3, 5 and the deepest, with gaps between.
template <class T> Container<T> sample() {
  Container<T> tree;
  Access::addTile(tree, {0, 0, 0}, 2);
  Access::addTile(tree, {0, 0, 0}, 3);
  for (int n = 0; n < 3; ++n)
    Access::addTile(tree, {T::kMaxTileCoord, T::kMaxTileCoord - n * T::width(5), 0}, 5);
  Access::addTile(tree, {T::kMinTileCoord, 0, 0}, T::kMaxDepth);
  return tree;
}

template <class T> std::vector<TreeIndex> allTiles(Container<T> const& tree) {
  std::vector<TreeIndex> list;
  for (int d = 0; d <= T::kMaxDepth; ++d) {
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) list.push_back({n, d});
  }
  return list;
}

} // namespace

// requirement
TYPED_TEST(Iterators, VisitEachDepthInIndexOrder) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  auto const expected = allTiles(tree);
  std::vector<TreeIndex> found;
  for (auto t = tree.cbeginTiles(); t != tree.cendTiles(); ++t) {
    EXPECT_TRUE(t.valid());
    EXPECT_EQ(t.treeIndex(), t->treeIndex());
    EXPECT_EQ(t.depth(), (*t).depth());
    EXPECT_EQ(t.tileIndex(), t->index());
    found.push_back(t.treeIndex());
  }
  EXPECT_EQ(found, expected);
  found.clear();
  for (auto t = std::as_const(tree).beginTiles(); t != std::as_const(tree).endTiles(); ++t)
    found.push_back(t.treeIndex());
  EXPECT_EQ(found, expected);
  found.clear();
  for (auto t = tree.beginTiles(); t != tree.endTiles(); ++t) {
    t->setBranchSize(t.tileIndex());
    found.push_back(t.treeIndex());
  }
  EXPECT_EQ(found, expected);
  EXPECT_EQ(tree.tile(2, 5).branchSize(), 2);
  static_assert(std::is_same_v<decltype(*tree.cbeginTiles()), typename Container<T>::TileType const&>);
  static_assert(std::is_same_v<decltype(*tree.beginTiles()), typename Container<T>::TileType&>);
}

// boundary
TYPED_TEST(Iterators, EmptyContainerBeginsAtItsEnd) {
  using T = TypeParam;
  Container<T> tree;
  EXPECT_TRUE(tree.beginTiles() == tree.endTiles());
  EXPECT_TRUE(tree.cbeginTiles() == tree.cendTiles());
  EXPECT_TRUE(tree.begin() == tree.end());
  EXPECT_FALSE(tree.cbeginTiles().valid());
  EXPECT_EQ(tree.cendTiles().depth(), T::kMaxDepth);
  auto it = tree.cbeginTiles();
  EXPECT_FALSE(it.increment(1));
  EXPECT_FALSE(it.increment(-1));
  EXPECT_TRUE(it.increment(0));
  EXPECT_TRUE(it == tree.cendTiles());
}

// requirement: the end lies behind the last tile of the deepest depth
TYPED_TEST(Iterators, EndIsBehindTheDeepestDepth) {
  using T = TypeParam;
  auto const tree = sample<T>();
  auto const end = tree.cendTiles();
  EXPECT_EQ(end.depth(), T::kMaxDepth);
  EXPECT_EQ(end.tileIndex(), tree.tileCount(T::kMaxDepth));
  EXPECT_FALSE(end.valid());
  Container<T> shallow;
  Access::addTile(shallow, {0, 0, 0}, 2);
  auto it = shallow.cbeginTiles();
  EXPECT_EQ(it.depth(), 2);
  ++it;
  EXPECT_TRUE(it == shallow.cendTiles());
}

// requirement: steps cross empty depths both ways and tell whether they went all the way
TYPED_TEST(Iterators, StepsCrossEmptyDepths) {
  using T = TypeParam;
  auto const tree = sample<T>();
  auto const all = allTiles(tree);
  auto const count = static_cast<std::int64_t>(all.size());
  for (std::int64_t from = 0; from <= count; ++from) {
    for (std::int64_t to = 0; to <= count; ++to) {
      auto it = tree.cbeginTiles(from);
      EXPECT_TRUE(it.increment(to - from)) << from << " to " << to;
      if (to < count) {
        EXPECT_EQ(it.treeIndex(), all[static_cast<std::size_t>(to)]) << from << " to " << to;
        EXPECT_TRUE(it.valid());
      } else {
        EXPECT_TRUE(it == tree.cendTiles()) << from;
      }
    }
    auto beyond = tree.cbeginTiles(from);
    EXPECT_FALSE(beyond.increment(count - from + 1));
    EXPECT_TRUE(beyond == tree.cendTiles());
    auto before = tree.cbeginTiles(from);
    EXPECT_FALSE(before.increment(-from - 1));
    EXPECT_EQ(before.treeIndex(), all.front()) << from;
  }
  auto it = tree.cbeginTiles();
  it += 3;
  EXPECT_EQ(it.treeIndex(), all[3]);
  --it;
  EXPECT_EQ(it.treeIndex(), all[2]);
  EXPECT_TRUE(tree.cbeginTiles(1000) == tree.cendTiles());
}

// requirement
TYPED_TEST(Iterators, VoxelsComeSlotBySlot) {
  using T = TypeParam;
  auto const tree = sample<T>();
  auto voxel = tree.begin();
  for (TreeIndex const& at : allTiles(tree)) {
    auto const& t = tree.tile(at);
    for (int slot = 0; slot < T::kTileSize; ++slot, ++voxel) {
      ASSERT_FALSE(voxel == tree.end());
      Voxel<T> const& v = *voxel;
      ASSERT_EQ(&v.tile(), &t);
      ASSERT_EQ(voxel->slot(), slot);
      ASSERT_EQ(v.ijk(), t.childIJK(slot));
      ASSERT_EQ(v.tijk(), t.childTIJK(t.childIJK(slot)));
      ASSERT_EQ(v.treeIndex(), at);
      ASSERT_EQ(v.voxelTreeIndex(), (VoxelTreeIndex(at, t.childIJK(slot))));
      ASSERT_EQ(v.isLeaf(), t.isLeaf(slot));
      ASSERT_EQ(v.voxelWidth(), t.voxelWidth());
      ASSERT_EQ(v.depth(), at.depth);
      ASSERT_EQ(v.index(), at.index);
      ASSERT_EQ(v.parentIndex(), t.parentIndex());
      ASSERT_EQ(v.parentTreeIndex(), t.parentTreeIndex());
      ASSERT_EQ(v.isRoot(), t.isRoot());
      ASSERT_EQ(v.atMaxDepth(), t.atMaxDepth());
      if (!t.atMaxDepth()) {
        ASSERT_EQ(v.childIndex(), t.childIndex(slot));
        ASSERT_EQ(v.childTreeIndex(), t.childTreeIndex(slot));
      }
    }
  }
  EXPECT_TRUE(voxel == tree.end());
}

// requirement
TYPED_TEST(Iterators, VoxelsMayBeSkipped) {
  using T = TypeParam;
  auto const tree = sample<T>();
  auto const count = static_cast<std::int64_t>(tree.size());
  std::vector<VoxelTreeIndex> all;
  for (auto v = tree.cbegin(); v != tree.cend(); ++v) all.push_back(v->voxelTreeIndex());
  ASSERT_EQ(static_cast<std::int64_t>(all.size()), count);
  for (std::int64_t n = 0; n < count; n += 7) {
    EXPECT_EQ(tree.begin(n)->voxelTreeIndex(), all[static_cast<std::size_t>(n)]);
    auto v = tree.cbegin(n);
    v += count - n;
    EXPECT_TRUE(v == tree.cend());
  }
  EXPECT_TRUE(tree.begin(count) == tree.end());
  EXPECT_TRUE(tree.begin(count + 5) == tree.end());
}

// boundary
TYPED_TEST(Iterators, DefaultVoxelIsInvalid) {
  Voxel<TypeParam> const v;
  EXPECT_EQ(v.treeIndex(), TreeIndex{});
  EXPECT_EQ(v.ijk(), (int3{0, 0, 0}));
  EXPECT_TRUE(v == Voxel<TypeParam>());
}

// requirement
TYPED_TEST(Iterators, VoxelsCompareByIndexDepthAndPosition) {
  using T = TypeParam;
  auto const tree = sample<T>();
  EXPECT_TRUE(*tree.begin(1) == *tree.begin(1));
  EXPECT_FALSE(*tree.begin(1) == *tree.begin(2));
  EXPECT_FALSE(*tree.begin(0) == *tree.begin(T::kTileSize));
}
