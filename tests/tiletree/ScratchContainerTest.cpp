// Scratch containers that parallel builders borrow.
#include "support/Print.h"
#include "support/RandomForest.h"
#include "support/Shapes.h"
#include "support/Threads.h"

#include "GeometryVolume/core/Parallel.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <set>

using namespace VLN::TileTree3D;
using Support::Access;

VLN_SHAPE_SUITE(ScratchContainer);

namespace {

template <class T> void expectOnlyTheFirstTile(Container<T> const& scratch) {
  EXPECT_EQ(scratch.tileCount(-1), 1);
  EXPECT_EQ(scratch.tileCount(0), 1);
  EXPECT_EQ(scratch.rootCount(), 1);
  EXPECT_TRUE(scratch.tile(0).isLeaf());
  EXPECT_TRUE(scratch.checkConsistency(false));
}

} // namespace

// requirement
TYPED_TEST(ScratchContainer, NewOneBeginsWithOneTileUnlessKeptEmpty) {
  using T = TypeParam;
  Container<T> tree("t", 0.5f);
  auto* const scratch = tree.threadLocalContainer(0);
  ASSERT_NE(scratch, nullptr);
  EXPECT_EQ(scratch->name(), "voxel_tile_tree_thread_local");
  expectOnlyTheFirstTile(*scratch);
  EXPECT_EQ(scratch->tile(0).voxelCoord(),
            (VoxelCoord{T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord, 0}));
  auto* const empty = tree.threadLocalContainer(1);
  ASSERT_NE(empty, scratch);
  EXPECT_TRUE(empty->empty());
  EXPECT_EQ(tree.tileCount(-1), 0) << "the tree itself is untouched";
}

// boundary
TYPED_TEST(ScratchContainer, FreedOneLosesWhatItGainedAndIsHandedOutAgain) {
  using T = TypeParam;
  Container<T> tree;
  auto* const scratch = tree.threadLocalContainer(0);
  auto accessor = scratch->tileAccessor();
  for (int d : {3, T::kMaxDepth, 5}) accessor.addTile(1000 * d, 0, 0, d);
  scratch->precomputeTileNeighbors();
  scratch->buildAccessorAccelerationStructure(T::kMaxDepth);
  tree.freeThreadLocalContainer(scratch);
  expectOnlyTheFirstTile(*scratch);
  EXPECT_EQ(scratch->neighborData(), nullptr);
  EXPECT_EQ(Access::data(*scratch).m_gridDepth, -1);
  auto const& data = Access::data(tree);
  EXPECT_TRUE(data.m_threadLocalCounts.empty());
  ASSERT_EQ(data.m_freeThreadLocal.size(), 1u);
  EXPECT_EQ(data.m_freeThreadLocal.front(), scratch);
  EXPECT_EQ(tree.threadLocalContainer(0), scratch);
  EXPECT_EQ(data.m_allThreadLocal.size(), 1u);
}

// requirement: what it held when it was handed out stays
TYPED_TEST(ScratchContainer, TruncationStartsAtTheFirstDepthThatGrew) {
  using T = TypeParam;
  Container<T> tree;
  auto* const scratch = tree.threadLocalContainer(1);
  auto accessor = scratch->tileAccessor();
  accessor.addTile(0, 0, 0, 2);
  accessor.addTile(0, 0, 0, 3);
  tree.clearThreadLocalData(nullptr); // it holds nothing again
  EXPECT_TRUE(scratch->empty());

  auto* const again = tree.threadLocalContainer(1);
  ASSERT_EQ(again, scratch);
  auto second = again->tileAccessor();
  second.addTile(0, 0, 0, 2);
  second.addTile(0, 0, 0, 3);
  tree.freeThreadLocalContainer(again);
  EXPECT_TRUE(again->empty());
  EXPECT_EQ(again->rootCount(), 0);
}

// requirement: roots of the truncated depths go, those above stay, and so does consistency
TYPED_TEST(ScratchContainer, TruncationRemovesRootsOfTheDepthsThatGo) {
  using T = TypeParam;
  Container<T> tree;
  auto* const scratch = tree.threadLocalContainer(1);
  auto fill = [&] {
    auto accessor = scratch->tileAccessor();
    accessor.addTile(0, 0, 0, 2);
    accessor.addTile(0, 0, 0, 4);
    accessor.addTile(T::kMaxTileCoord, 0, 0, 3);
    accessor.addTile(T::kMaxTileCoord, T::kMaxTileCoord, 0, T::kMaxDepth);
  };
  fill();
  typename Container<T>::TileLists lists;
  lists[3].append({0, 0, 0});
  lists[5].append({0, 0, 0});
  tree.clearThreadLocalData(&lists);
  EXPECT_EQ(scratch->tileCount(2), 1);
  EXPECT_EQ(scratch->tileCount(-1), 1);
  EXPECT_EQ(scratch->rootCount(), 1);
  EXPECT_EQ(scratch->rootCount(2), 1);
  EXPECT_EQ(scratch->rootCount(3), 0);
  EXPECT_EQ(scratch->rootCount(T::kMaxDepth), 0);
  EXPECT_TRUE(scratch->tile(0, 2).isLeaf());
  EXPECT_TRUE(scratch->checkConsistency(false));
  EXPECT_EQ(Access::data(tree).m_freeThreadLocal.size(), 1u);
  EXPECT_TRUE(Access::data(tree).m_threadLocalCounts.empty());
}

