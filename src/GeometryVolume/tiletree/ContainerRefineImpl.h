// Refinement of one tree by others. Included by Container.cpp alone.
#pragma once

#include "GeometryVolume/core/Canceller.h"
#include "GeometryVolume/tiletree/ContainerBuilderImpl.h"
#include "Ostil/Job.h"
#include "Velorn/ExceptionMessage.h"

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
std::vector<std::int64_t> ContainerBuilder<TraitsT>::findCounterparts(TileArray<TileType> const& wanted,
                                                                      int depth,
                                                                      std::vector<std::int64_t> const& above,
                                                                      std::vector<std::int64_t>& here) const {
  std::int64_t const count = wanted.size();
  here.resize(static_cast<std::size_t>(count));
  std::vector<std::int64_t> missing(static_cast<std::size_t>(Internal::refineChunks(count)));
  Internal::refinePass(count, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    auto const accessor = m_tree.growthAccessor();
    std::int64_t notThere = 0;
    for (std::int64_t n = begin; n < end; ++n) {
      TileType const& t = wanted[n];
      std::int64_t found = kDeadSource;
      if (t.valid()) {
        if (t.isRoot()) {
          TreeIndex const at = accessor.treeIndex(t.ti(), t.tj(), t.tk(), depth, false);
          if (at.depth == depth) found = at.index;
        } else {
          TileType const& over = tile({above[static_cast<std::size_t>(t.parentIndex())], depth - 1});
          found = over.childIndex(Internal::slotOfCorner(over, t.tijk()));
        }
        if (found < 0) found = kNotThere, ++notThere;
      }
      here[static_cast<std::size_t>(n)] = found;
    }
    missing[static_cast<std::size_t>(chunk)] = notThere;
  });
  return missing;
}

template <class TraitsT> void ContainerBuilder<TraitsT>::refine(Tree const& source, TileLists* newTiles) {
  if (&source == &m_tree) return;
  m_tree.tilesAdded();
  // For each source tile of the depth above, and of this one, the index of its counterpart here. A tile with
  // a parent in the source is found through the parent's counterpart, without a search.
  std::vector<std::int64_t> above, here;
  for (int d = 0; d <= kMaxDepth; ++d) {
    auto const& tiles = source.m_data->tiles(d);
    std::vector<std::int64_t> starts = findCounterparts(tiles, d, above, here);
    Internal::refineCheckpoint();
    // Chunks are consecutive: new tiles lie in the order of the source.
    std::int64_t next = tileCount(d);
    for (std::int64_t& start : starts) next += std::exchange(start, next);
    if (next > tileCount(d)) {
      Growth growth(data(), newTiles);
      allocateUninitialised(d, next - tileCount(d));
      std::vector<std::vector<DetachedTile>> parts(starts.size());
      auto const make = [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
        auto const accessor = m_tree.growthAccessor();
        std::int64_t index = starts[static_cast<std::size_t>(chunk)];
        DetachedTile detached;
        for (std::int64_t n = begin; n < end; ++n) {
          if (here[static_cast<std::size_t>(n)] != kNotThere) continue;
          TileType const& t = tiles[n];
          std::int64_t const parent = t.isRoot() ? -1 : above[static_cast<std::size_t>(t.parentIndex())];
          if (!initLinkedTile(index, d, t.tijk(), parent, accessor, detached))
            parts[static_cast<std::size_t>(chunk)].push_back(detached);
          here[static_cast<std::size_t>(n)] = index++;
        }
      };
      Internal::refinePass(tiles.size(), make, next - growth.before()[d]);
      linkDetached(d, parts, growth, newTiles);
      growth.keep();
    }
    Internal::refineCheckpoint();
    above.swap(here);
  }
}

template <class TraitsT>
void Container<TraitsT>::refineInternal(Container const& source, bool last, TileLists* newTiles) {
  ContainerBuilder<TraitsT>(*this).refine(source, newTiles);
  if (last) setBranchSizes();
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
