#include "GeometryVolume/channels/ElementReTile.h"

#include "GeometryVolume/channels/ElementScanImpl.h"
#include "GeometryVolume/channels/UpdateDispatch.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Numeric.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/Visitor.h"

#if VLN_HAS_ELEMENT_FLOAT3

#include <algorithm>
#include <tuple>

namespace VLN::TileTree3D {

namespace {

using Internal::Found;
using Internal::kDropped;
using Internal::PositionsOf;
using Internal::scanDepth;

/// Fills the scratch tree with the listed tiles and those between them and its first tile.
template <class TraitsT>
void collectTiles(Container<TraitsT>& scratch, typename Container<TraitsT>::TileLists& corners) {
  auto const less = [](int3 const& a, int3 const& b) {
    return std::tie(a.x, a.y, a.z) < std::tie(b.x, b.y, b.z);
  };
  for (int d = TraitsT::kMaxDepth; d > 0; --d) {
    auto& list = corners[d];
    std::sort(list.begin(), list.end(), less);
    list.resize(static_cast<std::uint64_t>(std::unique(list.begin(), list.end()) - list.begin()));
    auto& above = corners[d - 1];
    for (int3 const& p : list) {
      int3 const corner = TraitsT::align(p, d - 1);
      if (above.empty() || above.back() != corner) above.append(corner);
    }
  }
  scratch.tileAccessor().addTiles(corners);
}

/// Settles the waiting points, now that their tiles exist.
template <class TraitsT>
void settle(Container<TraitsT> const& tree, PositionsOf<TraitsT> const& positions, int depth, Found& found) {
  parallelFor(0, static_cast<std::int64_t>(found.waiting.size()), [&](std::int64_t begin, std::int64_t end) {
    auto const accessor = tree.tileAccessor();
    for (auto n = static_cast<std::size_t>(begin); n < static_cast<std::size_t>(end); ++n) {
      ElementToFrom& move = found.moves[found.waiting[n]];
      float3 const& p = positions[ElementTreeIndex(move.from, move.fromDepth, move.fromElement)];
      // The position as it stands: the voxel size plays no part here.
      TreeIndex const there =
          accessor.treeIndex(toIntFloor(p.x), toIntFloor(p.y), toIntFloor(p.z), depth, true);
      move.to = there.valid() ? there.index : kDropped;
    }
  });
}

/// Finds the tiles that neither hold points nor have a descendant that does.
template <class TraitsT> class DetermineActiveTilesVisitor final : public Visitor<Container<TraitsT>> {
  using Base = Visitor<Container<TraitsT>>;

public:
  using TileType = typename Container<TraitsT>::TileType;
  /// For each depth, a byte for each child slot of each tile.
  using ChildMasks = std::vector<std::vector<std::uint8_t>>;

  DetermineActiveTilesVisitor(PositionsOf<TraitsT> const& positions, ChildMasks& masks)
      : m_positions(positions)
      , m_masks(masks)
      , m_inactive(static_cast<std::size_t>(TraitsT::kDepths)) {
    this->setBeginTileOverridden(false);
  }
  using Base::endTile;
  void endTile(TileType const& tile) override {
    bool active =
        tile.index() < m_positions.tileCount(tile.depth()) && m_positions.elementCount(tile.treeIndex()) > 0;
    if (!active && !tile.isLeaf()) {
      // The children have reported: a parent's end comes after theirs.
      auto const* mask = childMask(tile.treeIndex());
      active = std::any_of(mask, mask + TraitsT::kTileSize, [](std::uint8_t child) { return child != 0; });
    }
    if (!active)
      m_inactive[static_cast<std::size_t>(tile.depth())].push_back(tile.index());
    else if (!tile.isRoot())
      childMask(tile.parentTreeIndex())[slotInParent(tile)] = 1;
  }
  void join(Base const& other) override {
    auto const& b = static_cast<DetermineActiveTilesVisitor const&>(other);
    for (std::size_t d = 0; d < m_inactive.size(); ++d)
      m_inactive[d].insert(m_inactive[d].end(), b.m_inactive[d].begin(), b.m_inactive[d].end());
  }
  DetermineActiveTilesVisitor* clone() const override {
    return new DetermineActiveTilesVisitor(m_positions, m_masks);
  }
  TileIndexLists& inactive() { return m_inactive; }

private:
  std::uint8_t* childMask(TreeIndex const& tile) const {
    return m_masks[static_cast<std::size_t>(tile.depth)].data() + tile.index * TraitsT::kTileSize;
  }
  static int slotInParent(TileType const& tile) {
    int3 const p = tile.parentIJK();
    return TileType::slotOf(p.x, p.y, p.z);
  }

  PositionsOf<TraitsT> const& m_positions;
  ChildMasks& m_masks;
  TileIndexLists m_inactive;
};

template <class TraitsT>
TileIndexLists tilesWithoutPoints(Container<TraitsT> const& tree, PositionsOf<TraitsT> const& positions) {
  typename DetermineActiveTilesVisitor<TraitsT>::ChildMasks masks(
      static_cast<std::size_t>(TraitsT::kMaxDepth));
  for (int d = 0; d < TraitsT::kMaxDepth; ++d)
    masks[static_cast<std::size_t>(d)].resize(
        static_cast<std::size_t>(tree.tileCount(d) * TraitsT::kTileSize));
  DetermineActiveTilesVisitor<TraitsT> visitor(positions, masks);
  TraversalRange range;
  range.maxDepth = positions.depth();
  tree.reduce(visitor, kParallelDepthFirst, range);
  return std::move(visitor.inactive());
}

/// Takes a component that lies in the object out of it for as long as this lives.
class ScopedAbsence {
public:
  ScopedAbsence(VLN::Component const& component, VLN::Object& object)
      : m_object(object) {
    for (auto const& name : object.componentRange()) {
      m_component = object.component(name);
      if (m_component.get() == &component) {
        m_name = name;
        object.setProperty(name, Ostil::Any());
        return;
      }
    }
    m_component = nullptr;
  }
  ~ScopedAbsence() {
    if (m_component) m_object.setProperty(m_name, Ostil::Any(std::move(m_component)));
  }
  ScopedAbsence(ScopedAbsence const&) = delete;
  ScopedAbsence& operator=(ScopedAbsence const&) = delete;

private:
  VLN::Object& m_object;
  Ostil::String m_name;
  Ostil::Ptr<VLN::Component> m_component;
};

} // namespace

template <class TraitsT>
void channelElementReTile(Container<TraitsT>& tree, PointTopology<TraitsT>& topology,
                          PositionsOf<TraitsT>& positions, VLN::Object& object, bool prune,
                          TreeChanged changed) {
  ScopedAbsence const aside(positions, object);
  Container<TraitsT> const& reading = tree;
  PositionsOf<TraitsT> const& points = positions;

  // Scan. Nothing is shared that changes: the tree grows once, afterwards.
  std::vector<Found> found(kChannelDepths);
  typename Container<TraitsT>::TileLists missing;
  for (int d = TraitsT::kMaxDepth; d >= 0; --d) {
    auto const at = static_cast<std::size_t>(d);
    if (points.elementCount(d) == 0) continue;
    found[at] = scanDepth(reading, points, d);
    for (int3 const& corner : found[at].missing) missing[at].append(corner);
  }

  // Grow.
  Container<TraitsT> scratch("tmp", tree.voxelSize());
  scratch.tileAccessor().addTile(0, 0, 0, 0);
  if (missing != typename Container<TraitsT>::TileLists{}) collectTiles(scratch, missing);
  if (scratch.tileCount(-1) > 1) {
    tree.refine({&scratch}, nullptr, true);
    topology.update(tree);
    positions.updateTilesAdded(topology);
    updateTilesAdded(topology, object);
    changed(nullptr);
  }

  // Settle and move.
  ElementMoves moves(kChannelDepths);
  bool anyMove = false;
  for (int d = TraitsT::kMaxDepth; d >= 0; --d) {
    auto const at = static_cast<std::size_t>(d);
    if (!found[at].waiting.empty()) settle(reading, points, d, found[at]);
    moves[at] = std::move(found[at].moves);
    anyMove |= !moves[at].empty();
  }
  if (anyMove) {
    ElementOrder order;
    DestinationTiles tiles;
    ArrivalMap arrivals;
    positions.computePermutation(moves, order, tiles, arrivals, true);
    positions.updateElements(moves, order, tiles, arrivals);
    topology.update(positions);
    updateElements(moves, order, tiles, arrivals, topology, object);
  } else {
    topology.update(positions);
  }
  if (!prune) return;

  // Prune.
  TileIndexLists const inactive = tilesWithoutPoints(reading, points);
  if (std::all_of(inactive.begin(), inactive.end(), [](auto const& list) { return list.empty(); })) return;
  TileMoves removed;
  tree.tileAccessor().removeTiles(inactive, true, &removed);
  topology.update(tree);
  positions.updateTilesRemoved(removed, topology);
  topology.update(positions); // tiles have moved, and their counts with them
  updateTilesRemoved(removed, topology, object);
  changed(&removed);
}

template <class TraitsT>
void channelElementReTile(Container<TraitsT>& tree, PointTopology<TraitsT>& topology,
                          PositionsOf<TraitsT>& positions, VLN::Object& object, bool prune) {
  channelElementReTile(tree, topology, positions, object, prune, [](TileRemovalList const*) {});
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template VLN_API void channelElementReTile(Container<TraitsT>&, PointTopology<TraitsT>&,                   \
                                             PositionsOf<TraitsT>&, VLN::Object&, bool);                     \
  template VLN_API void channelElementReTile(Container<TraitsT>&, PointTopology<TraitsT>&,                   \
                                             PositionsOf<TraitsT>&, VLN::Object&, bool, TreeChanged);
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D

#endif
