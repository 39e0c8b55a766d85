// Traversals that join, stop, fail or run beside each other.
#include "support/Print.h"
#include "support/RecordingVisitor.h"
#include "support/Shapes.h"

#include "GeometryVolume/core/Canceller.h"
#include "GeometryVolume/core/Parallel.h"
#include "Ostil/Job.h"
#include "Velorn/ExceptionMessage.h"

#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

using namespace VLN::TileTree3D;
using Support::Access;
using Support::RecordingVisitor;

VLN_SHAPE_SUITE(TraversalControl);

namespace {

template <class T> Container<T> sample() {
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTiles({0, 0, 0}, {60, 60, 60}, T::kMaxDepth);
  accessor.addTile(0, 0, 0, T::kMaxDepth - 6);
  accessor.addTile(T::kMinTileCoord, 0, 0, 3);
  Access::setBranchSizes(tree);
  return tree;
}

/// Calls a function at each tile; nothing else.
template <class T> class CallingVisitor : public Visitor<Container<T>> {
public:
  using TileT = typename Container<T>::TileType;
  using Body = std::function<void(TileT const&)>;
  explicit CallingVisitor(Body body)
      : m_body(std::move(body)) {}
  void beginTile(TileT const& t) override { m_body(t); }
  void beginTile(TileT& t) override { m_body(t); }
  CallingVisitor* clone() const override { return new CallingVisitor(m_body); }

private:
  Body m_body;
};

/// Joins in an order that shows: a list of what was visited.
template <class T> class ListingVisitor : public Visitor<Container<T>> {
public:
  using TileT = typename Container<T>::TileType;
  using Visitor<Container<T>>::beginTile;
  void beginTile(TileT const& t) override { list.push_back(t.treeIndex()); }
  void join(Visitor<Container<T>> const& other) override {
    auto const& b = static_cast<ListingVisitor const&>(other).list;
    list.insert(list.end(), b.begin(), b.end());
    ++joins;
  }
  ListingVisitor* clone() const override { return new ListingVisitor; }

  std::vector<TreeIndex> list;
  int joins = 0;
};

struct JobCancelled {
  JobCancelled() { Ostil::setJobCancelled(true); }
  ~JobCancelled() { Ostil::setJobCancelled(false); }
};
struct Armed {
  explicit Armed(int id) { VLN::Canceller::setCancelID(id); }
  ~Armed() { VLN::Canceller::setCancelID(0); }
};

template <class F> std::string textThrownBy(F const& f) {
  try {
    f();
  } catch (std::runtime_error const& e) { return e.what(); }
  return "nothing was thrown";
}

} // namespace

// requirement: the joined result is the same list at any number of threads
TYPED_TEST(TraversalControl, JoinedResultsDoNotDependOnThreads) {
  using T = TypeParam;
  auto const tree = sample<T>();
  for (int mode : {4, 5, 6, 7, 8}) {
    for (bool withStart : {false, true}) {
      TraversalRange range;
      if (withStart) range.start = Access::tileIndex(tree, {0, 0, 0}, T::kMaxDepth - 6);
      std::vector<TreeIndex> first;
      for (int threads : {1, 2, 8, 8}) {
        ListingVisitor<T> visitor;
        VLN::withThreads(threads, [&] { tree.reduce(visitor, static_cast<TraversalMode>(mode), range); });
        bool const visits = !withStart || mode == 4 || mode == 6;
        EXPECT_EQ(visitor.joins > 0, visits) << mode;
        EXPECT_EQ(!visitor.list.empty(), visits) << mode;
        if (threads == 1) first = visitor.list;
        EXPECT_TRUE(visitor.list == first) << "mode " << mode << " threads " << threads;
      }
      if (!withStart) { EXPECT_EQ(static_cast<std::int64_t>(first.size()), tree.tileCount(-1)) << mode; }
    }
  }
}

// requirement: depth scans join in the order of the scan
TYPED_TEST(TraversalControl, JoinedScansKeepTheirOrder) {
  using T = TypeParam;
  auto const tree = sample<T>();
  for (auto [parallel, serial] : {std::pair{4, 0}, std::pair{5, 1}, std::pair{7, 0}, std::pair{8, 0}}) {
    ListingVisitor<T> a, b;
    tree.reduce(a, static_cast<TraversalMode>(parallel));
    tree.reduce(b, static_cast<TraversalMode>(serial));
    EXPECT_TRUE(a.list == b.list) << parallel;
    EXPECT_EQ(b.joins, 0) << "serial modes have nothing to join";
  }
}

