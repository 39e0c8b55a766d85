// Quantised tiles: the smallest sample, a quantum, and a code for each sample.
//
//   Fp4 Fp8 Fp16   | minimum f32 | quantum f32 | codes, the first one lowest                  |
//   FpN            | minimum f32 | quantum f32 | payload u16 | log2 bits u8 | 0 u8 | codes    |
//
// A sample reads as minimum + code * quantum.
#pragma once

#include "GeometryVolume/nanovtt/ConversionSettingsImpl.h"

#include <array>

namespace nanovtt::Internal {

/// Codes of a halo tile, padded so that they fill whole bytes at every width.
constexpr std::size_t kMaxCodes = 128;

/// What is added to a scaled sample before its fraction is cut off: by position in the tile, 0.5 everywhere
/// without dithering.
using Dither = std::array<float, kMaxCodes>;
Dither makeDither(bool enabled);

/// What the tile of an FpN grid starts with.
struct FpNRecord {
  float minimum = 0;
  float quantum = 0;
  std::uint16_t payload = 8; ///< bytes of codes
  std::uint8_t logBits = 0;
  std::uint8_t reserved = 0;
};
static_assert(sizeof(FpNRecord) == 12);

/// Fewest bits, of 1, 2, 4, 8 and 16, with which every sample stays within the tolerance; 16 where none do.
FpNRecord planFpN(float const* samples, int count, float tolerance, Dither const& dither);
void writeFpN(FpNRecord const& record, float const* samples, int count, Dither const& dither,
              std::uint8_t* out);

/// A tile of a build with codes of one width.
/// @formula quantum = (max - min) / L with L = 15, 255, 65535; code = trunc((sample - min) * L / (max - min)
/// + dither), in double.
/// @edges Where the range is not finite and above 0, the scale is 1 and codes are limited to 0..L. Samples
/// that are not numbers take no part in the range.
void writeQuantised(Build build, float const* samples, int count, Dither const& dither, std::uint8_t* out);

} // namespace nanovtt::Internal
