// The table of trilinear weights that compressed tile halos refer to.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <array>
#include <cstdint>

namespace VLN::TileTree3D {

inline constexpr int kHaloWeightCount = 261;

/// 261 distinct weights, all exact in float, and the bit widths of a packed record's fields.
struct HaloCompression {
  std::array<float, kHaloWeightCount> weights;
  std::uint8_t weightBits = 9;    ///< index into the table
  std::uint8_t sameDepthBits = 5; ///< count of directions served at the tile's own depth
  std::uint8_t coarserBits = 6;   ///< count of weighted entries from coarser tiles

  VLN_API HaloCompression();
};

/// The table.
/// @formula Eight weights that come first because they are common; then, by reduced denominator and
/// numerator, every other product a*b*c that a trilinear read of a parent 1, 2 or 3 levels coarser can give
/// for corner samples (factors j / 2^L) and for centred samples (odd j / 2^(L+1)); then the simplest products
/// a*b*c / 4096 with a, b, c in 1..16 not yet there, up to 260; last 175 / 1024.
VLN_API std::array<float, kHaloWeightCount> const& haloWeights();

/// Index of the weight nearest to `w`; the earlier one on a tie.
VLN_API int nearestHaloWeight(float w);

} // namespace VLN::TileTree3D
