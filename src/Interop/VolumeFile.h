// importVolumes(): the volumes of a file of any format that holds some.
#pragma once

#include "Interop/Mesh.h"
#include "Interop/VdbImport.h"

namespace VLN::Interop {

/// The level set of a mesh as importMesh() makes it, by the suffix; a .vdb file as importVdb() reads it, a
/// .nvdb file as importNvdb() does, or a .nvtt file as importNvtt() does: the content tells which.
/// @error FileError.
VLN_API VdbImport importVolumes(std::string const& path, VdbReadLimits const& limits = {},
                                Progress const& progress = {}, MeshOptions const& mesh = {});

/// The volume of a flat buffer as a tree with channels again: one for each grid, quantised ones as float.
/// Merged blocks become tiles again. What a flat buffer does not hold (active states, metadata, all of a
/// transform but a scale) is not there, so that such a volume cannot be exported as .vdb.
/// @error FileError; also for a buffer that would take more than the limit's memory.
VLN_API VdbImport importNvtt(std::string const& path, VdbReadLimits const& limits = {},
                             Progress const& progress = {});

} // namespace VLN::Interop
