// ContainerData: what a container holds. Copies of a container share the tile arrays until one of them is
// changed.
#pragma once

#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/tiletree/HaloWeights.h"
#include "GeometryVolume/tiletree/TileArrayImpl.h"
#include "GeometryVolume/tiletree/TileHalo.h"
#include "Ostil/Ptr.h"

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <vector>

namespace VLN::TileTree3D {

/// Packed halos of all tiles, and the bytes that they lie in.
template <class TraitsT> struct CompressedHaloTable {
  PerDepth<std::vector<CompressedTileHalo>, TraitsT::kDepths> records;
  std::vector<std::vector<std::uint8_t>> storage;
};

/// The roots by corner and depth; they never overlap. A point is looked up by aligning it to each depth that
/// has roots.
using RootTable = std::map<VoxelCoord, TreeIndex>;

template <class TraitsT> struct VLN_API ContainerData : ContainerTiles<TraitsT> {
  using Base = ContainerTiles<TraitsT>;
  using Base::kDepths, Base::kMaxDepth;
  using typename Base::Array, typename Base::Counts, typename Base::TileType;
  using UpperArrays = PerDepth<Array, kMaxDepth>;
  using NeighborTable = typename Container<TraitsT>::NeighborTable;
  using HaloTable = PerDepth<std::vector<TileHalo<TraitsT>>, kDepths>;

  ContainerData();
  /// Shares the tile arrays and the derived caches; scratch containers, mutexes and partitioners start fresh.
  ContainerData(ContainerData const& other);
  ContainerData& operator=(ContainerData const&) = delete;
  ~ContainerData();

  bool tilesUnique() const { return m_tiles.unique() && m_tilesMaxDepth.unique(); }
  /// Makes the tile arrays private to this data. Every change of a tile goes through it.
  /// @cost Two loads when they are private already.
  void detachTiles() {
    if (!tilesUnique()) cloneTiles();
  }
  void cloneTiles();

  /// Whether there is anything that a change of the tree drops.
  bool hasDerived() const {
    return m_neighbors || m_halos || m_compressedHalos || m_gridDepth >= 0 || this->m_lookup.loadRelaxed() ||
           m_longSearches.load(std::memory_order_relaxed) != 0;
  }

  void memUse(std::uint64_t& used, std::uint64_t& allocated) const;

  void setLookupTable(std::shared_ptr<TileLookupTable<TraitsT> const> table);
  std::shared_ptr<TileLookupTable<TraitsT> const> lookupTable() const {
    std::lock_guard const lock(m_lookupMutex);
    return m_lookupTable;
  }

  Ostil::Ptr<UpperArrays> m_tiles;
  Ostil::Ptr<Array> m_tilesMaxDepth; // apart, because these have no child tables
  std::shared_ptr<NeighborTable const> m_neighbors;
  std::shared_ptr<HaloTable const> m_halos;
  std::shared_ptr<CompressedHaloTable<TraitsT> const> m_compressedHalos;
  HaloCompression m_haloCompression;
  RootTable m_roots;
  /// Whether anyone else ever had tiles to write. Else those of the deepest depth have the sizes that they
  /// were made with.
  bool m_tilesHandedOut = false;

  // Acceleration grid: a dense box of tile indices at one depth.
  std::array<std::int32_t, 3> m_gridSize{0, 0, 0};
  std::vector<std::int64_t> m_gridTable;
  int3 m_gridOrigin{0, 0, 0};
  int3 m_gridExtent{0, 0, 0};
  std::int32_t m_gridDepth = -1;
  std::int32_t m_gridCellWidth = 1;

  /// The owner of what m_lookup points to. Readers of the tree may set it; lookups read the pointer alone.
  std::shared_ptr<TileLookupTable<TraitsT> const> m_lookupTable;
  mutable std::mutex m_lookupMutex;
  /// Long searches since the tree changed; far below 0 where a table has been tried in vain.
  std::atomic<std::int64_t> m_longSearches{0};
  std::atomic_flag m_lookupBusy{};

  PerDepth<std::unique_ptr<AffinityPartitioner>, kDepths> m_affinityPartitioners;
  std::atomic<std::int32_t> m_affinityUseCount{0};

  // Scratch containers. The first mutex guards the free list and the list of all, the second the bookkeeping;
  // they are never held together.
  std::mutex m_threadLocalFreeMutex;
  std::mutex m_threadLocalMapMutex;
  std::vector<Container<TraitsT>*> m_freeThreadLocal;
  std::vector<Ostil::Ptr<Container<TraitsT>>> m_allThreadLocal;
  std::map<Container<TraitsT>*, Counts> m_threadLocalCounts;

private:
  void linkArrays();
};

template <class TraitsT> ContainerData<TraitsT>& Container<TraitsT>::data() {
  return static_cast<Data&>(*m_data);
}
template <class TraitsT> ContainerData<TraitsT> const& Container<TraitsT>::data() const {
  return static_cast<Data const&>(*m_data);
}

} // namespace VLN::TileTree3D
