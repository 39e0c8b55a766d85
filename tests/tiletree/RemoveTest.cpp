// Removal of tiles, with and without compaction.
#include "GeometryVolume/core/Parallel.h"
#include "support/Shapes.h"
#include "support/TreeModel.h"

#include <algorithm>

using namespace Support;
using namespace VLN::TileTree3D;

namespace {

template <class TraitsT> class Remove : public ::testing::Test {
public:
  using T = TraitsT;
  using M = TreeModel<T>;
  static constexpr int kDeep = T::kMaxDepth;

  Container<T> tree;
  TileMoves moves;

  TreeIndex add(VoxelCoord const& at) { return tree.tileAccessor().addTile(at).treeIndex(); }
  TreeIndex find(VoxelCoord const& at) { return tree.tileAccessor().tile(at, true).treeIndex(); }
  /// The n-th tile of a row of roots at the deepest depth.
  static VoxelCoord inRow(int n) {
    VoxelCoord const first = M::holder({0, 0, 0}, kDeep);
    return {first.i + n * T::width(kDeep), first.j, first.k, kDeep};
  }
  void addRow(int count) {
    for (int n = 0; n < count; ++n) add(inRow(n));
  }
  void remove(TreeIndex const& at, bool withBranch) {
    tree.tileAccessor().removeTile(at, withBranch, &moves);
  }
  std::size_t moveCount() const {
    std::size_t count = 0;
    for (auto const& list : moves) count += list.size();
    return count;
  }
  /// Corner of the child in a slot of a tile.
  static VoxelCoord childOf(VoxelCoord const& at, int i, int j, int k) {
    int const w = T::width(at.depth + 1);
    return {at.i + i * w, at.j + j * w, at.k + k * w, at.depth + 1};
  }
};
TYPED_TEST_SUITE(Remove, Shapes, ShapeNames);

TYPED_TEST(Remove, TheLastTileOfAnArrayMovesNone) {
  this->addRow(5);
  this->remove({4, this->kDeep}, true);
  EXPECT_EQ(this->moveCount(), 0u);
  EXPECT_EQ(this->tree.tileCount(this->kDeep), 4);
  EXPECT_TRUE(this->tree.checkConsistency(false));
}

TYPED_TEST(Remove, AHoleIsFilledFromTheEnd) {
  this->addRow(5);
  this->remove({1, this->kDeep}, true);
  ASSERT_EQ(this->moveCount(), 1u);
  EXPECT_EQ(this->moves[TestFixture::kDeep][0], (std::pair<std::int64_t, std::int64_t>(1, 4)));
  EXPECT_EQ(this->tree.tile(1, this->kDeep).voxelCoord(), this->inRow(4));
  EXPECT_EQ(this->find(this->inRow(4)), (TreeIndex{1, this->kDeep}));
  EXPECT_TRUE(this->tree.checkConsistency(false));
}

TYPED_TEST(Remove, AHoleNextToTheFilledOneIsNotTakenForTheEnd) {
  // Holes 12 and 13 of 16: the filled hole 12 looks dead until its tile arrives.
  this->addRow(16);
  this->tree.tileAccessor().removeTiles({12, 13, 14}, this->kDeep, true, &this->moves);
  EXPECT_EQ(this->tree.tileCount(this->kDeep), 13);
  EXPECT_EQ(this->moveCount(), 1u);
  EXPECT_TRUE(this->find(this->inRow(15)).valid());
  EXPECT_TRUE(this->tree.checkConsistency(false));
}

TYPED_TEST(Remove, AllTilesOfADepthLeaveAnEmptyArrayAndNoMoves) {
  this->addRow(150);
  std::vector<std::int64_t> all;
  for (std::int64_t n = 0; n < 150; ++n) all.push_back(149 - n);
  this->tree.tileAccessor().removeTiles(all, this->kDeep, false, &this->moves);
  EXPECT_EQ(this->tree.tileCount(this->kDeep), 0);
  EXPECT_EQ(this->tree.tileCount(-1), 0);
  EXPECT_EQ(this->tree.rootCount(this->kDeep), 0);
  EXPECT_EQ(this->tree.rootCount(), 0);
  EXPECT_EQ(this->moveCount(), 0u);
  EXPECT_TRUE(this->tree.checkConsistency(false));
}

TYPED_TEST(Remove, DuplicatesInAListCountOnce) {
  this->addRow(10);
  this->tree.tileAccessor().removeTiles({3, 3, 3, 9, 9}, this->kDeep, true, &this->moves);
  EXPECT_EQ(this->tree.tileCount(-1), 8);
  EXPECT_EQ(this->tree.tileCount(this->kDeep), 8);
  EXPECT_TRUE(this->tree.checkConsistency(false));
}

TYPED_TEST(Remove, UnknownIndicesAreIgnored) {
  this->addRow(3);
  auto const before = treeContents(this->tree);
  for (TreeIndex const& at : {TreeIndex{}, TreeIndex{-1, 3}, TreeIndex{0, -1}, TreeIndex{3, this->kDeep},
                              TreeIndex{0, 0}, TreeIndex{0, this->kDeep + 1}}) {
    this->remove(at, true);
    this->remove(at, false);
    EXPECT_EQ(this->moveCount(), 0u);
  }
  EXPECT_EQ(treeContents(this->tree), before);
}

TYPED_TEST(Remove, WithoutCompactionTheTileStaysDeadInItsPlace) {
  this->addRow(5);
  this->tree.setCompactOnRemoval(false);
  this->remove({1, this->kDeep}, true);
  EXPECT_EQ(this->tree.tileCount(this->kDeep), 5);
  EXPECT_EQ(this->tree.tileCount(-1), 4);
  EXPECT_FALSE(this->tree.tile(1, this->kDeep).valid());
  EXPECT_FALSE(this->tree.checkConsistency(false));
  EXPECT_EQ(this->moveCount(), 0u);

  struct Counter final : Visitor<Container<TypeParam>> {
    using Tile = typename Container<TypeParam>::TileType;
    using Visitor<Container<TypeParam>>::beginTile;
    void beginTile(Tile const& tile) override { count += 1, sawDead |= !tile.valid(); }
    void join(Visitor<Container<TypeParam>> const& b) override {
      count += static_cast<Counter const&>(b).count;
      sawDead |= static_cast<Counter const&>(b).sawDead;
    }
    Counter* clone() const override { return new Counter; }
    int count = 0;
    bool sawDead = false;
  };
  for (int mode = 0; mode <= 8; ++mode) {
    Counter counter;
    std::as_const(this->tree).reduce(counter, static_cast<TraversalMode>(mode));
    EXPECT_EQ(counter.count, 4) << "mode " << mode;
    EXPECT_FALSE(counter.sawDead) << "mode " << mode;
  }
  // A second removal of the dead tile is nothing; compaction then closes the hole.
  this->remove({1, this->kDeep}, true);
  EXPECT_EQ(this->tree.tileCount(-1), 4);
  this->tree.compact(&this->moves);
  EXPECT_EQ(this->moveCount(), 1u);
  EXPECT_EQ(this->tree.tileCount(this->kDeep), 4);
  EXPECT_TRUE(this->tree.checkConsistency(false));
}

TYPED_TEST(Remove, CompactionDropsDeadTilesAtTheEndToo) {
  this->addRow(8);
  this->tree.setCompactOnRemoval(false);
  this->tree.tileAccessor().removeTiles({6, 7}, this->kDeep, true);
  this->tree.setCompactOnRemoval(true);
  this->remove({2, this->kDeep}, true);
  ASSERT_EQ(this->moveCount(), 1u);
  EXPECT_EQ(this->moves[TestFixture::kDeep][0], (std::pair<std::int64_t, std::int64_t>(2, 5)));
  EXPECT_EQ(this->tree.tileCount(this->kDeep), 5);
  EXPECT_TRUE(this->tree.checkConsistency(false));
}

TYPED_TEST(Remove, ARootWithOneChildMakesTheChildARoot) {
  VoxelCoord const root = TestFixture::M::holder({0, 0, 0}, 4), child = this->childOf(root, 1, 0, 1);
  this->add(root);
  this->add(child);
  this->remove(this->find(root), false);
  EXPECT_EQ(this->tree.tileCount(-1), 1);
  EXPECT_EQ(this->tree.rootCount(), 1);
  EXPECT_EQ(this->tree.cbeginRoots()->first, child);
  EXPECT_EQ(this->tree.tile(this->find(child)).parentIndex(), -1);
  EXPECT_TRUE(this->tree.checkConsistency(false));
  EXPECT_TRUE(this->tree.checkBranchSizes(false));
}

TYPED_TEST(Remove, ARootWithAdjacentChildrenIsRefused) {
  VoxelCoord const root = TestFixture::M::holder({0, 0, 0}, 4);
  this->add(root);
  this->add(this->childOf(root, 0, 0, 0));
  this->add(this->childOf(root, 1, 1, 1)); // corner to corner
  auto const before = treeContents(this->tree);
  this->remove(this->find(root), false);
  EXPECT_EQ(treeContents(this->tree), before);
  EXPECT_TRUE(this->tree.tile(this->find(root)).valid());
  // With its branch it goes.
  this->remove(this->find(root), true);
  EXPECT_EQ(this->tree.tileCount(-1), 0);
}

TEST(RemoveOdd, ARootWithChildrenApartGoesAlone) {
  Container<OddTraits> tree;
  auto accessor = tree.tileAccessor();
  VoxelCoord const root = TreeModel<OddTraits>::holder({0, 0, 0}, 4);
  int const w = OddTraits::width(5);
  accessor.addTile(root);
  for (int const step : {0, 2, 4}) accessor.addTile(root.i + step * w, root.j, root.k, 5);
  accessor.removeTile(accessor.tile(root, true).treeIndex(), false);
  EXPECT_EQ(tree.tileCount(4), 0);
  EXPECT_EQ(tree.rootCount(5), 3);
  EXPECT_TRUE(tree.checkConsistency(false));

  // A fourth one in between makes neighbours.
  accessor.addTile(root);
  accessor.addTile(root.i + 3 * w, root.j, root.k, 5);
  accessor.removeTile(accessor.tile(root, true).treeIndex(), false);
  EXPECT_EQ(tree.tileCount(4), 1);
}

TYPED_TEST(Remove, ATileThatIsNoRootGoesWithItsBranchAlways) {
  VoxelCoord const root = TestFixture::M::holder({0, 0, 0}, 3), child = this->childOf(root, 0, 0, 0);
  this->add(root);
  this->add(this->childOf(child, 0, 0, 0));
  this->add(this->childOf(child, 1, 0, 0));
  this->add(this->childOf(root, 1, 1, 0));
  this->tree.tileAccessor().addTiles(typename Container<TypeParam>::TileLists{}); // branch sizes
  EXPECT_EQ(this->tree.tile(this->find(root)).branchSize(), 5 * TypeParam::kTileSize);
  this->remove(this->find(child), false);
  EXPECT_EQ(this->tree.tileCount(-1), 2);
  EXPECT_EQ(this->tree.tile(this->find(root)).branchSize(), 2 * TypeParam::kTileSize);
  EXPECT_TRUE(this->tree.checkBranchSizes(false));
  EXPECT_TRUE(this->tree.checkConsistency(false));
}

TYPED_TEST(Remove, AListedDescendantOfAListedTileGoesOnce) {
  VoxelCoord const root = TestFixture::M::holder({0, 0, 0}, 3), child = this->childOf(root, 0, 0, 0);
  this->add(root);
  this->add(child);
  this->add(this->childOf(child, 1, 0, 0));
  this->add(this->inRow(40000000));
  TileIndexLists lists(static_cast<std::size_t>(TypeParam::kDepths));
  for (std::size_t d : {3, 4, 5}) lists[d] = {0};
  this->tree.tileAccessor().removeTiles(lists, true, &this->moves);
  EXPECT_EQ(this->tree.tileCount(-1), 1);
  EXPECT_TRUE(this->tree.checkConsistency(false));
}

TYPED_TEST(Remove, TheRemovingAccessorReadsItsCursorAgain) {
  this->addRow(4);
  auto accessor = this->tree.tileAccessor();
  accessor.tile(this->inRow(1), true);
  accessor.removeTile({1, this->kDeep}, true);
  EXPECT_EQ(accessor.current().voxelCoord(), this->inRow(3)) << "the index names another tile now";
  EXPECT_FALSE(accessor.tile(this->inRow(1), true).valid());
  accessor.tile(this->inRow(3), true);
  accessor.removeTiles({0, 1, 2}, this->kDeep, true);
  EXPECT_FALSE(accessor.current().valid());
}

TYPED_TEST(Remove, DerivedCachesAndScratchContainersStartAnew) {
  this->addRow(200);
  this->tree.precomputeTileNeighbors();
  this->tree.precomputeTileHalos();
  this->tree.precomputeCompressedTileHalos();
  this->tree.buildAccessorAccelerationStructure(this->kDeep);
  auto* scratch = this->tree.threadLocalContainer(0);
  scratch->tileAccessor().addTile(0, 0, 0, this->kDeep);
  this->remove({1, this->kDeep}, true);
  EXPECT_EQ(this->tree.neighborData(), nullptr);
  EXPECT_EQ(this->tree.tileHalo({0, this->kDeep}), nullptr);
  EXPECT_EQ(scratch->tileCount(this->kDeep), 0) << "moved depths leave the scratch trees";
  EXPECT_EQ(this->tree.threadLocalContainer(0), scratch) << "it is idle again";
  for (int n = 0; n < 200; ++n) {
    auto const& t = this->tree.tileAccessor().tile(this->inRow(n), true);
    EXPECT_EQ(t.valid(), n != 1);
  }
}

TYPED_TEST(Remove, ACopyKeepsItsTiles) {
  this->addRow(20);
  Container<TypeParam> const copy = this->tree;
  auto const before = treeContents(copy);
  this->remove({3, this->kDeep}, true);
  this->tree.compact();
  EXPECT_EQ(treeContents(copy), before);
}

TYPED_TEST(Remove, BytesAreEqualAtAnyNumberOfThreads) {
  Container<TypeParam> source;
  auto accessor = source.tileAccessor();
  TilePlaces<TypeParam> places(17);
  for (VoxelCoord const& at : places.some(3000)) accessor.addTile(at);
  TileIndexLists lists(static_cast<std::size_t>(TypeParam::kDepths));
  for (int d = 0; d <= TypeParam::kMaxDepth; ++d) {
    for (std::int64_t n = 0; n < source.tileCount(d); ++n) {
      if (places.below(3) == 0) lists[static_cast<std::size_t>(d)].push_back(n);
    }
  }
  std::vector<std::int64_t> first;
  for (int const threads : {1, 2, 8}) {
    this->tree = source;
    VLN::withThreads(threads, [&] { this->tree.tileAccessor().removeTiles(lists, true); });
    EXPECT_TRUE(this->tree.checkConsistency(false));
    if (first.empty()) first = treeContents(this->tree);
    EXPECT_EQ(treeContents(this->tree), first) << threads;
  }
}

// requirement: tiles without children, listed by rising index, go in parallel; in any other order one by one.
// Both leave the same tree and tell the same moves
TYPED_TEST(Remove, RequirementTheOrderOfAListChangesNothing) {
  Container<TypeParam> source;
  auto accessor = source.tileAccessor();
  TilePlaces<TypeParam> places(23);
  for (VoxelCoord const& at : places.some(6000)) accessor.addTile(at);
  for (int const part : {2, 3, 40}) {
    TileIndexLists rising(static_cast<std::size_t>(TypeParam::kDepths));
    for (int d = 0; d <= TypeParam::kMaxDepth; ++d) {
      for (std::int64_t n = 0; n < source.tileCount(d); ++n) {
        auto const& t = std::as_const(source).tile(n, d);
        if (!t.isRoot() && t.isLeaf() && places.below(part) == 0)
          rising[static_cast<std::size_t>(d)].push_back(n);
      }
    }
    auto falling = rising;
    for (auto& list : falling) std::reverse(list.begin(), list.end());
    for (bool const compacts : {true, false}) {
      Container<TypeParam> slow = source;
      slow.setCompactOnRemoval(compacts);
      TileMoves slowMoves;
      slow.tileAccessor().removeTiles(falling, true, &slowMoves);
      EXPECT_EQ(slow.checkConsistency(false), compacts) << "dead tiles stay, and are told";
      for (int const threads : {1, 2, 8}) {
        Container<TypeParam> fast = source;
        fast.setCompactOnRemoval(compacts);
        TileMoves made;
        VLN::withThreads(threads, [&] { fast.tileAccessor().removeTiles(rising, threads == 2, &made); });
        EXPECT_EQ(treeContents(fast), treeContents(slow)) << threads;
        EXPECT_EQ(made, slowMoves) << threads;
      }
    }
  }
}

} // namespace
