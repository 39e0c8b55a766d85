// The traversal engine: every mode, range and form against a plain reading of the rules.
#include "support/Print.h"
#include "support/RecordingVisitor.h"
#include "support/Shapes.h"

#include "GeometryVolume/core/Parallel.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <limits>
#include <map>
#include <set>
#include <tuple>
#include <utility>
#include <vector>

using namespace VLN::TileTree3D;
using Support::Access;
using Support::Event;
using Support::ExpectedTraversal;
using Support::RecordingVisitor;

VLN_SHAPE_SUITE(Traversal);

namespace {

constexpr bool isParallel(int mode) { return mode >= 4 && mode <= 8; }

/// Roots at several depths, a bushy branch down to the deepest depth, and dead tiles at three places.
template <class T> Container<T> sample() {
  Container<T> tree;
  int const deep = T::kMaxDepth;
  Access::addTile(tree, {T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxTileCoord}, 3);
  Access::addTile(tree, {T::kMinTileCoord, T::kMaxTileCoord, 0}, 2);
  Access::addTile(tree, {T::kMinTileCoord, 0, 0}, deep);
  TreeIndex const deadDeep = Access::addTile(tree, {T::kMinTileCoord, 0, T::kMinTileCoord}, deep);
  TreeIndex const deadRoot = Access::addTile(tree, {0, T::kMaxTileCoord, T::kMaxTileCoord}, 3);
  int const w = T::width(deep - 2);
  int3 const base{T::align(0, deep - 2), T::align(0, deep - 2), T::align(0, deep - 2)};
  auto accessor = tree.tileAccessor();
  accessor.addTile(base, deep - 2);
  accessor.addTile(base + int3{w, 0, 0}, deep - 2);
  int const v = T::width(deep - 1), u = T::width(deep);
  accessor.addTile(base + int3{v, v, 0}, deep - 1);
  TreeIndex const deadChild = accessor.addTile(base + int3{0, v, v}, deep - 1).treeIndex();
  for (int n = 0; n < 4; ++n) accessor.addTile(base + int3{n % 2 * u, n / 2 * u, u}, deep);
  accessor.addTile(base, deep - 3);
  Access::setBranchSizes(tree);
  for (TreeIndex const& at : {deadDeep, deadRoot, deadChild}) Access::killLeafTile(tree, at);
  return tree;
}

std::string describe(int mode, TraversalRange const& r) {
  std::ostringstream os;
  os << "mode " << mode << " start " << r.start << " depths " << r.minDepth << ".." << r.maxDepth
     << " voxels " << r.voxelBegin << ".." << r.voxelEnd << " interior " << r.interior << " grain "
     << r.grain;
  return os.str();
}

using Key = std::tuple<int, std::int64_t>;
Key keyOf(TreeIndex const& at) { return {at.depth, at.index}; }

/// Events of each tile in the order in which they came.
std::map<Key, std::vector<Event>> byTile(std::vector<Event> const& events) {
  std::map<Key, std::vector<Event>> tiles;
  for (Event const& e : events) {
    if (e.kind != 'B' && e.kind != 'E') tiles[keyOf(e.at)].push_back(e);
  }
  return tiles;
}

/// The log of a parallel pass: the expected calls for each tile in their order, the mode's barriers, and one
/// thread for each tile.
template <class T>
void checkParallel(Container<T> const& tree, int mode, Support::EventLog const& log,
                   std::vector<Event> const& expected) {
  ASSERT_EQ(byTile(log.events), byTile(expected));
  std::map<Key, std::thread::id> threadOf;
  std::map<Key, std::pair<std::size_t, std::size_t>> span;
  int depth = -1;
  for (std::size_t n = 0; n < log.events.size(); ++n) {
    Event const& e = log.events[n];
    if (e.kind == 'B' || e.kind == 'E') continue;
    if (e.kind == 'b') span[keyOf(e.at)].first = n;
    if (e.kind == 'e') span[keyOf(e.at)].second = n;
    if (mode == 6) continue;
    auto const [thread, isNew] = threadOf.try_emplace(keyOf(e.at), log.threads[n]);
    ASSERT_EQ(thread->second, log.threads[n]) << "one thread for each tile";
    if (mode != 7) {
      if (depth >= 0) {
        ASSERT_TRUE(mode == 5 ? e.at.depth <= depth : e.at.depth >= depth) << "a barrier after each depth";
      }
      depth = e.at.depth;
    }
  }
  if (mode != 6) return;
  for (auto const& [key, events] : byTile(log.events)) {
    auto const parent = span.find(keyOf(tree.tile({std::get<1>(key), std::get<0>(key)}).parentTreeIndex()));
    if (parent == span.end()) continue;
    ASSERT_LT(parent->second.first, span[key].first) << "a parent begins before its children";
    ASSERT_GT(parent->second.second, span[key].second) << "and ends after them";
  }
}

template <class T, class ContainerRef>
void checkOne(ContainerRef& tree, int mode, TraversalRange const& range, int threads, bool reduce = false) {
  SCOPED_TRACE(describe(mode, range) + " threads " + std::to_string(threads));
  RecordingVisitor<T> visitor;
  VLN::withThreads(threads, [&] {
    if (reduce)
      tree.reduce(visitor, static_cast<TraversalMode>(mode), range);
    else
      tree.traverse(visitor, static_cast<TraversalMode>(mode), range);
  });
  auto const& log = visitor.log();
  ExpectedTraversal<T> const expected(tree, mode, range);
  ASSERT_GE(log.events.size(), 2u);
  ASSERT_EQ(log.events.front().kind, 'B');
  ASSERT_EQ(log.events.back().kind, 'E');
  ASSERT_EQ(std::count_if(log.events.begin(), log.events.end(),
                          [](Event const& e) { return e.kind == 'B' || e.kind == 'E'; }),
            2);
  bool const writes = !std::is_const_v<ContainerRef>;
  for (std::size_t n = 1; n + 1 < log.events.size(); ++n) ASSERT_EQ(log.writable[n], writes);
  if (isParallel(mode)) {
    checkParallel<T>(tree, mode, log, expected.events());
  } else {
    std::vector<Event> const inner(log.events.begin() + 1, log.events.end() - 1);
    ASSERT_EQ(inner, expected.events());
    ASSERT_EQ(log.clones, 0) << "serial modes use the visitor itself";
  }
}

} // namespace

