// Brings all topologies of a tree, and their channels, into step after the tree has changed.
#pragma once

#include "GeometryVolume/channels/ChannelTypes.h"
#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/tiletree/Container.h"

namespace VLN::TileTree3D {

/// Updates every voxel and point topology of `object` that belongs to the tree, then its channels.
/// @param removed What a removal of tiles moved; null after tiles were added.
/// @param except A topology that has been updated already: it and its channels are left alone.
/// @pre One call for each change of the tree, in the order of the changes.
template <class TraitsT>
void updateTopologies(Container<TraitsT> const& tree, VLN::Object& object,
                      TileRemovalList const* removed = nullptr, Component const* except = nullptr);

} // namespace VLN::TileTree3D
