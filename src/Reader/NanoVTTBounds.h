// BoundsReader: the smallest, the largest and the mean value of each tile, for rays and for coarse pictures.
//
//   │ tiles, bits │ low, high │ flags │ box │ rows: low, high, mean of each tile, in codes of 8 or 16 bits │
//   0             8           16      24    48
//
// docs/flat_buffer.md has the byte table. A value is the sample's, or the length of a vector; what is no
// finite number counts as the default value.
#pragma once

#include "Reader/NanoVTTReader.h"
#include "Reader/NanoVTTValidate.h"

namespace nanovtt {

inline constexpr std::uint64_t kBoundsTilesOffset = 0;  // u32
inline constexpr std::uint64_t kBoundsBitsOffset = 4;   // u32, 8 or 16
inline constexpr std::uint64_t kBoundsLowOffset = 8;    // float, of all samples
inline constexpr std::uint64_t kBoundsHighOffset = 12;  // float
inline constexpr std::uint64_t kBoundsFlagsOffset = 16; // u32
inline constexpr std::uint64_t kBoundsBoxOffset = 24;   // i32[6], first and last
inline constexpr std::uint64_t kBoundsRowsOffset = 48;
inline constexpr int kBoundsRowCodes = 3;
/// Every float in a tile with halo is a finite number: such tiles need no other look before they are drawn.
inline constexpr std::uint32_t kBoundsAllFinite = 1;

NANOVTT_HD constexpr std::uint64_t boundsBytes(std::uint32_t tiles, int bits) {
  return kBoundsRowsOffset + std::uint64_t(tiles) * kBoundsRowCodes * static_cast<std::uint64_t>(bits / 8);
}

/// The larger codes of a row are no smaller: a code stands for low + code * (high - low) / last.
NANOVTT_HD inline float boundsValue(float low, float high, std::uint32_t code, std::uint32_t last) {
  if (code == last) return high;
  return static_cast<float>(double(low) + code * ((double(high) - double(low)) / last));
}

class BoundsReader {
public:
  BoundsReader() = default;
  /// @pre check() found no fault in the bytes.
  NANOVTT_HD explicit BoundsReader(void const* bytes)
      : m_rows(static_cast<unsigned char const*>(bytes) + kBoundsRowsOffset)
      , m_low(load<float>(at(bytes, kBoundsLowOffset)))
      , m_high(load<float>(at(bytes, kBoundsHighOffset)))
      , m_last((1u << load<std::uint32_t>(at(bytes, kBoundsBitsOffset))) - 1)
      , m_flags(load<std::uint32_t>(at(bytes, kBoundsFlagsOffset))) {}

  /// Of all samples. Both 0 without tiles.
  NANOVTT_HD float low() const { return m_low; }
  NANOVTT_HD float high() const { return m_high; }
  NANOVTT_HD bool isAllFinite() const { return m_flags & kBoundsAllFinite; }
  /// Box, in tile space, of the samples that differ from the default value, of the deepest tiles at each
  /// place: n 0..2 its first, 3..5 its last unit. The first is above the last where there is none.
  NANOVTT_HD std::int32_t box(int n) const {
    return load<std::int32_t>(m_rows - kBoundsRowsOffset + kBoundsBoxOffset +
                              4 * static_cast<std::uint64_t>(n));
  }

  /// No blend that begins in the tile, or in any below it, is smaller.
  NANOVTT_HD float low(std::uint32_t tile) const { return value(code(tile, 0)); }
  /// Nor larger.
  NANOVTT_HD float high(std::uint32_t tile) const { return value(code(tile, 1)); }
  /// Of the finest samples in the tile, each by the volume that it stands for.
  NANOVTT_HD float mean(std::uint32_t tile) const {
    return boundsValue(low(tile), high(tile), code(tile, 2), m_last);
  }

  /// Whether the bytes are the bounds of a tree's tiles: in form, and none narrower than one below it.
  /// @return The first fault, at its offset in the bytes.
  NANOVTT_HD static Validation check(void const* bytes, std::uint64_t length, ContainerReader const& tree) {
    std::uint32_t const tiles = tree.tileCount();
    if (length < kBoundsRowsOffset) return {"bounds shorter than their header", length};
    auto const bits = load<std::uint32_t>(at(bytes, kBoundsBitsOffset));
    if (load<std::uint32_t>(at(bytes, kBoundsTilesOffset)) != tiles)
      return {"bounds of another number of tiles", kBoundsTilesOffset};
    if (bits != 8 && bits != 16) return {"bits of bounds", kBoundsBitsOffset};
    if (length != boundsBytes(tiles, static_cast<int>(bits))) return {"length of bounds", length};
    auto const low = load<float>(at(bytes, kBoundsLowOffset)),
               high = load<float>(at(bytes, kBoundsHighOffset));
    if (!(low <= high && high - high == 0 && low - low == 0))
      return {"range of all bounds", kBoundsLowOffset};
    BoundsReader const reader(bytes);
    for (std::uint32_t n = 0; n < tiles; ++n) {
      std::uint32_t const parent = tree.parent(n);
      bool const isOrdered = reader.code(n, 0) <= reader.code(n, 1);
      bool const isInParent = parent == kNoTile || (reader.code(parent, 0) <= reader.code(n, 0) &&
                                                    reader.code(parent, 1) >= reader.code(n, 1));
      if (!isOrdered || !isInParent)
        return {"bounds of a tile", kBoundsRowsOffset + std::uint64_t(n) * kBoundsRowCodes * (bits / 8)};
    }
    return {};
  }

  NANOVTT_HD float value(std::uint32_t code) const { return boundsValue(m_low, m_high, code, m_last); }
  /// @param n 0: low, 1: high, 2: mean.
  NANOVTT_HD std::uint32_t code(std::uint32_t tile, int n) const {
    std::uint64_t const c = std::uint64_t(tile) * kBoundsRowCodes + static_cast<std::uint64_t>(n);
    return m_last == 255 ? m_rows[c] : load<std::uint16_t>(m_rows + 2 * c);
  }

private:
  NANOVTT_HD static unsigned char const* at(void const* bytes, std::uint64_t offset) {
    return static_cast<unsigned char const*>(bytes) + offset;
  }

  unsigned char const* m_rows = nullptr;
  float m_low = 0, m_high = 0;
  std::uint32_t m_last = 65535;
  std::uint32_t m_flags = 0;
};

} // namespace nanovtt
