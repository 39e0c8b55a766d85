// Bulk creation of tiles, and refinement of one tree by others. Included by Container.cpp alone.
#pragma once

#include "GeometryVolume/core/Canceller.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/tiletree/Morton.h"
#include "Ostil/Job.h"
#include "Velorn/ExceptionMessage.h"

#include <stdexcept>

namespace VLN::TileTree3D {

namespace Internal {

/// Passes over fewer tiles than this run serially; others in ranges of at least kRefineGrain.
inline constexpr std::int64_t kParallelTiles = 100;
inline constexpr std::int64_t kRefineGrain = 50;

inline void refinePass(std::int64_t count,
                       FunctionRef<void(std::int64_t chunk, std::int64_t, std::int64_t)> body) {
  if (count >= kParallelTiles)
    parallelChunks(0, count, kRefineGrain, body);
  else if (count > 0)
    body(0, 0, count);
}

/// Throws when the host has cancelled the job. Called between the passes, never while tiles lack their links.
inline void refineCheckpoint() {
  Canceller::cancelID(Canceller::kRefine);
  if (Ostil::isJobCancelled()) throw std::runtime_error(exceptionMessage);
}

} // namespace Internal

template <class TraitsT>
std::vector<std::int64_t>
Container<TraitsT>::findMissing(std::int64_t count, int depth,
                                FunctionRef<int3 const*(std::int64_t)> cornerAt) const {
  if (tileCount(depth) == 0) {
    std::vector<std::int64_t> all;
    for (std::int64_t n = 0; n < count; ++n) {
      if (cornerAt(n)) all.push_back(n);
    }
    return all;
  }
  std::vector<std::vector<std::int64_t>> parts(static_cast<std::size_t>(
      count >= Internal::kParallelTiles ? chunkCount(0, count, Internal::kRefineGrain) : 1));
  Internal::refinePass(count, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    auto accessor = tileAccessor();
    for (std::int64_t n = begin; n < end; ++n) {
      int3 const* corner = cornerAt(n);
      if (!corner) continue;
      if (accessor.treeIndex(corner->x, corner->y, corner->z, depth, false).depth != depth)
        parts[static_cast<std::size_t>(chunk)].push_back(n);
    }
  });
  // Chunks are consecutive, so that the joined list is in the order of the serial pass.
  std::vector<std::int64_t> missing;
  for (auto const& part : parts) missing.insert(missing.end(), part.begin(), part.end());
  return missing;
}

template <class TraitsT>
void Container<TraitsT>::createTiles(std::vector<int3> const& corners, int depth, TileLists* newTiles,
                                     std::vector<std::int64_t> const* parents) {
  auto const count = static_cast<std::int64_t>(corners.size());
  if (count == 0) return;
  Counts const before = m_data->m_tileCounts;
  std::int64_t const first = tileCount(depth);
  allocateTiles(depth, count);
  // A tile without a parent is a root (no tile above it), or hangs below a coarser tile with tiles between.
  struct Unlinked {
    std::int64_t index;
    TreeIndex above;
  };
  std::vector<std::vector<Unlinked>> parts(static_cast<std::size_t>(
      count >= Internal::kParallelTiles ? chunkCount(0, count, Internal::kRefineGrain) : 1));
  Internal::refinePass(count, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    Container const& tree = *this;
    auto accessor = tree.tileAccessor();
    for (std::int64_t n = begin; n < end; ++n) {
      int3 const& p = corners[static_cast<std::size_t>(n)];
      std::int64_t const index = first + n;
      std::int64_t parent = -1;
      TreeIndex nearest;
      if (parents && (*parents)[static_cast<std::size_t>(n)] >= 0) {
        // Each slot belongs to exactly one tile: no two workers write the same.
        parent = (*parents)[static_cast<std::size_t>(n)];
        TileType& above = editTile({parent, depth - 1});
        above.childIndex(above.childIJK(p)) = index;
      } else if (depth > 0) {
        TileType const& above = accessor.tile(p, depth - 1, false);
        if (above.valid() && above.depth() == depth - 1) {
          parent = above.index();
          editTile(above.treeIndex()).childIndex(above.childIJK(p)) = index;
        } else if (above.valid()) {
          nearest = above.treeIndex();
        }
      }
      editTile({index, depth}).init(parent, p.x, p.y, p.z, depth, index);
      if (parent < 0) parts[static_cast<std::size_t>(chunk)].push_back({index, nearest});
    }
  });
  bool anyRoot = false;
  for (auto const& part : parts) {
    for (Unlinked const& made : part) {
      if (made.above.valid())
        insertChild(made.above, {made.index, depth});
      else
        addRoot(tile(made.index, depth)), anyRoot = true;
    }
  }
  if (anyRoot) adoptDeeperRoots(depth);
  // The asked tiles lie first among the new ones of their depth; tiles between were made at other depths.
  for (int d = 0; newTiles && d <= kMaxDepth; ++d) {
    for (std::int64_t n = before[static_cast<std::size_t>(d)]; n < tileCount(d); ++n)
      (*newTiles)[static_cast<std::size_t>(d)].append(tile(n, d).tijk());
  }
}

