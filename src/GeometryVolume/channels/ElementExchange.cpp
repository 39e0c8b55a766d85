// A tile of s elements, of which those at p0 < p1 < ... leave, and its arrivals a0, a1, ... in order:
//
//   at least as many arrive      | . p0 . . p1 . |          the last arrivals fill the holes, backwards;
//                                                            the others follow behind
//   fewer arrive                  all arrivals fill the first holes, backwards; the other holes are filled
//                                 from the tail
//
// That is what becomes of a tile to whose end all arrivals were written before its holes are filled from the
// tail, without the room for both.
#include "GeometryVolume/channels/ElementExchangeImpl.h"

#include "GeometryVolume/channels/TypedChannel.h"
#include "GeometryVolume/channels/detail/TileVectorOps.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <atomic>
#include <optional>

namespace VLN::TileTree3D::Internal {

namespace {

/// The moves of one tile begin at `first`.
struct SourceRun {
  std::int64_t tile;
  std::uint64_t first;
};

/// What happens to one tile: a run of the moves takes elements from it, a run of the order brings others.
struct TileExchange {
  std::int64_t tile;
  std::uint64_t firstLeaving, leaving;
  std::uint64_t firstArrival, arriving;
};

/// The moves to one depth, as a permutation lists them.
struct DepthMoves {
  std::vector<ElementToFrom> const& moves;
  std::vector<std::uint64_t> const& order;
  std::vector<std::uint64_t> const& tiles;
  TileArrivals const& arrivals;
  int depth;
};

template <class T> class DepthExchange {
public:
  using Tiles = std::vector<TileVector<T>>;

  explicit DepthExchange(DepthMoves const& moves)
      : m_in(moves)
      , m_gathered(unwritten<T>(moves))
      , m_places(unwritten<std::int32_t>(moves)) {}

  int depth() const { return m_in.depth; }

  /// Takes copies of all elements that leave. @return false where the moves are not for this.
  bool gather(Tiles const& tiles) {
    if (m_in.order.size() != m_in.moves.size()) return false;
    auto const n = static_cast<std::int64_t>(m_in.moves.size());
    constexpr std::int64_t kGrain = 8192;
    std::vector<std::vector<SourceRun>> runs(chunkCount(0, n, kGrain));
    std::atomic<bool> held{true};
    parallelChunks(0, n, kGrain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
      if (!gatherChunk(tiles, static_cast<std::size_t>(begin), static_cast<std::size_t>(end), runs[chunk]))
        held.store(false, std::memory_order_relaxed);
    });
    return held && plan(runs);
  }

  /// Makes the room that apply() needs.
  void reserve(Tiles& tiles) const {
    forEach(tiles, [](TileVector<T>& tile, TileExchange const& e) {
      std::size_t const size = tile.size() - e.leaving + e.arriving;
      if (size > tile.capacity()) growOutOfBlock(tile, size);
    });
  }

  /// @pre reserve() was called.
  void apply(Tiles& tiles) const {
    forEach(tiles, [&](TileVector<T>& tile, TileExchange const& e) { apply(tile, e); });
  }

private:
  template <class U> static TileVector<U> unwritten(DepthMoves const& moves) {
    return unwrittenVector(static_cast<std::int64_t>(moves.moves.size()), TileDataAllocator<U>());
  }

