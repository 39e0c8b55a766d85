// Trees when memory ends: growth, refinement, removal, reordering, derived caches and walks.
#include "Faults.h"

#include "GeometryVolume/tiletree/TileAccessor.h"
#include "GeometryVolume/tiletree/TileHalo.h"

#include <gtest/gtest.h>
#include <memory>
#include <sstream>
#include <vector>

namespace {

using namespace VLN::TileTree3D;
using test::faults::After;
using test::faults::everyAllocation;
using test::faults::Scenario;

/// A tree, perhaps another that shares its tiles, and what an operation tells beside its work.
template <class Shape> struct Trees {
  using Tree = Container<Shape>;
  std::unique_ptr<Tree> tree = std::make_unique<Tree>("tree", 1.0f), other;
  typename Tree::TileLists newTiles{};
  TileMoves moves;
};

template <class Shape> std::string stateOf(Container<Shape> const& tree) {
  std::ostringstream os;
  os << tree.tileCount(-1) << ' ' << tree.checkConsistency(false) << ' ' << tree.rootCount();
  for (auto root = tree.cbeginRoots(); root != tree.cendRoots(); ++root)
    os << " r" << root->second.depth << ':' << root->second.index;
  for (int d = 0; d < Shape::kDepths; ++d) {
    if (tree.tileCount(d) == 0) continue;
    os << " [" << d;
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
      auto const& t = tree.tile(n, d);
      os << ' ' << t.ti() << ',' << t.tj() << ',' << t.tk() << '/' << t.index();
      if (!t.valid()) {
        os << '-';
        continue;
      }
      os << '^' << t.parentIndex() << '#' << t.branchSize();
      if (!t.atMaxDepth())
        for (auto child = t.begin(); child != t.end(); ++child) os << '.' << child.treeIndex().index;
    }
    os << ']';
  }
  return os.str();
}
template <class Shape> std::string stateOfTrees(Trees<Shape> const& t) {
  std::ostringstream os;
  os << stateOf(*t.tree);
  if (t.other) os << " beside " << stateOf(*t.other);
  for (auto const& list : t.newTiles)
    for (auto const& p : list) os << " new " << p.x << ',' << p.y << ',' << p.z;
  for (auto const& list : t.moves)
    for (auto const& [dst, src] : list) os << " moved " << src << '>' << dst;
  return os.str();
}
/// Whether each record agrees with the others, and each tile is found where it lies. Dead tiles are left out.
template <class Shape> bool isSound(Container<Shape> const& tree, bool withDead) {
  if (!withDead && !tree.checkConsistency(false)) return false;
  auto const accessor = tree.tileAccessor();
  for (int d = 0; d < Shape::kDepths; ++d)
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
      auto const& t = tree.tile(n, d);
      if (t.valid() && !(accessor.treeIndex(t.ti(), t.tj(), t.tk(), d, true) == TreeIndex{n, d}))
        return false;
    }
  return true;
}

/// Tiles of several depths, deep and shallow roots among them.
template <class Shape> Trees<Shape> grown(bool shared) {
  Trees<Shape> t;
  auto accessor = t.tree->tileAccessor();
  int const deep = Shape::kMaxDepth, w = Shape::width(deep);
  accessor.addTile(0, 0, 0, deep - 3);
  for (int n = 0; n < 12; ++n) accessor.addTile(w * n, w * (n % 3), 0, deep - n % 2);
  accessor.addTile(-100 * w, 0, 0, deep);
  accessor.addTile(-101 * w, 3 * w, 0, deep - 1);
  if (shared) t.other = std::make_unique<Container<Shape>>(*t.tree);
  return t;
}
template <class Shape> void buildCaches(Container<Shape>& tree) {
  tree.buildAccessorAccelerationStructure(Shape::kMaxDepth);
  tree.precomputeTileNeighbors();
  tree.precomputeTileHalos();
  tree.precomputeCompressedTileHalos();
}

