// The passes behind non-leaf values, with the element type erased. One instantiation for each tree shape.
#pragma once

#include "GeometryVolume/channels/ChannelTypes.h"
#include "GeometryVolume/channels/ElementOpsTableImpl.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelOffsetType.h"

namespace VLN::TileTree3D::Internal {

using Velorn::Math::int3;

struct NonLeafPass {
  UntypedTiles tiles;
  ChannelLayout layout;
  VoxelOffsetType offsetType;
  int firstDepth, lastDepth;
};

/// Flat index of the child sample that sample (i,j,k) of a parent takes.
int nonLeafChildElement(ChannelLayout const& layout, VoxelOffsetType offsetType, int3 const& sample);

/// @pre The channel's tiles are shared with no other channel.
template <class TraitsT> void setNonLeafValues(NonLeafPass const& pass, Container<TraitsT> const& tree);
template <class TraitsT>
bool findNonLeafDifference(NonLeafPass const& pass, double tolerance, Container<TraitsT> const& tree);

} // namespace VLN::TileTree3D::Internal
