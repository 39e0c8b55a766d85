// Non-leaf values: each sample whose voxel is refined takes one sample of the finer tile below it.
//
//   Traits<2,4,0,1>: a child lies under 2 x 2 x 2 samples. Along an axis, for a child sample c (0, or 2 for
//   centred samples):
//
//     parent sample       0   1   2   3           child sample  c + 2 * (parent sample mod 2)
//     child              [  0  ] [  1  ]
//
//   Traits<5,5,0,1>: each sample has a child of its own and takes its sample c.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelOffsetType.h"

namespace VLN::TileTree3D {

/// Copies child samples into the refined samples of their parents, fine to coarse, so that values rise
/// through several depths. No averaging. Samples of leaf voxels and halos stay as they are.
/// @param firstDepth, lastDepth Depths of the parents; limited to those of the channel that can have
/// children.
/// @edges Centred samples in a channel without halo: where a child sample lies one past its row, the flat
/// array has the first sample of the next one there, and that is taken; past the end of the tile, each
/// coordinate is limited to the last sample.
/// @pre The layouts E = W with no halo or one layer, and E = W + 1.
/// @numeric The same bytes for any number of threads.
/// @error std::bad_alloc; some samples may have been copied then, and the call can be repeated.
/// @cost Parallel over the tiles of one depth at a time.
template <class TraitsT, class T, int E, int H>
void setNonLeafValueToChildValue(Channel<TraitsT, T, E, H>& channel, Container<TraitsT> const& tree,
                                 VoxelOffsetType offsetType, int firstDepth, int lastDepth);

/// Whether a refined sample differs from the child sample that setNonLeafValueToChildValue() would copy by
/// more than the tolerance: true reports an inconsistency.
/// @formula The square root of the sum of the squared differences of the components. One that is not a number
/// does not count.
/// @cost Stops soon after the first difference.
template <class TraitsT, class T, int E, int H>
bool checkIfNonLeafValueIsSetToChildValue(Channel<TraitsT, T, E, H> const& channel,
                                          Container<TraitsT> const& tree, VoxelOffsetType offsetType,
                                          float tolerance, int firstDepth, int lastDepth);

} // namespace VLN::TileTree3D