// requirement
TYPED_TEST(ScratchContainer, ClearReturnsAllThatAreHandedOut) {
  using T = TypeParam;
  Container<T> tree;
  std::set<Container<T>*> handed;
  for (int n = 0; n < 4; ++n) {
    auto* scratch = tree.threadLocalContainer(0);
    handed.insert(scratch);
    if (n % 2) scratch->tileAccessor().addTile(0, 0, 0, 2 + n);
  }
  EXPECT_EQ(handed.size(), 4u);
  typename Container<T>::TileLists const empty;
  tree.clearThreadLocalData(&empty);
  for (auto* scratch : handed) expectOnlyTheFirstTile(*scratch);
  EXPECT_EQ(Access::data(tree).m_freeThreadLocal.size(), 4u);
  tree.clearThreadLocalData(nullptr);
  EXPECT_EQ(Access::data(tree).m_freeThreadLocal.size(), 4u) << "none was out";
}

// requirement: removal reports which depth changed first
TYPED_TEST(ScratchContainer, RemovalOfTilesTruncatesFromItsShallowestDepth) {
  using T = TypeParam;
  Container<T> tree;
  Access::addTile(tree, {0, 0, 0}, 3);
  tree.precomputeTileNeighbors();
  auto* const scratch = tree.threadLocalContainer(0);
  auto accessor = scratch->tileAccessor();
  accessor.addTile(0, 0, 0, 6);
  using Moves = std::vector<std::vector<std::pair<std::int64_t, std::int64_t>>>;
  Moves moves(static_cast<std::size_t>(T::kMaxDepth + 1));
  Access::tilesRemoved(tree, &moves);
  EXPECT_EQ(tree.neighborData(), nullptr);
  EXPECT_EQ(scratch->tileCount(6), 1) << "no depth changed";
  Access::tilesRemoved(tree, nullptr);
  EXPECT_EQ(scratch->tileCount(6), 1);
  moves[4].emplace_back(0, 1);
  moves[9].emplace_back(0, 1);
  Access::tilesRemoved(tree, &moves);
  EXPECT_EQ(scratch->tileCount(3), 1);
  EXPECT_EQ(scratch->tileCount(4), 0);
  EXPECT_EQ(scratch->tileCount(-1), 4);
  EXPECT_TRUE(scratch->checkConsistency(false));
}

// negative: a container that is not out is not returned a second time
TYPED_TEST(ScratchContainer, FreeingTwiceListsItOnce) {
  using T = TypeParam;
  Container<T> tree, stranger;
  auto* const scratch = tree.threadLocalContainer(0);
  tree.freeThreadLocalContainer(scratch);
  tree.freeThreadLocalContainer(scratch);
  tree.freeThreadLocalContainer(&stranger);
  tree.freeThreadLocalContainer(nullptr);
  EXPECT_EQ(Access::data(tree).m_freeThreadLocal.size(), 1u);
}

// requirement: many threads borrow and return at once
TYPED_TEST(ScratchContainer, ThreadsBorrowContainersOfTheirOwn) {
  using T = TypeParam;
  Container<T> tree;
  VLN::withThreads(8, [&] {
    VLN::parallelFor(0, 200, [&](std::int64_t begin, std::int64_t end) {
      for (std::int64_t n = begin; n < end; ++n) {
        auto* scratch = tree.threadLocalContainer(0);
        EXPECT_EQ(scratch->tileCount(-1), 1);
        scratch->tileAccessor().addTile(static_cast<int>(n) * 100, 0, 0, 4);
        EXPECT_EQ(scratch->tileCount(4), 1);
        tree.freeThreadLocalContainer(scratch);
      }
    });
  });
  auto const& data = Access::data(tree);
  EXPECT_EQ(data.m_freeThreadLocal.size(), data.m_allThreadLocal.size());
  for (auto* scratch : data.m_freeThreadLocal) expectOnlyTheFirstTile(*scratch);
}
