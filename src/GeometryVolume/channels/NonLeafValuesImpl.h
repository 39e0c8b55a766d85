// Definitions of the non-leaf functions. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/NonLeafDriverImpl.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/channels/UntypedTilesImpl.h"

namespace VLN::TileTree3D {

template <class TraitsT, class T, int E, int H>
void setNonLeafValueToChildValue(Channel<TraitsT, T, E, H>& channel, Container<TraitsT> const& tree,
                                 VoxelOffsetType offsetType, int firstDepth, int lastDepth) {
  auto const tiles = Internal::untypedTarget<T>(channel);
  Internal::setNonLeafValues<TraitsT>({tiles, channel.layout(), offsetType, firstDepth, lastDepth}, tree);
}

template <class TraitsT, class T, int E, int H>
bool checkIfNonLeafValueIsSetToChildValue(Channel<TraitsT, T, E, H> const& channel,
                                          Container<TraitsT> const& tree, VoxelOffsetType offsetType,
                                          float tolerance, int firstDepth, int lastDepth) {
  return Internal::findNonLeafDifference<TraitsT>(
      {Internal::untypedTiles<T>(channel), channel.layout(), offsetType, firstDepth, lastDepth},
      static_cast<double>(tolerance), tree);
}

} // namespace VLN::TileTree3D
