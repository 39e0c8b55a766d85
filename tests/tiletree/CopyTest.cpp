// Copies of a container: what they share, what separates them, and when.
#include "support/CaptureStream.h"
#include "support/Print.h"
#include "support/RandomForest.h"
#include "support/Shapes.h"

#include "GeometryVolume/tiletree/TileHalo.h"

#include <gtest/gtest.h>

#include <map>
#include <string>
#include <utility>

using namespace VLN::TileTree3D;
using Support::Access;
using Support::CaptureStream;

VLN_SHAPE_SUITE(ContainerCopy);

namespace {

/// All that can be read of the tiles.
template <class T> std::string stateOf(Container<T> const& tree) {
  std::ostringstream os;
  os << tree.tileCount(-1) << '/' << tree.rootCount();
  for (int d = 0; d <= T::kMaxDepth; ++d) {
    os << '\n' << d << ':' << tree.tileCount(d);
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
      auto const& t = tree.tile(n, d);
      os << '|' << t.tijk() << t.depth() << ' ' << t.index() << ' ' << t.parentIndex() << ' '
         << t.branchSize() << ' ' << t.valid();
      for (int slot = 0; t.children() && slot < T::kTileSize; ++slot) {
        if (!t.isLeaf(slot)) os << ' ' << slot << '=' << t.childIndex(slot);
      }
    }
  }
  for (auto root = tree.cbeginRoots(); root != tree.cendRoots(); ++root) os << root->first << root->second;
  return os.str();
}

/// A forest of mixed depths, none of its roots at depth 0.
template <class T> Container<T> sample() {
  for (std::uint32_t seed = 11;; ++seed) {
    Support::RandomForest<T> forest(seed);
    if (forest.minDepth() < 2 || forest.minDepth() > T::kMaxDepth - 3) continue;
    for (int n = 0; n < 15; ++n) forest.grow();
    Access::setBranchSizes(forest.tree());
    return forest.tree();
  }
}

/// Every way to change a container's tiles, by name.
template <class T> std::map<std::string, void (*)(Container<T>&)> mutators() {
  using C = Container<T>;
  return {
      {"addTile",
       [](C& c) {
         for (int d : {T::kMaxDepth, T::kMaxDepth - 1})
           Access::addTile(c, {T::kMaxTileCoord, T::kMinTileCoord, 77 * 5}, d);
       }},
      {"addTile through an accessor",
       [](C& c) { c.tileAccessor().addTile(T::kMaxTileCoord, T::kMinTileCoord, 77 * 5, T::kMaxDepth); }},
      {"addTiles",
       [](C& c) {
         c.tileAccessor().addTiles({999, 999, -999}, {1020, 1020, -980}, T::kMaxDepth);
       }},
      {"root above all",
       [](C& c) {
         Access::addTile(c, {0, 0, 0}, 0);
       }},
      {"allocateTile", [](C& c) { Access::allocateTile(c, 3); }},
      {"allocateTiles", [](C& c) { Access::allocateTiles(c, T::kMaxDepth, 4); }},
      {"resize", [](C& c) { Access::resize(c, c.tileCount(T::kMaxDepth) + 2, T::kMaxDepth); }},
      {"resize of an upper depth",
       [](C& c) {
         for (int d = 0; d < T::kMaxDepth; ++d) Access::resize(c, c.tileCount(d) + 1, d);
       }},
      {"reallocateTile",
       [](C& c) {
         for (int d = 0; d <= T::kMaxDepth; ++d) {
           if (c.tileCount(d) > 1) Access::reallocateTile(c, 0, c.tileCount(d) - 1, d);
         }
       }},
      {"writing iterators",
       [](C& c) {
         for (auto t = c.beginTiles(); t != c.endTiles(); ++t) t->setBranchSize(-5);
       }},
      {"a writing traversal",
       [](C& c) {
         struct Writer : Visitor<C> {
           using Visitor<C>::beginTile;
           void beginTile(typename C::TileType& t) override { t.setBranchSize(-6); }
           Writer* clone() const override { return new Writer; }
         } writer;
         c.traverse(writer, kParallelFlat);
       }},
      {"setBranchSizes",
       [](C& c) {
         Access::editTile(c, c.cbeginRoots()->second).setBranchSize(1);
         Access::setBranchSizes(c);
         Access::editTile(c, c.cbeginRoots()->second).setBranchSize(2);
       }},
  };
}

} // namespace

