// Traits: the two tree shapes and their arithmetic.
//
//   Traits<2,4,0,1>   tile = 2x2x2 voxels, 4x4x4 samples, depths 0..28, domain 2^30 wide
//   Traits<5,5,0,1>   tile = 5x5x5 voxels, 5x5x5 samples, depths 0..12, domain 5^13 wide
//
// Tile space is the integer lattice whose unit is one sample at the deepest depth. The domain is one depth-0
// tile:
//
//   kMinTileCoord = -(width/2)                      0                        kMaxTileCoord
//        |------------------------------------------+---------------------------------|
//        |<------------------------------ W[0] -------------------------------------->|
//        |<---------- W[1] ---------->| ...                      (W[d] = W[d-1] / kTW)
//
// Every grid of tiles is anchored at kMinTileCoord, not at 0.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Velorn/Math.h"

#include <array>
#include <cstddef>
#include <cstdint>

namespace VLN::TileTree3D {

__extension__ using DoubleWord = unsigned __int128;

// Exported, or every template over it would stay hidden in the library.
template <int TileWidth, int TileDataWidth, int, int> struct VLN_API Traits {
  static constexpr int kTileWidth = TileWidth;
  static constexpr int kTileDataWidth = TileDataWidth;
  static constexpr int kTW = TileWidth;
  static constexpr int kTDW = TileDataWidth;
  static constexpr int kTileSize = kTW * kTW * kTW;
  static constexpr int kTileDataSize = kTDW * kTDW * kTDW;

private:
  // The largest power of kTW that a signed 32-bit integer holds.
  static constexpr std::int32_t domainWidth() {
    std::int64_t w = 1;
    while (w * kTW <= INT32_MAX) w *= kTW;
    return static_cast<std::int32_t>(w);
  }
  // The depth at which a tile is exactly kTDW units wide.
  static constexpr int maxDepth() {
    int d = 0;
    for (std::int32_t w = domainWidth(); w != kTDW; w /= kTW) ++d;
    return d;
  }

public:
  static constexpr std::int32_t kDomainWidth = domainWidth();
  static constexpr int kMaxDepth = maxDepth();
  static constexpr int kDepths = kMaxDepth + 1;
  static constexpr int kMaxParallelDepth = kMaxDepth - 2;
  static constexpr int kDepthFirstMaxParallelDepth = kMaxDepth - 3;
  static constexpr std::int32_t kMinTileCoord = -(kDomainWidth / 2);
  static constexpr std::int32_t kMaxTileCoord = kMinTileCoord + (kDomainWidth - 1);

  /// Width of a tile of depth `d` in tile-space units, for d in -1..kMaxDepth+3.
  /// Beyond 0..kMaxDepth+1 lie pads that keep divisions defined: the domain width above, 1 below.
  static constexpr std::int32_t width(int d) { return kWidths[d + 1]; }

  static constexpr bool inDomain(std::int32_t c) { return c >= kMinTileCoord && c <= kMaxTileCoord; }
  static constexpr bool inDomain(std::int32_t i, std::int32_t j, std::int32_t k) {
    return inDomain(i) && inDomain(j) && inDomain(k);
  }
  static constexpr bool inDomain(Velorn::Math::int3 const& p) { return inDomain(p.x, p.y, p.z); }
  static constexpr bool isDepth(int d) {
    return static_cast<unsigned>(d) <= static_cast<unsigned>(kMaxDepth);
  }

  /// Corner coordinate of the tile of depth `d` that holds coordinate `c`.
  /// @pre `c` lies in the domain, `d` in 0..kMaxDepth.
  static constexpr std::int32_t align(std::int32_t c, int d) {
    std::uint32_t const aligned = quotient(offset(c), d) * static_cast<std::uint32_t>(width(d));
    return static_cast<std::int32_t>(aligned + static_cast<std::uint32_t>(kMinTileCoord));
  }

  static constexpr Velorn::Math::int3 align(Velorn::Math::int3 const& p, int d) {
    return {align(p.x, d), align(p.y, d), align(p.z, d)};
  }

  /// Quotient of an offset from kMinTileCoord and the width of depth `d`, for d in 0..kMaxDepth.
  /// @formula A shift by the width's logarithm, or the high word of the product with ceil(2^64 / width),
  /// which is exact for every 32-bit dividend and divisor above 1.
  static constexpr std::uint32_t quotient(std::uint32_t offset, int d) {
    auto const& divider = kDividers[d];
    if constexpr (kTW == 2)
      return offset >> divider;
    else
      return static_cast<std::uint32_t>((static_cast<DoubleWord>(offset) * divider) >> 64);
  }
  /// Offset of a coordinate of the domain from its low end.
  static constexpr std::uint32_t offset(std::int32_t c) {
    return static_cast<std::uint32_t>(c) - static_cast<std::uint32_t>(kMinTileCoord);
  }

private:
  static constexpr auto kDividers = [] {
    std::array<std::uint64_t, kMaxDepth + 1> divider{};
    std::uint64_t w = static_cast<std::uint64_t>(kDomainWidth);
    for (auto& entry : divider) {
      if constexpr (kTW == 2) {
        for (std::uint64_t v = w; v > 1; v /= 2) ++entry;
      } else {
        entry = UINT64_MAX / w + 1; // w is odd and above 1, so it never divides 2^64
      }
      w /= static_cast<std::uint64_t>(kTW);
    }
    return divider;
  }();
  static constexpr auto kWidths = [] {
    std::array<std::int32_t, kMaxDepth + 5> w{};
    std::int32_t value = kDomainWidth;
    w[0] = value;
    for (std::size_t n = 1; n < w.size(); ++n) {
      w[n] = value;
      value = value / kTW > 0 ? value / kTW : 1;
    }
    return w;
  }();
};

using PowerOfTwoTraits = Traits<2, 4, 0, 1>;
using OddTraits = Traits<5, 5, 0, 1>;

static_assert(PowerOfTwoTraits::kMaxDepth == 28 && PowerOfTwoTraits::kMinTileCoord == -536870912 &&
              PowerOfTwoTraits::kMaxTileCoord == 536870911);
static_assert(OddTraits::kMaxDepth == 12 && OddTraits::kMinTileCoord == -610351562 &&
              OddTraits::kMaxTileCoord == 610351562);

inline constexpr int kShapeCount = 2;

/// Depths that every per-depth array of a channel has, for both shapes.
inline constexpr int kChannelDepths = 29;

} // namespace VLN::TileTree3D

/// Expands X for each tree shape.
#define VLN_FOR_EACH_SHAPE(X)                                                                                \
  X(::VLN::TileTree3D::PowerOfTwoTraits)                                                                     \
  X(::VLN::TileTree3D::OddTraits)
