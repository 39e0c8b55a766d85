// writeNpz(), writeVti(): volumes as dense boxes, for numpy and for ParaView.
//
//   .npz   one array for each channel, indexed [x, y, z] or [x, y, z, component]; "low", the index of element
//          [0, 0, 0]; "to_world", the rows of the matrix from an element's place to world space;
//          "<name>.background", the value that holds elsewhere
//   .vti   one image whose points are the samples, with one point array for each channel; extents are indices
#pragma once

#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/tiletree/Traits.h"
#include "Interop/IndexToWorld.h"
#include "Interop/VdbImport.h"

#include <string>
#include <vector>

namespace VLN::Interop {

struct DenseVolume {
  Object object; ///< as importers make them
  IndexToWorld indexToWorld;
  std::vector<std::string> channels;
  IndexBox box;                                        ///< of voxels; half open: `max` is beyond
  int depth = TileTree3D::PowerOfTwoTraits::kMaxDepth; ///< of the samples
  /// Channels of bytes that mean true and false.
  std::vector<std::string> flags = {};
};

/// The content of a volume that was imported, over the box of all its active voxels.
VLN_API DenseVolume denseVolumeOf(VdbVolume const& volume);

/// Writes a file whole or not at all, compressed.
/// @error FileError; for a transform that is not linear too.
VLN_API void writeNpz(std::string const& path, DenseVolume const& volume, Progress const& progress = {});

/// Writes a file whole or not at all: XML, and behind it the values as they are.
/// @error FileError; also for a transform that is no scale along three directions at right angles.
VLN_API void writeVti(std::string const& path, DenseVolume const& volume, Progress const& progress = {});

/// Writes the active voxels of the grids of one volume, one by one, as "<name>.indices" and "<name>.values",
/// and no "low": places are indices.
/// @error FileError; for a transform that is not linear too.
VLN_API void writeNpzVoxels(std::string const& path, VdbImport const& content, Progress const& progress = {});

} // namespace VLN::Interop
