// Four numbers side by side, one instruction for all: x, y, z and a lane without meaning.
//
// Each lane computes what the plain expression computes, bit for bit.
#pragma once

#include "GeometryVolume/core/Numeric.h"
#include "Velorn/Math.h"

namespace VLN::TileTree3D::Internal {

using FloatLanes = float __attribute__((vector_size(16)));
using UnsignedLanes = std::uint32_t __attribute__((vector_size(16)));
using IntLanes = std::int32_t __attribute__((vector_size(16)));

inline FloatLanes lanesOf(Velorn::Math::float3 const& v) { return FloatLanes{v.x, v.y, v.z, 0.0f}; }
inline IntLanes lanesOf(Velorn::Math::int3 const& v) { return IntLanes{v.x, v.y, v.z, 0}; }
inline FloatLanes lanesOf(float v) { return FloatLanes{v, v, v, v}; }
inline Velorn::Math::float3 toFloat3(FloatLanes v) { return {v[0], v[1], v[2]}; }
inline Velorn::Math::int3 toInt3(IntLanes v) { return {v[0], v[1], v[2]}; }

/// floor of each lane.
/// @pre Every lane is in the reach of int.
inline IntLanes floorLanes(FloatLanes v) {
  auto const cut = __builtin_convertvector(v, IntLanes);
  // A true comparison is -1.
  return cut + (__builtin_convertvector(cut, FloatLanes) > v);
}
/// floor of each lane. NaN and values that no int holds give the lowest int or one close to either end of its
/// range, beyond every domain of tile space.
inline IntLanes floorLanesAnywhere(FloatLanes v) {
  constexpr float kLow = -2147483648.0f, kHigh = 2147483520.0f; // the ends of int's range in float
  FloatLanes const low = lanesOf(kLow), high = lanesOf(kHigh);
  v = v > low ? v : low; // NaN too
  v = v < high ? v : high;
  return floorLanes(v);
}

inline FloatLanes lerpLanes(FloatLanes a, FloatLanes b, FloatLanes t) { return (b - a) * t + a; }

} // namespace VLN::TileTree3D::Internal
