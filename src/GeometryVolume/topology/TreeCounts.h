// TreeCounts: what a topology records of a tree, by depth and by tile.
#pragma once

#include "GeometryVolume/core/FixedArray.h"
#include "GeometryVolume/tiletree/TreeComponent.h"

#include <cstdint>
#include <iosfwd>
#include <vector>

namespace VLN::TileTree3D {

/// Counts of tiles and elements for a shape of `Depths` depths.
template <int Depths> struct TreeCounts {
  using Counts = PerDepth<std::int64_t, Depths>;

  Counts tileCounts{};
  std::int64_t tileCountTotal = 0;
  PerDepth<std::vector<std::uint32_t>, Depths> elementsPerTile;
  Counts elementCounts{};
  std::int64_t elementCountTotal = 0;

  /// Counts of one depth; -1 gives the total, depths that the shape lacks 0.
  std::int64_t tileCount(int depth) const { return at(tileCounts, tileCountTotal, depth); }
  std::int64_t elementCount(int depth) const { return at(elementCounts, elementCountTotal, depth); }
  int elementCount(TreeIndex const& tile) const {
    return static_cast<int>(elementsPerTile[tile.depth][tile.index]);
  }

  /// Takes the tile counts of a tree. Tiles that are new get `newElements` elements.
  void countTiles(Component const& tree, std::uint32_t newElements);
  /// Takes each tile's element count from `source`, but never less than `atLeast`. Tile counts stay.
  void countElements(Component const& source, std::uint32_t atLeast);
  void addMemory(std::uint64_t& used, std::uint64_t& allocated) const;

private:
  static std::int64_t at(Counts const& counts, std::int64_t total, int depth) {
    if (depth == -1) return total;
    return depth >= 0 && depth < Depths ? counts[depth] : 0;
  }
};

} // namespace VLN::TileTree3D
