#include "GeometryVolume/channels/ElementReTile.h"

#include "GeometryVolume/channels/ElementScanImpl.h"
#include "GeometryVolume/channels/UpdateDispatch.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Numeric.h"
#include "GeometryVolume/core/Parallel.h"

#if VLN_HAS_ELEMENT_FLOAT3

#include <algorithm>
#include <atomic>
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
    for (auto n = begin; n < end; ++n) {
      ElementToFrom& move = found.moves[found.waiting[n]];
      float3 const& p = positions[ElementTreeIndex(move.from, move.fromDepth, move.fromElement)];
      // The position as it stands: the voxel size plays no part here.
      TreeIndex const there =
          accessor.treeIndex(toIntFloor(p.x), toIntFloor(p.y), toIntFloor(p.z), depth, true);
      move.to = there.valid() ? there.index : kDropped;
    }
  });
}

/// The tiles that neither hold points nor have a descendant that does, rising.
/// @error std::runtime_error(VLN::exceptionMessage) when the host cancels the job.
template <class TraitsT>
TileIndexLists tilesWithoutPoints(Container<TraitsT> const& tree, PositionsOf<TraitsT> const& positions) {
  constexpr std::int64_t kGrain = 2048;
  TileIndexLists inactive(TraitsT::kDepths);
  // Whether a tile has an active child. Children of one parent all write the same.
  std::vector<std::uint8_t> marked, above;
  for (int d = std::min(positions.depth(), TraitsT::kMaxDepth); d >= 0; --d) {
    std::int64_t const tiles = tree.tileCount(d), known = std::min(tiles, positions.tileCount(d));
    auto const* const held = known > 0 ? (*positions.tileArrays())[d].data() : nullptr;
    marked.swap(above);
    marked.resize(tiles);
    above.assign(d > 0 ? static_cast<std::size_t>(tree.tileCount(d - 1)) : 0, 0);
    std::vector<std::vector<std::int64_t>> parts(chunkCount(0, tiles, kGrain));
    parallelChunks(
        0, tiles, kGrain,
        [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
          for (std::int64_t n = begin; n < end; ++n) {
            auto const& tile = tree.tile(n, d);
            if (!tile.valid()) continue;
            bool const active = (n < known && !held[n].empty()) || marked[n] != 0;
            if (!active)
              parts[chunk].push_back(n);
            else if (!tile.isRoot())
              std::atomic_ref(above[tile.parentIndex()]).store(1, std::memory_order_relaxed);
          }
        },
        Cancellation::kPoll);
    auto& list = inactive[d];
    for (auto const& part : parts) list.insert(list.end(), part.begin(), part.end());
  }
  return inactive;
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
    if (points.elementCount(d) == 0) continue;
    found[d] = scanDepth(reading, points, d);
    for (int3 const& corner : found[d].missing) missing[d].append(corner);
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
    if (!found[d].waiting.empty()) settle(reading, points, d, found[d]);
    moves[d] = std::move(found[d].moves);
    anyMove |= !moves[d].empty();
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