// requirement
TYPED_TEST(TraversalControl, TraversalLeavesTheCopiesToTheCaller) {
  using T = TypeParam;
  auto const tree = sample<T>();
  for (int mode : {4, 5, 6, 7, 8}) {
    ListingVisitor<T> visitor;
    EXPECT_FALSE(visitor.hasVisitorCopies());
    EXPECT_EQ(visitor.visitorCopy(), nullptr);
    tree.traverse(visitor, static_cast<TraversalMode>(mode));
    EXPECT_TRUE(visitor.hasVisitorCopies()) << mode;
    EXPECT_TRUE(visitor.list.empty()) << mode;
    std::size_t count = 0;
    visitor.forEachCopy(
        [&](Visitor<Container<T>>& copy) { count += static_cast<ListingVisitor<T>&>(copy).list.size(); });
    EXPECT_EQ(static_cast<std::int64_t>(count), tree.tileCount(-1)) << mode;
  }
}

// requirement
TYPED_TEST(TraversalControl, VisitorCopiesAreMadeOncePerThreadAndFreedByTheOwner) {
  using T = TypeParam;
  static std::atomic<int> s_live{0};
  struct Counted : ListingVisitor<T> {
    Counted() { ++s_live; }
    ~Counted() override { --s_live; }
    Counted* clone() const override { return new Counted; }
  };
  {
    Counted visitor;
    visitor.forEachCopy([](auto&) { ADD_FAILURE() << "there is no copy"; });
    visitor.initVisitorCopies();
    visitor.initVisitorCopies();
    EXPECT_TRUE(visitor.hasVisitorCopies());
    auto* const own = visitor.visitorCopy();
    ASSERT_NE(own, nullptr);
    EXPECT_NE(own, &visitor);
    EXPECT_EQ(visitor.visitorCopy(), own);
    std::thread([&] { EXPECT_NE(visitor.visitorCopy(), own); }).join();
    EXPECT_EQ(s_live, 3);
    int copies = 0;
    visitor.forEachCopy([&](auto&) { ++copies; });
    EXPECT_EQ(copies, 2);
    EXPECT_EQ(visitor.getData(), nullptr);
    visitor.setParentData(nullptr);
    visitor.clearData();
  }
  EXPECT_EQ(s_live, 0);
}

// requirement: all operations but the clone have defaults that do nothing, and keep every child
TYPED_TEST(TraversalControl, VisitorsNeedNothingButTheirClone) {
  using T = TypeParam;
  struct Bare : Visitor<Container<T>> {
    Bare* clone() const override { return new Bare; }
  };
  Container<T> tree = sample<T>();
  for (int mode = 0; mode <= 9; ++mode) {
    Bare visitor;
    EXPECT_TRUE(visitor.isBeginTileOverridden());
    EXPECT_TRUE(visitor.isEndTileOverridden());
    EXPECT_NO_THROW(tree.traverse(visitor, static_cast<TraversalMode>(mode)));
    EXPECT_NO_THROW(std::as_const(tree).reduce(visitor, static_cast<TraversalMode>(mode)));
    auto& t = Access::editTile(tree, tree.cbeginRoots()->second);
    EXPECT_TRUE(visitor.visitInteriorVoxel(t, int3{0, 0, 0}));
    EXPECT_TRUE(visitor.visitInteriorVoxel(std::as_const(t), int3{0, 0, 0}));
  }
  EXPECT_TRUE(tree.checkBranchSizes(false));
}