// requirement
TYPED_TEST(ContainerCopy, CopyHasDataOfItsOwnAndSharesTheTiles) {
  using T = TypeParam;
  Container<T> const a = sample<T>();
  Container<T> const b(a);
  EXPECT_EQ(a.dataUseCount(), 1);
  EXPECT_EQ(b.dataUseCount(), 1);
  EXPECT_TRUE(a.sharesTiles(b));
  EXPECT_EQ(&a.tile(0), &b.tile(0));
  EXPECT_TRUE(stateOf(a) == stateOf(b));
  EXPECT_EQ(b.name(), a.name());
  EXPECT_TRUE(b.checkConsistency(false));
}

// requirement
TYPED_TEST(ContainerCopy, AssignmentReplacesEverything) {
  using T = TypeParam;
  Container<T> a("source", 0.5f);
  Access::addTile(a, {0, 0, 0}, 3);
  Container<T> b("target", 1.0f);
  Access::addTile(b, {0, 0, 0}, 5);
  b = a;
  EXPECT_EQ(b.name(), "source");
  EXPECT_EQ(b.voxelSize(), 0.5f);
  EXPECT_TRUE(stateOf(a) == stateOf(b));
  EXPECT_TRUE(a.sharesTiles(b));
  EXPECT_EQ(b.dataUseCount(), 1);
  auto& self = b;
  b = self;
  EXPECT_EQ(b.dataUseCount(), 1);
  EXPECT_TRUE(stateOf(a) == stateOf(b));
}

// requirement: neither side sees what the other changes
TYPED_TEST(ContainerCopy, NoChangeOfOneShowsInTheOther) {
  using T = TypeParam;
  for (auto const& [name, mutate] : mutators<T>()) {
    SCOPED_TRACE(name);
    Container<T> a = sample<T>();
    Container<T> b = a;
    std::string const before = stateOf(a);
    mutate(b);
    EXPECT_TRUE(stateOf(a) == before);
    EXPECT_FALSE(stateOf(b) == before) << "the change must show where it was made";
    Container<T> c = a;
    std::string const old = stateOf(c);
    mutate(a); // the original this time
    EXPECT_TRUE(stateOf(c) == old);
  }
}

// requirement
TYPED_TEST(ContainerCopy, ChainOfCopiesSeparatesOneByOne) {
  using T = TypeParam;
  Container<T> a;
  Access::addTile(a, {0, 0, 0}, 4);
  Container<T> b = a, c = b, d = c;
  Access::addTile(c, {0, 0, 0}, 6);
  EXPECT_EQ(a.tileCount(-1), 1);
  EXPECT_EQ(b.tileCount(-1), 1);
  EXPECT_EQ(c.tileCount(-1), 3);
  EXPECT_EQ(d.tileCount(-1), 1);
  EXPECT_TRUE(a.sharesTiles(d));
  EXPECT_FALSE(a.sharesTiles(c));
  Access::addTile(a, {0, 0, 0}, 5);
  Access::addTile(b, {T::kMaxTileCoord, 0, 0}, 5);
  for (auto const* tree : {&a, &b, &c, &d}) EXPECT_TRUE(tree->checkConsistency(false));
  EXPECT_EQ(a.tileCount(5), 1);
  EXPECT_EQ(b.rootCount(), 2);
  EXPECT_EQ(d.tileCount(-1), 1);
  c = a;
  EXPECT_EQ(c.tileCount(-1), 2);
}

// requirement
TYPED_TEST(ContainerCopy, CopyOutlivesItsSource) {
  using T = TypeParam;
  Container<T> copy;
  std::string before;
  {
    Container<T> source = sample<T>();
    before = stateOf(source);
    copy = source;
  }
  EXPECT_TRUE(stateOf(copy) == before);
  Access::addTile(copy, {0, 0, 0}, 0);
  EXPECT_TRUE(copy.checkConsistency(false));
}

// requirement
TYPED_TEST(ContainerCopy, CloneDataOfASoleOwnerCopiesNothing) {
  using T = TypeParam;
  Container<T> a = sample<T>();
  auto const* const data = &Access::data(a);
  a.cloneData();
  EXPECT_EQ(&Access::data(a), data);
}

// requirement
TYPED_TEST(ContainerCopy, CopyToMakesAContainerWithTheSameTiles) {
  using T = TypeParam;
  auto const a = Ostil::makePtr<Container<T>>("name", 0.125f);
  a->setTargetName("target");
  Access::addTile(*a, {0, 0, 0}, 4);
  Ostil::Ptr<VLN::Component> out = Ostil::makePtr<Container<T>>("old", 1.0f);
  a->copyTo(out);
  auto const copy = Ostil::dynamicCast<Container<T>>(out);
  ASSERT_TRUE(copy);
  ASSERT_NE(copy.get(), a.get());
  EXPECT_EQ(copy->name(), "name");
  EXPECT_EQ(copy->getTargetName(), "target");
  EXPECT_EQ(copy->voxelSize(), 0.125f);
  EXPECT_TRUE(copy->sharesTiles(*a));
  EXPECT_EQ(copy->dataUseCount(), 1);
  EXPECT_TRUE(stateOf(*copy) == stateOf(*a));
  Access::addTile(*copy, {0, 0, 0}, 7);
  EXPECT_EQ(a->tileCount(-1), 1);
}

