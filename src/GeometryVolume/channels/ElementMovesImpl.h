// Definitions of ChannelData: moving elements between tiles. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/ChannelData.h"
#include "GeometryVolume/channels/ElementMoves.h"
#include "GeometryVolume/channels/detail/TileVectorOps.h"
#include "GeometryVolume/core/Parallel.h"

#include <algorithm>

namespace VLN::TileTree3D {

namespace Internal {

/// As ArrivalPlan, yet without lists of its own: what writes after room was made must not fail any more.
class ArrivalRuns {
public:
  ArrivalRuns(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals, std::size_t moveCount)
      : m_tiles(tiles)
      , m_arrivals(arrivals)
      , m_end(moveCount) {}

  std::uint64_t start(std::size_t n) const {
    return n < m_tiles.size() ? m_arrivals.find(m_tiles[n])->second.first : m_end;
  }
  /// Calls `body(n, start, end, first, last)` in parallel for pieces [first, last) of the order that lie in
  /// the n-th run, which is [start, end).
  template <class Body> void forEachRun(Body const& body) const {
    ParallelOptions options;
    options.grain = 1024;
    parallelFor(
        static_cast<std::int64_t>(start(0)), static_cast<std::int64_t>(m_end),
        [&](std::int64_t begin, std::int64_t end) {
          auto at = static_cast<std::uint64_t>(begin);
          auto const last = static_cast<std::uint64_t>(end);
          std::size_t run = runOf(at);
          std::uint64_t first = start(run);
          for (; at < last; ++run) {
            std::uint64_t const next = start(run + 1);
            body(run, first, next, at, std::min(next, last));
            at = first = next;
          }
        },
        options);
  }

private:
  /// The last run that begins at or before a position of the order.
  std::size_t runOf(std::uint64_t at) const {
    std::size_t low = 0, high = m_tiles.size();
    while (high - low > 1) {
      std::size_t const middle = low + (high - low) / 2;
      (start(middle) <= at ? low : high) = middle;
    }
    return low;
  }

  std::vector<std::uint64_t> const& m_tiles;
  TileArrivals const& m_arrivals;
  std::uint64_t m_end;
};

} // namespace Internal

template <class T> bool ChannelData<T>::holdsAll(std::vector<ElementToFrom> const& moves, int depth) const {
  if (moves.empty() || !m_data) return true;
  if (depth < 0 || depth >= kChannelDepths) return false;
  auto const destinations = static_cast<std::int64_t>(depthTiles(depth).size());
  auto const holds = [&](ElementToFrom const& move) {
    if (move.to >= destinations || move.fromDepth < 0 || move.fromDepth >= kChannelDepths) return false;
    auto const& sources = depthTiles(move.fromDepth);
    return move.from >= 0 && move.from < static_cast<std::int64_t>(sources.size()) && move.fromElement >= 0 &&
           static_cast<std::size_t>(move.fromElement) < sources[move.from].size();
  };
  return parallelReduce(
      0, static_cast<std::int64_t>(moves.size()), 4096, true,
      [&](std::int64_t begin, std::int64_t end) {
        return std::all_of(moves.begin() + begin, moves.begin() + end, holds);
      },
      [](bool a, bool b) { return a && b; });
}

template <class T>
void ChannelData<T>::reserveElements(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                                     std::size_t moveCount, int depth) {
  if (tiles.empty() || !m_data) return;
  cloneData();
  auto& all = depthTiles(depth);
  auto const plan = Internal::planArrivals(tiles, arrivals, moveCount);
  ParallelOptions options;
  options.grain = 64;
  parallelFor(
      0, static_cast<std::int64_t>(tiles.size()),
      [&](std::int64_t begin, std::int64_t end) {
        for (auto n = begin; n < end; ++n) {
          Vector& tile = all[tiles[n]];
          Internal::growOutOfBlock(tile, tile.size() + plan.count(n));
        }
      },
      options);
}

template <class T>
void ChannelData<T>::allocateElements(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                                      std::size_t moveCount, int depth) {
  if (tiles.empty() || !m_data) return;
  cloneData();
  auto& all = depthTiles(depth);
  Internal::ArrivalRuns const runs(tiles, arrivals, moveCount);
  ParallelOptions options;
  options.grain = 64;
  parallelFor(
      0, static_cast<std::int64_t>(tiles.size()),
      [&](std::int64_t begin, std::int64_t end) {
        for (auto n = begin; n < end; ++n) {
          Vector& tile = all[tiles[n]];
          Internal::resizeOutOfBlock(tile, tile.size() + (runs.start(n + 1) - runs.start(n)), T{});
        }
      },
      options);
}

template <class T>
void ChannelData<T>::copyElements(std::vector<ElementToFrom> const& moves,
                                  std::vector<std::uint64_t> const& order,
                                  std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                                  int depth) {
  if (tiles.empty() || !m_data) return;
  auto& all = depthTiles(depth);
  Internal::ArrivalRuns const runs(tiles, arrivals, order.size());
  runs.forEachRun(
      [&](std::size_t run, std::uint64_t start, std::uint64_t next, std::uint64_t at, std::uint64_t stop) {
        // The run fills the end of its tile, which allocateElements() has added.
        Vector& tile = all[tiles[run]];
        T* to = tile.data() + (tile.size() - (next - start)) + (at - start);
        for (; at < stop; ++at) {
          ElementToFrom const& move = moves[order[at]];
          *to++ = vector(TreeIndex{move.from, move.fromDepth})[move.fromElement];
        }
      });
}

template <class T>
void ChannelData<T>::removeElements(std::vector<ElementInTile> const& elements, int depth) {
  if (elements.empty() || !m_data || depth >= kChannelDepths) return;
  cloneData();
  auto& all = depthTiles(depth);
  Internal::forEachTileRun(elements, [&](std::int64_t low, std::int64_t end) {
    auto const position = [&](std::int64_t at) { return static_cast<std::size_t>(elements[at].element); };
    std::int64_t const index = elements[low].tile;
    if (index < 0 || index >= static_cast<std::int64_t>(all.size())) return;
    Vector& tile = all[index];
    std::size_t size = tile.size();
    std::int64_t high = end - 1;
    // What the tile does not hold cannot be removed.
    while (low <= high && position(high) >= size) --high;
    while (low <= high) {
      if (position(high) == size - 1)
        --high;
      else
        tile[position(low++)] = tile[size - 1];
      --size;
    }
    tile.resize(size);
    if (static_cast<float>(size) * 2.0f < static_cast<float>(tile.capacity())) Internal::trimVector(tile);
  });
}

} // namespace VLN::TileTree3D
