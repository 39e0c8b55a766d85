// Fractal gradient noise. No function of the C library beyond floor and sqrt is used, so that all machines
// compute the same bits.
#pragma once

#include <cmath>
#include <cstdint>

namespace VLN::Interop {

inline std::uint32_t latticeHash(std::int32_t i, std::int32_t j, std::int32_t k, std::uint32_t seed) {
  std::uint32_t h = seed * 0x27d4eb2fu ^ static_cast<std::uint32_t>(i) * 0x9e3779b1u ^
                    static_cast<std::uint32_t>(j) * 0x85ebca77u ^ static_cast<std::uint32_t>(k) * 0xc2b2ae3du;
  h = (h ^ h >> 15) * 0x2c1b3c6du;
  h = (h ^ h >> 12) * 0x297a2d39u;
  return h ^ h >> 15;
}

/// One octave: a smooth field of about -1..1 that is zero at the whole numbers.
inline double gradientNoise(double x, double y, double z, std::uint32_t seed) {
  double const fx = std::floor(x), fy = std::floor(y), fz = std::floor(z);
  auto const i = static_cast<std::int32_t>(fx), j = static_cast<std::int32_t>(fy),
             k = static_cast<std::int32_t>(fz);
  double const u = x - fx, v = y - fy, w = z - fz;
  auto fade = [](double t) { return t * t * t * (t * (t * 6 - 15) + 10); };
  // The slope at a lattice point is one of the twelve directions to the edges of a cube.
  auto corner = [&](int a, int b, int c) {
    std::uint32_t const h = latticeHash(i + a, j + b, k + c, seed) % 12;
    double const p = u - a, q = v - b, r = w - c;
    double const first = h < 8 ? p : q, second = h < 4 ? q : r;
    return (h & 1 ? -first : first) + (h & 2 ? -second : second);
  };
  auto mix = [](double a, double b, double t) { return a + (b - a) * t; };
  double const fu = fade(u), fv = fade(v), fw = fade(w);
  return mix(mix(mix(corner(0, 0, 0), corner(1, 0, 0), fu), mix(corner(0, 1, 0), corner(1, 1, 0), fu), fv),
             mix(mix(corner(0, 0, 1), corner(1, 0, 1), fu), mix(corner(0, 1, 1), corner(1, 1, 1), fu), fv),
             fw);
}

/// Octaves of half the width and half the height each; below 2 in absolute value.
inline double fractalNoise(double x, double y, double z, int octaves, std::uint32_t seed) {
  double sum = 0, height = 1;
  for (int n = 0; n < octaves; ++n) {
    sum += height * gradientNoise(x, y, z, seed + static_cast<std::uint32_t>(n));
    x *= 2, y *= 2, z *= 2, height /= 2;
  }
  return sum;
}

} // namespace VLN::Interop
