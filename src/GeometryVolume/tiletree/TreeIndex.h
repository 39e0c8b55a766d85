// Addresses of tiles, voxels and elements.
#pragma once

#include "Velorn/Math.h"

#include <compare>
#include <cstdint>

namespace VLN::TileTree3D {

/// A tile by its place in the array of its depth.
struct TreeIndex {
  std::int64_t index = -1;
  std::int32_t depth = -1;

  bool valid() const { return index >= 0 && depth >= 0; }
  bool operator==(TreeIndex const&) const = default;
  /// By depth, then by index.
  std::strong_ordering operator<=>(TreeIndex const& b) const {
    return depth != b.depth ? depth <=> b.depth : index <=> b.index;
  }
};

/// A tile by the position of its lowest corner in tile space.
struct VoxelCoord {
  std::int32_t i = 0, j = 0, k = 0;
  std::int32_t depth = -1;

  Velorn::Math::int3 ijk() const { return {i, j, k}; }
  bool operator==(VoxelCoord const&) const = default;
  /// By i, j, k and then by depth.
  auto operator<=>(VoxelCoord const&) const = default; // NOLINT(modernize-use-nullptr): none is there
};

/// A voxel: a tile and the voxel's position inside it, each component in 0..kTW-1.
struct VoxelTreeIndex : TreeIndex {
  Velorn::Math::int3 ijk{0, 0, 0};

  VoxelTreeIndex() = default;
  VoxelTreeIndex(TreeIndex const& tile, Velorn::Math::int3 const& position)
      : TreeIndex(tile)
      , ijk(position) {}
  VoxelTreeIndex(std::int64_t tile, std::int32_t tileDepth, Velorn::Math::int3 const& position)
      : TreeIndex{tile, tileDepth}
      , ijk(position) {}
  bool operator==(VoxelTreeIndex const& b) const {
    return index == b.index && depth == b.depth && ijk == b.ijk;
  }
};

/// An element: a tile and the element's position in the tile's vector.
struct ElementTreeIndex : TreeIndex {
  std::int32_t element = -1;

  ElementTreeIndex() = default;
  ElementTreeIndex(TreeIndex const& tile, std::int32_t position)
      : TreeIndex(tile)
      , element(position) {}
  ElementTreeIndex(std::int64_t tile, std::int32_t tileDepth, std::int32_t position)
      : TreeIndex{tile, tileDepth}
      , element(position) {}
  bool operator==(ElementTreeIndex const& b) const {
    return index == b.index && depth == b.depth && element == b.element;
  }
};

/// One of the 27 relative offsets (di, dj, dk), each in -1..1, as (di+1)*9 + (dj+1)*3 + (dk+1).
/// 0 is (-1,-1,-1), 13 the tile itself, 26 is (1,1,1).
enum NeighborDirection : std::int32_t { kNeighborSelf = 13, kNeighborCount = 27 };

constexpr NeighborDirection neighborDirection(int di, int dj, int dk) {
  return static_cast<NeighborDirection>((di + 1) * 9 + (dj + 1) * 3 + (dk + 1));
}
constexpr Velorn::Math::int3 neighborOffset(int direction) {
  return {direction / 9 - 1, direction / 3 % 3 - 1, direction % 3 - 1};
}

} // namespace VLN::TileTree3D
