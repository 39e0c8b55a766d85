#include "GeometryVolume/tiletree/ContainerDataImpl.h"

#include <iostream>

namespace VLN::TileTree3D {

template <class TraitsT>
ContainerData<TraitsT>::ContainerData()
    : m_tiles(Ostil::makePtr<UpperArrays>())
    , m_tilesMaxDepth(Ostil::makePtr<Array>()) {
  for (auto& partitioner : m_affinityPartitioners) partitioner = std::make_unique<AffinityPartitioner>();
  linkArrays();
}

template <class TraitsT>
ContainerData<TraitsT>::ContainerData(ContainerData const& b)
    : Base()
    , m_tiles(b.m_tiles)
    , m_tilesMaxDepth(b.m_tilesMaxDepth)
    , m_neighbors(b.m_neighbors)
    , m_halos(b.m_halos)
    , m_compressedHalos(b.m_compressedHalos)
    , m_roots(b.m_roots)
    , m_tilesHandedOut(b.m_tilesHandedOut)
    , m_gridSize(b.m_gridSize)
    , m_gridTable(b.m_gridTable)
    , m_gridOrigin(b.m_gridOrigin)
    , m_gridExtent(b.m_gridExtent)
    , m_gridDepth(b.m_gridDepth)
    , m_gridCellWidth(b.m_gridCellWidth) {
  for (auto& partitioner : m_affinityPartitioners) partitioner = std::make_unique<AffinityPartitioner>();
  this->m_rootCounts = b.m_rootCounts;
  this->m_tileCounts = b.m_tileCounts;
  this->m_tileCountTotal = b.m_tileCountTotal;
  this->m_voxelSize = b.m_voxelSize;
  this->m_voxelSizeInv = b.m_voxelSizeInv;
  this->m_maxRelativeRefinementError = b.m_maxRelativeRefinementError;
  this->m_compactOnRemoval = b.m_compactOnRemoval;
  setLookupTable(b.lookupTable());
  linkArrays();
}

template <class TraitsT> ContainerData<TraitsT>::~ContainerData() = default;

template <class TraitsT>
void ContainerData<TraitsT>::setLookupTable(std::shared_ptr<TileLookupTable<TraitsT> const> table) {
  std::lock_guard const lock(m_lookupMutex);
  this->m_lookup.storeRelease(table.get());
  m_lookupTable = std::move(table);
}

template <class TraitsT> void ContainerData<TraitsT>::linkArrays() {
  for (int d = 0; d < kMaxDepth; ++d) this->m_arrays[d] = &(*m_tiles)[d];
  this->m_arrays[kMaxDepth] = m_tilesMaxDepth.get();
}

template <class TraitsT> void ContainerData<TraitsT>::cloneTiles() {
  // Both or neither: the table of arrays must not lead to one that is another's.
  auto upper = m_tiles.unique() ? m_tiles : Ostil::makePtr<UpperArrays>(*m_tiles);
  if (!m_tilesMaxDepth.unique()) m_tilesMaxDepth = Ostil::makePtr<Array>(*m_tilesMaxDepth);
  m_tiles = std::move(upper);
  linkArrays();
}

template <class TraitsT>
void ContainerData<TraitsT>::memUse(std::uint64_t& used, std::uint64_t& allocated) const {
  auto const warnIfShared = [](auto const& shared, char const* name) {
    if (!shared.unique())
      std::cerr << "Container::Data.memUse(): Warning: '" << name
                << "' not unique (use count = " << shared.useCount() << ")" << std::endl;
  };
  warnIfShared(m_tiles, "m_tiles");
  warnIfShared(m_tilesMaxDepth, "m_tilesMaxDepth");

  used = allocated = sizeof(ContainerData);
  for (int d = 0; d < kDepths; ++d) {
    Array const& array = this->tiles(d);
    std::uint64_t bytes = sizeof(Array);
    for (TileType const& tile : array) {
      std::uint64_t record = 0, same = 0;
      tile.memUse(record, same);
      bytes += record;
    }
    used += bytes;
    allocated += bytes + static_cast<std::uint64_t>(array.capacity() - array.size()) * sizeof(TileType);
  }
  used += m_gridTable.size() * sizeof(std::int64_t);
  allocated += m_gridTable.capacity() * sizeof(std::int64_t);
  // Used counts the grid alone; what goes with it is an aid, but it takes memory.
  if (auto const table = lookupTable())
    allocated +=
        table->cells.capacity() * sizeof(std::int32_t) + table->places.capacity() * sizeof(std::int32_t);
  used += m_allThreadLocal.size() * sizeof(m_allThreadLocal[0]);
  allocated += m_allThreadLocal.capacity() * sizeof(m_allThreadLocal[0]);
  for (auto const& scratch : m_allThreadLocal) {
    std::uint64_t scratchUsed = 0, scratchAllocated = 0;
    scratch->memUse(scratchUsed, scratchAllocated, true);
    used += scratchUsed, allocated += scratchAllocated;
  }
  constexpr std::uint64_t kBookkeepingEntry = 232;
  used += m_threadLocalCounts.size() * kBookkeepingEntry;
  allocated += m_threadLocalCounts.size() * kBookkeepingEntry;
}

#define VLN_INSTANTIATE(TraitsT) template struct VLN_API ContainerData<TraitsT>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
