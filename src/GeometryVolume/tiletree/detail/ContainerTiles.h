// ContainerTiles: the part of a container's data that lookups read, each of them, in place.
#pragma once

#include "GeometryVolume/core/FixedArray.h"
#include "GeometryVolume/core/detail/Atomic.h"
#include "GeometryVolume/tiletree/Tile.h"
#include "GeometryVolume/tiletree/detail/TileArray.h"
#include "GeometryVolume/tiletree/detail/TileLookupTable.h"

namespace VLN::TileTree3D {

template <class TraitsT> struct ContainerTiles {
  static constexpr int kMaxDepth = TraitsT::kMaxDepth;
  static constexpr int kDepths = TraitsT::kDepths;

  using TileType = Tile<TraitsT, TraitsT::kTileSize>;
  using Array = TileArray<TileType>;
  using Counts = PerDepth<std::int64_t, kDepths>;

  Array const& tiles(int depth) const { return *m_arrays[depth]; }
  /// @pre The arrays are this data's alone.
  Array& editTiles(int depth) { return *m_arrays[depth]; }

  PerDepth<Array*, kDepths> m_arrays{};
  Counts m_rootCounts{};
  Counts m_tileCounts{};
  std::int64_t m_tileCountTotal = 0;
  /// Made with the acceleration grid, or by lookups that go far; null where it does not fit.
  VLN::Internal::Atomic<TileLookupTable<TraitsT> const*> m_lookup;
  float m_voxelSize = 1.0f;
  float m_voxelSizeInv = 1.0f;
  float m_maxRelativeRefinementError = 0.0f;
  bool m_compactOnRemoval = true;
  TileType m_invalidTile;
};

} // namespace VLN::TileTree3D
