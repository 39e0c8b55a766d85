// A grid that is linear in world space, below a transform that is a shift, three voxel sizes and a turn:
// every sample and gradient is known.
#pragma once

#include "Interop/VdbTypesImpl.h"

namespace VLN::Test {

/// Its gradient is (2, -1, 0.5).
inline double rampAt(openvdb::Vec3d const& world) { return 2 * world.x() - world.y() + 0.5 * world.z() + 40; }

/// Named "ramp", over the voxels (-8, 0, 8) .. (15, 15, 23).
inline openvdb::FloatGrid::Ptr turnedRamp() {
  openvdb::initialize();
  auto const turned = openvdb::math::Transform::createLinearTransform(0.5);
  turned->preScale(openvdb::Vec3d(1, 2, 0.5));
  turned->postRotate(0.6, openvdb::math::Z_AXIS);
  turned->postTranslate(openvdb::Vec3d(3, -1, 2));
  auto grid = openvdb::FloatGrid::create(0.0f);
  grid->setName("ramp");
  grid->setTransform(turned);
  openvdb::CoordBBox const box(openvdb::Coord(-8, 0, 8), openvdb::Coord(15, 15, 23));
  for (auto it = box.begin(); it; ++it)
    grid->tree().setValueOn(*it, static_cast<float>(rampAt(turned->indexToWorld(*it))));
  return grid;
}

} // namespace VLN::Test
