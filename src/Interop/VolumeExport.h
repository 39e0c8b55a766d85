// exportVolumes(): the content of a file in any format that takes some of it.
#pragma once

#include "Interop/Mesh.h"
#include "Interop/VdbImport.h"

#include <string>

namespace VLN::Interop {

struct ExportOptions {
  SurfaceOptions surface;    ///< of .ply files
  bool voxelByVoxel = false; ///< of .npz files: the active voxels one by one, no dense box
};

/// Writes what a file held, whole or not at all, in the format of the suffix. .vdb keeps all of it; what the
/// others keep is told where their writers are.
/// @error FileError for a suffix of another kind, for what the format cannot tell, and for a file that cannot
/// be written.
VLN_API void exportVolumes(VdbImport const& content, std::string const& path, Progress const& progress = {},
                           ExportOptions const& options = {});
/// The same, and releases the volumes where that saves memory: see exportVdbReleasing().
VLN_API void exportVolumesReleasing(VdbImport& content, std::string const& path,
                                    Progress const& progress = {}, ExportOptions const& options = {});

} // namespace VLN::Interop
