// writeOmeZarr(): volumes with their levels as a folder of chunks, for napari and the tools of OME-Zarr.
//
//   <folder>          of one channel: the image. Of more: one folder for each, listed in OME/.zattrs
//     .zattrs         multiscales of version 0.4: axes, and for each array a scale and a translation
//     0 1 2 ...       one array for each depth that has tiles, the deepest first, indexed [z, y, x] or
//                     [component, z, y, x]
//       .zarray       Zarr version 2; what no chunk holds is the background
//       <z>/<y>/<x>   chunks of at most 64 samples an axis, compressed with zlib
//
// Scale and translation lead from a sample's place in its array to its own place in the world, which is that
// of the low one of the voxels that it stands for, as everywhere in the library.
#pragma once

#include "Interop/DenseWrite.h"

namespace VLN::Interop {

/// The file that tells such a folder.
inline constexpr char const* kZarrMark = ".zgroup";

/// Writes a folder whole or not at all. Of the volumes all but `depth` counts: boxes may be of any size, as
/// what holds the background alone is left out.
/// @error FileError; also for a transform that is more than a positive scale and a shift along the axes.
VLN_API void writeOmeZarr(std::string const& path, std::vector<DenseVolume> const& volumes,
                          Progress const& progress = {});

} // namespace VLN::Interop
