// What the importer's sources, and tests that build grids in memory, share.
#pragma once

#include "Interop/VdbFileImpl.h"
#include "Interop/VdbGridSourceImpl.h"
#include "Interop/VdbImport.h"

namespace VLN::Interop {

/// Builds the volumes of a file that is in memory. Grids that cannot come in are named as skipped.
VLN_API VdbImport importGrids(VdbFile const& file, Progress const& progress = {});

/// The same of the grids that the limits' filter lets through. Grids go out of the file as their channels are
/// made.
/// @error FileError for a filter that is none.
VdbImport importGrids(VdbFile& file, VdbReadLimits const& limits, Progress const& progress);

/// A volume for each points grid of the file. Those that cannot come in are named as skipped.
std::vector<PointVolume> importPointGrids(VdbFile const& file, std::vector<SkippedGrid>& skipped);
bool isPointGrid(openvdb::GridBase const& grid);

/// Empty when the transform is one uniform scale along the axes; otherwise what it is, on one line.
std::string transformBesidesScale(openvdb::math::Transform const& transform);

} // namespace VLN::Interop
