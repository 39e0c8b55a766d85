// Points of .ply files: text, and binary of either byte order.
//
//   ply
//   format binary_little_endian 1.0
//   element vertex 368119          the points
//   property float x               three of the properties are the position,
//   property uchar red             the other scalars become attributes; lists are left out
//   end_header
//   ...                            other elements are skipped
#pragma once

#include "Interop/PointSet.h"

namespace VLN::Interop {

struct PlyOptions {
  /// World length of a voxel; 0 takes the power of two that comes nearest to `pointsPerTile`.
  double voxelSize = 0;
  double pointsPerTile = 64;
};

/// Reads the points of a file. Float positions and a voxel size that is a power of two come through exactly;
/// double positions are taken relative to an origin near them.
/// @error FileError that names the file and what is wrong: nothing in the file is trusted.
/// @cost The file is held in memory while it is read.
VLN_API PointSet readPly(std::string const& path, PlyOptions const& options = {});
/// The same from memory; `path` is only named in errors.
VLN_API PointSet parsePly(std::string const& path, char const* data, std::size_t size,
                          PlyOptions const& options = {});

/// Writes a binary little-endian file. Vector attributes become one property for each component.
/// @error FileError; no file is left half-written.
VLN_API void writePly(std::string const& path, PointSet const& points);

/// The voxel size, a power of two, at which points at these world positions come nearest to so many in each
/// tile that holds any.
VLN_API double chooseVoxelSize(std::vector<Velorn::Math::double3> const& world, double pointsPerTile);

} // namespace VLN::Interop
