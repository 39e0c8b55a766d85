// Random mixed-depth forests against the brute-force model: shape, roots, counts, lookups, neighbours and
// branch sizes, with each combination of the derived caches.
#include "support/CaptureStream.h"
#include "support/Print.h"
#include "support/RandomForest.h"
#include "support/Shapes.h"

#include <gtest/gtest.h>

#include <limits>
#include <map>
#include <thread>
#include <utility>
#include <vector>

using namespace VLN::TileTree3D;
using Support::Access;
using Support::RandomForest;

VLN_SHAPE_SUITE(ForestModel);

namespace {

template <class T> using Forest = RandomForest<T>;

template <class TileT> VoxelCoord coordOf(TileT const& t) {
  return t.valid() ? t.voxelCoord() : VoxelCoord{};
}

/// Records, links, roots and counts of the tree are those of the model.
template <class T> void expectSameShape(Container<T> const& tree, Support::ForestModel<T> const& model) {
  std::int64_t total = 0;
  std::set<VoxelCoord> found;
  for (int d = 0; d <= T::kMaxDepth; ++d) {
    ASSERT_EQ(tree.tileCount(d), model.count(d)) << "depth " << d;
    total += tree.tileCount(d);
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
      auto const& t = tree.tile(n, d);
      ASSERT_TRUE(t.valid());
      ASSERT_EQ(t.treeIndex(), (TreeIndex{n, d}));
      ASSERT_TRUE(model.has(t.voxelCoord())) << t.voxelCoord();
      ASSERT_TRUE(found.insert(t.voxelCoord()).second) << "twice: " << t.voxelCoord();
      auto const parent = model.parent(t.voxelCoord());
      ASSERT_EQ(t.isRoot(), !parent) << t.voxelCoord();
      if (parent) {
        auto const& above = tree.tile(t.parentTreeIndex());
        ASSERT_EQ(above.voxelCoord(), *parent);
        ASSERT_EQ(above.childTreeIndex(t), t.treeIndex());
      }
      if (!t.atMaxDepth()) {
        for (int slot = 0; slot < T::kTileSize; ++slot) {
          int3 const corner = t.childTIJK(t.childIJK(slot));
          VoxelCoord const child{corner.x, corner.y, corner.z, d + 1};
          ASSERT_EQ(t.isLeaf(slot), !model.has(child)) << t.voxelCoord() << " slot " << slot;
          if (!t.isLeaf(slot)) { ASSERT_EQ(tree.tile(t.childTreeIndex(slot)).voxelCoord(), child); }
        }
      }
    }
  }
  ASSERT_EQ(tree.tileCount(-1), total);
  auto const roots = model.roots();
  ASSERT_EQ(tree.rootCount(), static_cast<std::int64_t>(roots.size()));
  std::map<int, std::int64_t> rootsOfDepth;
  auto expected = roots.begin();
  for (auto root = tree.cbeginRoots(); root != tree.cendRoots(); ++root, ++expected) {
    ASSERT_EQ(root->first, *expected) << "roots go by corner i, j, k and then by depth";
    ASSERT_EQ(tree.tile(root->second).voxelCoord(), *expected);
    ++rootsOfDepth[root->first.depth];
  }
  for (int d = 0; d <= T::kMaxDepth; ++d) ASSERT_EQ(tree.rootCount(d), rootsOfDepth[d]);
}

