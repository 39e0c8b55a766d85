// VoxelOffsetType: where the samples of a voxel grid lie.
#pragma once

#include "Velorn/Math.h"

#include <cstdint>

namespace VLN::TileTree3D {

/// Bits select the axes (1 is i, 2 is j, 4 is k) on which a sample lies on its voxel's low corner rather than
/// at its centre: 0 is the cell-centred layout, 1, 2 and 4 the faces of a staggered grid, 7 the corners.
enum VoxelOffsetType : std::int32_t {
  kVoxelOffsetCenter = 0,
  kVoxelOffsetFaceX = 1,
  kVoxelOffsetFaceY = 2,
  kVoxelOffsetEdgeZ = 3,
  kVoxelOffsetFaceZ = 4,
  kVoxelOffsetEdgeY = 5,
  kVoxelOffsetEdgeX = 6,
  kVoxelOffsetCorner = 7,
};

/// Offset of a sample from its voxel's low corner. @units sample widths
constexpr Velorn::Math::float3 voxelOffset(VoxelOffsetType type) {
  return {type & 1 ? 0.0f : 0.5f, type & 2 ? 0.0f : 0.5f, type & 4 ? 0.0f : 0.5f};
}

} // namespace VLN::TileTree3D
