// Points on a tree with all that follows them, and what re-tiling must make of them.
#pragma once

#include "GeometryVolume/channels/ElementReTile.h"
#include "GeometryVolume/channels/UpdateDispatch.h"
#include "GeometryVolume/channels/UpdateTopologies.h"
#include "GeometryVolume/topology/Command.h"
#include "support/TreeModel.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <iterator>
#include <map>

namespace Support {

using Velorn::Math::float3;
using VLN::TileTree3D::PointTopology;
using VLN::TileTree3D::VoxelTopology;

template <class TraitsT> class PointCloud {
public:
  static constexpr int kW = TraitsT::kTileDataWidth;
  using Tree = Container<TraitsT>;
  using Positions = VLN::TileTree3D::Channel<TraitsT, float3, kW, 0>;
  using Ids = VLN::TileTree3D::Channel<TraitsT, int, kW, 0>;
  using Weights = VLN::TileTree3D::Channel<TraitsT, float, kW, 0>;
  using Voxels = VLN::TileTree3D::Channel<TraitsT, float, kW, 1>;
  using Marks = Ids;
  using Model = TreeModel<TraitsT>;
  struct Less {
    bool operator()(VoxelCoord const& a, VoxelCoord const& b) const { return typename Model::Less()(a, b); }
  };
  using PointsByTile = std::map<VoxelCoord, std::map<int, float3>, Less>;

  explicit PointCloud(float voxelSize)
      : tree("tree", voxelSize)
      , topology("points")
      , positions("positions", nullptr, VLN::TileTree3D::kInitializeDefaultValue, false, true, 0, 28) {
    topology.setTargetName(tree.name());
    positions.setTargetName(topology.name());
    namespace Command = VLN::TileTree3D::Command;
    using Shape = TraitsT;
    Command::createChannel<int, Shape::kTW, kW, kW, 0, 0>("ids", topology, object, 0,
                                                          VLN::TileTree3D::kInitializeDefaultValue, 0, 28);
    Command::createChannel<float, Shape::kTW, kW, kW, 0, 0>("weights", topology, object, 0.0f,
                                                            VLN::TileTree3D::kInitializeDefaultValue, 0, 28);
    auto voxels = Ostil::makePtr<VoxelTopology<TraitsT>>("voxels", VLN::TileTree3D::kVoxelOffsetCenter);
    voxels->setTargetName(tree.name());
    object.addComponent(voxels);
    Command::createChannel<float, Shape::kTW, kW, kW, 0, 1>("density", *voxels, object, 0.0f,
                                                            VLN::TileTree3D::kInitializeDefaultValue, 0, 28);
    Command::createChannel<int, Shape::kTW, kW, kW, 0, 0>("marks", *voxels, object, 0,
                                                          VLN::TileTree3D::kInitializeDefaultValue, 0, 28);
  }

  /// Adds tiles, then points to them.
  void addTiles(std::vector<VoxelCoord> const& tiles) {
    auto accessor = tree.tileAccessor();
    for (VoxelCoord const& at : tiles) accessor.addTile(at), model.add(at);
    accessor.addTiles(typename Tree::TileLists{}); // branch sizes
    grew();
  }
  /// Everything follows a tree that has grown.
  void grew() {
    topology.update(tree);
    positions.updateTilesAdded(topology);
    VLN::TileTree3D::updateTilesAdded(topology, object);
    VLN::TileTree3D::updateTopologies(tree, object, nullptr, &topology);
    labelNewVoxels();
  }
  /// Everything follows a tree that has lost tiles, and with them their points.
  void shrank(VLN::TileTree3D::TileRemovalList const& moves) {
    topology.update(tree);
    positions.updateTilesRemoved(moves, topology);
    topology.update(positions);
    VLN::TileTree3D::updateTilesRemoved(moves, topology, object);
    VLN::TileTree3D::updateTopologies(tree, object, &moves, &topology);
    for (auto at = points.begin(); at != points.end();)
      at = model.has(at->first) ? std::next(at) : points.erase(at);
    labelNewVoxels();
  }
  /// Removes tiles of tree and model, at once, or as dead tiles that a compaction takes out; all follows.
  void remove(std::vector<VLN::TileTree3D::VoxelCoord> asked, bool withBranch, bool compactLater) {
    // Depth by depth, as the tree does it.
    std::stable_sort(asked.begin(), asked.end(),
                     [](auto const& a, auto const& b) { return a.depth < b.depth; });
    VLN::TileTree3D::TileIndexLists lists(static_cast<std::size_t>(TraitsT::kDepths));
    for (auto const& at : asked)
      lists[static_cast<std::size_t>(at.depth)].push_back(tree.tileAccessor().tile(at, true).index());
    VLN::TileTree3D::TileMoves moves;
    tree.setCompactOnRemoval(!compactLater);
    tree.tileAccessor().removeTiles(lists, withBranch, &moves);
    if (compactLater) tree.compact(&moves);
    tree.setCompactOnRemoval(true);
    for (auto const& at : asked) model.remove(at, withBranch);
    shrank(moves);
  }
  /// Everything follows a tree in a new order.
  void permuted(std::vector<std::vector<std::int64_t>> const& oldToNew) {
    auto const newToOld = VLN::TileTree3D::invertPermutation(oldToNew);
    positions.updateTilesPermuted(newToOld);
    topology.update(positions);
    VLN::TileTree3D::updateTilesPermuted(newToOld, topology, object);
    auto const voxels = object.template component<VoxelTopology<TraitsT>>("voxels");
    VLN::TileTree3D::updateTilesPermuted(newToOld, *voxels, object);
  }
  void addPoint(VoxelCoord const& at, float3 const& p) {
    TreeIndex const tile = tree.tileAccessor().tile(at, true).treeIndex();
    ASSERT_TRUE(tile.valid());
    int const id = static_cast<int>(m_next++);
    positions.tileDataAccessor().tileData(tile).push(p);
    pushTo<Ids>("ids", tile, id);
    pushTo<Weights>("weights", tile, weight(id));
    points[at][id] = p;
  }
  /// Appends to a tile of one of the object's channels.
  template <class C, class V> void pushTo(char const* name, TreeIndex const& tile, V value) {
    auto channel = object.template extractComponent<C>(name);
    channel->tileDataAccessor().tileData(tile).push(value);
    object.putComponent(std::move(channel));
  }
  void counted() { topology.update(positions); }
  /// A place in a tile, in world space.
  static float3 placeIn(VoxelCoord const& at, float voxelSize, std::mt19937& random) {
    std::uniform_real_distribution<double> unit(0, 1);
    double const w = static_cast<double>(Model::width(at.depth));
    auto const on = [&](int corner) {
      return static_cast<float>((corner + std::min(unit(random), 0.999) * w) *
                                static_cast<double>(voxelSize));
    };
    return {on(at.i), on(at.j), on(at.k)};
  }
  template <class Move> void move(Move const& where) {
    for (auto& [tile, held] : points) {
      for (auto& [id, p] : held) p = where(p);
    }
    for (float3& p : positions) p = where(p);
  }

  void reTile(bool prune) {
    expectRules(prune);
    VLN::TileTree3D::channelElementReTile(
        tree, topology, positions, object, prune, [&](VLN::TileTree3D::TileRemovalList const* removed) {
          for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
            EXPECT_EQ(tree.tileCount(d), topology.tileCount(d));
            EXPECT_EQ(tree.tileCount(d), positions.tileCount(d));
            EXPECT_EQ(tree.tileCount(d), object.template component<Ids>("ids")->tileCount(d));
          }
          compareCounts();
          VLN::TileTree3D::updateTopologies(tree, object, removed, &topology);
          labelNewVoxels();
        });
  }

