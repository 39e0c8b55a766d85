// TileLookupTable: from a position straight to its tile, without a walk through the tile records.
//
//   acceleration grid                        block of a tile of the grid's depth g
//   +----+----+----+----+                    +--+--+--+--+    a number for each place of lastDepth:
//   | t3 | -- | t7 | c  |   t of depth g --> |  |  |  |  |    the deepest tile there, and its depth
//   +----+----+----+----+                    +--+--+--+--+
//                   c: coarser, the same tile in the whole cell; --: no tile of any depth
//
// Two loads in place of two for each level: at random places each of those is a miss of the processor's
// caches.
#pragma once

#include "GeometryVolume/tiletree/Traits.h"
#include "GeometryVolume/tiletree/TreeIndex.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace VLN::TileTree3D {

template <class TraitsT> struct TileLookupTable {
  /// Levels below the grid's depth that a block resolves.
  static constexpr int kLevels = TraitsT::kTW == 2 ? 2 : 1;
  /// Cells, and depths of answers: no tile at all there; and tiles of deeper roots alone, to be asked of the
  /// tree.
  static constexpr int kNoTile = -2, kUnknown = -1;

  int gridDepth = -1;
  /// The deepest depth that is resolved. Deeper tiles lie below the answer when that has this depth.
  int lastDepth = -1;
  std::uint32_t levels = 0;     ///< lastDepth - gridDepth
  std::uint32_t placeWidth = 1; ///< places along a block
  std::uint32_t blockSize = 1;
  /// Cells of the grid's low corner and along its axes.
  std::array<std::uint32_t, 3> first{}, size{};
  /// index * kDepthUnit + depth of the deepest tile at or above the grid's depth; kNoTile and
  /// kUnknown else.
  std::vector<std::int32_t> cells;
  /// For each tile of the grid's depth a block of index * kLevelUnit + levels below the grid.
  std::vector<std::int32_t> places;

  // The same for shapes of powers of two, see indexAtLast().
  std::array<std::uint32_t, 3> low{}; ///< the grid's low corner in tile space
  std::uint32_t placeBits = 0, placeMask = 0, widthMask = 0;

  static constexpr std::int32_t kDepthUnit = 32;
  static constexpr std::uint32_t kLevelUnit = 4;
  static constexpr std::int64_t kMostTiles = INT32_MAX / 4, kMostCellTiles = INT32_MAX / kDepthUnit;

  /// Index of the tile of lastDepth that holds the point; below 0 where there may be none.
  /// @cost Half of the instructions of find(). Reads at random wait for memory side by side, as many as the
  /// processor holds.
  std::int64_t indexAtLast(int i, int j, int k) const requires(TraitsT::kTW == 2) {
    // The domain is a quarter of all integers: positions below the grid wrap to far above it.
    std::uint32_t const x = static_cast<std::uint32_t>(i) - low[0],
                        y = static_cast<std::uint32_t>(j) - low[1],
                        z = static_cast<std::uint32_t>(k) - low[2];
    std::uint32_t const px = x >> placeBits, py = y >> placeBits, pz = z >> placeBits;
    std::uint32_t const place =
        ((((pz & placeMask) << levels) | (py & placeMask)) << levels) | (px & placeMask);
    std::uint32_t const ci = px >> levels, cj = py >> levels, ck = pz >> levels;
    if (ci >= size[0] || cj >= size[1] || ck >= size[2]) return -1;
    std::int32_t const cell = cells[ci + std::size_t(size[0]) * (cj + std::size_t(size[1]) * ck)];
    if ((cell & (kDepthUnit - 1)) != gridDepth) return -1;
    std::uint32_t const tile = static_cast<std::uint32_t>(cell) / kDepthUnit;
    if (levels == 0) return tile;
    auto const found = static_cast<std::uint32_t>(places[std::size_t(tile) * blockSize + place]);
    return found % kLevelUnit == levels ? std::int64_t(found / kLevelUnit) : -1;
  }

  /// The deepest tile that holds the point, down to lastDepth; else with depth kNoTile or kUnknown.
  TreeIndex find(int i, int j, int k) const {
    std::uint32_t const ui = TraitsT::offset(i), uj = TraitsT::offset(j), uk = TraitsT::offset(k);
    std::uint32_t const ci = TraitsT::quotient(ui, gridDepth) - first[0],
                        cj = TraitsT::quotient(uj, gridDepth) - first[1],
                        ck = TraitsT::quotient(uk, gridDepth) - first[2];
    if (ci >= size[0] || cj >= size[1] || ck >= size[2]) return {-1, kUnknown};
    std::int32_t const cell = cells[ci + std::size_t(size[0]) * (cj + std::size_t(size[1]) * ck)];
    if (cell < 0) return {-1, cell};
    std::int32_t const depth = cell & (kDepthUnit - 1);
    std::uint32_t const tile = static_cast<std::uint32_t>(cell) / kDepthUnit;
    if (depth != gridDepth) return {static_cast<std::int64_t>(tile), depth};
    auto const at = [this](std::uint32_t u, std::uint32_t c) {
      return TraitsT::quotient(u, lastDepth) - placeWidth * c;
    };
    std::uint32_t const place =
        at(ui, ci + first[0]) + placeWidth * (at(uj, cj + first[1]) + placeWidth * at(uk, ck + first[2]));
    auto const found = static_cast<std::uint32_t>(places[static_cast<std::size_t>(tile) * blockSize + place]);
    std::uint32_t const index = found / kLevelUnit, level = found % kLevelUnit;
    // A branch, so that what follows the depth need not wait for the load.
    if (level == levels) return {index, lastDepth};
    return {index, gridDepth + static_cast<std::int32_t>(level)};
  }
};

} // namespace VLN::TileTree3D