template <class Shape> using Act = std::function<void(Trees<Shape>&)>;

/// Runs it on trees of their own and shared ones, with and without derived caches.
template <class Shape>
void tryOn(std::string const& name, Act<Shape> const& act, After after = After::kUnchanged,
           bool withDead = false) {
  for (bool const shared : {false, true})
    for (bool const caches : {false, true}) {
      std::string const full = name + (shared ? ", shared" : "") + (caches ? ", with caches" : "");
      everyAllocation<Trees<Shape>>(full.c_str(), {[=] {
                                                     auto t = grown<Shape>(shared);
                                                     if (caches) buildCaches(*t.tree);
                                                     t.tree->setCompactOnRemoval(!withDead);
                                                     return t;
                                                   },
                                                   act, &stateOfTrees<Shape>, after,
                                                   [=](Trees<Shape> const& t) {
                                                     return isSound(*t.tree, withDead) &&
                                                            (!t.other || isSound(*t.other, withDead));
                                                   }});
    }
}

template <class Shape> class TreeFaults : public ::testing::Test {};
using BothShapes = ::testing::Types<PowerOfTwoTraits, OddTraits>;
TYPED_TEST_SUITE(TreeFaults, BothShapes);

TYPED_TEST(TreeFaults, RequirementOneTileIsAddedWholeOrNotAtAll) {
  using Shape = TypeParam;
  int const deep = Shape::kMaxDepth, w = Shape::width(deep);
  tryOn<Shape>("a child", [=](auto& t) { t.tree->tileAccessor().addTile(40 * w, 0, 0, deep); });
  tryOn<Shape>("a tile below others yet to be made",
               [=](auto& t) { t.tree->tileAccessor().addTile(2 * w, 2 * w, 2 * w, deep); });
  tryOn<Shape>("a root", [=](auto& t) { t.tree->tileAccessor().addTile(5000 * w, 0, 0, deep - 4); });
  tryOn<Shape>("a root above roots", [=](auto& t) { t.tree->tileAccessor().addTile(-100 * w, 0, 0, 0); });
  tryOn<Shape>("the smallest tile that holds a box", [=](auto& t) {
    t.tree->tileAccessor().addTile({60 * w, 0, 0}, {61 * w, 3, 3});
  });
}
TYPED_TEST(TreeFaults, RequirementTilesOfABox) {
  using Shape = TypeParam;
  int const deep = Shape::kMaxDepth, w = Shape::width(deep);
  // Those added so far stay.
  tryOn<Shape>(
      "a box",
      [=](auto& t) {
        t.tree->tileAccessor().addTiles({-3 * w, 0, 0}, {4 * w, 3 * w, 3 * w}, deep);
      },
      After::kUsable);
}
TYPED_TEST(TreeFaults, RequirementBulkAddition) {
  using Shape = TypeParam;
  int const deep = Shape::kMaxDepth, w = Shape::width(deep);
  for (bool const domain : {false, true})
    tryOn<Shape>(domain ? "many tiles and the whole domain" : "many tiles", [=](auto& t) {
      typename Container<Shape>::TileLists points{};
      for (int n = 0; n < 40; ++n) {
        points[static_cast<std::size_t>(deep)].append({w * (n % 7) * 3, w * (n / 7) * 2, w * n});
        points[static_cast<std::size_t>(deep - 2)].append({-w * 30 * n, 0, 0});
      }
      points[static_cast<std::size_t>(deep - 5)].append({0, 0, 0});
      if (domain) points[0].append({0, 0, 0});
      t.tree->tileAccessor().addTiles(points, &t.newTiles);
    });
}
TYPED_TEST(TreeFaults, RequirementRefine) {
  using Shape = TypeParam;
  int const deep = Shape::kMaxDepth, w = Shape::width(deep);
  Container<Shape> a("a", 1.0f), b("b", 1.0f);
  auto accessor = a.tileAccessor();
  for (int n = 0; n < 120; ++n) accessor.addTile(w * (n % 11), w * (n / 11), w * (n % 3), deep);
  accessor.addTile(-100 * w, 0, 0, deep - 6);
  accessor = b.tileAccessor();
  for (int n = 0; n < 9; ++n) accessor.addTile(3000 * w * (n - 4), 0, 7 * w * n, deep - n % 4);
  // The depths finished so far stay, as for a cancelled job.
  tryOn<Shape>(
      "refined",
      [&](auto& t) {
        t.tree->refine({&a, &b}, &t.newTiles, true);
      },
      After::kUsable);
}
TYPED_TEST(TreeFaults, RequirementRemoval) {
  using Shape = TypeParam;
  int const deep = Shape::kMaxDepth, w = Shape::width(deep);
  for (bool const dead : {false, true}) {
    std::string const how = dead ? ", holes stay" : "";
    tryOn<Shape>(
        "a leaf goes" + how,
        [=](auto& t) {
          auto accessor = t.tree->tileAccessor();
          accessor.removeTile(accessor.treeIndex(2 * w, 2 * w, 0, deep, true), true, &t.moves);
        },
        After::kUnchanged, dead);
    tryOn<Shape>(
        "a branch goes" + how,
        [=](auto& t) {
          auto accessor = t.tree->tileAccessor();
          accessor.removeTile(accessor.treeIndex(w, w, 0, deep - 2, true), true, &t.moves);
        },
        After::kUnchanged, dead);
    tryOn<Shape>(
        "many go" + how,
        [=](auto& t) {
          TileIndexLists lists(static_cast<std::size_t>(Shape::kDepths));
          lists[static_cast<std::size_t>(deep)] = {0, 2, 3, 1, 2};
          lists[static_cast<std::size_t>(deep - 1)] = {1, 0};
          t.tree->tileAccessor().removeTiles(lists, true, &t.moves);
        },
        After::kUnchanged, dead);
    tryOn<Shape>(
        "a root goes and its child stays" + how,
        [=](auto& t) {
          t.tree->tileAccessor().removeTile({0, deep - 3}, false, &t.moves);
          t.tree->tileAccessor().removeTile({t.tree->tileCount(deep - 1) - 1, deep - 1}, false);
        },
        After::kUsable, dead);
  }
}
TYPED_TEST(TreeFaults, RequirementOrder) {
  using Shape = TypeParam;
  int const deep = Shape::kMaxDepth;
  auto const removeSome = [=](Trees<Shape>& t) {
    TileIndexLists lists(static_cast<std::size_t>(Shape::kDepths));
    lists[static_cast<std::size_t>(deep)] = {0, 2, 3};
    t.tree->setCompactOnRemoval(false);
    t.tree->tileAccessor().removeTiles(lists, true);
  };
  for (bool const shared : {false, true}) {
    auto const make = [=] {
      auto t = grown<Shape>(false);
      removeSome(t);
      buildCaches(*t.tree);
      if (shared) t.other = std::make_unique<Container<Shape>>(*t.tree);
      return t;
    };
    auto const sound = [](Trees<Shape> const& t) { return isSound(*t.tree, true); };
    everyAllocation<Trees<Shape>>("holes filled", {make, [](auto& t) { t.tree->compact(&t.moves); },
                                                   &stateOfTrees<Shape>, After::kUnchanged, sound});
    everyAllocation<Trees<Shape>>("Morton order", {make, [](auto& t) { t.tree->sortIntoMortonOrder(); },
                                                   &stateOfTrees<Shape>, After::kUnchanged, sound});
  }
}
TYPED_TEST(TreeFaults, RequirementCachesAreBuiltOrNot) {
  using Shape = TypeParam;
  struct Cached {
    Trees<Shape> trees = grown<Shape>(false);
    std::vector<TreeIndex> found;
  };
  auto const state = [](Cached const& c) {
    auto const& tree = *c.trees.tree;
    std::ostringstream os;
    os << (tree.neighborData() ? "neighbours " : "") << (tree.tileHalo({0, Shape::kMaxDepth}) ? "halos " : "")
       << isSound(tree, false) << c.found.size();
    return os.str();
  };
  std::vector<std::pair<char const*, std::function<void(Container<Shape>&)>>> const kinds{
      {"grid", [](auto& t) { t.buildAccessorAccelerationStructure(Shape::kMaxDepth); }},
      {"coarse grid", [](auto& t) { t.buildAccessorAccelerationStructure(Shape::kMaxDepth - 2); }},
      {"neighbours", [](auto& t) { t.precomputeTileNeighbors(); }},
      {"halos", [](auto& t) { t.precomputeTileHalos(); }},
      {"compressed halos", [](auto& t) { t.precomputeCompressedTileHalos(); }}};
  for (bool const before : {false, true})
    for (auto const& [name, build] : kinds)
      everyAllocation<Cached>(name, {[&, b = build] {
                                       Cached c;
                                       if (before) buildCaches(*c.trees.tree), b(*c.trees.tree);
                                       return c;
                                     },
                                     [b = build](Cached& c) { b(*c.trees.tree); }, state});
  everyAllocation<Cached>(
      "neighbours of a tile",
      {[] { return Cached(); },
       [](Cached& c) {
         auto const accessor = std::as_const(*c.trees.tree).tileAccessor();
         c.found.clear();
         accessor.tileNeighbors(accessor.tile({0, Shape::kMaxDepth - 3}), c.found, Shape::kMaxDepth, true);
       },
       state, After::kUsable});
}

