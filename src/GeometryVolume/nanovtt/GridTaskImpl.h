// GridTask: one grid of a flat buffer while it is planned and filled. Where a tile's samples lie in the grid
// follows from the tile's number alone, except inside coalesced blocks.
#pragma once

#include "GeometryVolume/channels/ElementOpsTableImpl.h"
#include "GeometryVolume/nanovtt/ContainerLayoutImpl.h"
#include "GeometryVolume/nanovtt/QuantiseImpl.h"

namespace nanovtt::Internal {

/// Copies a tile with halo, and raises the samples at or below the threshold that border on one above it to
/// just above it: a blended read at the border of fog then stays above it.
using FogFix = void (*)(void const* samples, float threshold, void* out);

struct GridTask {
  GridTask(ContainerLayout const& containerLayout, ConversionSettings const& conversionSettings)
      : layout(containerLayout)
      , settings(conversionSettings) {}

  ContainerLayout const& layout;
  ConversionSettings const& settings;

  // What is stored
  VLN::TileTree3D::Internal::UntypedTiles source;
  GridType type = GridType::kFloat;            ///< set by setType()
  std::uint64_t plainBytes = 0, haloBytes = 0; ///< of one tile; FpN tiles differ
  GridClass gridClass = GridClass::kOther;
  /// Null unless asked for and this is the channel that it is for.
  FogFix fixFog = nullptr;

  // How
  std::uint64_t size = 0;         ///< bytes of the grid
  std::uint64_t bricksAcross = 0; ///< of the 3D texture; 0 without
  float tolerance = 0;
  std::vector<FpNRecord> records;
  std::vector<std::uint64_t> offsets; ///< FpN: by number, and the end
  Dither dither{};
  std::uint8_t* bytes = nullptr; ///< of the grid, when it is filled

  bool quantised() const { return isQuantised(type); }
  bool isLevelSet() const { return gridClass == GridClass::kLevelSet; }
  std::uint64_t tableBytes() const { return (std::uint64_t(layout.tileCount()) + 1) * 8; }
  /// Settles how elements are stored, and with it the sizes of tiles.
  void setType(GridType stored) {
    type = stored;
    plainBytes = tileBytes(stored, false), haloBytes = tileBytes(stored, true);
  }

  /// Where the data of a tile begins, counted from the tile table; the end of the data for tileCount().
  std::uint64_t offset(std::uint32_t number) const {
    if (layout.coalesced()) return tableBytes() + layout.samplesBefore(number) * elementBytes(type);
    if (type == GridType::kFpN) return offsets[number];
    return tableBytes() + number * plainBytes + layout.halosBefore(number) * (haloBytes - plainBytes);
  }
  std::uint64_t end() const {
    if (bricksAcross > 0) {
      std::uint64_t const width = bricksAcross * kHaloTileWidth;
      return tableBytes() + width * width * width * elementBytes(type);
    }
    return offset(layout.tileCount());
  }
  /// Brick of the 3D texture that holds a tile. Brick 0 holds the default value.
  struct Brick {
    std::uint64_t x, y, z;
  };
  Brick brick(std::uint32_t number) const {
    std::uint64_t const c = std::uint64_t(number) + 1, q = bricksAcross;
    return {c % q, c % (q * q) / q, c / (q * q)};
  }
  /// Entry of the tile table.
  /// @param levels Of the coalesced block that the tile heads.
  std::uint64_t entry(std::uint32_t number, std::uint64_t offset, bool halo, int levels) const {
    if (bricksAcross > 0) {
      Brick const at = brick(number);
      return textureEntry(at.x, at.y, at.z);
    }
    if (quantised()) return offset;
    return tileEntry(offset, (std::uint64_t(kTileWidth) << levels) + halo,
                     static_cast<std::uint64_t>(levels));
  }
  std::uint8_t* table() const { return bytes + kTileTableOffset; }
};

/// Boxes of the samples that count as active, in tile space, with a margin of two samples. Empty: min > max.
struct ActiveBox {
  int low[3] = {INT32_MAX, INT32_MAX, INT32_MAX};
  int high[3] = {INT32_MIN, INT32_MIN, INT32_MIN};

  bool empty() const { return low[0] > high[0]; }
  void join(ActiveBox const& b) {
    for (int a = 0; a < 3; ++a) {
      if (b.low[a] < low[a]) low[a] = b.low[a];
      if (b.high[a] > high[a]) high[a] = b.high[a];
    }
  }
};
struct ActiveBoxes {
  ActiveBox all;
  ActiveBox aboveThreshold; ///< only where the fog fix applies

  void join(ActiveBoxes const& b) { all.join(b.all), aboveThreshold.join(b.aboveThreshold); }
};

} // namespace nanovtt::Internal
