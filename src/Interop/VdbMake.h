// Generated volumes, so that a demonstration or a test needs no file from elsewhere.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Interop/Progress.h"

#include <cstdint>
#include <string>

namespace VLN::Interop {

inline constexpr std::int64_t kFewestMadeVoxels = 1000;
inline constexpr std::int64_t kMostMadeVoxels = 2000000000;

/// Writes a cumulus cloud of fractal noise as one fog volume "density", values in 0..1.
/// @units The longest axis is about 10 world units.
/// @numeric The same bytes on every run and for any number of threads.
/// @error FileError.
VLN_API void makeCloud(std::string const& path, std::int64_t voxels = 1000000, Progress const& progress = {});

/// Writes a torus as one level set "surface" with a narrow band of half width 3; the axis is z, the tube's
/// radius 0.4 of the ring's, and the ring's radius 1 world unit.
/// @numeric As makeCloud(); the values are exact distances, rounded to float.
/// @error FileError.
VLN_API void makeTorus(std::string const& path, std::int64_t voxels = 1000000, Progress const& progress = {});

} // namespace VLN::Interop
