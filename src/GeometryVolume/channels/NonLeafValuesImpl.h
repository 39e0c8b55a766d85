// Definitions of the non-leaf functions. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/EraseTilesImpl.h"
#include "GeometryVolume/channels/NonLeafDriver.h"
#include "GeometryVolume/channels/NonLeafValues.h"

namespace VLN::TileTree3D {

template <class TraitsT, class T, int E, int H>
void setNonLeafValueToChildValue(Channel<TraitsT, T, E, H>& channel, Container<TraitsT> const& tree,
                                 VoxelOffsetType offsetType, int firstDepth, int lastDepth) {
  auto const tiles = Internal::eraseTarget<T>(channel);
  Internal::setNonLeafValues<TraitsT>({tiles, channel.layout(), offsetType, firstDepth, lastDepth}, tree);
}

template <class TraitsT, class T, int E, int H>
bool checkIfNonLeafValueIsSetToChildValue(Channel<TraitsT, T, E, H> const& channel,
                                          Container<TraitsT> const& tree, VoxelOffsetType offsetType,
                                          float tolerance, int firstDepth, int lastDepth) {
  return Internal::findNonLeafDifference<TraitsT>(
      {Internal::eraseTiles<T>(channel), channel.layout(), offsetType, firstDepth, lastDepth},
      static_cast<double>(tolerance), tree);
}

#define VLN_NON_LEAF_VALUES(S, T, E, H)                                                                      \
  template VLN_API void setNonLeafValueToChildValue<S, T, E, H>(Channel<S, T, E, H>&, Container<S> const&,   \
                                                                VoxelOffsetType, int, int);                  \
  template VLN_API bool checkIfNonLeafValueIsSetToChildValue<S, T, E, H>(                                    \
      Channel<S, T, E, H> const&, Container<S> const&, VoxelOffsetType, float, int, int);

} // namespace VLN::TileTree3D