  void check() const {
    model.compare(tree, false);
    ASSERT_TRUE(tree.checkBranchSizes(false));
    compareCounts();
    auto const ids = object.template component<Ids>("ids");
    auto const weights = object.template component<Weights>("weights");
    auto const voxels = object.template component<Voxels>("density");
    auto const marks = object.template component<Marks>("marks");
    PointsByTile found;
    for (auto t = tree.cbeginTiles(); t != tree.cendTiles(); ++t) {
      TreeIndex const at = (*t).treeIndex();
      auto const p = std::as_const(positions).tileData(at);
      auto const id = std::as_const(*ids).tileData(at);
      auto const w = std::as_const(*weights).tileData(at);
      ASSERT_EQ(p.size(), id.size());
      ASSERT_EQ(p.size(), w.size());
      for (int n = 0; n < p.size(); ++n) {
        ASSERT_TRUE(found[(*t).voxelCoord()].emplace(id[n], p[n]).second) << "doubled point " << id[n];
        ASSERT_EQ(w[n], weight(id[n]));
      }
      float const expected = label((*t).voxelCoord());
      auto const density = std::as_const(*voxels).tileData(at);
      auto const mark = std::as_const(*marks).tileData(at);
      ASSERT_EQ(density.size(), Voxels::kSize);
      ASSERT_EQ(mark.size(), Marks::kSize);
      ASSERT_TRUE(std::all_of(density.begin(), density.end(), [&](float v) { return v == expected; }))
          << "voxels out of step at " << (*t).voxelCoord();
      ASSERT_TRUE(
          std::all_of(mark.begin(), mark.end(), [&](int v) { return v == static_cast<int>(expected); }))
          << "marks out of step at " << (*t).voxelCoord();
    }
    auto const& expected = points;
    auto a = found.begin();
    for (auto const& [tile, held] : expected) {
      if (held.empty()) continue;
      ASSERT_NE(a, found.end());
      ASSERT_EQ(a->first, tile);
      ASSERT_EQ(a->second.size(), held.size());
      auto b = a->second.begin();
      for (auto const& [id, p] : held) {
        ASSERT_EQ(b->first, id);
        ASSERT_EQ(std::memcmp(&b->second, &p, sizeof p), 0) << "point " << id << " has another position";
        ++b;
      }
      ++a;
    }
    ASSERT_EQ(a, found.end());
  }
  std::size_t pointCount() const {
    std::size_t n = 0;
    for (auto const& [tile, held] : points) n += held.size();
    return n;
  }
  /// Everything that must not depend on the number of threads.
  std::vector<std::int64_t> contents() const {
    auto out = treeContents(tree);
    auto const ids = object.template component<Ids>("ids");
    for (int const id : std::as_const(*ids)) out.push_back(id);
    for (float3 const& p : std::as_const(positions)) {
      std::int64_t bits[2] = {0, 0};
      std::memcpy(bits, &p, sizeof p);
      out.insert(out.end(), bits, bits + 2);
    }
    return out;
  }