// requirement: parallel modes end a cancelled job with the host's exception, serial ones run through
TYPED_TEST(TraversalControl, CancelledJobEndsParallelModes) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  for (int mode = 0; mode <= 9; ++mode) {
    for (bool reduce : {false, true}) {
      SCOPED_TRACE("mode " + std::to_string(mode) + (reduce ? " reduce" : ""));
      std::atomic<std::int64_t> visited{0};
      CallingVisitor<T> visitor([&](auto const&) { ++visited; });
      auto const run = [&] {
        if (reduce)
          tree.reduce(visitor, static_cast<TraversalMode>(mode));
        else
          tree.traverse(visitor, static_cast<TraversalMode>(mode));
      };
      {
        JobCancelled const cancelled;
        if (mode >= 4 && mode <= 8) {
          EXPECT_EQ(textThrownBy(run), VLN::exceptionMessage);
          EXPECT_LT(visited, tree.tileCount(-1));
        } else {
          EXPECT_NO_THROW(run());
          EXPECT_EQ(visited, tree.tileCount(-1));
        }
      }
      EXPECT_EQ(Access::affinityUse(tree), 0);
      visited = 0;
      EXPECT_NO_THROW(run());
      EXPECT_EQ(visited, tree.tileCount(-1));
    }
  }
  EXPECT_TRUE(tree.checkConsistency(false));
}

// requirement: polled between chunks, so that a long pass ends early
TYPED_TEST(TraversalControl, CancellationDuringAPassStopsIt) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  for (int mode : {4, 5, 6, 7, 8}) {
    for (int threads : {1, 2, 8}) {
      std::atomic<int> visited{0};
      CallingVisitor<T> visitor([&](auto const&) {
        if (++visited == 3) Ostil::setJobCancelled(true);
      });
      std::string text;
      VLN::withThreads(threads, [&] {
        text = textThrownBy([&] { tree.traverse(visitor, static_cast<TraversalMode>(mode)); });
      });
      Ostil::setJobCancelled(false);
      EXPECT_EQ(text, VLN::exceptionMessage) << mode;
      EXPECT_LT(visited, tree.tileCount(-1)) << mode;
      EXPECT_EQ(Access::affinityUse(tree), 0);
    }
  }
}

// requirement
TYPED_TEST(TraversalControl, ArmedCheckpointEndsATraversalAtItsEntry) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  for (int mode = 0; mode <= 9; ++mode) {
    RecordingVisitor<T> visitor;
    Armed const armed(VLN::Canceller::kTraverse);
    EXPECT_EQ(textThrownBy([&] { tree.traverse(visitor, static_cast<TraversalMode>(mode)); }),
              VLN::exceptionMessage);
    EXPECT_TRUE(visitor.events().empty()) << mode;
    EXPECT_EQ(textThrownBy([&] { std::as_const(tree).reduce(visitor, static_cast<TraversalMode>(mode)); }),
              VLN::exceptionMessage);
    EXPECT_EQ(Access::affinityUse(tree), 0);
  }
  for (int other : {VLN::Canceller::kNone, VLN::Canceller::kTest, VLN::Canceller::kRefine}) {
    RecordingVisitor<T> visitor;
    Armed const armed(other);
    EXPECT_NO_THROW(tree.traverse(visitor, kParallelTopDown));
    EXPECT_EQ(visitor.events().back().kind, 'E');
  }
}

// requirement: and after each parallel depth
TYPED_TEST(TraversalControl, ArmedCheckpointEndsAPassAfterItsDepth) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  int const at = T::kMaxDepth - 3;
  for (int mode : {4, 8, 5}) {
    std::atomic<int> deepest{-1}, shallowest{1000};
    CallingVisitor<T> visitor([&](auto const& t) {
      for (int d = deepest; d < t.depth() && !deepest.compare_exchange_weak(d, t.depth());) {}
      for (int d = shallowest; d > t.depth() && !shallowest.compare_exchange_weak(d, t.depth());) {}
      if (t.depth() == at) VLN::Canceller::setCancelID(VLN::Canceller::kTraverse);
    });
    EXPECT_EQ(textThrownBy([&] {
                VLN::withThreads(1, [&] { tree.traverse(visitor, static_cast<TraversalMode>(mode)); });
              }),
              VLN::exceptionMessage);
    VLN::Canceller::setCancelID(0);
    EXPECT_EQ(mode == 5 ? shallowest : deepest, at) << mode;
    EXPECT_EQ(Access::affinityUse(tree), 0);
  }
}

