// ContainerData: what a container holds. Copies of a container share the tile arrays until one of them is
// changed.
#pragma once

#include "GeometryVolume/core/FixedArray.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/HaloWeights.h"
#include "GeometryVolume/tiletree/Tile.h"
#include "GeometryVolume/tiletree/TileArray.h"
#include "GeometryVolume/tiletree/TileLookupTable.h"
#include "Ostil/Ptr.h"

#include <array>
#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <vector>

namespace VLN::TileTree3D {

template <class TraitsT> class Container;
template <class TraitsT> struct TileHalo;
struct CompressedTileHalo;

template <class TraitsT> struct VLN_API ContainerData {
  static constexpr int kMaxDepth = TraitsT::kMaxDepth;
  static constexpr int kDepths = TraitsT::kDepths;

  using TileType = Tile<TraitsT, TraitsT::kTileSize>;
  using Array = TileArray<TileType>;
  using UpperArrays = std::array<Array, kMaxDepth>;
  using Roots = std::map<VoxelCoord, TreeIndex>;
  using Counts = std::array<std::int64_t, kDepths>;
  using NeighborTable = std::array<std::vector<Dense1D::FixedArray<TreeIndex, kNeighborCount>>, kDepths>;
  using HaloTable = std::array<std::vector<TileHalo<TraitsT>>, kDepths>;
  struct CompressedHaloTable;

  ContainerData();
  /// Shares the tile arrays and the derived caches; scratch containers, mutexes and partitioners start fresh.
  ContainerData(ContainerData const& other);
  ContainerData& operator=(ContainerData const&) = delete;
  ~ContainerData();

  Array const& tiles(int depth) const { return *m_arrays[static_cast<std::size_t>(depth)]; }
  /// @pre tilesUnique() holds.
  Array& editTiles(int depth) { return *m_arrays[static_cast<std::size_t>(depth)]; }
  bool tilesUnique() const { return m_tiles.unique() && m_tilesMaxDepth.unique(); }
  /// Makes the tile arrays private to this data. Every change of a tile goes through it.
  /// @cost Two loads when they are private already.
  void detachTiles() {
    if (!tilesUnique()) cloneTiles();
  }
  void cloneTiles();

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
  std::shared_ptr<CompressedHaloTable const> m_compressedHalos;
  HaloCompression m_haloCompression;

  /// Roots by corner and depth; they never overlap. A point is looked up by aligning it to each depth that
  /// has roots.
  Roots m_roots;
  Counts m_rootCounts{};
  Counts m_tileCounts{};
  std::int64_t m_tileCountTotal = 0;

  // Acceleration grid: a dense box of tile indices at one depth.
  std::array<std::int32_t, 3> m_gridSize{0, 0, 0};
  std::vector<std::int64_t> m_gridTable;
  int3 m_gridOrigin{0, 0, 0};
  int3 m_gridExtent{0, 0, 0};
  std::int32_t m_gridDepth = -1;
  std::int32_t m_gridCellWidth = 1;

  /// Built with the grid, or by lookups that go far; null where it does not fit. The mutex guards the owner,
  /// which readers of the tree may set; lookups read the pointer.
  std::shared_ptr<TileLookupTable<TraitsT> const> m_lookupTable;
  std::atomic<TileLookupTable<TraitsT> const*> m_lookup{nullptr};
  mutable std::mutex m_lookupMutex;
  /// Long searches since the tree changed; far below 0 where a table has been tried in vain.
  std::atomic<std::int64_t> m_longSearches{0};
  std::atomic_flag m_lookupBusy{};

  float m_voxelSize = 1.0f;
  float m_voxelSizeInv = 1.0f;
  float m_maxRelativeRefinementError = 0.0f;
  bool m_compactOnRemoval = true;
  TileType m_invalidTile;

  std::array<std::unique_ptr<AffinityPartitioner>, kDepths> m_affinityPartitioners;
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

  std::array<Array*, kDepths> m_arrays;
};

} // namespace VLN::TileTree3D
