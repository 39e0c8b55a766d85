// Sorting and grouping of element moves. No element type takes part.
#pragma once

#include "GeometryVolume/channels/ChannelTypes.h"
#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/core/FunctionRef.h"

#include <cstdint>
#include <vector>

namespace VLN::TileTree3D {

/// What channels need to apply moves, bundled for Channel::updateElementsNoDispatch. Holds references only.
struct ElementPermutation {
  enum Kind : std::int32_t {
    kOneDepth = 1,  ///< One list of each sort, for the destination depth `firstDepth`.
    kAllDepths = 2, ///< A list for each depth.
    kRecorded = 3   ///< A list for each depth, and the elements to be removed told apart from the moves.
  };

  Kind kind;
  std::vector<ElementToFrom> const* moves = nullptr;
  std::vector<std::uint64_t> const* order = nullptr;
  std::vector<std::uint64_t> const* tiles = nullptr;
  TileArrivals const* arrivals = nullptr;
  int firstDepth = -1, lastDepth = -1;

  ElementMoves const* allMoves = nullptr;
  ElementOrder const* allOrders = nullptr;
  DestinationTiles const* allTiles = nullptr;
  ArrivalMap const* allArrivals = nullptr;
  ElementRemovals const* removals = nullptr;
};

/// The bundle for channels of one tree shape.
template <class Traits> struct Permutation : ElementPermutation {
  Permutation(std::vector<ElementToFrom> const& m, std::vector<std::uint64_t> const& o,
              std::vector<std::uint64_t> const& t, TileArrivals const& a, int first, int last)
      : ElementPermutation{kOneDepth} {
    moves = &m, order = &o, tiles = &t, arrivals = &a, firstDepth = first, lastDepth = last;
  }
  Permutation(ElementMoves const& m, ElementOrder const& o, DestinationTiles const& t, ArrivalMap const& a)
      : ElementPermutation{kAllDepths} {
    allMoves = &m, allOrders = &o, allTiles = &t, allArrivals = &a;
  }
  Permutation(ElementMoves const& m, ElementOrder const& o, DestinationTiles const& t, ArrivalMap const& a,
              ElementRemovals const& r)
      : Permutation(m, o, t, a) {
    kind = kRecorded;
    removals = &r;
  }
};

/// The other sense of a permutation: a tree's permute() maps old to new, channels take new to old.
/// @pre Each list names every index below its size once.
VLN_API TilePermutation invertPermutation(TilePermutation const& permutation);

namespace Internal {

/// Lists shorter than this are sorted on the calling thread.
inline constexpr std::size_t kParallelSortFrom = 500;

/// By source depth, tile and element.
VLN_API void sortMoves(std::vector<ElementToFrom>& moves);
VLN_API void sortRemovals(std::vector<ElementInTile>& elements);

/// Fills order, tiles and arrivals for the moves to one depth. `elementCount` gives the elements that a tile
/// of that depth holds now.
VLN_API void groupByDestination(std::vector<ElementToFrom> const& moves, std::vector<std::uint64_t>& order,
                                std::vector<std::uint64_t>& tiles, TileArrivals& arrivals,
                                FunctionRef<int(std::int64_t tile)> elementCount);

/// Adds the sources of `moves` to the removals of their depths.
VLN_API void addSources(std::vector<ElementToFrom> const& moves, ElementRemovals& removals);
/// Sorts each depth's list and drops repetitions.
VLN_API void finishRemovals(ElementRemovals& removals);

/// The runs of one depth's order that arrive in one tile each.
struct VLN_API ArrivalPlan {
  std::vector<std::uint64_t> starts;
  std::uint64_t end = 0;

  /// Elements that arrive in the n-th destination tile: up to the next run, or to the end of the order.
  std::uint64_t count(std::size_t n) const {
    return (n + 1 < starts.size() ? starts[n + 1] : end) - starts[n];
  }
  /// Calls `body(n, from, to)` in parallel for pieces of the order that lie in the n-th run.
  void forEachRun(FunctionRef<void(std::size_t n, std::uint64_t from, std::uint64_t to)> body) const;
};
VLN_API ArrivalPlan planArrivals(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                                 std::size_t moveCount);

/// Calls `body(begin, end)` in parallel for each run of elements of one tile.
VLN_API void forEachTileRun(std::vector<ElementInTile> const& elements,
                            FunctionRef<void(std::int64_t begin, std::int64_t end)> body);

} // namespace Internal
} // namespace VLN::TileTree3D