  bool gatherChunk(Tiles const& tiles, std::size_t begin, std::size_t end, std::vector<SourceRun>& runs) {
    auto const& moves = m_in.moves;
    auto const count = static_cast<std::int64_t>(tiles.size());
    T* const gathered = m_gathered.data();
    std::int32_t* const places = m_places.data();
    // A tile may go on from the chunk before: what was checked there is not trusted here.
    std::int64_t tile = -1;
    std::int32_t last = -1;
    if (begin > 0) tile = moves[begin - 1].from, last = moves[begin - 1].fromElement;
    bool goesOn = begin > 0 && moves[begin].from == tile;
    for (std::size_t n = begin; n < end;) {
      if (!goesOn) {
        if (moves[n].from <= tile) return false;
        tile = moves[n].from, last = -1;
        runs.push_back({tile, n});
      }
      goesOn = false;
      if (tile < 0 || tile >= count) return false;
      auto const& vector = tiles[tile];
      auto const size = static_cast<std::int64_t>(vector.size());
      T const* const elements = vector.data();
      for (; n < end && moves[n].from == tile; ++n) {
        ElementToFrom const& move = moves[n];
        if (move.fromDepth != m_in.depth || move.to >= count || move.fromElement <= last) return false;
        last = move.fromElement;
        if (last >= size) return false;
        places[n] = last;
        gathered[n] = elements[last];
      }
    }
    return true;
  }

  /// Brings the runs of sources and those of destinations together, tile by tile.
  bool plan(std::vector<std::vector<SourceRun>> const& runs) {
    auto const& tiles = m_in.tiles;
    std::size_t sources = 0;
    for (auto const& part : runs) sources += part.size();
    m_exchanges.reserve(sources + tiles.size());

    std::size_t destination = 0;
    auto at = m_in.arrivals.begin();
    // Lists of destinations and arrivals are in step, unless a caller made them so.
    auto const startOf = [&](std::size_t n) -> std::optional<std::uint64_t> {
      if (n == tiles.size()) return m_in.moves.size();
      if (at == m_in.arrivals.end() || at->first != tiles[n]) at = m_in.arrivals.find(tiles[n]);
      if (at == m_in.arrivals.end()) return std::nullopt;
      return (at++)->second.first;
    };
    auto start = startOf(0);
    if (!start) return false;
    std::uint64_t arrival = *start;
    // Takes the destinations below a tile, and those of the tile into `e`.
    auto const takeDestinations = [&](TileExchange* e, std::int64_t tile) {
      for (; destination < tiles.size() && static_cast<std::int64_t>(tiles[destination]) <= tile;
           ++destination) {
        auto const index = static_cast<std::int64_t>(tiles[destination]);
        auto const next = startOf(destination + 1);
        if (!next || *next < arrival || *next > m_in.moves.size()) return false;
        if (e && index == tile)
          e->firstArrival = arrival, e->arriving = *next - arrival;
        else
          m_exchanges.push_back({index, 0, 0, arrival, *next - arrival});
        arrival = *next;
      }
      return true;
    };
    TileExchange open{-1, 0, 0, 0, 0};
    auto const close = [&](std::uint64_t end) {
      if (open.tile < 0) return true;
      open.leaving = end - open.firstLeaving;
      if (!takeDestinations(&open, open.tile)) return false;
      m_exchanges.push_back(open);
      return true;
    };
    for (auto const& part : runs) {
      for (SourceRun const& run : part) {
        if (!close(run.first)) return false;
        open = {run.tile, run.first, 0, 0, 0};
      }
    }
    return close(m_in.moves.size()) && takeDestinations(nullptr, INT64_MAX);
  }

  /// Calls `body(tile, exchange)` for each tile that changes, in parallel.
  template <class Body> void forEach(Tiles& tiles, Body const& body) const {
    ParallelOptions options;
    options.grain = 64;
    parallelFor(
        0, static_cast<std::int64_t>(m_exchanges.size()),
        [&](std::int64_t begin, std::int64_t end) {
          constexpr std::int64_t kAhead = 2;
          for (auto n = begin; n < end; ++n) {
            if (n + kAhead < end) prefetchHoles(tiles, m_exchanges[n + kAhead]);
            TileExchange const& e = m_exchanges[n];
            body(tiles[e.tile], e);
          }
        },
        options);
  }

