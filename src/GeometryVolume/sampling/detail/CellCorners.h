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

  /// Two samples in a row from each of two places.
  static FloatLanes rows(float const* p, float const* q) {
    using Pair = float __attribute__((vector_size(8)));
    Pair a, b;
    __builtin_memcpy(&a, p, sizeof a); // as std::memcpy, without its header
    __builtin_memcpy(&b, q, sizeof b);
    return __builtin_shufflevector(a, b, 0, 1, 2, 3);
  }
  static float lerp(float a, float b, float t) { return (b - a) * t + a; }
  /// The four samples at either end of the cell along x, in the order (0,0) (0,1) (1,0) (1,1) of y and z.
  struct Ends {
    FloatLanes low, high;
  };
  Ends ends() const {
    int const w = width;
    auto const a = rows(low, low + w * w), b = rows(low + w, low + (w * w + w));
    return {__builtin_shufflevector(a, b, 0, 2, 4, 6), __builtin_shufflevector(a, b, 1, 3, 5, 7)};
  }
  float value() const {
    auto const [a, b] = ends();
    return value(a, b);
  }
  float value(FloatLanes low4, FloatLanes high4) const {
    auto const v = lerpLanes(low4, high4, lanesOf(weights[0]));
    // By y, for both z at once.
    auto const u = lerpLanes(v, __builtin_shufflevector(v, v, 2, 3, 2, 3), lanesOf(weights[1]));
    return lerp(u[0], u[1], weights[2]);
  }
  /// Derivatives by the weights.
  Velorn::Math::float3 slope() const {
    auto const [a, b] = ends();
    auto const d = b - a;
    float const x = weights[0], y = weights[1], z = weights[2];
    return {lerp(lerp(d[0], d[2], y), lerp(d[1], d[3], y), z),
            lerp(lerp(a[2] - a[0], b[2] - b[0], x), lerp(a[3] - a[1], b[3] - b[1], x), z),
            lerp(lerp(a[1] - a[0], b[1] - b[0], x), lerp(a[3] - a[2], b[3] - b[2], x), y)};
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