template <class TraitsT> void Container<TraitsT>::adoptDeeperRoots(int depth) {
  bool deeper = false;
  for (int d = depth + 1; d <= kMaxDepth; ++d) deeper |= rootCount(d) > 0;
  if (!deeper) return;
  // Roots never overlap, so a root of this depth that holds a deeper one is new.
  std::vector<std::pair<TreeIndex, TreeIndex>> adoptions;
  for (auto const& [at, index] : m_data->m_roots) {
    if (at.depth <= depth) continue;
    auto const above = m_data->m_roots.find(
        {TraitsT::align(at.i, depth), TraitsT::align(at.j, depth), TraitsT::align(at.k, depth), depth});
    if (above != m_data->m_roots.end()) adoptions.emplace_back(above->second, index);
  }
  for (auto const& [parent, child] : adoptions) {
    removeRoot(tile(child));
    insertChild(parent, child);
  }
}

template <class TraitsT>
void Container<TraitsT>::refineInternal(Container const& source, bool last, TileLists* newTiles) {
  if (&source != this) {
    tilesAdded();
    // For each source tile of the depth above, and of this one, the index of its counterpart here. A tile
    // with a parent in the source is found through the parent's counterpart, without a search.
    std::vector<std::int64_t> above, here;
    for (int d = 0; d <= kMaxDepth; ++d) {
      auto const& tiles = source.m_data->tiles(d);
      here.assign(static_cast<std::size_t>(tiles.size()), -1);
      struct Missing {
        std::int64_t index, parent;
      };
      std::vector<std::vector<Missing>> parts(static_cast<std::size_t>(
          tiles.size() >= Internal::kParallelTiles ? chunkCount(0, tiles.size(), Internal::kRefineGrain)
                                                   : 1));
      Internal::refinePass(tiles.size(), [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
        Container const& tree = *this;
        auto const accessor = tree.tileAccessor();
        for (std::int64_t n = begin; n < end; ++n) {
          TileType const& wanted = tiles[n];
          if (!wanted.valid()) continue;
          std::int64_t parent = -1, found = -1;
          if (wanted.isRoot()) {
            TreeIndex const at = accessor.treeIndex(wanted.ti(), wanted.tj(), wanted.tk(), d, false);
            if (at.depth == d) found = at.index;
          } else {
            parent = above[static_cast<std::size_t>(wanted.parentIndex())];
            TileType const& over = tree.tile(parent, d - 1);
            found = over.childIndex(over.childIJK(wanted));
          }
          if (found >= 0)
            here[static_cast<std::size_t>(n)] = found;
          else
            parts[static_cast<std::size_t>(chunk)].push_back({n, parent});
        }
      });
      Internal::refineCheckpoint();
      // Chunks are consecutive: new tiles lie in the order of the source.
      std::vector<int3> corners;
      std::vector<std::int64_t> parents;
      std::int64_t const first = tileCount(d);
      for (auto const& part : parts) {
        for (Missing const& missing : part) {
          here[static_cast<std::size_t>(missing.index)] = first + static_cast<std::int64_t>(corners.size());
          corners.push_back(tiles[missing.index].tijk());
          parents.push_back(missing.parent);
        }
      }
      createTiles(corners, d, newTiles, &parents);
      Internal::refineCheckpoint();
      above.swap(here);
    }
  }
  if (last) setBranchSizes();
}

template <class TraitsT>
void Container<TraitsT>::refine(std::vector<Container const*> const& sources, TileLists* newTiles,
                                bool setBranchSizesAtEnd) {
  for (std::size_t n = 0; n < sources.size(); ++n)
    refineInternal(*sources[n], setBranchSizesAtEnd && n + 1 == sources.size(), newTiles);
}

template <class TraitsT>
void Container<TraitsT>::addTilesInBulk(TileLists const& corners, TileLists* newTiles) {
  tilesAdded();
  for (int d = 0; d <= kMaxDepth; ++d) {
    auto const& list = corners[static_cast<std::size_t>(d)];
    auto const count = static_cast<std::int64_t>(list.size());
    std::vector<int3> aligned(static_cast<std::size_t>(count));
    parallelFor(0, count,
                [&](std::int64_t begin, std::int64_t end) {
                  for (auto n = static_cast<std::size_t>(begin); n < static_cast<std::size_t>(end); ++n) {
                    int3 const& p = list[n];
                    aligned[n] = p;
                    if (TraitsT::inDomain(p.x, p.y, p.z))
                      aligned[n] = {TraitsT::align(p.x, d), TraitsT::align(p.y, d), TraitsT::align(p.z, d)};
                  }
                },
                {.grain = 4096});
    auto const missing = findMissing(count, d, [&](std::int64_t n) {
      int3 const& p = aligned[static_cast<std::size_t>(n)];
      return TraitsT::inDomain(p.x, p.y, p.z) ? &p : nullptr;
    });
    // Morton order makes neighbours in space neighbours in memory, and puts duplicates side by side.
    std::vector<SortRecord> order(missing.size());
    parallelFor(0, static_cast<std::int64_t>(missing.size()),
                [&](std::int64_t begin, std::int64_t end) {
                  for (auto n = static_cast<std::size_t>(begin); n < static_cast<std::size_t>(end); ++n)
                    order[n] =
                        mortonRecord<TraitsT>(aligned[static_cast<std::size_t>(missing[n])], missing[n]);
                },
                {.grain = 4096});
    parallelSort(order.data(), static_cast<std::int64_t>(order.size()));
    std::vector<int3> unique;
    unique.reserve(order.size());
    for (SortRecord const& record : order) {
      int3 const& p = aligned[static_cast<std::size_t>(record.value)];
      if (unique.empty() || unique.back() != p) unique.push_back(p);
    }
    createTiles(unique, d, newTiles);
  }
  setBranchSizes();
}

} // namespace VLN::TileTree3D