/// Lookups through the container and through accessors give the model's answer.
template <class T> void expectSameLookups(Forest<T>& forest, int count) {
  auto const& tree = std::as_const(forest.tree());
  auto const walking = tree.tileAccessor();
  for (int n = 0; n < count; ++n) {
    int3 const p = forest.point();
    int const d = forest.pick(0, 5) == 0 ? forest.pick(0, T::kMaxDepth) : forest.depth();
    auto const expected = forest.model().find(p, d);
    VoxelCoord const deepest = expected.value_or(VoxelCoord{});
    VoxelCoord const exact = expected && expected->depth == d ? *expected : VoxelCoord{};
    TreeIndex const at = Access::tileIndex(tree, p, d);
    ASSERT_EQ(at.valid() ? coordOf(tree.tile(at)) : VoxelCoord{}, deepest) << p << " depth " << d;
    ASSERT_EQ(coordOf(Access::tile(tree, p, d)), deepest) << p << " depth " << d;
    ASSERT_EQ(coordOf(walking.tile(p, d, false)), deepest) << p << " depth " << d;
    ASSERT_EQ(coordOf(walking.tile(p, d, true)), exact) << p << " depth " << d;
    ASSERT_EQ(coordOf(walking.tile(VoxelCoord{p.x, p.y, p.z, d}, n % 2 == 0)), n % 2 ? deepest : exact);
    ASSERT_EQ(walking.treeIndex(p.x, p.y, p.z, d, false), at);
    if (n % 8 == 0) {
      ASSERT_EQ(coordOf(tree.tileAccessor().tile(p, d, true)), exact) << p << " depth " << d;
    }
  }
  for (int extreme : {std::numeric_limits<int>::min(), T::kMinTileCoord - 1, T::kMaxTileCoord + 1,
                      std::numeric_limits<int>::max()}) {
    for (int axis = 0; axis < 3; ++axis) {
      int3 p = forest.point();
      p[axis] = extreme;
      int const d = forest.depth();
      ASSERT_FALSE(Access::tileIndex(tree, p, d).valid()) << p;
      ASSERT_FALSE(walking.tile(p, d, false).valid()) << p;
      ASSERT_FALSE(walking.tile(p, d, true).valid()) << p;
    }
  }
}

template <class T> void expectSameNeighbors(Forest<T>& forest) {
  auto const& tree = std::as_const(forest.tree());
  auto const accessor = tree.tileAccessor();
  std::int64_t const total = tree.tileCount(-1);
  for (int n = 0; n < 30 && total > 0; ++n) {
    auto const& t = tree.tile(static_cast<std::int64_t>(forest.pick(0, static_cast<int>(total) - 1)));
    for (int dir = 0; dir < kNeighborCount; ++dir) {
      auto const expected = forest.model().beside(t.voxelCoord(), neighborOffset(dir));
      auto const direction = static_cast<NeighborDirection>(dir);
      ASSERT_EQ(coordOf(accessor.tileNeighbor(t, direction)), expected.value_or(VoxelCoord{}))
          << t.voxelCoord() << " direction " << dir;
      TreeIndex const at = accessor.treeIndexNeighbor(t, direction);
      ASSERT_EQ(at.valid(), expected.has_value());
      if (expected) { ASSERT_EQ(tree.tile(at).voxelCoord(), *expected); }
      if (auto const* table = tree.neighborData()) {
        ASSERT_EQ((*table)[static_cast<std::size_t>(t.depth())][static_cast<std::size_t>(t.index())]
                          [static_cast<std::size_t>(dir)],
                  at);
      }
    }
  }
}

template <class T> void expectSameBranchSizes(Forest<T>& forest) {
  auto const& tree = std::as_const(forest.tree());
  for (int d = 0; d <= T::kMaxDepth; ++d) {
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
      auto const& t = tree.tile(n, d);
      ASSERT_EQ(t.branchSize(), forest.model().branch(t.voxelCoord()) * T::kTileSize) << t.voxelCoord();
    }
  }
}

template <class T> void run(std::uint32_t seed) {
  SCOPED_TRACE("seed " + std::to_string(seed));
  Forest<T> forest(seed);
  for (int batch = 0; batch < 4; ++batch) {
    int const additions = forest.pick(1, batch == 0 ? 4 : 14);
    for (int n = 0; n < additions; ++n) forest.grow();
    expectSameShape<T>(forest.tree(), forest.model());
    if (::testing::Test::HasFatalFailure()) return;
    ASSERT_TRUE(forest.tree().checkConsistency(false));
    for (int caches = 0; caches < 4; ++caches) {
      SCOPED_TRACE("caches " + std::to_string(caches));
      if (caches & 1) forest.tree().buildAccessorAccelerationStructure(forest.depth());
      if (caches & 2) forest.tree().precomputeTileNeighbors();
      expectSameLookups(forest, 150);
      if (::testing::Test::HasFatalFailure()) return;
      if (caches != 1) expectSameNeighbors(forest);
      if (::testing::Test::HasFatalFailure()) return;
      forest.tree().clearAccessorAccelerationStructure();
      forest.tree().clearPrecomputedTileNeighbors();
    }
    Access::setBranchSizes(forest.tree());
    expectSameBranchSizes(forest);
    if (::testing::Test::HasFatalFailure()) return;
    ASSERT_TRUE(forest.tree().checkBranchSizes(false));
    forest.tree().buildAccessorAccelerationStructure(T::kMaxDepth);
    if (batch % 2) forest.tree().precomputeTileNeighbors();
  }
}

} // namespace

