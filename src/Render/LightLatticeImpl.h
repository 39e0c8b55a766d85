// The light that reaches each point of a coarse lattice through a fog, for previews.
#pragma once

#include "Render/Fog.h"

#include <vector>

namespace VLN::Render {

struct LightLattice {
  std::vector<LightView::Shares> values;
  LightView view;
};

/// Sweeps, for each of the two lights, from plane to plane, from the side of the light on: what a point gets
/// is what the place toward the light got on the plane before, less what the fog between takes.
/// @param toLight, up Local, of world length 1. @param spacing Local distances of the points.
/// @cost One blend of the field for each point; in parallel within a plane.
LightLattice sweepLights(FogView const& fog, Vec3 toLight, Vec3 up, Vec3 spacing, int threads);

} // namespace VLN::Render
