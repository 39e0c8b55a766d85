#include "GeometryVolume/channels/ElementMoves.h"

#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/Traits.h"

#include <algorithm>
#include <numeric>
#include <tuple>

namespace VLN::TileTree3D {

namespace {

bool bySource(ElementToFrom const& a, ElementToFrom const& b) {
  // The destination last, so that the result does not depend on how the list was sorted.
  return std::tie(a.fromDepth, a.from, a.fromElement, a.to) <
         std::tie(b.fromDepth, b.from, b.fromElement, b.to);
}

void fillWithPositions(std::vector<std::uint64_t>& order, std::size_t n) {
  order.resize(n);
  ParallelOptions options;
  options.grain = 16384;
  parallelFor(
      0, static_cast<std::int64_t>(n),
      [&](std::int64_t begin, std::int64_t end) {
        std::iota(order.begin() + begin, order.begin() + end, static_cast<std::uint64_t>(begin));
      },
      options);
}

template <class Record, class Less> void sortRecords(std::vector<Record>& records, Less const& less) {
  if (records.size() < Internal::kParallelSortFrom) {
    std::sort(records.begin(), records.end(), less);
    return;
  }
  // Recorded tile by tile, lists often arrive sorted.
  if (std::is_sorted(records.begin(), records.end(), less)) return;
  std::vector<std::uint64_t> order;
  fillWithPositions(order, records.size());
  parallelSortPositions(order.data(), static_cast<std::int64_t>(order.size()),
                        [&](std::uint64_t a, std::uint64_t b) { return less(records[a], records[b]); });
  std::vector<Record> sorted(records.size());
  ParallelOptions options;
  options.grain = 4096;
  parallelFor(
      0, static_cast<std::int64_t>(order.size()),
      [&](std::int64_t begin, std::int64_t end) {
        for (auto n = begin; n < end; ++n) sorted[n] = records[order[n]];
      },
      options);
  records.swap(sorted);
}

} // namespace

TilePermutation invertPermutation(TilePermutation const& permutation) {
  TilePermutation inverse(permutation.size());
  for (std::size_t d = 0; d < permutation.size(); ++d) {
    auto const& list = permutation[d];
    inverse[d].assign(list.size(), -1);
    for (std::size_t i = 0; i < list.size(); ++i) inverse[d][list[i]] = static_cast<std::int64_t>(i);
  }
  return inverse;
}

namespace Internal {

void sortMoves(std::vector<ElementToFrom>& moves) { sortRecords(moves, bySource); }

void sortRemovals(std::vector<ElementInTile>& elements) {
  sortRecords(elements, [](ElementInTile const& a, ElementInTile const& b) { return a < b; });
}

namespace {

struct Run {
  std::int64_t tile;
  std::uint64_t start;
};

/// Sorts by counting: linear, where the destinations are few. @return false when they are not.
bool countByDestination(std::vector<ElementToFrom> const& moves, std::vector<std::uint64_t>& order,
                        std::vector<Run>& runs) {
  constexpr std::int64_t kLowest = -2; // dropped, or without a tile
  auto const mostBuckets = static_cast<std::uint64_t>(4 * moves.size());
  // The count of bucket b lies at b + 1: it becomes the start of the next. It grows with what is met, so that
  // the moves are read but once for it.
  std::vector<std::uint64_t> next(std::min<std::uint64_t>(mostBuckets, moves.size() / 8) + 1);
  std::uint64_t buckets = 0;
  for (ElementToFrom const& move : moves) {
    std::uint64_t const bucket = static_cast<std::uint64_t>(move.to) - static_cast<std::uint64_t>(kLowest);
    if (bucket >= mostBuckets) return false;
    if (bucket + 1 >= next.size()) next.resize(std::min(mostBuckets + 1, 2 * (bucket + 2)));
    buckets = std::max(buckets, bucket + 1);
    ++next[bucket + 1];
  }
  next.resize(buckets + 1);
  for (std::size_t bucket = 1; bucket < next.size(); ++bucket) {
    bool const holdsAny = next[bucket] > 0;
    auto const tile = static_cast<std::int64_t>(bucket) - 1 + kLowest;
    if (holdsAny && tile >= 0) runs.push_back({tile, next[bucket - 1]});
    next[bucket] += next[bucket - 1];
  }
  order.resize(moves.size());
  for (std::uint64_t at = 0; at < moves.size(); ++at) order[next[moves[at].to - kLowest]++] = at;
  return true;
}

void sortByDestination(std::vector<ElementToFrom> const& moves, std::vector<std::uint64_t>& order,
                       std::vector<Run>& runs) {
  auto const n = static_cast<std::int64_t>(moves.size());
  fillWithPositions(order, moves.size());
  auto const byDestination = [&](std::uint64_t a, std::uint64_t b) {
    return moves[a].to != moves[b].to ? moves[a].to < moves[b].to : a < b;
  };
  if (moves.size() < kParallelSortFrom)
    std::sort(order.begin(), order.end(), byDestination);
  else
    parallelSortPositions(order.data(), n, byDestination);
  auto const destination = [&](std::int64_t at) { return moves[order[at]].to; };
  for (std::int64_t at = 0; at < n; ++at) {
    std::int64_t const to = destination(at);
    if (to >= 0 && (at == 0 || destination(at - 1) != to))
      runs.push_back({to, static_cast<std::uint64_t>(at)});
  }
}

} // namespace

void groupByDestination(std::vector<ElementToFrom> const& moves, std::vector<std::uint64_t>& order,
                        std::vector<std::uint64_t>& tiles, TileArrivals& arrivals,
                        FunctionRef<int(std::int64_t)> elementCount) {
  // Both ways give the same order: by destination, then by position.
  std::vector<Run> runs;
  if (moves.size() < kParallelSortFrom || !countByDestination(moves, order, runs)) {
    runs.clear();
    sortByDestination(moves, order, runs);
  }
  tiles.clear();
  arrivals.clear();
  tiles.reserve(runs.size());
  for (Run const& run : runs) {
    auto const tile = static_cast<std::uint64_t>(run.tile);
    arrivals.emplace_hint(arrivals.end(), tile, std::pair(run.start, elementCount(run.tile)));
    tiles.push_back(tile);
  }
}

void addSources(std::vector<ElementToFrom> const& moves, ElementRemovals& removals) {
  removals.resize(kChannelDepths);
  for (ElementToFrom const& move : moves) {
    if (move.fromDepth >= 0 && move.fromDepth < std::ssize(removals))
      removals[move.fromDepth].push_back({move.from, move.fromElement});
  }
}

void finishRemovals(ElementRemovals& removals) {
  for (auto& list : removals) {
    sortRemovals(list);
    list.erase(std::unique(list.begin(), list.end()), list.end());
  }
}

ArrivalPlan planArrivals(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                         std::size_t moveCount) {
  ArrivalPlan plan;
  plan.starts.reserve(tiles.size());
  for (std::uint64_t tile : tiles) plan.starts.push_back(arrivals.find(tile)->second.first);
  plan.end = moveCount;
  return plan;
}

void ArrivalPlan::forEachRun(FunctionRef<void(std::size_t, std::uint64_t, std::uint64_t)> body) const {
  if (starts.empty()) return;
  ParallelOptions options;
  options.grain = 1024;
  parallelFor(
      static_cast<std::int64_t>(starts.front()), static_cast<std::int64_t>(end),
      [&](std::int64_t first, std::int64_t last) {
        auto at = static_cast<std::uint64_t>(first);
        auto run =
            static_cast<std::size_t>(std::upper_bound(starts.begin(), starts.end(), at) - starts.begin() - 1);
        for (; at < static_cast<std::uint64_t>(last); ++run) {
          std::uint64_t const stop = std::min(starts[run] + count(run), static_cast<std::uint64_t>(last));
          body(run, at, stop);
          at = stop;
        }
      },
      options);
}

void forEachTileRun(std::vector<ElementInTile> const& elements,
                    FunctionRef<void(std::int64_t, std::int64_t)> body) {
  auto const n = static_cast<std::int64_t>(elements.size());
  auto const tile = [&](std::int64_t at) { return elements[at].tile; };
  ParallelOptions options;
  options.grain = 512;
  parallelFor(
      0, n,
      [&](std::int64_t begin, std::int64_t end) {
        // Each tile belongs to the range in which its run begins.
        while (begin > 0 && begin < n && tile(begin) == tile(begin - 1)) ++begin;
        while (begin < end) {
          std::int64_t stop = begin + 1;
          while (stop < n && tile(stop) == tile(begin)) ++stop;
          body(begin, stop);
          begin = stop;
        }
      },
      options);
}

} // namespace Internal
} // namespace VLN::TileTree3D
