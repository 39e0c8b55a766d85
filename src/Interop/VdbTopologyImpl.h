// The tiles that a set of float grids needs, found without the tree.
#pragma once

#include "GeometryVolume/tiletree/Traits.h"
#include "Interop/VdbImport.h"

#include <openvdb/openvdb.h>

#include <array>
#include <optional>
#include <string>
#include <vector>

namespace VLN::Interop {

using VdbTraits = TileTree3D::Traits<2, 4, 0, 1>;

/// What one grid holds, in the measures of the tree.
struct GridSummary {
  IndexBox stored;                       ///< leaves and active tiles, whole
  int shallowest = VdbTraits::kMaxDepth; ///< depth that the widest active tile asks for
  IndexBox active;
  std::int64_t activeVoxels = 0;
  double minimum = 0, maximum = 0;
  bool hasRange = false;
};

/// Why a grid cannot be placed in the tree; nothing when it can.
std::optional<std::string> whyNotPlaced(openvdb::FloatGrid const& grid);

/// @pre whyNotPlaced() has no objection.
GridSummary summarize(openvdb::FloatGrid const& grid);

/// Depth of all roots for grids with these summaries.
int rootDepth(std::vector<GridSummary> const& grids);

/// Corners of all tiles by depth, each once, neighbours close together (Morton order).
using TileCorners = std::array<std::vector<Velorn::Math::int3>, VdbTraits::kDepths>;
TileCorners tileCorners(std::vector<openvdb::FloatGrid::ConstPtr> const& grids, int rootDepth);

} // namespace VLN::Interop
