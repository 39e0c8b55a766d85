// PointSet: points with their attributes as plain arrays, between a file and a volume.
#pragma once

#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Export.h"
#include "Velorn/Math.h"

#include <algorithm>
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <limits>
#include <string>
#include <vector>

namespace VLN::Interop {

/// One value for each point, of an element type named as channels name it: "float", "uint8", "double3", ...
struct PointAttribute {
  std::string name;
  std::string type;
  std::size_t valueSize = 0;
  std::vector<std::byte> bytes;

  template <class T> T value(std::size_t point) const {
    T v;
    std::memcpy(&v, bytes.data() + point * sizeof(T), sizeof(T));
    return v;
  }
  template <class T> void append(T const& v) {
    std::size_t const end = bytes.size();
    bytes.resize(end + sizeof(T));
    std::memcpy(bytes.data() + end, &v, sizeof(T));
  }
};

struct PointSet {
  /// @space Tile space: world = origin + voxelSize * position.
  std::vector<Velorn::Math::float3> positions;
  Velorn::Math::double3 origin{0, 0, 0};
  double voxelSize = 1;
  /// Whether positions came as doubles, and should be written so.
  bool doublePositions = false;
  std::vector<PointAttribute> attributes;

  std::size_t size() const { return positions.size(); }
  /// @edges A finite position is somewhere in world space too: at the end of what a double holds, not beyond.
  Velorn::Math::double3 world(std::size_t point) const {
    auto const& p = positions[point];
    Velorn::Math::double3 w;
    for (int a = 0; a < 3; ++a) {
      constexpr double kEnd = std::numeric_limits<double>::max();
      w[a] = origin[a] + voxelSize * double(p[a]);
      if (std::isfinite(p[a])) w[a] = std::clamp(w[a], -kEnd, kEnd);
    }
    return w;
  }
};

/// A new attribute whose values are of element type T.
template <class T> PointAttribute makeAttribute(std::string const& name) {
  PointAttribute attribute{name, "", sizeof(T), {}};
#define VLN_NAME_TYPE(type_, name_)                                                                          \
  if constexpr (std::is_same_v<T, type_>) attribute.type = #name_;
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_NAME_TYPE)
#undef VLN_NAME_TYPE
  return attribute;
}

/// Calls `body.template operator()<T>()` for the element type of that name.
/// @return false when this build has no such type.
template <class Body> bool withElementType(std::string const& name, Body&& body) {
#define VLN_TRY_TYPE(type_, name_)                                                                           \
  if (name == #name_) {                                                                                      \
    body.template operator()<type_>();                                                                       \
    return true;                                                                                             \
  }
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_TRY_TYPE)
#undef VLN_TRY_TYPE
  return false;
}

} // namespace VLN::Interop
