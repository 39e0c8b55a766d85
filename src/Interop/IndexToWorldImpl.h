#pragma once

#include "Interop/IndexToWorld.h"
#include "Interop/VdbTypesImpl.h"

namespace VLN::Interop {

struct IndexToWorld::Impl {
  openvdb::math::Transform::ConstPtr transform;
};

std::string transformBytes(openvdb::math::Transform const& transform);

} // namespace VLN::Interop
