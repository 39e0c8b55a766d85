// GridElements: the element types that a flat buffer has grids of, in the order of the grids.
#pragma once

#include "GeometryVolume/channels/ChannelBase.h"
#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/nanovtt/GridTaskImpl.h"
#include "GeometryVolume/topology/VoxelOffsetType.h"

#include <span>

namespace nanovtt::Internal {

using VLN::TileTree3D::ChannelBase;

/// What the grids need of one element type.
struct GridElement {
  char const* name;
  GridType type; ///< as the type is stored when it is not quantised

  /// The object's channel of this type with tiles as wide as the tree's; null without.
  Ostil::Ptr<ChannelBase> (*find)(VLN::Object const& object, Ostil::String const& name);
  VLN::TileTree3D::Internal::UntypedTiles (*tiles)(ChannelBase const& channel);
  /// Whether coarse samples differ from those of their children by more than the tolerance.
  bool (*coarserDiffer)(ChannelBase const& channel, Tree const& tree, VLN::TileTree3D::VoxelOffsetType offset,
                        float tolerance, int firstDepth);
  /// A copy whose coarse samples are those of their children.
  Ostil::Ptr<ChannelBase> (*withCoarser)(ChannelBase const& channel, Tree const& tree,
                                         VLN::TileTree3D::VoxelOffsetType offset, int firstDepth);
  FogFix fixFog; ///< null for types that no fog has
  /// Fills the tiles of a grid.
  ActiveBoxes (*fill)(GridTask const& task);
};

/// Those that this build has element types for.
std::span<GridElement const> gridElements();

/// Plans the tiles of an FpN grid: records and offsets of the task.
void planFpNTiles(GridTask& task);

} // namespace nanovtt::Internal