// requirement: ten modes, starts, depth ranges, voxel ranges, interior modes, both forms, three thread counts
TYPED_TEST(Traversal, EveryCombinationVisitsWhatTheRulesSay) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  TreeIndex dead{};
  for (std::int64_t n = 0; n < tree.tileCount(T::kMaxDepth); ++n) {
    if (!tree.tile(n, T::kMaxDepth).valid()) dead = {n, T::kMaxDepth};
  }
  ASSERT_TRUE(dead.valid());
  auto const bushy = Access::tileIndex(tree, {0, 0, 0}, T::kMaxDepth - 3);
  auto const middle = Access::tileIndex(tree, {0, 0, 0}, T::kMaxDepth - 2);
  TreeIndex const starts[] = {{}, bushy, middle, {0, T::kMaxDepth}, dead};
  std::pair<int, int> const depths[] = {{0, 1 << 20},
                                        {-7, T::kMaxDepth},
                                        {3, T::kMaxDepth - 1},
                                        {T::kMaxDepth - 2, T::kMaxDepth},
                                        {T::kMaxDepth, T::kMaxDepth + 9},
                                        {4, 3},
                                        {T::kMaxDepth + 1, T::kMaxDepth + 2},
                                        {-5, -1}};
  std::pair<int, int> const voxels[] = {{0, 1 << 20}, {0, T::kTW}, {1, 2}, {1, 1}, {0, T::kTW - 1}};
  int round = 0;
  for (int mode = 0; mode <= 9; ++mode) {
    for (TreeIndex const& start : starts) {
      for (auto const& [minDepth, maxDepth] : depths) {
        for (auto const& [voxelBegin, voxelEnd] : voxels) {
          for (auto interior : {kVisitAllDepths, kSkipMaxDepth}) {
            ++round;
            if (T::kTW == 5 && round % 5) continue; // 125 voxels a tile
            TraversalRange range;
            range.start = start;
            range.minDepth = minDepth, range.maxDepth = maxDepth;
            range.voxelBegin = voxelBegin, range.voxelEnd = voxelEnd;
            range.interior = interior;
            range.grain = static_cast<std::uint64_t>(round % 4);
            range.useAffinity = round % 3 != 0;
            int const threads = isParallel(mode) ? (round % 3 == 0 ? 1 : round % 3 == 1 ? 2 : 8) : 1;
            if (round % 2)
              checkOne<T>(tree, mode, range, threads);
            else
              checkOne<T>(std::as_const(tree), mode, range, threads, round % 4 == 0);
            if (this->HasFatalFailure()) return;
          }
        }
      }
    }
  }
  EXPECT_EQ(Access::affinityUse(tree), 0);
}