  void prefetchHoles(Tiles const& tiles, TileExchange const& e) const {
    constexpr std::uint64_t kMost = 64;
    T const* const elements = tiles[e.tile].data();
    std::int32_t const* const places = m_places.data() + e.firstLeaving;
    for (std::uint64_t n = 0, end = std::min(e.leaving, kMost); n < end; ++n)
      __builtin_prefetch(elements + places[n]);
  }

  void apply(TileVector<T>& tile, TileExchange const& e) const {
    std::int32_t const* const places = m_places.data() + e.firstLeaving;
    std::uint64_t const* const arriving = m_in.order.data() + e.firstArrival;
    T const* const gathered = m_gathered.data();
    std::size_t size = tile.size();
    std::uint64_t const both = std::min(e.leaving, e.arriving);
    T* elements = tile.data();
    for (std::uint64_t n = 0; n < both; ++n) elements[places[n]] = gathered[arriving[e.arriving - 1 - n]];
    if (e.arriving > both) {
      std::uint64_t const more = e.arriving - both;
      tile.resize(size + more, T{});
      elements = tile.data() + size;
      for (std::uint64_t n = 0; n < more; ++n) elements[n] = gathered[arriving[n]];
      size += more;
    } else if (e.leaving > both) {
      for (std::uint64_t low = both, high = e.leaving; low < high; --size) {
        if (static_cast<std::size_t>(places[high - 1]) == size - 1)
          --high;
        else
          elements[places[low++]] = elements[size - 1];
      }
      tile.resize(size);
    }
    if (e.leaving > 0 && static_cast<float>(size) * 2.0f < static_cast<float>(tile.capacity()))
      trimVector(tile);
  }

  DepthMoves m_in;
  /// The elements that leave, and where they were in their tiles, in the order of the moves.
  TileVector<T> m_gathered;
  TileVector<std::int32_t> m_places;
  std::vector<TileExchange> m_exchanges;
};

template <class T> bool exchange(TypedChannel<T>& channel, ElementPermutation const& p) {
  if (!channel.tileArrays()) return false;
  std::vector<DepthExchange<T>> depths;
  if (p.kind == ElementPermutation::kOneDepth) {
    if (p.firstDepth < 0 || p.firstDepth >= kChannelDepths) return false;
    if (!p.moves->empty())
      depths.emplace_back(DepthMoves{*p.moves, *p.order, *p.tiles, *p.arrivals, p.firstDepth});
  } else {
    std::size_t const n = std::min({p.allMoves->size(), p.allOrders->size(), p.allTiles->size(),
                                    p.allArrivals->size(), std::size_t(kChannelDepths)});
    for (std::size_t d = 0; d < n; ++d) {
      if ((*p.allMoves)[d].empty()) continue;
      depths.emplace_back(DepthMoves{(*p.allMoves)[d], (*p.allOrders)[d], (*p.allTiles)[d],
                                     (*p.allArrivals)[d], static_cast<int>(d)});
    }
  }
  if (depths.empty()) return true;
  for (auto& depth : depths)
    if (!depth.gather((*channel.tileArrays())[depth.depth()])) return false;
  // What may fail comes first.
  auto const tileCount = channel.tileCount(-1);
  auto& tiles = *channel.cloneData();
  if (channel.tileCount(-1) != tileCount) return true; // no memory for the copy's block: it is empty
  for (auto& depth : depths) depth.reserve(tiles[depth.depth()]);
  for (auto& depth : depths) depth.apply(tiles[depth.depth()]);
  return true;
}

} // namespace

bool exchangeElements(ChannelBase& channel, ElementPermutation const& permutation) {
  if (permutation.kind == ElementPermutation::kRecorded) return false;
#define VLN_EXCHANGE(type, name)                                                                             \
  if (auto* const typed = dynamic_cast<TypedChannel<type>*>(&channel)) return exchange(*typed, permutation);
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_EXCHANGE)
#undef VLN_EXCHANGE
  return false;
}

} // namespace VLN::TileTree3D::Internal
