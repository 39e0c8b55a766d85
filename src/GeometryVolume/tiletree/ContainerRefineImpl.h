// Refinement of one tree by others. Included by Container.cpp alone.
#pragma once

#include "GeometryVolume/core/Canceller.h"
#include "GeometryVolume/tiletree/ContainerBuilderImpl.h"
#include "Ostil/Job.h"
#include "Velorn/ExceptionMessage.h"

#include <atomic>
#include <cstdlib>
#include <new>
#include <stdexcept>
#include <utility>

namespace VLN::TileTree3D {

namespace Internal {

/// Passes over fewer tiles than this run serially; others in ranges of at least kRefineGrain.
inline constexpr std::int64_t kParallelTiles = 100;
inline constexpr std::int64_t kRefineGrain = 50;

inline std::int64_t refineChunks(std::int64_t count) {
  return count >= kParallelTiles ? chunkCount(0, count, kRefineGrain) : 1;
}
/// @param work Number of tiles that decides between the paths, where it is not the count.
inline void refinePass(std::int64_t count,
                       FunctionRef<void(std::int64_t chunk, std::int64_t, std::int64_t)> body,
                       std::int64_t work = kParallelTiles) {
  if (count >= kParallelTiles && work >= kParallelTiles) {
    parallelChunks(0, count, kRefineGrain, body);
  } else {
    std::int64_t const chunk = count >= kParallelTiles ? kRefineGrain : count;
    for (std::int64_t n = 0, c = 0; n < count; n += chunk, ++c) body(c, n, std::min(count, n + chunk));
  }
}

/// Whether tiles lie near their siblings, by a few pairs of them: then they are best found through their
/// parents.
template <class TileType> bool siblingsLieTogether(TileArray<TileType> const& tiles) {
  constexpr std::int64_t kPairs = 16;
  if (tiles.size() < kParallelTiles) return tiles.size() > 0;
  std::int64_t near = 0;
  for (std::int64_t i = 0; i < kPairs; ++i) {
    TileType const* const pair = tiles.begin() + tiles.size() / kPairs * i;
    near += std::abs(pair[1].parentIndex() - pair[0].parentIndex()) <= 1;
  }
  return near > kPairs / 2;
}

/// Throws when the host has cancelled the job. Called between the passes, never while tiles lack their links.
inline void refineCheckpoint() {
  Canceller::cancelID(Canceller::kRefine);
  if (Ostil::isJobCancelled()) throw std::runtime_error(exceptionMessage);
}

} // namespace Internal

template <class TraitsT> void ContainerBuilder<TraitsT>::allocateUninitialised(int depth, std::int64_t n) {
  // At the deepest depth nothing is allocated for a tile, so that no record can stay unmade.
  if (depth < kMaxDepth) return m_tree.allocateTiles(depth, n);
  data().detachTiles();
  auto& tiles = data().editTiles(depth);
  tiles.growRaw(tiles.size() + n);
  data().m_tileCounts[depth] += n;
  data().m_tileCountTotal += n;
}

template <class TraitsT>
bool ContainerBuilder<TraitsT>::initLinkedTile(std::int64_t index, int depth, int3 const& p,
                                               std::int64_t parent, ConstTileAccessor const& accessor,
                                               DetachedTile& detached) {
  TreeIndex nearest;
  if (parent < 0 && depth > 0) {
    nearest = accessor.treeIndex(p.x, p.y, p.z, depth - 1, false);
    if (nearest.depth == depth - 1) parent = nearest.index;
  }
  if (parent >= 0) {
    TileType& above = editTile({parent, depth - 1});
    above.childIndex(Internal::slotOfCorner(above, p)) = index;
  }
  auto* const tile = &data().editTiles(depth)[index];
  if (depth == kMaxDepth) new (static_cast<void*>(tile)) TileType;
  tile->init(parent, p.x, p.y, p.z, depth, index);
  detached = {index, nearest};
  return parent >= 0;
}

template <class TraitsT>
void ContainerBuilder<TraitsT>::linkDetached(int depth, std::vector<std::vector<DetachedTile>> const& parts,
                                             Growth& growth, TileLists* newTiles) {
  bool anyRoot = false;
  for (auto const& part : parts) {
    for (DetachedTile const& made : part) {
      if (made.above.valid())
        insertChild(made.above, {made.index, depth});
      else
        m_tree.addRoot(tile({made.index, depth})), anyRoot = true;
    }
  }
  if (anyRoot) adoptDeeperRoots(depth, growth);
  listNewTiles(growth.before(), newTiles);
}

template <class TraitsT>
bool ContainerBuilder<TraitsT>::findChildren(Tree const& source, int depth,
                                             std::vector<std::int64_t> const& above,
                                             std::vector<std::int64_t>* here,
                                             MissingChildren& missing) const {
  /// The children of a chunk's parents, where they are neighbours.
  struct Run {
    std::int64_t begin = 0, end = 0;
  };
  auto const& parents = source.m_data->tiles(depth - 1);
  std::int64_t const count = parents.size(), wanted = source.m_data->tiles(depth).size();
  auto const chunks = static_cast<std::size_t>(Internal::refineChunks(count));
  if (here) here->assign(wanted, kDeadSource);
  missing.slots.resize(count);
  missing.counts.assign(chunks, 0);
  std::vector<Run> runs(chunks);
  std::atomic<bool> inOrder{true};
  Internal::refinePass(count, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    if (!here && !inOrder.load(std::memory_order_relaxed)) return;
    Run run;
    bool neighbours = true;
    std::int64_t notThere = 0;
    for (std::int64_t n = begin; n < end; ++n) {
      std::bitset<kTileSize> slots;
      if (std::int64_t const* const children = parents[n].children()) {
        auto const& counterpart = tile({above[n], depth - 1});
        for (int slot = 0; slot < kTileSize; ++slot) {
          std::int64_t const child = children[slot];
          if (child < 0) continue;
          if (run.begin == run.end) run = {child, child};
          neighbours = neighbours && child == run.end++;
          std::int64_t const found = counterpart.childIndex(slot);
          if (here) (*here)[child] = found >= 0 ? found : kNotThere;
          if (found >= 0) continue;
          slots[slot] = true;
          ++notThere;
        }
      }
      missing.slots[n] = slots;
    }
    if (!neighbours) inOrder.store(false, std::memory_order_relaxed);
    runs[chunk] = run;
    missing.counts[chunk] = notThere;
  });
  if (!inOrder) return false;
  // From the first tile to the last.
  std::int64_t next = 0;
  for (Run const& run : runs) {
    if (run.begin == run.end) continue;
    if (run.begin != next) return false;
    next = run.end;
  }
  return next == wanted;
}

