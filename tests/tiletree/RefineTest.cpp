// Refinement of a tree by others, and bulk addition.
#include "GeometryVolume/core/Canceller.h"
#include "GeometryVolume/core/Parallel.h"
#include "Ostil/Job.h"
#include "Velorn/ExceptionMessage.h"
#include "support/Shapes.h"
#include "support/TreeModel.h"

#include <algorithm>
#include <random>
#include <stdexcept>
#include <utility>

using namespace Support;
using namespace VLN;
using namespace VLN::TileTree3D;

namespace {

template <class TraitsT> class Refine : public ::testing::Test {
public:
  using T = TraitsT;
  using Tree = Container<T>;
  using Lists = typename Tree::TileLists;

  /// `count` tiles in a row at the deepest depth, under a common root.
  static void addRow(Tree& tree, int count, int first = 0) {
    auto accessor = tree.tileAccessor();
    for (int n = 0; n < count; ++n)
      accessor.addTile(T::align(0, T::kMaxDepth) + (first + n) * T::width(T::kMaxDepth),
                       T::align(0, T::kMaxDepth), T::align(0, T::kMaxDepth), T::kMaxDepth);
  }
  static Tree randomTree(std::uint32_t seed, int tiles) {
    Tree tree;
    TilePlaces<T> places(seed);
    auto accessor = tree.tileAccessor();
    for (VoxelCoord const& at : places.some(tiles)) accessor.addTile(at);
    return tree;
  }
  static TreeModel<T> modelOf(Tree const& tree) {
    TreeModel<T> model;
    typename TreeModel<T>::Set set;
    for (auto t = tree.cbeginTiles(); t != tree.cendTiles(); ++t) set.insert((*t).voxelCoord());
    model.add(set);
    return model;
  }
  static void expectSame(Tree const& tree, TreeModel<T> const& model) {
    model.compare(tree, false);
    EXPECT_TRUE(tree.checkConsistency(false));
  }
};
TYPED_TEST_SUITE(Refine, Shapes, ShapeNames);

TYPED_TEST(Refine, AnEmptyTreeBecomesTheSource) {
  auto const source = this->randomTree(1, 400);
  Container<TypeParam> tree;
  tree.refine({&source}, nullptr, true);
  this->expectSame(tree, this->modelOf(source));
  EXPECT_TRUE(std::equal(tree.cbeginRoots(), tree.cendRoots(), source.cbeginRoots(),
                         [](auto const& a, auto const& b) { return a.first == b.first; }));
  EXPECT_EQ(tree.rootCount(), source.rootCount());
  EXPECT_TRUE(tree.checkBranchSizes(false));
}

TYPED_TEST(Refine, NoSourcesChangeNothing) {
  auto tree = this->randomTree(2, 50);
  auto const before = treeContents(tree);
  tree.refine({}, nullptr, true);
  EXPECT_EQ(treeContents(tree), before);
}

TYPED_TEST(Refine, AnEmptySourceAddsNothing) {
  auto tree = this->randomTree(2, 50);
  tree.tileAccessor().addTiles(typename Container<TypeParam>::TileLists{}); // branch sizes
  auto const before = treeContents(tree);
  Container<TypeParam> const source;
  typename Container<TypeParam>::TileLists made;
  tree.refine({&source}, &made, true);
  EXPECT_EQ(treeContents(tree), before);
  for (auto const& list : made) EXPECT_TRUE(list.empty());
}

TYPED_TEST(Refine, ATreeByItselfOrItsCopyAddsNothing) {
  auto tree = this->randomTree(3, 300);
  tree.tileAccessor().addTiles(typename Container<TypeParam>::TileLists{});
  auto const before = treeContents(tree);
  Container<TypeParam> const copy = tree;
  typename Container<TypeParam>::TileLists made;
  tree.refine({&tree, &copy}, &made, true);
  EXPECT_EQ(treeContents(tree), before);
  for (auto const& list : made) EXPECT_TRUE(list.empty());
}

TYPED_TEST(Refine, ACopyThatGrowsLeavesTheOtherAlone) {
  auto tree = this->randomTree(3, 100);
  Container<TypeParam> copy = tree;
  auto const before = treeContents(tree);
  auto const source = this->randomTree(4, 200);
  copy.refine({&source, &tree}, nullptr, true);
  EXPECT_EQ(treeContents(tree), before);
  EXPECT_GT(copy.tileCount(-1), tree.tileCount(-1));
}

TYPED_TEST(Refine, SerialAndParallelSizesGiveTheSameTree) {
  // 99 tiles at a depth take the serial path, 100 the parallel one; so for the tiles found missing.
  for (int const present : {0, 1, 50}) {
    for (int const count : {1, 49, 50, 51, 98, 99, 100, 101, 150, 151, 400}) {
      SCOPED_TRACE(std::to_string(count) + " tiles, " + std::to_string(present) + " present");
      Container<TypeParam> source, tree, expected;
      this->addRow(source, count);
      this->addRow(tree, std::min(present, count));
      this->addRow(expected, count);
      typename Container<TypeParam>::TileLists made;
      tree.refine({&source}, &made, true);
      this->expectSame(tree, this->modelOf(expected));
      EXPECT_TRUE(tree.checkBranchSizes(false));
      int const d = TypeParam::kMaxDepth;
      EXPECT_EQ(static_cast<int>(made[static_cast<std::size_t>(d)].size()), std::max(0, count - present));
      // New tiles lie in the order of the source, on either path.
      std::int64_t const first = tree.tileCount(d) - std::max(0, count - present);
      for (std::int64_t n = first; n < tree.tileCount(d); ++n) {
        EXPECT_EQ(tree.tile(n, d).tijk(), source.tile(n, d).tijk());
        EXPECT_EQ(tree.tile(n, d).tijk(),
                  made[static_cast<std::size_t>(d)][static_cast<std::uint64_t>(n - first)]);
      }
    }
  }
}

/// How the tiles of a source lie, beside their parents.
enum class Lie { kByParents, kGrown, kSwapped, kShuffled, kWithHoles, kWithRoots };

/// A cluster of some hundred tiles, with what lies between them and a few coarse ones.
template <class T> Container<T> cluster(std::uint32_t seed, Lie lie) {
  using Tree = Container<T>;
  constexpr int kTop = T::kMaxDepth - 5, kDeepest = T::kMaxDepth;
  std::mt19937 random(seed);
  auto const place = [&] {
    auto const along = [&] { return static_cast<int>(random() % 24) * T::width(kDeepest); };
    return int3{along(), along(), along()};
  };
  typename Tree::TileLists lists;
  for (int n = 0; n < 400; ++n) {
    int3 const p = place();
    lists[kDeepest].append(T::align(p, kDeepest));
    lists[kTop].append(T::align(p, kTop));
  }
  Tree tree;
  tree.tileAccessor().addTiles(lists);
  auto accessor = tree.tileAccessor();
  if (lie == Lie::kGrown)
    for (int n = 0; n < 20; ++n) accessor.addTile(place(), kDeepest);
  if (lie == Lie::kWithHoles)
    for (int d : {kDeepest - 1, kDeepest}) accessor.removeTiles({1, tree.tileCount(d) / 2}, d, true);
  if (lie == Lie::kWithRoots)
    for (int n = 1; n < 20; ++n) accessor.addTile(int3{0, 0, T::width(kTop) * (n + 40)}, kTop + n % 6);
  if (lie == Lie::kSwapped || lie == Lie::kShuffled) {
    std::vector<std::vector<std::int64_t>> orders(T::kDepths);
    for (int d = 0; d <= kDeepest; ++d) {
      auto& order = orders[static_cast<std::size_t>(d)];
      for (std::int64_t n = 0; n < tree.tileCount(d); ++n) order.push_back(n);
      if (lie == Lie::kShuffled)
        std::shuffle(order.begin(), order.end(), random);
      else if (order.size() > 1)
        std::swap(order.front(), order.back());
    }
    tree.permute(orders.data());
  }
  return tree;
}

// A source's tiles are found by parents or by themselves, as they lie.
TYPED_TEST(Refine, NewTilesLieInTheOrderOfTheSourceHoweverItsTilesLie) {
  for (Lie const lie :
       {Lie::kByParents, Lie::kGrown, Lie::kSwapped, Lie::kShuffled, Lie::kWithHoles, Lie::kWithRoots}) {
    for (std::uint32_t seed = 1; seed < 4; ++seed) {
      SCOPED_TRACE(std::to_string(static_cast<int>(lie)) + ", " + std::to_string(seed));
      Container<TypeParam> const source = cluster<TypeParam>(seed, lie);
      Container<TypeParam> tree = cluster<TypeParam>(seed + 10, Lie::kGrown), before = tree;
      auto const find = std::as_const(before).tileAccessor();
      typename Container<TypeParam>::TileLists made;
      withThreads(static_cast<int>(1 + seed % 2), [&] { tree.refine({&source}, &made, true); });
      for (int d = 0; d <= TypeParam::kMaxDepth; ++d) {
        std::vector<int3> missing;
        for (std::int64_t n = 0; n < source.tileCount(d); ++n) {
          auto const& t = source.tile(n, d);
          if (t.valid() && find.treeIndex(t.ti(), t.tj(), t.tk(), d, false).depth != d)
            missing.push_back(t.tijk());
        }
        auto const& list = made[static_cast<std::size_t>(d)];
        ASSERT_EQ(static_cast<std::size_t>(list.size()), missing.size());
        ASSERT_TRUE(std::equal(missing.begin(), missing.end(), list.begin()));
        std::int64_t const first = before.tileCount(d);
        for (std::size_t n = 0; n < missing.size(); ++n)
          ASSERT_EQ(tree.tile(first + static_cast<std::int64_t>(n), d).tijk(), missing[n]);
      }
      EXPECT_TRUE(tree.checkConsistency(false));
      EXPECT_TRUE(tree.checkBranchSizes(false));
    }
  }
}

TYPED_TEST(Refine, BranchSizesOfOldTilesAreSetToo) {
  Container<TypeParam> tree;
  this->addRow(tree, 20);
  for (auto t = tree.beginTiles(); t != tree.endTiles(); ++t) t->setBranchSize(-1);
  Container<TypeParam> source;
  this->addRow(source, 20, 10);
  tree.refine({&source}, nullptr, true);
  EXPECT_TRUE(tree.checkBranchSizes(false));
  for (auto t = tree.cbeginTiles(); t != tree.cendTiles(); ++t) EXPECT_GT((*t).branchSize(), 0);
}

// Whoever had tiles to write may have changed any size, also of the tree that this one is a copy of.
TYPED_TEST(Refine, BranchSizesThatATraversalWroteAreSetInCopiesToo) {
  struct Writer : Visitor<Container<TypeParam>> {
    using Visitor<Container<TypeParam>>::beginTile;
    void beginTile(typename Container<TypeParam>::TileType& t) override { t.setBranchSize(-1); }
    Writer* clone() const override { return new Writer; }
  } writer;
  Container<TypeParam> tree;
  this->addRow(tree, 20);
  tree.traverse(writer, kParallelFlat);
  Container<TypeParam> copy(tree);
  Container<TypeParam> source;
  this->addRow(source, 20, 10);
  copy.refine({&source}, nullptr, true);
  EXPECT_TRUE(copy.checkBranchSizes(false));
  EXPECT_EQ(tree.tile(0, TypeParam::kMaxDepth).branchSize(), -1);
}

TYPED_TEST(Refine, BranchSizesAreSetOnceAtTheEnd) {
  auto const a = this->randomTree(5, 120), b = this->randomTree(6, 120);
  Container<TypeParam> tree;
  tree.refine({&a, &b}, nullptr, true);
  EXPECT_TRUE(tree.checkBranchSizes(false));

  Container<TypeParam> stale;
  stale.refine({&a, &b}, nullptr, false);
  EXPECT_TRUE(stale.checkConsistency(false));
  EXPECT_FALSE(stale.checkBranchSizes(false)) << "nobody asked for them";
  stale.refine({&a}, nullptr, true);
  EXPECT_TRUE(stale.checkBranchSizes(false));
}

TYPED_TEST(Refine, ANegativeErrorIsStoredAsZero) {
  Container<TypeParam> tree;
  EXPECT_EQ(tree.maxRelativeRefinementError(), 0.0f);
  tree.setMaxRelativeRefinementError(0.25f);
  Container<TypeParam> const copy = tree;
  EXPECT_EQ(copy.maxRelativeRefinementError(), 0.25f);
  tree.setMaxRelativeRefinementError(-0.25f);
  EXPECT_EQ(tree.maxRelativeRefinementError(), 0.0f);
}

TYPED_TEST(Refine, TheOrderOfSourcesDoesNotMatter) {
  for (std::uint32_t seed = 10; seed < 20; ++seed) {
    auto const a = this->randomTree(seed, 60), b = this->randomTree(seed + 100, 60),
               c = this->randomTree(seed + 200, 3);
    Container<TypeParam> abc, cba;
    abc.refine({&a, &b, &c}, nullptr, true);
    cba.refine({&c, &b, &a}, nullptr, true);
    this->expectSame(abc, this->modelOf(cba));
    ASSERT_FALSE(this->HasFailure()) << seed;
  }
}

TYPED_TEST(Refine, AFormerRootHangsBelowANewTileThatHoldsIt) {
  using M = TreeModel<TypeParam>;
  Container<TypeParam> tree, source;
  VoxelCoord const fine = M::holder({0, 0, 0}, 6), coarse = M::holder({0, 0, 0}, 2);
  tree.tileAccessor().addTile(fine);
  source.tileAccessor().addTile(coarse);
  typename Container<TypeParam>::TileLists made;
  tree.refine({&source}, &made, true);
  EXPECT_EQ(tree.rootCount(), 1);
  EXPECT_EQ(tree.cbeginRoots()->first, coarse);
  EXPECT_EQ(tree.tileCount(-1), 5); // tiles between at 3, 4 and 5
  for (std::size_t d : {2, 3, 4, 5}) EXPECT_EQ(made[d].size(), 1u) << d;
  EXPECT_TRUE(made[6].empty());
  EXPECT_TRUE(tree.checkConsistency(false));
  EXPECT_TRUE(tree.checkBranchSizes(false));
}

TYPED_TEST(Refine, AFormerRootIsFoundWhileItsNewAncestorsArrive) {
  using M = TreeModel<TypeParam>;
  Container<TypeParam> tree, source;
  VoxelCoord const fine = M::holder({0, 0, 0}, 6);
  tree.tileAccessor().addTile(fine);
  auto accessor = source.tileAccessor();
  for (int d = 2; d <= 6; ++d) accessor.addTile(M::holder({0, 0, 0}, d));
  tree.refine({&source}, nullptr, true);
  EXPECT_EQ(tree.tileCount(-1), 5) << "a tile was made twice";
  EXPECT_EQ(tree.rootCount(), 1);
  EXPECT_TRUE(tree.checkConsistency(false));
}

TYPED_TEST(Refine, ANearbyRootThatIsNotInsideStaysARoot) {
  // One voxel width below the new tile's corner: division that truncates would take it for a descendant.
  using M = TreeModel<TypeParam>;
  VoxelCoord const coarse = M::holder({0, 0, 0}, 3);
  VoxelCoord const beside = M::holder({coarse.i - 1, coarse.j, coarse.k}, 5);
  Container<TypeParam> tree, source;
  tree.tileAccessor().addTile(beside);
  source.tileAccessor().addTile(coarse);
  tree.refine({&source}, nullptr, true);
  EXPECT_EQ(tree.rootCount(), 2);
  EXPECT_EQ(tree.tileCount(-1), 2);
}

TYPED_TEST(Refine, ASourcesRootBelowACoarserTileHangsThere) {
  using M = TreeModel<TypeParam>;
  Container<TypeParam> tree, source;
  tree.tileAccessor().addTile(M::holder({0, 0, 0}, 2));
  source.tileAccessor().addTile(M::holder({0, 0, 0}, 6));
  for (int times = 0; times < 2; ++times) {
    tree.refine({&source}, nullptr, true);
    EXPECT_EQ(tree.rootCount(), 1) << "roots must not overlap";
    EXPECT_EQ(tree.tileCount(-1), 5);
    EXPECT_TRUE(tree.checkConsistency(false));
    EXPECT_TRUE(tree.checkBranchSizes(false));
  }
}

TYPED_TEST(Refine, AScratchContainerBringsItsFirstTile) {
  Container<TypeParam> tree;
  auto* scratch = tree.threadLocalContainer(0);
  scratch->tileAccessor().addTile(5, 5, 5, 3);
  Container<TypeParam> target;
  target.tileAccessor().addTile(-5, -5, -5, 4);
  target.refine({scratch}, nullptr, true);
  EXPECT_EQ(target.rootCount(), 1);
  EXPECT_EQ(target.rootCount(0), 1);
  EXPECT_TRUE(target.checkConsistency(false));
  tree.freeThreadLocalContainer(scratch);
}

TYPED_TEST(Refine, DerivedCachesAreDropped) {
  auto tree = this->randomTree(7, 30);
  tree.precomputeTileNeighbors();
  tree.precomputeTileHalos();
  auto const source = this->randomTree(8, 30);
  tree.refine({&source}, nullptr, true);
  EXPECT_EQ(tree.neighborData(), nullptr);
  EXPECT_EQ(tree.tileHalo({0, tree.cbeginRoots()->first.depth}), nullptr);
}

TYPED_TEST(Refine, BytesAreEqualAtAnyNumberOfThreads) {
  Container<TypeParam> a, b;
  this->addRow(a, 3000);
  this->addRow(b, 3000, -2000);
  auto const c = this->randomTree(9, 1000);
  std::vector<std::int64_t> first;
  for (int const threads : {1, 2, 8}) {
    Container<TypeParam> tree;
    withThreads(threads, [&] { tree.refine({&a, &c, &b}, nullptr, true); });
    auto const contents = treeContents(tree);
    if (first.empty()) first = contents;
    EXPECT_EQ(contents, first) << threads;
  }
}

/// Sets the host's answer for the life of a scope.
struct CancelledJob {
  CancelledJob() { Ostil::setJobCancelled(true); }
  ~CancelledJob() { Ostil::setJobCancelled(false); }
};
struct ArmedCanceller {
  explicit ArmedCanceller(Canceller::ID id) { Canceller::setCancelID(id); }
  ~ArmedCanceller() { Canceller::setCancelID(Canceller::kNone); }
};

TYPED_TEST(Refine, ACancelledJobThrowsAndLeavesAWholeTree) {
  auto tree = this->randomTree(10, 100);
  auto const source = this->randomTree(11, 500);
  auto const before = this->modelOf(tree);
  for (bool const byHost : {true, false}) {
    std::string message;
    try {
      if (byHost) {
        CancelledJob const cancelled;
        tree.refine({&source}, nullptr, true);
      } else {
        ArmedCanceller const armed(Canceller::kRefine);
        tree.refine({&source}, nullptr, true);
      }
    } catch (std::runtime_error const& e) { message = e.what(); }
    EXPECT_EQ(message, exceptionMessage);
    EXPECT_TRUE(tree.checkConsistency(false)) << "half-linked tiles";
    for (VoxelCoord const& at : before.tiles()) EXPECT_TRUE(tree.tileAccessor().tile(at, true).valid()) << at;
  }
  tree.refine({&source}, nullptr, true); // and goes on where it stopped
  auto const wanted = this->modelOf(source);
  for (VoxelCoord const& at : wanted.tiles()) EXPECT_TRUE(tree.tileAccessor().tile(at, true).valid()) << at;
  EXPECT_TRUE(tree.checkConsistency(false));
  EXPECT_TRUE(tree.checkBranchSizes(false));
}

TYPED_TEST(Refine, TilesAtTheEndsOfTheDomain) {
  using M = TreeModel<TypeParam>;
  constexpr int low = TypeParam::kMinTileCoord, high = TypeParam::kMaxTileCoord;
  Container<TypeParam> source, tree;
  auto accessor = source.tileAccessor();
  for (int const i : {low, high}) {
    for (int const j : {low, high}) {
      for (int const k : {low, high}) {
        accessor.addTile(i, j, k, TypeParam::kMaxDepth);
        accessor.addTile(M::holder({i, j, k}, TypeParam::kMaxDepth - 3));
      }
    }
  }
  tree.refine({&source}, nullptr, true);
  this->expectSame(tree, this->modelOf(source));
  Container<TypeParam> whole;
  whole.tileAccessor().addTile(0, 0, 0, 0);
  tree.refine({&whole}, nullptr, true);
  EXPECT_EQ(tree.rootCount(), 1);
  EXPECT_TRUE(tree.checkConsistency(false));
  EXPECT_TRUE(tree.checkBranchSizes(false));
}

TYPED_TEST(Refine, BulkAdditionLeavesOutPointsOutOfTheDomainAndDuplicates) {
  Container<TypeParam> tree;
  typename TestFixture::Lists lists, made;
  auto& deepest = lists[TypeParam::kMaxDepth];
  for (int n = 0; n < 200; ++n) deepest.append({n % 20, 0, 0});
  deepest.append({TypeParam::kMinTileCoord - 1, 0, 0});
  deepest.append({0, TypeParam::kMaxTileCoord + 1, 0});
  tree.tileAccessor().addTiles(lists, &made);
  typename TreeModel<TypeParam>::Set expected;
  for (int n = 0; n < 20; ++n) expected.insert(TreeModel<TypeParam>::holder({n, 0, 0}, TypeParam::kMaxDepth));
  TreeModel<TypeParam> model;
  model.add(expected);
  this->expectSame(tree, model);
  EXPECT_EQ(made[TypeParam::kMaxDepth].size(), expected.size());
  EXPECT_TRUE(tree.checkBranchSizes(false));
}

} // namespace
