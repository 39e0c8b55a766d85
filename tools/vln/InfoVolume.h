// What info tells of volumes, as facts and as JSON.
#pragma once

#include "Interop/VdbImport.h"

#include <array>
#include <cstdint>
#include <string>

#include <nlohmann/json.hpp>

namespace Vln {

using Bounds = std::array<std::array<double, 3>, 2>;

std::int64_t elementsOf(VLN::Interop::VdbVolume const& volume, std::string const& channel);
/// Of all channels.
std::int64_t activeVoxels(VLN::Interop::VdbVolume const& volume);
/// Whether each refined sample holds the value of the child sample at its place.
bool coarseEqualsChildren(VLN::Interop::VdbVolume const& volume, std::string const& channel);

/// World box of the finest tiles that hold active voxels: of their eight corners, through the whole
/// transform. Corners of tiles are multiples of their width.
Bounds tileBounds(VLN::Interop::VdbVolume const& volume);
/// World box of the places of the active voxels themselves.
Bounds activeBounds(VLN::Interop::VdbVolume const& volume);

/// A value of the channel, or the length of one, in the fewest digits that name it.
std::string exactText(VLN::Interop::VdbChannel const& channel, double value);

nlohmann::ordered_json fileJson(VLN::Interop::VdbImport const& content);

} // namespace Vln