// requirement: what a visitor throws passes, and leaves the container as it was
TYPED_TEST(TraversalControl, ExceptionsOfVisitorsPassAndReleaseTheAffinityCount) {
  using T = TypeParam;
  Container<T> tree = sample<T>();
  for (int mode = 0; mode <= 9; ++mode) {
    for (int threads : {1, 2, 8}) {
      for (bool affinity : {true, false}) {
        for (bool reduce : {false, true}) {
          SCOPED_TRACE("mode " + std::to_string(mode) + " threads " + std::to_string(threads));
          CallingVisitor<T> visitor([&](auto const& t) {
            if (t.depth() == T::kMaxDepth - 1) throw std::out_of_range("visitor");
          });
          TraversalRange range;
          range.useAffinity = affinity;
          VLN::withThreads(threads, [&] {
            auto const run = [&] {
              if (reduce)
                tree.reduce(visitor, static_cast<TraversalMode>(mode), range);
              else
                tree.traverse(visitor, static_cast<TraversalMode>(mode), range);
            };
            EXPECT_THROW(run(), std::out_of_range);
          });
          EXPECT_EQ(Access::affinityUse(tree), 0);
        }
      }
    }
  }
  EXPECT_TRUE(tree.checkConsistency(false));
  EXPECT_TRUE(tree.checkBranchSizes(false));
}

// requirement: only the sole traversal uses the partitioners
TYPED_TEST(TraversalControl, InnerTraversalLeavesThePartitionersToTheOuterOne) {
  using T = TypeParam;
  Container<T> const tree = sample<T>();
  std::atomic<int> inner{0}, outer{0};
  CallingVisitor<T> visitor([&](auto const& t) {
    ++outer;
    EXPECT_EQ(Access::affinityUse(tree), 1);
    if (t.depth() != 3) return;
    CallingVisitor<T> nested([&](auto const&) {
      ++inner;
      EXPECT_EQ(Access::affinityUse(tree), 1) << "the inner one gave it back at once";
    });
    tree.traverse(nested, kParallelBottomUp);
  });
  tree.traverse(visitor, kParallelTopDown);
  EXPECT_EQ(outer, tree.tileCount(-1));
  EXPECT_EQ(inner, tree.tileCount(3) * tree.tileCount(-1));
  EXPECT_EQ(Access::affinityUse(tree), 0);

  TraversalRange plain;
  plain.useAffinity = false;
  CallingVisitor<T> modest([&](auto const&) { EXPECT_EQ(Access::affinityUse(tree), 0); });
  tree.traverse(modest, kParallelFlat, plain);
}

// boundary
TYPED_TEST(TraversalControl, ConcurrentTraversalsBothVisitEverything) {
  using T = TypeParam;
  Container<T> const tree = sample<T>();
  for (int round = 0; round < 5; ++round) {
    std::vector<std::thread> threads;
    std::atomic<std::int64_t> visited{0};
    for (int mode : {4, 5, 6, 7}) {
      threads.emplace_back([&, mode] {
        CallingVisitor<T> visitor([&](auto const&) { ++visited; });
        tree.traverse(visitor, static_cast<TraversalMode>(mode));
      });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(visited, 4 * tree.tileCount(-1));
    EXPECT_EQ(Access::affinityUse(tree), 0);
  }
}

// requirement: writing traversals of two copies at once touch only their own tiles
TYPED_TEST(TraversalControl, CopiesMayBeWrittenAtOnce) {
  using T = TypeParam;
  Container<T> const tree = sample<T>();
  std::vector<Container<T>> copies(3, tree);
  std::vector<std::thread> threads;
  for (std::size_t n = 0; n < copies.size(); ++n) {
    threads.emplace_back([&, n] {
      struct Writer : Visitor<Container<T>> {
        explicit Writer(std::int64_t v)
            : value(v) {}
        using Visitor<Container<T>>::beginTile;
        void beginTile(typename Container<T>::TileType& t) override { t.setBranchSize(value); }
        Writer* clone() const override { return new Writer(value); }
        std::int64_t value;
      } writer(static_cast<std::int64_t>(n) + 1000000);
      copies[n].traverse(writer, kParallelFlat);
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_TRUE(tree.checkBranchSizes(false));
  for (std::size_t n = 0; n < copies.size(); ++n) {
    for (auto t = copies[n].cbeginTiles(); t != copies[n].cendTiles(); ++t)
      ASSERT_EQ(t->branchSize(), static_cast<std::int64_t>(n) + 1000000);
  }
}
