// From volumes back to a .vdb file.
#pragma once

#include "Interop/VdbImport.h"

namespace VLN::Interop {

/// Writes the grids of volumes that importVdb() made: names, types, classes, transforms, metadata, half
/// storage, active voxels and tiles, and values, bit for bit. The file is written beside its name and renamed
/// when it is whole.
/// @error FileError; what was there before stays untouched. A volume that no longer holds what its records
/// name is told as std::runtime_error.
VLN_API void exportVdb(std::vector<VdbVolume> const& volumes, std::string const& path,
                       Progress const& progress = {});
/// The same with the points grids behind them, whose points are those of the volumes tile by tile.
VLN_API void exportVdb(VdbImport const& content, std::string const& path, Progress const& progress = {});
/// The same, and releases the volumes: tiles go while the grid grows that is made of them, so that the values
/// are not there twice. Afterwards `content` has no volumes, whether they were written or not.
/// @pre Nobody else uses the volumes.
VLN_API void exportVdbReleasing(VdbImport& content, std::string const& path, Progress const& progress = {});

} // namespace VLN::Interop
