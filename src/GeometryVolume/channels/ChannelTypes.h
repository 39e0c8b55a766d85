// Small types that channels of every element type share.
#pragma once

#include "GeometryVolume/tiletree/TreeComponent.h"

#include <cstdint>
#include <map>
#include <utility>
#include <vector>

namespace VLN::TileTree3D {

/// What the maker of a channel wants new elements to hold. Stored and handed on; nothing branches on it.
enum DataElementInitializerType : std::int32_t {
  kInitializeNone = 0,
  kInitializeZero = 1,
  kInitializeDefaultValue = 2
};

/// Sizes of a channel's tiles, as run-time values.
struct ChannelLayout {
  int core;          ///< Width of the core.
  int halo;          ///< Layers round the core.
  int extended;      ///< Samples by which the core is wider than the tree's tiles.
  int tileDataWidth; ///< Samples along a tile of the tree.
  int size;          ///< Elements of a tile, halo included.
  int maxDepth;      ///< Deepest depth of the tree's shape.

  /// Whether every tile holds `size` elements. Else each tile follows the counts of the tree component.
  constexpr bool fixedSize() const { return halo > 0 || extended > 0; }
  /// Elements along a tile, halo included.
  constexpr int width() const { return core + 2 * halo; }
  /// Flat index of a coordinate in a tile; the core begins at (0,0,0).
  constexpr int element(int i, int j, int k) const {
    return (i + halo) + width() * ((j + halo) + width() * (k + halo));
  }
  bool operator==(ChannelLayout const&) const = default;
};

/// One element's move. A destination of -1 drops the element; -2 stands for a tile that does not exist yet.
struct ElementToFrom {
  std::int64_t to;
  std::int64_t from;
  std::int32_t fromElement;
  std::int32_t fromDepth;

  bool operator==(ElementToFrom const&) const = default;
};

/// An element to be removed from a tile of a known depth.
struct ElementInTile {
  std::int64_t tile;
  std::int32_t element;

  auto operator<=>(ElementInTile const&) const = default; // NOLINT(modernize-use-nullptr): none is there
};

// What changed, one entry for each depth. Lists may be shorter than kChannelDepths: the rest did not change.

/// (to, from) pairs: the compaction that a removal of tiles performed.
using TileRemovalList = std::vector<std::vector<std::pair<std::int64_t, std::int64_t>>>;
/// For each new tile index the old one. An empty list leaves the depth as it is.
using TilePermutation = std::vector<std::vector<std::int64_t>>;
/// Moves by depth of destination.
using ElementMoves = std::vector<std::vector<ElementToFrom>>;
/// Positions in the list of moves, sorted by destination tile.
using ElementOrder = std::vector<std::vector<std::uint64_t>>;
/// Tiles that receive elements, rising.
using DestinationTiles = std::vector<std::vector<std::uint64_t>>;
/// From a tile to the position in the order where its arrivals begin, and its first free element.
using TileArrivals = std::map<std::uint64_t, std::pair<std::uint64_t, int>>;
using ArrivalMap = std::vector<TileArrivals>;
/// Elements to be removed, by depth.
using ElementRemovals = std::vector<std::vector<ElementInTile>>;

} // namespace VLN::TileTree3D
