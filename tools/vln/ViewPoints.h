// Points as a page holds them.
#pragma once

#include "Render/Points.h"

#include <cstdint>
#include <string>

namespace Vln {

struct PackedPoints {
  std::size_t count = 0;
  VLN::Render::Vec3d origin, size; ///< of their box, in the world
  double radius = 0;
  std::string block; ///< x, y, z of each point as codes of 16 bits in the box, then the colours as sRGB bytes
};

/// As many of the points as fit, evenly through their order; discs of fewer points are larger.
/// @error std::invalid_argument when hardly any fit.
PackedPoints packPoints(VLN::Render::PointCloud const& cloud, std::uint64_t mostBytes);

} // namespace Vln
