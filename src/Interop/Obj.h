// Boxes in Wavefront OBJ files, in world space, to look at points and tiles with any viewer.
#pragma once

#include "Interop/PointVolume.h"
#include "Interop/VdbImport.h"

#include <cstdint>
#include <string>
#include <vector>

namespace VLN::Interop {

/// A cube of half-width `half` (a world length) round each point, in the order of the volume's tiles.
/// @error FileError.
VLN_API void writePointsObj(std::string const& path, PointVolume const& volume, double half);

/// A tree and where it stands.
struct PlacedTree {
  std::string name; ///< of the object in the file; used where there is more than one
  Ostil::Ptr<PointContainer> tree;
  IndexToWorld indexToWorld;
};

/// The tiles of a depth of all trees, each as a box of eight corners in world space; a turned tree gives
/// turned boxes. Three materials, so that tiles which share a face differ; they go into "tile_tree.mtl" in
/// the same folder, or are left out where the boxes go to a pipe.
/// @return Tiles written.
/// @error FileError; neither of the files has changed then.
VLN_API std::int64_t writeTilesObj(std::string const& path, std::vector<PlacedTree> const& trees, int depth);

} // namespace VLN::Interop
