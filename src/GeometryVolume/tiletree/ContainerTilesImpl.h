// Lookup of tiles by position, and the arrays that hold them. Included by Container.cpp alone.
#pragma once

#include "GeometryVolume/tiletree/ContainerBuilderImpl.h"

#include <limits>
#include <stdexcept>

namespace VLN::TileTree3D {

template <class TraitsT> auto Container<TraitsT>::tile(std::int64_t n) const -> TileType const& {
  for (int d = 0; d <= kMaxDepth; ++d) {
    if (n < tileCount(d)) return tile(n, d);
    n -= tileCount(d);
  }
  return invalidTile();
}

template <class TraitsT> std::int64_t Container<TraitsT>::tileIndex(TreeIndex const& at) const {
  std::int64_t n = at.index;
  for (int d = 0; d < at.depth; ++d) n += tileCount(d);
  return n;
}

template <class TraitsT>
auto Container<TraitsT>::tile(int i, int j, int k, int depth) const -> TileType const& {
  TreeIndex const at = tileIndex(i, j, k, depth);
  return at.valid() ? tile(at) : invalidTile();
}

template <class TraitsT>
TreeIndex Container<TraitsT>::descend(TreeIndex at, int i, int j, int k, int depth,
                                      std::int64_t* path) const {
  std::uint32_t const ui = TraitsT::offset(i), uj = TraitsT::offset(j), uk = TraitsT::offset(k);
  depth = std::min(depth, kMaxDepth);
  while (at.depth < depth) {
    // The tile's own position on the grid of its depth, then that of the child.
    int const d = at.depth, c = d + 1;
    int slot;
    if constexpr (kTW == 2) {
      slot = static_cast<int>((TraitsT::quotient(ui, c) & 1) | (TraitsT::quotient(uj, c) & 1) << 1 |
                              (TraitsT::quotient(uk, c) & 1) << 2);
    } else {
      auto const digit = [&](std::uint32_t u) {
        return static_cast<int>(TraitsT::quotient(u, c) - kTW * TraitsT::quotient(u, d));
      };
      slot = TileType::slotOf(digit(ui), digit(uj), digit(uk));
    }
    std::int64_t const child = data().tiles(d)[at.index].childIndex(slot);
    if (child < 0) break;
    at = {child, c};
    if (path) path[c] = child;
  }
  return at;
}

template <class TraitsT> TreeIndex Container<TraitsT>::tileIndex(int i, int j, int k, int depth) const {
  TreeIndex const at = entry(i, j, k, depth);
  return at.valid() ? descend(at, i, j, k, depth) : at;
}

template <class TraitsT> TreeIndex Container<TraitsT>::entry(int i, int j, int k, int depth) const {
  Data const& data = this->data();
  if (depth < 0) return {};
  if (data.m_gridDepth >= 0 && depth >= data.m_gridDepth) {
    auto const inside = [](int c, int origin, int extent) {
      return static_cast<std::uint32_t>(c) - static_cast<std::uint32_t>(origin) <
             static_cast<std::uint32_t>(extent);
    };
    int3 const& o = data.m_gridOrigin;
    int3 const& e = data.m_gridExtent;
    if (inside(i, o.x, e.x) && inside(j, o.y, e.y) && inside(k, o.z, e.z)) {
      // Cells are tiles of the grid's depth: count them by the tree's own quotients, from the origin's cell.
      int const d = data.m_gridDepth;
      auto const cell = [&](int c, int origin) {
        return static_cast<std::int64_t>(TraitsT::quotient(TraitsT::offset(c), d)) -
               static_cast<std::int64_t>(TraitsT::quotient(TraitsT::offset(origin), d));
      };
      std::int64_t const nx = data.m_gridSize[0], ny = data.m_gridSize[1];
      std::int64_t const at = (cell(k, o.z) * ny + cell(j, o.y)) * nx + cell(i, o.x);
      std::int64_t const index = data.m_gridTable[at];
      if (index >= 0) return {index, d};
    }
  }
  if (data.m_roots.empty() || !TraitsT::inDomain(i, j, k)) return {};
  for (int d = 0; d <= std::min(depth, kMaxDepth); ++d) {
    if (data.m_rootCounts[d] == 0) continue;
    auto const found =
        data.m_roots.find({TraitsT::align(i, d), TraitsT::align(j, d), TraitsT::align(k, d), d});
    if (found != data.m_roots.end()) return found->second;
  }
  return {};
}

template <class TraitsT> std::int64_t Container<TraitsT>::allocateTile(int depth, TileType*& out) {
  allocateTiles(depth, 1);
  auto& tiles = data().editTiles(depth);
  out = &tiles[tiles.size() - 1];
  return tiles.size() - 1;
}

template <class TraitsT> void Container<TraitsT>::allocateTiles(int depth, std::int64_t n) {
  data().detachTiles();
  auto& tiles = data().editTiles(depth);
  tiles.resize(tiles.size() + n);
  data().m_tileCounts[depth] += n;
  data().m_tileCountTotal += n;
}

template <class TraitsT> void Container<TraitsT>::resize(std::int64_t n, int depth) {
  data().detachTiles();
  data().editTiles(depth).resize(n);
  data().m_tileCounts[depth] = n;
}

template <class TraitsT>
void Container<TraitsT>::reallocateTile(std::int64_t dst, std::int64_t src, int depth) {
  data().detachTiles();
  auto& tiles = data().editTiles(depth);
  tiles[dst] = tiles[src];
}

template <class TraitsT> void Container<TraitsT>::addRoot(TileType const& tile) {
  if (data().m_roots.insert_or_assign(tile.voxelCoord(), tile.treeIndex()).second)
    ++data().m_rootCounts[tile.depth()];
}

template <class TraitsT>
void Container<TraitsT>::addRoots(std::vector<std::int64_t> const& tiles, int depth) {
  // In the table's order, so that each goes behind the one before.
  std::vector<SortRecord> order;
  order.reserve(tiles.size());
  for (std::int64_t const index : tiles) {
    TileType const& root = tile(index, depth);
    auto const word = [](int c) { return std::uint64_t(TraitsT::offset(c)); };
    order.push_back({word(root.ti()) << 32 | word(root.tj()), word(root.tk()), index});
  }
  parallelSort(order.data(), static_cast<std::int64_t>(order.size()));
  auto& roots = data().m_roots;
  auto behind = roots.end();
  for (SortRecord const& record : order) {
    TileType const& root = tile(record.value, depth);
    std::size_t const before = roots.size();
    behind = std::next(roots.insert_or_assign(behind, root.voxelCoord(), root.treeIndex()));
    if (roots.size() > before) ++data().m_rootCounts[depth];
  }
}

template <class TraitsT> void Container<TraitsT>::removeRoot(TileType const& tile) {
  if (data().m_roots.erase(tile.voxelCoord()) > 0) --data().m_rootCounts[tile.depth()];
}

template <class TraitsT> void Container<TraitsT>::tilesAdded() {
  clearPrecomputedTileNeighbors();
  clearTileHalos();
  clearCompressedTileHalos();
  clearAccessorAccelerationStructure();
}

template <class TraitsT> void Container<TraitsT>::tilesRemoved(TileMoves const* moves) {
  tilesAdded();
  if (!moves) return;
  for (int d = 0; d <= kMaxDepth && d < static_cast<int>(moves->size()); ++d) {
    if (!(*moves)[d].empty()) {
      ContainerBuilder<TraitsT>(*this).returnThreadLocal(d);
      return;
    }
  }
}

template <class TraitsT> void Container<TraitsT>::clearPrecomputedTileNeighbors() {
  data().m_neighbors.reset();
}
template <class TraitsT> void Container<TraitsT>::clearTileHalos() { data().m_halos.reset(); }
template <class TraitsT> void Container<TraitsT>::clearCompressedTileHalos() {
  data().m_compressedHalos.reset();
}
template <class TraitsT> void Container<TraitsT>::clearAccessorAccelerationStructure() {
  if (data().m_longSearches.load(std::memory_order_relaxed) != 0) data().m_longSearches = 0;
  if (data().m_lookup.loadRelaxed()) data().setLookupTable(nullptr);
  if (data().m_gridDepth < 0) return;
  data().m_gridDepth = -1;
  data().m_gridSize = {0, 0, 0};
  std::vector<std::int64_t>().swap(data().m_gridTable);
}

} // namespace VLN::TileTree3D
