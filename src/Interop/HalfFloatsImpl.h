// From 16-bit floats to wider ones, many at once.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <type_traits>

namespace VLN::Interop {

// Lanes by hand: the compiler does not see that a loop of these would fit them.
using FourHalves = std::uint16_t __attribute__((vector_size(8)));
using FourInts = std::int32_t __attribute__((vector_size(16)));
using FourFloats = float __attribute__((vector_size(16)));

inline FourFloats widenFour(FourHalves halves) {
  auto const lanes = __builtin_convertvector(halves, FourInts);
  FourInts const sign = (lanes >> 15) << 31, rest = (lanes & 0x7FFF) << 13;
  // A half's exponent counts from 15, a float's from 127; that of infinity and NaN is all ones in both.
  constexpr std::int32_t kShift = 112 << 23, kOnes = 31 << 23;
  FourInts const usual = rest + kShift + ((rest >= kOnes) & kShift);
  // With the least exponent there is no leading one: as a float of the next exponent it has one too many.
  constexpr std::int32_t kNext = 113 << 23;
  FourInts const one = {kNext, kNext, kNext, kNext};
  auto const small = reinterpret_cast<FourInts>(reinterpret_cast<FourFloats>(rest + kNext) -
                                                reinterpret_cast<FourFloats>(one));
  FourInts const isSmall = rest < (1 << 23);
  return reinterpret_cast<FourFloats>(sign | (small & isSmall) | (usual & ~isSmall));
}

/// Turns 16-bit floats into wider ones.
/// @numeric Exact, NaNs bit for bit.
template <class Real> void widenHalves(std::uint16_t const* halves, std::size_t count, Real* out) {
  auto const store = [&](FourHalves four, std::size_t n, std::size_t lanes) {
    FourFloats const wide = widenFour(four);
    if (std::is_same_v<Real, float> && lanes == 4) {
      std::memcpy(out + n, &wide, sizeof wide);
      return;
    }
    for (std::size_t lane = 0; lane < lanes; ++lane) out[n + lane] = Real(wide[lane]);
  };
  FourHalves four = {};
  std::size_t n = 0;
  for (; n + 4 <= count; n += 4) {
    std::memcpy(&four, halves + n, sizeof four);
    store(four, n, 4);
  }
  if (n == count) return;
  std::memcpy(&four, halves + n, (count - n) * sizeof(std::uint16_t));
  store(four, n, count - n);
}

} // namespace VLN::Interop