/// Counts voxels, in copies whose sums are joined.
template <class Shape> class Count final : public Visitor<Container<Shape>> {
  using Base = Visitor<Container<Shape>>;

public:
  using TileType = typename Container<Shape>::TileType;
  using Base::visitInteriorVoxel;
  bool visitInteriorVoxel(TileType const&, VLN::TileTree3D::int3 const&) override { return ++m_count > 0; }
  void join(Base const& other) override { m_count += static_cast<Count const&>(other).m_count; }
  Count* clone() const override { return new Count; }
  std::int64_t m_count = 0;
};

TYPED_TEST(TreeFaults, RequirementWalks) {
  using Shape = TypeParam;
  struct Walked {
    Trees<Shape> trees = grown<Shape>(false);
    std::int64_t sum = 0;
  };
  auto const state = [](Walked const& w) { return std::to_string(w.sum) + stateOfTrees(w.trees); };
  for (TraversalMode const mode : {kDepthFirst, kBreadthFirst, kParallelDepthFirst, kParallelTopDown,
                                   kParallelBottomUp, kParallelFlat, kParallelTopDownGuarded})
    everyAllocation<Walked>(("walk " + std::to_string(mode)).c_str(),
                            {[] { return Walked(); },
                             [=](Walked& w) {
                               Count<Shape> count;
                               std::as_const(*w.trees.tree).reduce(count, mode);
                               w.sum = count.m_count;
                             },
                             state});
}
TYPED_TEST(TreeFaults, RequirementScratchTrees) {
  using Shape = TypeParam;
  // Which are idle cannot be seen; that each can be had again can.
  everyAllocation<Trees<Shape>>("scratch trees", {[] { return grown<Shape>(false); },
                                                  [](auto& t) {
                                                    auto* a = t.tree->threadLocalContainer(0);
                                                    auto* b = t.tree->threadLocalContainer(1);
                                                    b->tileAccessor().addTile(0, 0, 0, 4);
                                                    t.tree->freeThreadLocalContainer(b);
                                                    a->tileAccessor().addTile(9, 9, 9, 3);
                                                    t.tree->clearThreadLocalData(nullptr);
                                                  },
                                                  &stateOfTrees<Shape>});
}

} // namespace
