// Points as discs that face the camera.
#pragma once

#include "Render/Renderer.h"

namespace VLN::Render {

struct PointCloud {
  std::vector<Vec3d> positions; ///< world
  std::vector<Vec3> colors;     ///< linear light, one for each
  double radius = 1;            ///< world length
};

/// Each pixel shows the nearest disc; edges are smoothed, and depths made plain by darkening what lies behind
/// a neighbouring pixel.
/// @source C. Boucheny, "Interactive scientific visualization of large datasets", 2009 (eye-dome lighting).
/// @numeric The same for any number of threads.
VLN_RENDER_API Picture renderPoints(PointCloud const& cloud, Camera const& camera, int width, int height);

} // namespace VLN::Render
