// load() and save(): volumes with fields, from and to files.
#pragma once

#include "GeometryVolume/volume/Volume.h"
#include "Interop/VdbImport.h"
#include "Interop/VolumeFile.h"

#include <string>

namespace VLN::Interop {

/// The volume of a .vdb or .nvtt file: its grids are fields, and what else it holds comes along. For files
/// with several transforms there is importVolumes().
/// @error FileError; also for a file with none or more than one volume.
VLN_API TileTree3D::Volume load(std::string const& path);

/// Writes all fields, whole or not at all, in the format of the suffix: .vdb, .nvtt, or another one that
/// exportVolumes() knows and that is not a dense box.
///
/// In a .vdb file a grid that came from one keeps its transform, metadata and the states that it had; of a
/// field that was added the samples that are not the background are active. A grid whose states were kept
/// apart, as some files need it, does not learn of elements that were set since: they are written as they are
/// marked.
/// @error FileError for another suffix, a file that cannot be written, and a field of a type that .vdb files
/// do not have; std::runtime_error for a volume that a flat buffer cannot hold. What was there before stays.
VLN_API void save(TileTree3D::Volume const& volume, std::string const& path);

/// The volume with what exportVolumes() must know of its fields; of active voxels alone it tells nothing.
/// @error FileError that names `path`, for a field of a type that .vdb files do not have.
VLN_API VdbVolume writtenVolume(TileTree3D::Volume const& volume, std::string const& path);

} // namespace VLN::Interop
