#pragma once

#include "Commands.h"
#include "Interop/PointVolume.h"

#include <string>
#include <vector>

namespace Vln {

/// The points of a .ply file, or all points grids of a .vdb file.
std::vector<VLN::Interop::PointVolume> readPointVolumes(PointsInput const& input,
                                                        VLN::Interop::Progress const& progress);
/// The one that the input names.
/// @error FileError when there is none, or more than one without a name.
VLN::Interop::PointVolume readPointVolume(PointsInput const& input, VLN::Interop::Progress const& progress);

/// What of the points did not come in; empty where all did.
std::string lossesOf(VLN::Interop::PointVolume const& volume);
/// Tells it on standard error.
void noteLosses(std::string const& file, VLN::Interop::PointVolume const& volume);

/// Writes points as the extension of the name asks.
/// @error FileError, for an unknown extension too.
void checkPointsOutput(std::string const& path);
void writePoints(std::string const& path, VLN::Interop::PointVolume const& volume, double size);

} // namespace Vln
