// Delivers a change of a tree to all channels of an object that belong to it.
//
// A channel belongs to the tree component whose name is its target name or its owner. Each is taken out of
// the object while it is updated, and comes back unshared: other objects that hold it keep what they had.
#pragma once

#include "GeometryVolume/channels/ChannelBase.h"
#include "GeometryVolume/core/Object.h"

namespace VLN::TileTree3D {

/// Tiles were added, or removed at the ends of depths.
VLN_API void updateTilesAdded(Component const& tree, VLN::Object& object);
/// Tiles were removed, and the gaps closed as the list says.
VLN_API void updateTilesRemoved(TileRemovalList const& removed, Component const& tree, VLN::Object& object);
/// Tiles have a new order.
VLN_API void updateTilesPermuted(TilePermutation const& newToOld, Component const& tree, VLN::Object& object);
/// Elements moved between tiles.
VLN_API void updateElements(ElementMoves const& moves, ElementOrder const& order,
                            DestinationTiles const& tiles, ArrivalMap const& arrivals, Component const& tree,
                            VLN::Object& object);

} // namespace VLN::TileTree3D
