// Definitions of ChannelData: moving elements between tiles. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/ChannelData.h"
#include "GeometryVolume/channels/ElementMoves.h"
#include "GeometryVolume/channels/TileVectorOps.h"
#include "GeometryVolume/core/Parallel.h"

#include <algorithm>

namespace VLN::TileTree3D {

namespace Internal {

/// Elements that arrive in the n-th destination tile: up to the next tile's run, or to the end of the order.
inline std::size_t arrivalCount(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                                std::size_t n, std::size_t moveCount) {
  std::uint64_t const start = arrivals.find(tiles[n])->second.first;
  std::uint64_t const end = n + 1 < tiles.size() ? arrivals.find(tiles[n + 1])->second.first : moveCount;
  return end - start;
}

} // namespace Internal

template <class T>
void ChannelData<T>::allocateElements(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                                      std::size_t moveCount, int depth) {
  if (tiles.empty() || !m_data) return;
  cloneData();
  auto& all = depthTiles(depth);
  ParallelOptions options;
  options.grain = 64;
  parallelFor(
      0, static_cast<std::int64_t>(tiles.size()),
      [&](std::int64_t begin, std::int64_t end) {
        for (auto n = static_cast<std::size_t>(begin); n < static_cast<std::size_t>(end); ++n) {
          Vector& tile = all[tiles[n]];
          std::size_t const added = Internal::arrivalCount(tiles, arrivals, n, moveCount);
          Internal::resizeOutOfBlock(tile, tile.size() + added, T{});
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
  // Start of each tile's run in the order, and where in the tile its first element goes.
  std::vector<std::uint64_t> starts(tiles.size());
  std::vector<std::size_t> firstFree(tiles.size());
  for (std::size_t n = 0; n < tiles.size(); ++n) {
    starts[n] = arrivals.find(tiles[n])->second.first;
    firstFree[n] = all[tiles[n]].size() - Internal::arrivalCount(tiles, arrivals, n, order.size());
  }
  ParallelOptions options;
  options.grain = 1024;
  parallelFor(
      static_cast<std::int64_t>(starts.front()), static_cast<std::int64_t>(order.size()),
      [&](std::int64_t begin, std::int64_t end) {
        auto at = static_cast<std::uint64_t>(begin);
        auto run =
            static_cast<std::size_t>(std::upper_bound(starts.begin(), starts.end(), at) - starts.begin() - 1);
        for (; at < static_cast<std::uint64_t>(end); ++run) {
          std::uint64_t const stop = std::min<std::uint64_t>(
              run + 1 < starts.size() ? starts[run + 1] : order.size(), static_cast<std::uint64_t>(end));
          T* to = all[tiles[run]].data() + firstFree[run] + (at - starts[run]);
          for (; at < stop; ++at) {
            ElementToFrom const& move = moves[order[at]];
            *to++ = vector(TreeIndex{move.from, move.fromDepth})[static_cast<std::size_t>(move.fromElement)];
          }
        }
      },
      options);
}

template <class T>
void ChannelData<T>::removeElements(std::vector<ElementInTile> const& elements, int depth) {
  if (elements.empty() || !m_data) return;
  cloneData();
  auto& all = depthTiles(depth);
  auto const n = static_cast<std::int64_t>(elements.size());
  auto const sameTile = [&](std::int64_t a, std::int64_t b) {
    return elements[static_cast<std::size_t>(a)].tile == elements[static_cast<std::size_t>(b)].tile;
  };
  ParallelOptions options;
  options.grain = 512;
  parallelFor(
      0, n,
      [&](std::int64_t begin, std::int64_t end) {
        // Each tile belongs to the range in which its run begins.
        while (begin > 0 && begin < n && sameTile(begin, begin - 1)) ++begin;
        while (begin < end) {
          std::int64_t last = begin;
          while (last + 1 < n && sameTile(last + 1, begin)) ++last;
          Vector& tile = all[static_cast<std::size_t>(elements[static_cast<std::size_t>(begin)].tile)];
          std::size_t size = tile.size();
          std::int64_t low = begin, high = last;
          auto const position = [&](std::int64_t at) {
            return static_cast<std::size_t>(elements[static_cast<std::size_t>(at)].element);
          };
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
          if (static_cast<float>(size) * 2.0f < static_cast<float>(tile.capacity()))
            Internal::trimVector(tile);
          begin = last + 1;
        }
      },
      options);
}

} // namespace VLN::TileTree3D
