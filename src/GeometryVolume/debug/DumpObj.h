// Boxes in a Wavefront OBJ file, to look at points with any viewer. Container::dumpObj() draws tiles.
#pragma once

#include "GeometryVolume/channels/Channel.h"

namespace Test {

/// Writes a cube of half-width `size` round each element of the channel, in the order of its iterators.
/// @error None: a file that cannot be written is left out silently.
template <class TraitsT>
void dumpObj(
    VLN::TileTree3D::Channel<TraitsT, Velorn::Math::float3, TraitsT::kTileDataWidth, 0> const& channel,
    float size, Ostil::String const& filename);

} // namespace Test