// requirement: with all threads at work on a larger tree
TYPED_TEST(Traversal, ParallelModesVisitEachTileOnceAtAnyNumberOfThreads) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTiles({0, 0, 0}, {50, 50, 50}, T::kMaxDepth);
  accessor.addTile(0, 0, 0, T::kMaxDepth - 6);
  accessor.addTiles({T::kMinTileCoord, 0, 0}, {T::kMinTileCoord + 20, 20, 20}, T::kMaxDepth);
  Access::setBranchSizes(tree);
  for (int mode : {4, 5, 6, 7, 8}) {
    for (int threads : {1, 2, 8}) {
      TraversalRange range;
      range.voxelEnd = 1;
      for (std::uint64_t grain : {1, 3, 100}) {
        range.grain = grain;
        checkOne<T>(std::as_const(tree), mode, range, threads);
        if (this->HasFatalFailure()) return;
      }
      range.maxParallelDepth = 0;
      checkOne<T>(tree, mode, range, threads, true);
      if (this->HasFatalFailure()) return;
    }
  }
}

// boundary
TYPED_TEST(Traversal, EmptyContainerIsBegunAndEndedOnce) {
  using T = TypeParam;
  Container<T> tree;
  for (int mode = 0; mode <= 9; ++mode) {
    RecordingVisitor<T> visitor;
    tree.traverse(visitor, static_cast<TraversalMode>(mode));
    EXPECT_EQ(visitor.events(), (std::vector<Event>{{'B'}, {'E'}})) << mode;
    RecordingVisitor<T> reader;
    std::as_const(tree).reduce(reader, static_cast<TraversalMode>(mode));
    EXPECT_EQ(reader.events(), (std::vector<Event>{{'B'}, {'E'}})) << mode;
  }
}

// boundary
TYPED_TEST(Traversal, ModesWithoutAStartVisitNothingWhenGivenOne) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  TraversalRange range;
  range.start = tree.cbeginRoots()->second;
  for (int mode : {1, 5, 7, 8}) {
    RecordingVisitor<T> visitor;
    tree.traverse(visitor, static_cast<TraversalMode>(mode), range);
    EXPECT_EQ(visitor.events(), (std::vector<Event>{{'B'}, {'E'}})) << mode;
  }
}

// requirement
TYPED_TEST(Traversal, LeafModeIgnoresTheStart) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  TraversalRange range;
  RecordingVisitor<T> whole, started;
  tree.traverse(whole, kLeafVoxels, range);
  range.start = tree.cbeginRoots()->second;
  tree.traverse(started, kLeafVoxels, range);
  EXPECT_EQ(whole.events(), started.events());
}

// boundary: false prunes in the depth-first modes alone
TYPED_TEST(Traversal, PruningWorksInDepthFirstModesOnly) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  auto const keep = [](TreeIndex const& at, int3 const& ijk) { return (at.depth + ijk.x + ijk.y) % 2 == 0; };
  for (int mode = 0; mode <= 9; ++mode) {
    for (TreeIndex const& start : {TreeIndex{}, Access::tileIndex(tree, {0, 0, 0}, T::kMaxDepth - 3)}) {
      TraversalRange range;
      range.start = start;
      RecordingVisitor<T> visitor(keep);
      VLN::withThreads(2, [&] { tree.traverse(visitor, static_cast<TraversalMode>(mode), range); });
      ExpectedTraversal<T> const expected(tree, mode, range, keep);
      EXPECT_TRUE(byTile(visitor.events()) == byTile(expected.events())) << describe(mode, range);
      if (mode == 2 || mode == 6) {
        ExpectedTraversal<T> const all(tree, mode, range);
        EXPECT_LT(expected.events().size(), all.events().size()) << "the test must prune something";
      }
    }
  }
}

