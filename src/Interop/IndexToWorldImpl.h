#pragma once

#include "Interop/IndexToWorld.h"

#include <openvdb/openvdb.h>

namespace VLN::Interop {

struct IndexToWorld::Impl {
  openvdb::math::Transform::ConstPtr transform;
};

std::string transformBytes(openvdb::math::Transform const& transform);

} // namespace VLN::Interop