// requirement
TYPED_TEST(ForestModel, RandomForestsAgreeWithTheModel) {
  for (std::uint32_t seed = 1; seed <= 60; ++seed) {
    run<TypeParam>(seed);
    if (this->HasFatalFailure()) break;
  }
}

// requirement: the cursor of one accessor stays right while others make the tree grow
TYPED_TEST(ForestModel, CursorsSurviveGrowthThroughOtherAccessors) {
  using T = TypeParam;
  for (std::uint32_t seed = 1; seed <= 10; ++seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    Forest<T> forest(1000 + seed);
    auto const reader = std::as_const(forest.tree()).tileAccessor();
    for (int n = 0; n < 60; ++n) {
      forest.grow();
      for (int q = 0; q < 5; ++q) {
        int3 const p = forest.point();
        int const d = forest.depth();
        ASSERT_EQ(coordOf(reader.tile(p, d, false)), forest.model().find(p, d).value_or(VoxelCoord{}))
            << p << " depth " << d << " after " << n;
      }
    }
  }
}

// requirement: copies taken while the forest grows keep the shape of their moment
TYPED_TEST(ForestModel, SnapshotsKeepTheShapeOfTheirMoment) {
  using T = TypeParam;
  for (std::uint32_t seed = 1; seed <= 8; ++seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    Forest<T> forest(2000 + seed);
    std::vector<std::pair<Container<T>, Support::ForestModel<T>>> snapshots;
    for (int n = 0; n < 40; ++n) {
      forest.grow();
      if (n % 8 == 3) snapshots.emplace_back(forest.tree(), forest.model());
      if (n % 8 == 5) { // and one that goes its own way
        auto& [tree, model] = snapshots.back();
        int3 const p = forest.point();
        Access::addTile(tree, p, forest.minDepth());
        model.add(p, forest.minDepth());
      }
    }
    expectSameShape<T>(forest.tree(), forest.model());
    for (auto const& [tree, model] : snapshots) {
      expectSameShape<T>(tree, model);
      EXPECT_TRUE(tree.checkConsistency(false));
    }
    if (this->HasFatalFailure()) return;
  }
}

// requirement: readers run side by side, each with an accessor of its own
TYPED_TEST(ForestModel, ThreadsReadSideBySide) {
  using T = TypeParam;
  Forest<T> forest(3001);
  for (int n = 0; n < 25; ++n) forest.grow();
  auto const& tree = std::as_const(forest.tree());
  std::vector<std::pair<VoxelCoord, TreeIndex>> questions;
  for (int n = 0; n < 500; ++n) {
    int3 const p = forest.point();
    int const d = forest.depth();
    questions.push_back({{p.x, p.y, p.z, d}, Access::tileIndex(tree, p, d)});
  }
  for (bool caches : {false, true}) {
    if (caches) {
      forest.tree().precomputeTileNeighbors();
      forest.tree().buildAccessorAccelerationStructure(T::kMaxDepth);
    }
    std::vector<std::thread> threads;
    for (std::size_t t = 0; t < 4; ++t) {
      threads.emplace_back([&, t] {
        auto const accessor = tree.tileAccessor();
        for (std::size_t n = 0; n < questions.size(); ++n) {
          auto const& [at, expected] = questions[(n * (t + 1) + t) % questions.size()];
          EXPECT_EQ(accessor.tile(at, false).treeIndex(), expected) << at;
        }
      });
    }
    for (auto& thread : threads) thread.join();
  }
}
