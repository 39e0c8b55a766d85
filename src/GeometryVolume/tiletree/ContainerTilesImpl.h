// Lookup of tiles by position, and their creation. Included by Container.cpp alone.
#pragma once

#include "GeometryVolume/tiletree/ContainerGrowthImpl.h"

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
    std::int64_t const child = m_data->tiles(d)[at.index].childIndex(slot);
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
  Data const& data = *m_data;
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
      std::int64_t const index = data.m_gridTable[static_cast<std::size_t>(at)];
      if (index >= 0) return {index, d};
    }
  }
  if (!TraitsT::inDomain(i, j, k)) return {};
  for (int d = 0; d <= std::min(depth, kMaxDepth); ++d) {
    if (data.m_rootCounts[static_cast<std::size_t>(d)] == 0) continue;
    auto const found =
        data.m_roots.find({TraitsT::align(i, d), TraitsT::align(j, d), TraitsT::align(k, d), d});
    if (found != data.m_roots.end()) return found->second;
  }
  return {};
}

template <class TraitsT> std::int64_t Container<TraitsT>::allocateTile(int depth, TileType*& out) {
  allocateTiles(depth, 1);
  auto& tiles = m_data->editTiles(depth);
  out = &tiles[tiles.size() - 1];
  return tiles.size() - 1;
}

template <class TraitsT> void Container<TraitsT>::allocateTiles(int depth, std::int64_t n) {
  m_data->detachTiles();
  auto& tiles = m_data->editTiles(depth);
  tiles.resize(tiles.size() + n);
  m_data->m_tileCounts[static_cast<std::size_t>(depth)] += n;
  m_data->m_tileCountTotal += n;
}

template <class TraitsT> void Container<TraitsT>::resize(std::int64_t n, int depth) {
  m_data->detachTiles();
  m_data->editTiles(depth).resize(n);
  m_data->m_tileCounts[static_cast<std::size_t>(depth)] = n;
}

template <class TraitsT>
void Container<TraitsT>::reallocateTile(std::int64_t dst, std::int64_t src, int depth) {
  m_data->detachTiles();
  auto& tiles = m_data->editTiles(depth);
  tiles[dst] = tiles[src];
}

template <class TraitsT> void Container<TraitsT>::addRoot(TileType const& tile) {
  if (m_data->m_roots.insert_or_assign(tile.voxelCoord(), tile.treeIndex()).second)
    ++m_data->m_rootCounts[static_cast<std::size_t>(tile.depth())];
}

template <class TraitsT> void Container<TraitsT>::removeRoot(TileType const& tile) {
  if (m_data->m_roots.erase(tile.voxelCoord()) > 0)
    --m_data->m_rootCounts[static_cast<std::size_t>(tile.depth())];
}

template <class TraitsT>
TreeIndex Container<TraitsT>::addTileBelow(TreeIndex above, int i, int j, int k, int depth) {
  Growth growth(*this);
  TreeIndex const made = makeTile(i, j, k, depth);
  insertChild(above, made);
  growth.keep();
  return made;
}

template <class TraitsT> TreeIndex Container<TraitsT>::makeTile(int i, int j, int k, int depth) {
  TileType* made = nullptr;
  std::int64_t const index = allocateTile(depth, made);
  made->init(-1, TraitsT::align(i, depth), TraitsT::align(j, depth), TraitsT::align(k, depth), depth, index);
  tilesAdded();
  return {index, depth};
}

template <class TraitsT> TreeIndex Container<TraitsT>::addTile(int i, int j, int k, int depth) {
  if (!TraitsT::isDepth(depth) || !TraitsT::inDomain(i, j, k)) return {};
  TreeIndex const found = tileIndex(i, j, k, depth);
  if (found.depth == depth) return found;
  if (found.valid()) return addTileBelow(found, i, j, k, depth);
  Growth growth(*this);
  TreeIndex const made = addRootTile(i, j, k, depth, growth);
  growth.keep();
  return made;
}

template <class TraitsT>
TreeIndex Container<TraitsT>::addRootTile(int i, int j, int k, int depth, Growth& growth) {
  TreeIndex const made = makeTile(i, j, k, depth);
  addRoot(tile(made));
  // It may stand above existing roots, which then hang below it.
  adoptDeeperRoots(depth, growth);
  return made;
}

template <class TraitsT> std::int64_t Container<TraitsT>::insertChild(TreeIndex parent, TreeIndex child) {
  m_data->detachTiles();
  int3 const ijk = tile(parent).childIJK(tile(child));
  int const slot = TileType::slotOf(ijk.x, ijk.y, ijk.z);
  if (!tile(parent).isLeaf(slot)) {
    insertChild(tile(parent).childTreeIndex(slot), child);
    return 0;
  }
  std::int64_t added = 0;
  if (child.depth == parent.depth + 1) {
    editTile(child).setParentIndex(parent.index);
    editTile(parent).childIndex(slot) = child.index;
    added = tile(child).branchSize();
  } else {
    int3 const corner = tile(parent).childTIJK(ijk);
    TreeIndex const between = makeTile(corner.x, corner.y, corner.z, parent.depth + 1);
    editTile(between).setParentIndex(parent.index);
    editTile(parent).childIndex(slot) = between.index;
    insertChild(between, child);
    added = tile(between).branchSize();
  }
  editTile(parent).setBranchSize(tile(parent).branchSize() + added);
  return added;
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
    if (!(*moves)[static_cast<std::size_t>(d)].empty()) {
      returnThreadLocal(d);
      return;
    }
  }
}

template <class TraitsT> void Container<TraitsT>::clearPrecomputedTileNeighbors() {
  m_data->m_neighbors.reset();
}
template <class TraitsT> void Container<TraitsT>::clearTileHalos() { m_data->m_halos.reset(); }
template <class TraitsT> void Container<TraitsT>::clearCompressedTileHalos() {
  m_data->m_compressedHalos.reset();
}
template <class TraitsT> void Container<TraitsT>::clearAccessorAccelerationStructure() {
  if (m_data->m_longSearches.load(std::memory_order_relaxed) != 0) m_data->m_longSearches = 0;
  if (m_data->m_lookup.load(std::memory_order_relaxed)) m_data->setLookupTable(nullptr);
  if (m_data->m_gridDepth < 0) return;
  m_data->m_gridDepth = -1;
  m_data->m_gridSize = {0, 0, 0};
  std::vector<std::int64_t>().swap(m_data->m_gridTable);
}

} // namespace VLN::TileTree3D
