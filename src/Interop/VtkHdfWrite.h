// writeVtkHdf(): a volume with all its levels, for ParaView and VTK.
//
//   VTKHDF                Type "OverlappingAMR", Origin, GridDescription "XYZ"
//     Level0              of the shallowest depth that has tiles; Spacing, the lengths of a sample's edges
//       AMRBox            (boxes, 6): first and last sample on x, y and z, counted from Origin
//       CellData/<name>   (samples) or (samples, components): box by box, x fastest
//     Level1 ...          of each depth below, half as wide
//
// A sample is a cell. Those of the deepest depth have the places of their voxels as middles, and a wider
// cell covers exactly the voxels that its sample stands for, so that cells of all levels meet.
#pragma once

#include "Interop/DenseWrite.h"

namespace VLN::Interop {

/// Whether this build can write such files: it takes the library HDF5.
VLN_API bool writesVtkHdf();

/// Writes a file whole or not at all, compressed. Tiles are merged into boxes of 16 or 32 samples an axis
/// where enough of them lie together; what has no tile in such a box has the value of the sample above. Of
/// `volume` all but `box` and `depth` counts.
/// @error FileError; also for a transform that is more than a scale and a shift along the axes.
/// @cost Holds the bytes of the file in memory once.
VLN_API void writeVtkHdf(std::string const& path, DenseVolume const& volume, Progress const& progress = {});

} // namespace VLN::Interop
