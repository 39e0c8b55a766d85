// Meshes: from .obj, .ply and .stl files to narrow-band level sets, and back to .ply.
#pragma once

#include "Interop/VdbImport.h"

#include <array>
#include <cstdint>
#include <string>
#include <vector>

namespace VLN::Interop {

struct Mesh {
  std::vector<Velorn::Math::double3> points;
  std::vector<std::array<std::uint32_t, 3>> triangles;
};

/// Whether a file is one of a mesh: .obj and .stl by the suffix, .ply where its header has faces.
VLN_API bool isMeshFile(std::string const& path);

/// Reads a mesh; polygons become fans of triangles. .stl may be binary or text.
/// @error FileError that names the file and what is wrong: nothing in the file is trusted. Positions that are
/// no numbers, faces of vertices that are not there, and a file without a face are errors.
VLN_API Mesh readMesh(std::string const& path);

struct MeshOptions {
  double voxelSize = 0; ///< world length of a voxel; 0 takes 1/256 of the mesh's longest side
  double band = 3;      ///< voxels to each side of the surface
};

/// The distances to a mesh, negative inside, as one level set "surface" with a narrow band.
/// @pre What is to have an inside is closed.
/// @error FileError; also for a voxel size at which the band would take more than the limit's memory.
VLN_API VdbImport importMesh(std::string const& path, MeshOptions const& options = {},
                             VdbReadLimits const& limits = {}, Progress const& progress = {});

struct SurfaceOptions {
  double iso = 0;        ///< the value on the surface
  double adaptivity = 0; ///< 0 to 1: how much flat parts may be made of larger faces
};
/// Writes where the one grid of floats or doubles has a value as a mesh, in world space; faces are seen from
/// the side of larger values.
/// @error FileError; also for no grid, several of them, and grids of other types.
VLN_API void exportSurface(VdbImport const& content, std::string const& path, SurfaceOptions const& options,
                           Progress const& progress = {});

} // namespace VLN::Interop
