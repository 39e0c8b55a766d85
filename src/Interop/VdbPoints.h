// Points grids of .vdb files.
#pragma once

#include "Interop/PointVolume.h"
#include "Interop/Progress.h"
#include "Interop/VdbFile.h"

namespace VLN::Interop {

/// A volume for each points grid of a file. Attributes of element types become channels; others are named as
/// skipped. Positions are the grid's index space.
/// @error FileError; see probeVdbFile().
VLN_API std::vector<PointVolume> importVdbPoints(std::string const& path, VdbReadLimits const& limits = {},
                                                 Progress const& progress = {});

/// Writes a points grid with a uniform scale and the origin as its transform. Unsigned and 8-bit attributes
/// become the next wider signed type that the format knows.
/// @error FileError; no file is left half-written.
VLN_API void writeVdbPoints(std::string const& path, PointSet const& points,
                            std::string const& name = "points");

} // namespace VLN::Interop
