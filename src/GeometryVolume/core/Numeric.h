// Small numeric helpers that hold everywhere in the library.
#pragma once

#include <cstdint>

namespace VLN {

/// Tile-space coordinate for what no int32 holds: out of every tree's domain.
inline constexpr std::int32_t kOutOfDomain = INT32_MIN;

/// floor(v) as int32; kOutOfDomain for NaN, infinities and values that no int32 holds.
template <class Real> inline std::int32_t toIntFloor(Real v) {
  // Both bounds are exact in float and double; NaN fails both tests.
  if (!(v >= Real(-2147483648.0) && v < Real(2147483648.0))) return kOutOfDomain;
  // std::floor is a call where the target has no instruction for it; a comparison is cheaper than that.
  auto const cut = static_cast<std::int32_t>(v);
  return cut - (static_cast<Real>(cut) > v ? 1 : 0);
}

/// The largest whole number whose cube is at most `n`, computed without floating point.
constexpr std::uint64_t cubeRootFloor(std::uint64_t n) {
  std::uint64_t low = 0, high = 2642245; // 2642245^3 is the largest cube below 2^64
  while (low < high) {
    std::uint64_t const mid = low + (high - low + 1) / 2;
    if (mid * mid * mid <= n)
      low = mid;
    else
      high = mid - 1;
  }
  return low;
}

/// Rounds up to the next multiple of a power of two.
constexpr std::uint64_t roundUp(std::uint64_t n, std::uint64_t powerOfTwo) {
  return (n + powerOfTwo - 1) & ~(powerOfTwo - 1);
}

} // namespace VLN
