// PointVolume: a point set as a volume that can be walked, moved and re-tiled.
//
//   object { "point_tile_tree" : Container, "point_component" : PointTopology,
//            "positions" : float3 Channel, "<attribute>" : Channel, ... }
//
// Points lie in tiles of the deepest depth. The container's voxel size is 1 and positions are in tile space:
// a float's precision then goes to where the points are, and re-tiling keeps every point. World positions are
// origin + voxelSize * position.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/PointTopology.h"
#include "Interop/PointSet.h"

namespace VLN::Interop {

using PointTraits = TileTree3D::PowerOfTwoTraits;
using PointContainer = TileTree3D::Container<PointTraits>;
using PointTopology = TileTree3D::PointTopology<PointTraits>;
using PositionChannel = TileTree3D::Channel<PointTraits, Velorn::Math::float3, 4, 0>;

inline constexpr char const* kPointContainerName = "point_tile_tree";
inline constexpr char const* kPointTopologyName = "point_component";
inline constexpr char const* kPositionsName = "positions";

struct PointVolume {
  std::string name; ///< of the grid that the points come from; empty where files have no names
  Ostil::Ptr<Object> object;
  Velorn::Math::double3 origin{0, 0, 0};
  double voxelSize = 1;
  bool doublePositions = false;
  /// Names of the attributes in order, and the channels that hold them.
  std::vector<std::pair<std::string, std::string>> attributes;
  std::vector<std::string> skippedAttributes; ///< of types that this build has no channels for
  std::int64_t dropped = 0;                   ///< points that lie out of the tree's reach, or nowhere
};

/// Builds the tree and the channels. Roots lie at the deepest depth at which the whole cloud spans at most 64
/// tiles an axis. Points of a tile keep the order that they had.
/// @numeric The same for any number of threads.
VLN_API PointVolume buildPointVolume(PointSet const& points);

/// The way back: all points, tile by tile.
VLN_API PointSet pointSetOf(PointVolume const& volume);

struct AdvectStatistics {
  std::int64_t tilesGained = 0, tilesLost = 0;
};
/// Moves all points by a world vector, and each into its tile; tiles without points go.
/// @error What re-tiling throws; all components are still there then, but out of step.
VLN_API AdvectStatistics advect(PointVolume& volume, Velorn::Math::double3 const& velocity);

} // namespace VLN::Interop