// boundary
TYPED_TEST(Traversal, BottomUpModesVisitTheDeepestDepthFirst) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  for (int mode : {1, 5}) {
    RecordingVisitor<T> visitor;
    tree.traverse(visitor, static_cast<TraversalMode>(mode));
    EXPECT_EQ(visitor.events()[1].at.depth, T::kMaxDepth) << mode;
  }
}

// requirement: roots come off the back of the list
TYPED_TEST(Traversal, DepthFirstTakesItsStartsFromTheBack) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  std::vector<TreeIndex> roots, begun;
  for (auto root = tree.cbeginRoots(); root != tree.cendRoots(); ++root) roots.push_back(root->second);
  RecordingVisitor<T> visitor;
  tree.traverse(visitor, kDepthFirst);
  for (Event const& e : visitor.events()) {
    if (e.kind == 'b' && tree.tile(e.at).isRoot()) begun.push_back(e.at);
  }
  std::reverse(begun.begin(), begun.end());
  EXPECT_EQ(begun, roots);
}

// requirement: visitors that do not override a call are not called
TYPED_TEST(Traversal, UnneededTileCallsAreSpared) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  for (int mode = 0; mode <= 9; ++mode) {
    for (int flags = 0; flags < 4; ++flags) {
      RecordingVisitor<T> visitor;
      visitor.setBeginTileOverridden(flags & 1);
      visitor.setEndTileOverridden(flags & 2);
      EXPECT_EQ(visitor.isBeginTileOverridden(), bool(flags & 1));
      tree.traverse(visitor, static_cast<TraversalMode>(mode));
      auto const count = [&](char kind) {
        return std::count_if(visitor.events().begin(), visitor.events().end(),
                             [&](Event const& e) { return e.kind == kind; });
      };
      EXPECT_EQ(count('b') > 0, bool(flags & 1)) << mode;
      EXPECT_EQ(count('e') > 0, bool(flags & 2)) << mode;
      EXPECT_GT(count('v'), 0) << mode;
    }
  }
}

// requirement: begin and end of the traversal run on the caller's thread and object
TYPED_TEST(Traversal, BeginAndEndRunOnTheCallersThread) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  for (int mode = 0; mode <= 9; ++mode) {
    RecordingVisitor<T> visitor;
    tree.traverse(visitor, static_cast<TraversalMode>(mode));
    EXPECT_EQ(visitor.log().threads.front(), std::this_thread::get_id());
    EXPECT_EQ(visitor.log().threads.back(), std::this_thread::get_id());
  }
}

// boundary: grains that no range can hold
TYPED_TEST(Traversal, HugeGrainsMeanOneChunk) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  for (std::uint64_t grain :
       {std::uint64_t(0), std::uint64_t(1) << 40, std::uint64_t(std::numeric_limits<std::int64_t>::max()),
        std::numeric_limits<std::uint64_t>::max()}) {
    for (int mode : {4, 5, 6, 7}) {
      for (auto interior : {kVisitAllDepths, kSkipMaxDepth}) {
        TraversalRange range;
        range.grain = grain;
        range.interior = interior;
        range.voxelEnd = 2;
        checkOne<T>(tree, mode, range, 2);
        checkOne<T>(tree, mode, range, 2, true);
        if (this->HasFatalFailure()) return;
      }
    }
  }
}

// boundary: extreme depths and voxel bounds are limited to the shape
TYPED_TEST(Traversal, ExtremeRangesAreLimited) {
  using T = TypeParam;
  int const lowest = std::numeric_limits<int>::min(), highest = std::numeric_limits<int>::max();
  Container<T> tree = sample<T>();
  TraversalRange extreme;
  extreme.minDepth = lowest, extreme.maxDepth = highest;
  extreme.voxelBegin = lowest, extreme.voxelEnd = highest;
  extreme.maxParallelDepth = lowest;
  for (int mode = 0; mode <= 9; ++mode) {
    RecordingVisitor<T> visitor, plain;
    tree.traverse(visitor, static_cast<TraversalMode>(mode), extreme);
    tree.traverse(plain, static_cast<TraversalMode>(mode));
    EXPECT_TRUE(byTile(visitor.events()) == byTile(plain.events())) << mode;
    TraversalRange none = extreme;
    none.minDepth = highest, none.maxDepth = lowest;
    RecordingVisitor<T> nothing;
    tree.traverse(nothing, static_cast<TraversalMode>(mode), none);
    EXPECT_EQ(nothing.events().size(), 2u) << mode;
  }
}
