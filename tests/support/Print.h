// How failing tests show addresses and coordinates.
#pragma once

#include "GeometryVolume/tiletree/TreeIndex.h"

#include <ostream>

namespace Velorn::Math {
template <class S> std::ostream& operator<<(std::ostream& os, Vec3<S> const& v) {
  return os << '(' << v.x << ", " << v.y << ", " << v.z << ')';
}
template <class V, class S> std::ostream& operator<<(std::ostream& os, bbox<V, S> const& box) {
  return os << '[' << box.min << " .. " << box.max << ']';
}
} // namespace Velorn::Math

namespace VLN::TileTree3D {
inline std::ostream& operator<<(std::ostream& os, TreeIndex const& at) {
  return os << "{index " << at.index << ", depth " << at.depth << '}';
}
inline std::ostream& operator<<(std::ostream& os, VoxelCoord const& at) {
  return os << "{corner " << at.ijk() << ", depth " << at.depth << '}';
}
} // namespace VLN::TileTree3D
