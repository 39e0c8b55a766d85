// Morton keys of tile corners.
//
//   low word:  bit b of i, j, k (b in 0..15)  at bit 3b, 3b+1, 3b+2
//   high word: bits 16..31 in the same way
#pragma once

#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/Tile.h"

#include <bit>

namespace VLN::TileTree3D {

/// Spreads 16 bits so that each is followed by two zeros.
constexpr std::uint64_t spreadBits(std::uint64_t v) {
  v &= 0xffff;
  v = (v | v << 16) & 0x0000ff0000ffull;
  v = (v | v << 8) & 0x00f00f00f00full;
  v = (v | v << 4) & 0x0c30c30c30c3ull;
  v = (v | v << 2) & 0x249249249249ull;
  return v;
}

/// The key of a corner, with a value that sorts along.
template <class TraitsT> constexpr SortRecord mortonRecord(int3 const& corner, std::int64_t value) {
  std::uint64_t const i = TraitsT::offset(corner.x), j = TraitsT::offset(corner.y),
                      k = TraitsT::offset(corner.z);
  auto const word = [&](int shift) {
    return spreadBits(i >> shift) | spreadBits(j >> shift) << 1 | spreadBits(k >> shift) << 2;
  };
  return {word(16), word(0), value};
}

/// The key of the corner of the tile of a depth that holds one whose key is known.
/// @param corner That corner.
template <class TraitsT> constexpr SortRecord keyAbove(SortRecord const& key, int3 const& corner, int depth) {
  if constexpr (TraitsT::kTW != 2)
    return mortonRecord<TraitsT>(corner, 0);
  else {
    int const bits = 3 * std::countr_zero(static_cast<std::uint32_t>(TraitsT::width(depth)));
    auto const kept = [](int lost) { return ~std::uint64_t(0) << lost; };
    return bits < 48 ? SortRecord{key.high, key.low & kept(bits), 0}
                     : SortRecord{key.high & kept(bits - 48), 0, 0};
  }
}

/// Whether a comes before b along a Z-shaped curve, without making keys: the axis whose coordinates differ in
/// the highest bit decides. Of several i does, so that this is the order of files whose leaves have k
/// fastest; in keys k does.
/// @pre Corners of the power-of-two shape.
inline bool mortonLess(int3 const& a, int3 const& b) {
  std::uint32_t highest = 0;
  int axis = 0;
  for (int n = 0; n < 3; ++n) {
    auto const differ = static_cast<std::uint32_t>(a[n]) ^ static_cast<std::uint32_t>(b[n]);
    if (highest < differ && highest < (highest ^ differ)) highest = differ, axis = n;
  }
  return a[axis] < b[axis];
}
/// For algorithms, which do not see through a pointer to a function.
struct MortonOrder {
  bool operator()(int3 const& a, int3 const& b) const { return mortonLess(a, b); }
};

} // namespace VLN::TileTree3D
