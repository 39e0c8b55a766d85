// Bulk creation of tiles, and refinement of one tree by others. Included by Container.cpp alone.
#pragma once

#include "GeometryVolume/core/Canceller.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/tiletree/Morton.h"
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

/// Slot of the child of `above` whose corner is p.
/// @pre p is such a corner. Then no division is needed where a tile has two voxels along an axis.
template <class TileType> int slotOfCorner(TileType const& above, int3 const& p) {
  if constexpr (TileType::kTileWidth == 2)
    return int(p.x > above.ti()) | int(p.y > above.tj()) << 1 | int(p.z > above.tk()) << 2;
  else {
    int3 const at = above.childIJK(p);
    return TileType::slotOf(at.x, at.y, at.z);
  }
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
  std::vector<std::vector<std::int64_t>> parts(static_cast<std::size_t>(Internal::refineChunks(count)));
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

template <class TraitsT> void Container<TraitsT>::allocateForMaking(int depth, std::int64_t n) {
  // At the deepest depth nothing is allocated for a tile, so that no record can stay unmade.
  if (depth < kMaxDepth) return allocateTiles(depth, n);
  m_data->detachTiles();
  auto& tiles = m_data->editTiles(depth);
  tiles.growRaw(tiles.size() + n);
  m_data->m_tileCounts[static_cast<std::size_t>(depth)] += n;
  m_data->m_tileCountTotal += n;
}

template <class TraitsT>
bool Container<TraitsT>::makeAt(std::int64_t index, int depth, int3 const& p, std::int64_t parent,
                                ConstTileAccessor const& accessor, Unlinked& unlinked) {
  TreeIndex nearest;
  if (parent < 0 && depth > 0) {
    nearest = accessor.treeIndex(p.x, p.y, p.z, depth - 1, false);
    if (nearest.depth == depth - 1) parent = nearest.index;
  }
  if (parent >= 0) {
    TileType& above = editTile({parent, depth - 1});
    above.childIndex(Internal::slotOfCorner(above, p)) = index;
  }
  auto* const tile = &m_data->editTiles(depth)[index];
  if (depth == kMaxDepth) new (static_cast<void*>(tile)) TileType;
  tile->init(parent, p.x, p.y, p.z, depth, index);
  unlinked = {index, nearest};
  return parent >= 0;
}

template <class TraitsT>
void Container<TraitsT>::finishMaking(int depth, std::vector<std::vector<Unlinked>> const& parts,
                                      Counts const& before, TileLists* newTiles) {
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

template <class TraitsT>
void Container<TraitsT>::createTiles(std::vector<int3> const& corners, int depth, TileLists* newTiles) {
  auto const count = static_cast<std::int64_t>(corners.size());
  if (count == 0) return;
  Counts const before = m_data->m_tileCounts;
  std::int64_t const first = tileCount(depth);
  allocateForMaking(depth, count);
  std::vector<std::vector<Unlinked>> parts(static_cast<std::size_t>(Internal::refineChunks(count)));
  Internal::refinePass(count, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    auto const accessor = std::as_const(*this).tileAccessor();
    Unlinked unlinked;
    for (std::int64_t n = begin; n < end; ++n) {
      if (!makeAt(first + n, depth, corners[static_cast<std::size_t>(n)], -1, accessor, unlinked))
        parts[static_cast<std::size_t>(chunk)].push_back(unlinked);
    }
  });
  finishMaking(depth, parts, before, newTiles);
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
    constexpr std::int64_t kDead = -1, kMissing = -2;
    // For each source tile of the depth above, and of this one, the index of its counterpart here. A tile
    // with a parent in the source is found through the parent's counterpart, without a search.
    std::vector<std::int64_t> above, here;
    for (int d = 0; d <= kMaxDepth; ++d) {
      auto const& tiles = source.m_data->tiles(d);
      std::int64_t const count = tiles.size();
      here.resize(static_cast<std::size_t>(count));
      auto const parentHere = [&](TileType const& wanted) {
        return wanted.isRoot() ? -1 : above[static_cast<std::size_t>(wanted.parentIndex())];
      };
      // For each chunk, how many are missing; then, where its first one goes.
      std::vector<std::int64_t> starts(static_cast<std::size_t>(Internal::refineChunks(count)));
      Internal::refinePass(count, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
        Container const& tree = *this;
        auto const accessor = tree.tileAccessor();
        std::int64_t missing = 0;
        for (std::int64_t n = begin; n < end; ++n) {
          TileType const& wanted = tiles[n];
          std::int64_t found = kDead;
          if (wanted.valid()) {
            if (wanted.isRoot()) {
              TreeIndex const at = accessor.treeIndex(wanted.ti(), wanted.tj(), wanted.tk(), d, false);
              if (at.depth == d) found = at.index;
            } else {
              TileType const& over = tree.tile(parentHere(wanted), d - 1);
              found = over.childIndex(Internal::slotOfCorner(over, wanted.tijk()));
            }
            if (found < 0) found = kMissing, ++missing;
          }
          here[static_cast<std::size_t>(n)] = found;
        }
        starts[static_cast<std::size_t>(chunk)] = missing;
      });
      Internal::refineCheckpoint();
      // Chunks are consecutive: new tiles lie in the order of the source.
      std::int64_t next = tileCount(d);
      for (std::int64_t& start : starts) next += std::exchange(start, next);
      if (next > tileCount(d)) {
        Counts const before = m_data->m_tileCounts;
        allocateForMaking(d, next - tileCount(d));
        std::vector<std::vector<Unlinked>> parts(starts.size());
        auto const make = [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
          auto const accessor = std::as_const(*this).tileAccessor();
          std::int64_t index = starts[static_cast<std::size_t>(chunk)];
          Unlinked unlinked;
          for (std::int64_t n = begin; n < end; ++n) {
            if (here[static_cast<std::size_t>(n)] != kMissing) continue;
            TileType const& wanted = tiles[n];
            if (!makeAt(index, d, wanted.tijk(), parentHere(wanted), accessor, unlinked))
              parts[static_cast<std::size_t>(chunk)].push_back(unlinked);
            here[static_cast<std::size_t>(n)] = index++;
          }
        };
        Internal::refinePass(count, make, next - before[static_cast<std::size_t>(d)]);
        finishMaking(d, parts, before, newTiles);
      }
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