  Tree tree;
  PointTopology<TraitsT> topology;
  Positions positions;
  VLN::Object object;
  Model model;
  PointsByTile points;

private:
  static float label(VoxelCoord const& at) {
    return static_cast<float>(at.i % 1009 + at.j % 1013 + at.k % 1019 + at.depth);
  }
  static float weight(int id) { return 0.5f * static_cast<float>(id); }
  /// Gives the voxels of new tiles their values; the others must keep theirs through every change.
  void labelNewVoxels() {
    auto voxels = object.template extractComponent<Voxels>("density");
    auto marks = object.template extractComponent<Marks>("marks");
    typename Model::Set live;
    for (auto t = tree.cbeginTiles(); t != tree.cendTiles(); ++t) {
      VoxelCoord const at = (*t).voxelCoord();
      live.insert(at);
      if (m_labelled.count(at)) continue;
      auto data = voxels->tileData((*t).treeIndex());
      auto mark = marks->tileData((*t).treeIndex());
      ASSERT_EQ(data.size(), Voxels::kSize);
      ASSERT_EQ(mark.size(), Marks::kSize);
      std::fill(data.begin(), data.end(), label(at));
      std::fill(mark.begin(), mark.end(), static_cast<int>(label(at)));
    }
    m_labelled = std::move(live);
    object.putComponent(std::move(voxels));
    object.putComponent(std::move(marks));
  }
  void compareCounts() const {
    std::int64_t total = 0;
    for (auto t = tree.cbeginTiles(); t != tree.cendTiles(); ++t) {
      TreeIndex const at = (*t).treeIndex();
      ASSERT_EQ(topology.elementCount(at), positions.elementCount(at)) << at;
      total += topology.elementCount(at);
    }
    ASSERT_EQ(topology.elementCount(-1), total);
    ASSERT_EQ(positions.elementCount(-1), total);
    ASSERT_EQ(static_cast<std::int64_t>(object.template component<Ids>("ids")->size()), total);
  }

  /// Where every point must go, by the rules as they are told: slowly, and in wide integers.
  void expectRules(bool prune) {
    float const s = 1.0f / tree.voxelSize();
    constexpr double kReach = 536870912.0;
    auto const cornerOf = [&](float3 const& q, int d, VoxelCoord& out) {
      std::int64_t c[3];
      for (int a = 0; a < 3; ++a) {
        double const f = std::floor(static_cast<double>(q[a]));
        if (!(f >= TraitsT::kMinTileCoord && f <= TraitsT::kMaxTileCoord)) return false;
        c[a] = static_cast<std::int64_t>(f);
      }
      out = Model::holder({static_cast<int>(c[0]), static_cast<int>(c[1]), static_cast<int>(c[2])}, d);
      return true;
    };
    PointsByTile after;
    struct Waiting {
      int depth, id;
      float3 p;
    };
    std::vector<Waiting> waiting;
    typename Model::Set made;
    for (auto const& [tile, held] : points) {
      for (auto const& [id, p] : held) {
        float3 const q{p.x * s, p.y * s, p.z * s};
        bool inReach = true;
        for (int a = 0; a < 3; ++a) inReach = inReach && std::abs(static_cast<double>(q[a])) < kReach;
        VoxelCoord to;
        if (!inReach) continue;
        ASSERT_TRUE(cornerOf(q, tile.depth, to));
        if (to == tile || model.has(to)) {
          after[to][id] = p;
        } else {
          waiting.push_back({tile.depth, id, p});
          made.insert(to);
        }
      }
    }
    if (!made.empty()) {
      made.insert(Model::holder({0, 0, 0}, 0));
      model.add(made);
    }
    for (Waiting const& w : waiting) {
      VoxelCoord to;
      if (cornerOf(w.p, w.depth, to) && model.has(to)) after[to][w.id] = w.p;
    }
    points = std::move(after);
    if (!prune) return;
    typename Model::Set active;
    for (auto const& [tile, held] : points) {
      for (int d = tile.depth; !held.empty() && d >= 0; --d) {
        if (VoxelCoord const above = Model::above(tile, d); model.has(above)) active.insert(above);
      }
    }
    Model pruned;
    pruned.add(active);
    model = pruned;
  }

  std::uint32_t m_next = 1;
  typename Model::Set m_labelled;
};

} // namespace Support
