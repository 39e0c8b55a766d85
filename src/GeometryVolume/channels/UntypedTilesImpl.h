// From a channel to its tiles without their element type. Only definitions of templates include this.
#pragma once

#include "GeometryVolume/channels/ElementOpsImpl.h"
#include "GeometryVolume/channels/TypedChannel.h"

namespace VLN::TileTree3D::Internal {

/// Refers to the channel, which must stay as it is meanwhile.
template <class T> UntypedTiles untypedTiles(TypedChannel<T> const& channel) {
  return {&TypedElementOps<T>::get(), channel.tileArrays(), &channel.defaultValue(),
          channel.minDepth(),         channel.depth(),      channel.layout().size};
}
/// The target of a pass, which is written and so shares nothing from here on.
template <class T> UntypedTiles untypedTarget(TypedChannel<T>& channel) {
  channel.cloneData();
  return untypedTiles(channel);
}

} // namespace VLN::TileTree3D::Internal