template <class TraitsT>
std::vector<std::int64_t> ContainerBuilder<TraitsT>::findCounterparts(TileArray<TileType> const& wanted,
                                                                      int depth,
                                                                      std::vector<std::int64_t> const& above,
                                                                      std::vector<std::int64_t>& here) const {
  std::int64_t const count = wanted.size();
  std::vector<std::int64_t> missing(Internal::refineChunks(count));
  Internal::refinePass(count, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    auto const accessor = m_tree.growthAccessor();
    std::int64_t notThere = 0;
    for (std::int64_t n = begin; n < end; ++n) {
      std::int64_t& found = here[n];
      TileType const& t = wanted[n];
      if (found == kDeadSource && t.valid()) {
        if (t.isRoot()) {
          TreeIndex const at = accessor.treeIndex(t.ti(), t.tj(), t.tk(), depth, false);
          if (at.depth == depth) found = at.index;
        } else {
          TileType const& over = tile({above[t.parentIndex()], depth - 1});
          found = over.childIndex(Internal::slotOfCorner(over, t.tijk()));
        }
        if (found < 0) found = kNotThere;
      }
      notThere += found == kNotThere;
    }
    missing[chunk] = notThere;
  });
  return missing;
}

template <class TraitsT>
void ContainerBuilder<TraitsT>::makeChildren(Tree const& source, int depth,
                                             std::vector<std::int64_t> const& above,
                                             std::vector<std::int64_t>& here, MissingChildren const& missing,
                                             std::vector<std::int64_t> const& starts) {
  auto const& parents = source.m_data->tiles(depth - 1);
  auto& tiles = data().editTiles(depth);
  auto& tilesAbove = data().editTiles(depth - 1);
  Internal::ChildCorners<TraitsT> const corners(depth);
  Internal::refinePass(parents.size(), [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    std::int64_t index = starts[chunk];
    TileType* tile = tiles.begin() + index;
    int const d = depth;
    for (std::int64_t n = begin; n < end; ++n) {
      auto const slots = missing.slots[n];
      if (slots.none()) continue;
      std::int64_t const parent = above[n];
      TileType& over = tilesAbove[parent]; // by no other source tile
      int3 const at = over.tijk();
      std::int64_t* const children = over.children();
      Internal::forEachSlot(slots, [&](std::size_t slot) {
        int3 const corner = corners(at, slot);
        if (d == kMaxDepth)
          new (static_cast<void*>(tile)) TileType;
        else
          here[parents[n].children()[slot]] = index;
        tile++->init(parent, corner.x, corner.y, corner.z, d, index);
        children[slot] = index++;
      });
    }
  });
}

