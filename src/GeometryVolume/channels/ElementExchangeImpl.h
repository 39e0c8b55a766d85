// Moves of elements between tiles of one depth, in one pass over each tile.
#pragma once

#include "GeometryVolume/channels/ChannelBase.h"

namespace VLN::TileTree3D::Internal {

/// Applies moves that stay within their depths and whose lists are sorted by source, each source once: what
/// leaves is gathered first, then each tile takes its arrivals into the places of those that leave.
/// The elements end in the order that growing, copying and removing gives.
/// @return false, with nothing changed, for other moves and where the channel lacks what they name.
/// @error std::bad_alloc, with no element moved.
bool exchangeElements(ChannelBase& channel, ElementPermutation const& permutation);

} // namespace VLN::TileTree3D::Internal
