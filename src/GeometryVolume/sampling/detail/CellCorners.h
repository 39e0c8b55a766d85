// CellCorners: the trilinear value of a cell, and its slope.
#pragma once

#include "GeometryVolume/core/detail/SimdLanes.h"

#include <array>
#include <cstdint>

namespace VLN::TileTree3D::Internal {

/// Eight samples and the weights between them.
struct CellCorners {
  float const* low; ///< in an array of `width` samples along x and y
  int width;
  FloatLanes weights;

  static float lerp(float a, float b, float t) { return (b - a) * t + a; }
  /// The four samples of an edge of the cell along x, in the order (0,0) (1,0) (0,1) (1,1) of y and z.
  FloatLanes samples(int x) const {
    float const* const p = low + x;
    int const w = width;
    return FloatLanes{p[0], p[w], p[w * w], p[w * w + w]};
  }
  float value() const { return value(samples(0), samples(1)); }
  float value(FloatLanes low4, FloatLanes high4) const {
    auto const v = lerpLanes(low4, high4, lanesOf(weights[0]));
    float const y = weights[1];
    return lerp(lerp(v[0], v[1], y), lerp(v[2], v[3], y), weights[2]);
  }
  /// Derivatives by the weights.
  Velorn::Math::float3 slope() const {
    auto const a = samples(0), b = samples(1), d = b - a;
    float const x = weights[0], y = weights[1], z = weights[2];
    return {lerp(lerp(d[0], d[1], y), lerp(d[2], d[3], y), z),
            lerp(lerp(a[1] - a[0], b[1] - b[0], x), lerp(a[3] - a[2], b[3] - b[2], x), z),
            lerp(lerp(a[2] - a[0], b[2] - b[0], x), lerp(a[3] - a[1], b[3] - b[1], x), y)};
  }
};

/// What lies on the high sides of a tile, as far as it was asked for.
struct HighSides {
  std::int64_t tile = -1;
  std::uint32_t known = 0;   ///< bits of the directions below that were looked up
  std::uint32_t missing = 0; ///< those where there is no tile
  std::uint32_t gaps = 0;    ///< cells that needed a coarser tile
  /// Of the tile itself, and at 1, 2 and 4 on along x, y and z. Where one is missing, numbers without
  /// meaning, so that they can be read without a test.
  std::array<float const*, 8> data;

  /// @param samples Null for a tile that is not there, or holds nothing.
  void set(unsigned direction, float const* samples) {
    static constexpr std::array<float, 125> kNone{}; // of the largest tile
    known |= 1u << direction;
    if (!samples) missing |= 1u << direction;
    data[direction] = samples ? samples : kNone.data();
  }
};

} // namespace VLN::TileTree3D::Internal