template <class TraitsT>
auto ContainerBuilder<TraitsT>::makeTiles(TileArray<TileType> const& wanted, int depth,
                                          std::vector<std::int64_t> const& above,
                                          std::vector<std::int64_t>& here,
                                          std::vector<std::int64_t> const& starts, std::int64_t count)
    -> std::vector<std::vector<DetachedTile>> {
  std::vector<std::vector<DetachedTile>> parts(starts.size());
  auto const make = [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    auto const accessor = m_tree.growthAccessor();
    std::int64_t index = starts[chunk];
    DetachedTile detached;
    for (std::int64_t n = begin; n < end; ++n) {
      if (here[n] != kNotThere) continue;
      TileType const& t = wanted[n];
      std::int64_t const parent = t.isRoot() ? -1 : above[t.parentIndex()];
      if (!initLinkedTile(index, depth, t.tijk(), parent, accessor, detached))
        parts[chunk].push_back(detached);
      here[n] = index++;
    }
  };
  Internal::refinePass(wanted.size(), make, count);
  return parts;
}

template <class TraitsT> void ContainerBuilder<TraitsT>::refine(Tree const& source, TileLists* newTiles) {
  if (&source == &m_tree) return;
  m_tree.tilesAdded();
  // For each source tile of the depth above, and of this one, the index of its counterpart here.
  std::vector<std::int64_t> above, here;
  MissingChildren missing;
  for (int d = 0; d <= kMaxDepth; ++d) {
    auto const& tiles = source.m_data->tiles(d);
    bool const together = d > 0 && Internal::siblingsLieTogether(tiles);
    // Below the deepest depth nobody asks for counterparts: they are put down only where the order needs
    // them.
    bool const byParents =
        together && findChildren(source, d, above, d < kMaxDepth ? &here : nullptr, missing);
    if (!together)
      here.assign(tiles.size(), kDeadSource);
    else if (!byParents && d == kMaxDepth)
      findChildren(source, d, above, &here, missing);
    std::vector<std::int64_t> starts =
        byParents ? std::move(missing.counts) : findCounterparts(tiles, d, above, here);
    Internal::refineCheckpoint();
    // Chunks are consecutive: new tiles lie in the order of the source.
    std::int64_t next = tileCount(d);
    for (std::int64_t& start : starts) next += std::exchange(start, next);
    if (next > tileCount(d)) {
      Growth growth(data(), newTiles);
      std::int64_t const count = next - tileCount(d);
      allocateUninitialised(d, count);
      std::vector<std::vector<DetachedTile>> detached;
      if (byParents)
        makeChildren(source, d, above, here, missing, starts);
      else
        detached = makeTiles(tiles, d, above, here, starts, count);
      linkDetached(d, detached, growth, newTiles);
      growth.keep();
    }
    Internal::refineCheckpoint();
    above.swap(here);
  }
}

template <class TraitsT>
void Container<TraitsT>::refineInternal(Container const& source, bool last, TileLists* newTiles) {
  ContainerBuilder<TraitsT> builder(*this);
  builder.refine(source, newTiles);
  if (last) builder.setBranchSizes(Cancellation::kPoll);
}

template <class TraitsT>
void Container<TraitsT>::refine(std::vector<Container const*> const& sources, TileLists* newTiles,
                                bool setBranchSizesAtEnd) {
  try {
    for (std::size_t n = 0; n < sources.size(); ++n)
      refineInternal(*sources[n], setBranchSizesAtEnd && n + 1 == sources.size(), newTiles);
  } catch (std::bad_alloc const&) {
    if (setBranchSizesAtEnd) ContainerBuilder<TraitsT>(*this).setBranchSizes(Cancellation::kSuppress);
    throw;
  }
}

} // namespace VLN::TileTree3D