// boundary
TYPED_TEST(ContainerCopy, CopyToItselfDoesNothing) {
  using T = TypeParam;
  auto const a = Ostil::makePtr<Container<T>>("name", 0.125f);
  Ostil::Ptr<VLN::Component> out = a;
  a->copyTo(out);
  EXPECT_EQ(out.get(), a.get());
  EXPECT_EQ(a.useCount(), 2);
}

// requirement: settings and caches come along; a change drops the changed side's caches alone
TYPED_TEST(ContainerCopy, CachesComeAlongAndAreDroppedByTheSideThatChanges) {
  using T = TypeParam;
  Container<T> a;
  a.tileAccessor().addTiles({0, 0, 0}, {30, 30, 30}, T::kMaxDepth);
  a.setMaxRelativeRefinementError(0.5f);
  a.setCompactOnRemoval(false);
  a.precomputeTileNeighbors();
  a.precomputeTileHalos();
  a.precomputeCompressedTileHalos();
  a.buildAccessorAccelerationStructure(T::kMaxDepth);
  ASSERT_GE(Access::data(a).m_gridDepth, 0);
  Container<T> b = a;
  EXPECT_EQ(b.maxRelativeRefinementError(), 0.5f);
  EXPECT_FALSE(b.compactOnRemoval());
  EXPECT_NE(b.neighborData(), nullptr);
  TreeIndex const some = b.cbeginRoots()->second;
  EXPECT_NE(b.tileHalo(some), nullptr);
  EXPECT_GT(b.tileHaloVisitor(some).count(), 0);
  EXPECT_EQ(Access::data(b).m_gridDepth, Access::data(a).m_gridDepth);
  Access::addTile(b, {T::kMaxTileCoord, T::kMinTileCoord, 77 * 5}, T::kMaxDepth);
  EXPECT_EQ(b.neighborData(), nullptr);
  EXPECT_EQ(b.tileHalo(some), nullptr);
  EXPECT_TRUE(b.tileHaloVisitor(some).end());
  EXPECT_EQ(Access::data(b).m_gridDepth, -1);
  EXPECT_NE(a.neighborData(), nullptr);
  EXPECT_NE(a.tileHalo(some), nullptr);
  EXPECT_GE(Access::data(a).m_gridDepth, 0);
}

// requirement: scratch containers belong to one data
TYPED_TEST(ContainerCopy, ScratchContainersStayBehind) {
  using T = TypeParam;
  Container<T> a;
  a.threadLocalContainer(0);
  Access::incrementAffinityUse(a);
  Container<T> const b = a;
  EXPECT_TRUE(Access::data(b).m_allThreadLocal.empty());
  EXPECT_TRUE(Access::data(b).m_freeThreadLocal.empty());
  EXPECT_TRUE(Access::data(b).m_threadLocalCounts.empty());
  EXPECT_EQ(Access::affinityUse(b), 0);
  EXPECT_NE(Access::data(b).m_affinityPartitioners[0], nullptr);
  EXPECT_NE(Access::data(b).m_affinityPartitioners[0], Access::data(a).m_affinityPartitioners[0]);
}

// requirement: the warning names the shared array and its use count
TYPED_TEST(ContainerCopy, MemUseWarnsOfSharedTiles) {
  using T = TypeParam;
  Container<T> a = sample<T>();
  std::uint64_t used = 0, allocated = 0;
  {
    CaptureStream const err;
    a.memUse(used, allocated, false);
    EXPECT_EQ(err.text(), "");
  }
  Container<T> const b = a, c = a;
  std::uint64_t sharedUsed = 0, sharedAllocated = 0;
  {
    CaptureStream const err;
    b.memUse(sharedUsed, sharedAllocated, false);
    EXPECT_EQ(err.text(),
              "Container::Data.memUse(): Warning: 'm_tiles' not unique (use count = 3)\n"
              "Container::Data.memUse(): Warning: 'm_tilesMaxDepth' not unique (use count = 3)\n");
  }
  EXPECT_EQ(sharedUsed, used);
}
