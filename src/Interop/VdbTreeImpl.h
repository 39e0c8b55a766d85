// The tree that volumes of .vdb files have here, beside that of the files.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "Interop/VdbTypesImpl.h"

namespace VLN::Interop {

using VdbTraits = TileTree3D::PowerOfTwoTraits;
using VdbContainer = TileTree3D::Container<VdbTraits>;
using VdbTopology = TileTree3D::VoxelTopology<VdbTraits>;
using StateChannel = TileTree3D::Channel<VdbTraits, unsigned char, 4, 0>;

/// Width of a node of the file's tree, of 8 (leaf), 128 and 4096 voxels, and what goes with it here.
inline constexpr int kNodeWidths[3] = {8, 128, 4096};

/// Depth of the tiles whose samples are `width` wide.
constexpr int depthOfSamples(int width) {
  int depth = VdbTraits::kMaxDepth;
  for (; width > 1; width /= 2) --depth;
  return depth;
}
/// Depth of the tiles that are `width` wide.
constexpr int depthOfTiles(int width) { return depthOfSamples(width / VdbTraits::kTDW); }
static_assert(depthOfSamples(8) == 25 && depthOfSamples(128) == 21 && depthOfSamples(4096) == 16);

} // namespace VLN::Interop
