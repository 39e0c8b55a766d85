// channelElementReTile: every point goes to the tile that its position now falls in.
//
//   scan     each point against its own tile; who left is looked up, or waits for a tile that must be made
//   grow     the tree by the missing tiles, and topology and channels with it        publish: tiles added
//   settle   the waiting points
//   move     positions first, then the topology counts them, then all other channels publish: elements
//   prune    tiles that hold no points, nor have a descendant that does              publish: tiles removed
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/topology/PointTopology.h"

namespace VLN::TileTree3D {

/// Told after the tree has changed and `topology` and its channels have followed: null after tiles were
/// added, else what their removal moved.
using TreeChanged = FunctionRef<void(TileRemovalList const* removed)>;

/// Moves every point to the tile of its own depth that holds its position, makes tiles that are missing and,
/// with `prune`, removes those without points.
///
/// A point that stays is not touched. The order of the points in a tile is not kept. Points at or beyond 2^29
/// tile-space units from the origin, and positions that are no numbers, are dropped.
/// The channels of `object` that belong to `topology` follow in all three steps. Others do not: where the
/// tree has more topologies, pass updateTopologies() as `changed`.
///
/// @space Positions are world space. A point that waits for a new tile is settled by its position as it
/// stands, without the voxel size: in trees whose voxel size is not 1 it goes to the tile there, or is
/// dropped where there is none.
/// @pre Tree, topology and channels are in step, and nothing else uses them during the call. `tree`,
/// `topology` and `positions` are taken out of the object; positions that lie in it are set aside meanwhile.
/// @error std::runtime_error(VLN::exceptionMessage) when the host cancels the job while the tree grows;
/// std::bad_alloc. Each component is then whole, and the object holds what it held, but tree, topology and
/// channels may be out of step with each other: give the volume up.
/// @numeric The result does not depend on the number of threads.
/// @cost A point that stays costs one multiply, one floor and one comparison an axis.
template <class TraitsT>
void channelElementReTile(Container<TraitsT>& tree, PointTopology<TraitsT>& topology,
                          Channel<TraitsT, float3, TraitsT::kTileDataWidth, 0>& positions,
                          VLN::Object& object, bool prune);
template <class TraitsT>
void channelElementReTile(Container<TraitsT>& tree, PointTopology<TraitsT>& topology,
                          Channel<TraitsT, float3, TraitsT::kTileDataWidth, 0>& positions,
                          VLN::Object& object, bool prune, TreeChanged changed);

} // namespace VLN::TileTree3D
