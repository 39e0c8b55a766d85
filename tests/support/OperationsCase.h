// A sequence of operations on a tree and all that follows it, as a fuzzer's input: each byte is a decision.
//
// The tree is held against a set of coordinates, points and labelled voxels against the model of PointCloud,
// fields against the values by place, and copies of everything against what they held when they were taken.
#pragma once

#include "support/FieldModel.h"
#include "support/PointCloud.h"

#include <memory>
#include <numeric>
#include <sstream>

namespace Support {

template <class TraitsT> class OperationsWalk {
public:
  using Tree = Container<TraitsT>;
  using Cloud = PointCloud<TraitsT>;
  using Model = TreeModel<TraitsT>;
  using Lists = typename Tree::TileLists;
  static constexpr int kMaxDepth = TraitsT::kMaxDepth;

  explicit OperationsWalk(Choices& choices)
      : m_choices(choices)
      , m_cloud(kVoxelSizes[choices.below(4)]) {
    addField();
    addField();
  }

  void step() {
    int const what = m_choices.below(24);
    bool const canGrow = m_cloud.model.tiles().size() < kMostTiles;
    switch (what) {
    case 0:
    case 1:
      if (canGrow) add();
      break;
    case 2:
      if (canGrow) addBox();
      break;
    case 3:
      if (canGrow) addInBulk();
      break;
    case 4:
    case 5:
      if (canGrow) refine();
      break;
    case 6:
    case 7:
      remove();
      break;
    case 8:
      permute();
      break;
    case 9:
      sort();
      break;
    case 10:
    case 11:
      if (canGrow) reTile();
      break;
    case 12:
      addPoints();
      break;
    case 13:
      movePoints();
      break;
    case 14:
    case 15:
      field().write(m_cloud.tree, m_cloud.object, m_choices);
      break;
    case 16:
      field().setRange(*m_cloud.object.template component<VoxelTopology<TraitsT>>("voxels"), m_cloud.object,
                       m_cloud.model.tiles(), m_choices);
      break;
    case 17:
      field().setNonLeafValues(m_cloud.tree, m_cloud.object, m_choices);
      break;
    case 18:
      if (m_cloud.model.tiles().size() <= 16) field().checkHalo(m_cloud.tree, m_cloud.object, m_choices);
      break;
    case 19:
      field().tidy(m_cloud.object, m_choices);
      break;
    case 20:
      copy();
      break;
    case 21:
      changeCopies();
      break;
    case 22:
      buildCaches();
      break;
    default:
      if (m_fields.size() < 4) addField();
    }
    m_log << ' ' << what;
    for (auto& f : m_fields) f->follow(m_cloud.model.tiles());
  }

  void check() {
    m_cloud.check();
    for (auto const& f : m_fields) f->check(m_cloud.tree, m_cloud.object);
    for (auto const& c : m_copies) c->check();
    for (auto const& t : m_trees) ASSERT_EQ(treeContents(t.tree), t.contents) << "a copy of the tree changed";
    for (auto const& o : m_objects) ASSERT_EQ(contents(o.object), o.contents) << "a copied object changed";
    std::vector<VoxelCoord> places;
    for (int n = 0; n < 6; ++n) places.push_back(place());
    m_cloud.model.compareLookups(m_cloud.tree, places);
  }
  bool small() const { return m_cloud.model.tiles().size() < 24; }
  std::string log() const { return m_log.str(); }

private:
  static constexpr float kVoxelSizes[4] = {1.0f, 1.0f, 0.5f, 3.0f};
  static constexpr std::size_t kMostTiles = 120;

  struct TreeCopy {
    Tree tree;
    std::vector<std::int64_t> contents;
  };
  struct ObjectCopy {
    VLN::Object object;
    std::vector<float> contents;
  };

  AnyField<TraitsT>& field() {
    return *m_fields[static_cast<std::size_t>(m_choices.below(static_cast<int>(m_fields.size())))];
  }

  VoxelCoord place() {
    constexpr int low = TraitsT::kMinTileCoord, high = TraitsT::kMaxTileCoord;
    static int3 const centers[] = {
        {0, 0, 0}, {0, 0, 0}, {low, low, low}, {high, high, high}, {12345, -777, 4097}};
    int const lowest = std::max(0, kMaxDepth - 8);
    int const kind = m_choices.byte();
    int const depth =
        kind % 16 == 0 ? m_choices.below(kMaxDepth + 1) : lowest + kind / 16 % (kMaxDepth + 1 - lowest);
    int3 const& c = centers[kind % 5];
    std::int64_t const w = TraitsT::width(depth);
    int const steps = m_choices.byte();
    int const step[3] = {steps % 6 - 3, steps / 6 % 6 - 3, steps / 36 % 6 - 3};
    int3 p;
    for (int a = 0; a < 3; ++a) {
      std::int64_t const at = c[a] + w * step[a];
      p[a] = static_cast<int>(std::clamp<std::int64_t>(at, low, high));
    }
    return Model::holder(p, depth);
  }
  std::vector<VoxelCoord> places(int most) {
    std::vector<VoxelCoord> list;
    for (int n = m_choices.below(most); n >= 0; --n) list.push_back(place());
    return list;
  }
  VoxelCoord existing() {
    auto const& tiles = m_cloud.model.tiles();
    return *std::next(tiles.begin(), m_choices.below(static_cast<int>(tiles.size())));
  }

  void add() { m_cloud.addTiles(places(4)); }
  /// The tiles of one depth over a box.
  void addBox() {
    VoxelCoord const at = place();
    std::int64_t const w = TraitsT::width(at.depth);
    int3 const min = at.ijk();
    int3 max = min;
    int const size = m_choices.below(64);
    int const steps[3] = {size % 4, size / 4 % 4, size / 16};
    for (int a = 0; a < 3; ++a)
      max[a] = static_cast<int>(std::min<std::int64_t>(min[a] + w * steps[a], 2147483647));
    m_cloud.tree.tileAccessor().addTiles(min, max, at.depth);
    for (std::int64_t i = min.x; i < max.x; i += w) {
      for (std::int64_t j = min.y; j < max.y; j += w) {
        for (std::int64_t k = min.z; k < max.z; k += w) {
          if (std::max({i, j, k}) > TraitsT::kMaxTileCoord) continue;
          m_cloud.model.add({static_cast<int>(i), static_cast<int>(j), static_cast<int>(k), at.depth});
        }
      }
    }
    m_cloud.tree.tileAccessor().addTiles(Lists{}); // branch sizes
    m_cloud.grew();
  }
  void addInBulk() {
    Lists lists, made;
    typename Model::Set set;
    for (VoxelCoord const& at : places(24)) {
      // Any point of a tile names it.
      std::int64_t const last = TraitsT::width(at.depth) - 1;
      lists[static_cast<std::size_t>(at.depth)].append(
          m_choices.coin() ? at.ijk()
                           : int3{static_cast<int>(at.i + last), at.j, static_cast<int>(at.k + last)});
      set.insert(at);
    }
    auto const before = m_cloud.model.tiles().size();
    m_cloud.tree.tileAccessor().addTiles(lists, &made);
    m_cloud.model.add(set);
    expectMade(before, made);
    m_cloud.grew();
  }
  void refine() {
    std::vector<Tree> trees(static_cast<std::size_t>(1 + m_choices.below(2)));
    std::vector<Tree const*> sources;
    auto const before = m_cloud.model.tiles().size();
    for (Tree& tree : trees) {
      auto accessor = tree.tileAccessor();
      Model model;
      for (VoxelCoord const& at : places(12)) accessor.addTile(at), model.add(at);
      if (m_choices.coin()) { // dead tiles of a source are none
        VoxelCoord const gone = place();
        tree.setCompactOnRemoval(false);
        accessor.removeTile(accessor.tile(gone, true).treeIndex(), true);
        model.remove(gone, true);
      }
      m_cloud.model.add(model.tiles());
      sources.push_back(&tree);
    }
    Lists made;
    m_cloud.tree.refine(sources, &made, true);
    expectMade(before, made);
    m_cloud.grew();
  }
  void expectMade(std::size_t before, Lists const& made) {
    std::size_t count = 0;
    for (auto const& list : made) count += list.size();
    EXPECT_EQ(before + count, m_cloud.model.tiles().size()) << "the list of new tiles is not complete";
  }
  /// At once, one by one, or by dead tiles that a compaction takes out later.
  void remove() {
    if (m_cloud.model.tiles().empty()) return;
    bool const withBranch = m_choices.coin(), later = m_choices.coin(), oneByOne = m_choices.below(4) == 0;
    if (oneByOne) {
      VLN::TileTree3D::TileMoves moves;
      VoxelCoord const at = existing();
      auto accessor = m_cloud.tree.tileAccessor();
      accessor.removeTile(accessor.tile(at, true).treeIndex(), withBranch, &moves);
      m_cloud.model.remove(at, withBranch);
      m_cloud.shrank(moves);
      return;
    }
    std::vector<VoxelCoord> asked;
    for (int n = m_choices.below(12); n >= 0; --n) asked.push_back(existing());
    m_cloud.remove(asked, withBranch, later);
  }
  void permute() {
    std::vector<std::vector<std::int64_t>> perms(static_cast<std::size_t>(TraitsT::kDepths));
    std::minstd_rand random(static_cast<std::uint32_t>(1 + m_choices.byte()));
    for (int d = 0; d <= kMaxDepth; ++d) {
      auto& perm = perms[static_cast<std::size_t>(d)];
      if (random() % 4 == 0) continue; // left as it is
      perm.resize(static_cast<std::size_t>(m_cloud.tree.tileCount(d)));
      std::iota(perm.begin(), perm.end(), 0);
      std::shuffle(perm.begin(), perm.end(), random);
    }
    m_cloud.tree.permute(perms.data());
    m_cloud.permuted(perms);
  }
  void sort() {
    std::vector<std::vector<std::int64_t>> perms;
    m_cloud.tree.sortIntoMortonOrder(&perms);
    m_cloud.permuted(perms);
  }
  void reTile() {
    static float const steps[] = {0.0f, 0.25f, 3.0f, 5.0f, -4.0f, 64.0f, 1000.0f, 6e8f};
    bool const prune = m_choices.coin();
    int const by = m_choices.byte();
    float3 const d{steps[by % 8], steps[by / 8 % 8] * (by % 3 ? 1.0f : -1.0f), steps[by / 64]};
    // A point that is nowhere goes, and no other with it.
    bool const nowhere = m_choices.below(8) == 7;
    m_cloud.move([&](float3 const& p) {
      return float3{nowhere && std::fmod(p.x, 2.0f) < 0.5f ? std::numeric_limits<float>::quiet_NaN()
                                                           : p.x + d.x,
                    p.y + d.y, p.z + d.z};
    });
    m_cloud.reTile(prune);
  }
  void addPoints() {
    if (m_cloud.model.tiles().empty()) return;
    for (int n = m_choices.below(24); n >= 0; --n) {
      VoxelCoord const at = existing();
      std::mt19937 random(static_cast<std::uint32_t>(m_choices.byte()));
      m_cloud.addPoint(at, Cloud::placeIn(at, m_cloud.tree.voxelSize(), random));
    }
    m_cloud.counted();
  }
  /// Points go to other tiles, or are removed, wherever they are.
  void movePoints() {
    using namespace VLN::TileTree3D;
    ElementMoves moves(static_cast<std::size_t>(kChannelDepths));
    auto const ids = m_cloud.object.template component<typename Cloud::Ids>("ids");
    auto after = m_cloud.points;
    for (auto& [tile, held] : m_cloud.points) {
      TreeIndex const from = m_cloud.tree.tileAccessor().tile(tile, true).treeIndex();
      auto const list = std::as_const(*ids).tileData(from);
      for (int e = 0; e < list.size(); ++e) {
        int const what = m_choices.byte();
        if (what % 3 != 1) continue;
        auto const point = held.at(list[e]);
        VoxelCoord const to = existing();
        bool const gone = what % 5 == 0;
        std::int64_t const index = gone ? -1 : m_cloud.tree.tileAccessor().tile(to, true).index();
        moves[static_cast<std::size_t>(gone ? tile.depth : to.depth)].push_back(
            {index, from.index, e, from.depth});
        after[tile].erase(list[e]);
        if (!gone) after[to][list[e]] = point;
      }
    }
    ElementOrder order;
    DestinationTiles tiles;
    ArrivalMap arrivals;
    m_cloud.positions.computePermutation(moves, order, tiles, arrivals, false);
    m_cloud.positions.updateElements(moves, order, tiles, arrivals);
    m_cloud.topology.update(m_cloud.positions);
    updateElements(moves, order, tiles, arrivals, m_cloud.topology, m_cloud.object);
    m_cloud.points = std::move(after);
  }

  void addField() {
    auto const topology = m_cloud.object.template component<VoxelTopology<TraitsT>>("voxels");
    std::string const name = "field" + std::to_string(m_fields.size());
    auto const make = [&]<class T, int Extended, int H>() {
      m_fields.push_back(std::make_unique<Field<TraitsT, T, Extended, H>>(name, *topology, m_cloud.object,
                                                                          m_cloud.model.tiles(), m_choices));
    };
    using Velorn::Math::double3;
    switch (m_choices.below(8)) {
    case 0:
    case 1:
      make.template operator()<float, 0, 0>();
      break;
    case 2:
      make.template operator()<float, 1, 0>();
      break;
    case 3:
      make.template operator()<float, 0, 2>();
      break;
    case 4:
      make.template operator()<double3, 0, 0>();
      break;
    case 5:
      make.template operator()<double3, 1, 0>();
      break;
    case 6:
      make.template operator()<unsigned char, 0, 1>();
      break;
    default:
      make.template operator()<std::int64_t, 0, 0>();
    }
  }

  void copy() {
    switch (m_choices.below(4)) {
    case 0:
      if (m_trees.size() < 3) m_trees.push_back({m_cloud.tree, treeContents(m_cloud.tree)});
      break;
    case 1:
      if (m_objects.size() < 2) m_objects.push_back({m_cloud.object, contents(m_cloud.object)});
      break;
    default:
      if (m_copies.size() < 3) m_copies.push_back(field().copy(m_cloud.object, m_choices));
    }
  }
  void changeCopies() {
    for (auto& c : m_copies) c->write(m_choices);
    for (auto& t : m_trees) {
      if (m_choices.coin()) t.tree.tileAccessor().addTile(place());
      if (m_choices.coin()) t.tree.sortIntoMortonOrder();
      if (m_choices.below(3) == 2) t.tree = m_cloud.tree;
      t.tree.tileAccessor().addTiles(Lists{});
      EXPECT_TRUE(t.tree.checkConsistency(false));
      t.contents = treeContents(t.tree);
    }
  }
  static std::vector<float> contents(VLN::Object const& object) {
    std::vector<float> out;
    for (int const id : std::as_const(*object.component<typename Cloud::Ids>("ids")))
      out.push_back(static_cast<float>(id));
    for (float const v : std::as_const(*object.component<typename Cloud::Weights>("weights")))
      out.push_back(v);
    for (float const v : std::as_const(*object.component<typename Cloud::Voxels>("density")))
      out.push_back(v);
    return out;
  }

  void buildCaches() {
    int const which = m_choices.below(32);
    Tree& tree = m_cloud.tree;
    if (which & 1) tree.buildAccessorAccelerationStructure(m_choices.below(TraitsT::kDepths));
    if (which & 2) tree.precomputeTileNeighbors();
    if (which & 4) tree.precomputeTileHalos();
    if (which & 8) tree.precomputeCompressedTileHalos();
    if (which == 16) tree.clearAccessorAccelerationStructure();
  }

  Choices& m_choices;
  Cloud m_cloud;
  std::vector<std::unique_ptr<AnyField<TraitsT>>> m_fields;
  std::vector<std::unique_ptr<typename AnyField<TraitsT>::Copy>> m_copies;
  std::vector<TreeCopy> m_trees;
  std::vector<ObjectCopy> m_objects;
  std::ostringstream m_log;
};

class OperationsCase {
public:
  OperationsCase(std::uint8_t const* data, std::size_t size)
      : m_data(data)
      , m_size(size) {}

  /// Differences are told by GoogleTest. @return Whether the sequence went to its end.
  bool run() const {
    Choices choices(m_data, m_size);
    return choices.coin() ? walk<VLN::TileTree3D::OddTraits>(choices)
                          : walk<VLN::TileTree3D::PowerOfTwoTraits>(choices);
  }

private:
  static constexpr int kMostSteps = 40;

  template <class TraitsT> static bool walk(Choices& choices) {
    OperationsWalk<TraitsT> walk(choices);
    for (int n = 0; n < kMostSteps && !choices.ended(); ++n) {
      walk.step();
      if (walk.small()) walk.check();
      if (::testing::Test::HasFailure()) {
        ADD_FAILURE() << "operations:" << walk.log();
        return false;
      }
    }
    walk.check();
    return !::testing::Test::HasFailure();
  }

  std::uint8_t const* m_data;
  std::size_t m_size;
};

} // namespace Support
