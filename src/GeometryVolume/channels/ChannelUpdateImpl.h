// Definitions of ChannelData: following the tiles of a tree. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/ChannelData.h"
#include "GeometryVolume/channels/detail/TileVectorOps.h"
#include "GeometryVolume/core/HugePagesImpl.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/RollbackImpl.h"

#include <algorithm>
#include <atomic>
#include <cstddef>
#include <cstring>
#include <iterator>
#include <span>
#include <utility>

namespace VLN::TileTree3D {

namespace Internal {

/// Room for `n` tiles, growing as vectors do.
template <class T> void reserveDepthTiles(std::vector<TileVector<T>>& tiles, std::int64_t n) {
  auto const wanted = static_cast<std::size_t>(n);
  if (wanted <= tiles.capacity()) return;
  tiles.reserve(std::max(wanted, 2 * tiles.size()));
  VLN::Internal::preferHugePages(tiles.data(), tiles.capacity() * sizeof(TileVector<T>));
}

/// Whether all bytes of a value are 0, which is more than to compare as 0 does.
template <class T> bool isZeroBytes(T const& value) {
  auto const bytes = std::as_bytes(std::span(&value, 1));
  return std::all_of(bytes.begin(), bytes.end(), [](std::byte b) { return b == std::byte(0); });
}

/// Drops capacity beyond twice the size, where there is memory for the move.
template <class T> void trimDepthTiles(std::vector<TileVector<T>>& tiles) {
  if (!(static_cast<float>(tiles.capacity()) > 2.0f * static_cast<float>(tiles.size()))) return;
  std::vector<TileVector<T>> exact;
  try {
    exact.reserve(tiles.size());
  } catch (std::bad_alloc const&) { return; }
  for (auto& tile : tiles) exact.push_back(std::move(tile));
  tiles.swap(exact);
}

/// Makes the capacity that assignTile() needs.
template <class T> void prepareAssign(TileVector<T>& to, TileVector<T> const& from) {
  if (from.size() > to.capacity()) growOutOfBlock(to, from.size());
}
/// Copies the elements of one tile to another. A static target keeps its slot while the elements fit.
template <class T> void assignTile(TileVector<T>& to, TileVector<T> const& from) {
  to.resize(from.size());
  std::copy(from.begin(), from.end(), to.begin());
}

} // namespace Internal

template <class T> bool ChannelData<T>::resizeTiles(Internal::TileCounts const& source) {
  if (!m_data) return true;
  bool const fill = !m_allocateEmptyTileData;
  std::int64_t const stride = m_useStaticAllocation && fill ? slotElements(0) : 0;
  auto const plan = Internal::planGrowth(firstDepth(), lastDepth(), m_tileCounts, source,
                                         m_layout.fixedSize() ? m_layout.size : 0, stride);
  if (!plan.changes) {
    sumCounts();
    return true;
  }
  Internal::BlockList blocks;
  T* block = nullptr;
  bool zeros = m_callElementConstructor && Internal::isZeroBytes(m_defaultValue);
  if (plan.blockElements > 0) {
    block = static_cast<T*>(blocks.allocate(plan.blockElements, sizeof(T), zeros));
    if (!block) return false;
  }

  Counts const before = m_tileCounts;
  cloneData();
  // A copy for which there was no static block is empty: the plan was for another.
  if (m_tileCounts != before) return false;

  // Tiles are added first and dropped last: dropping cannot fail.
  auto const wanted = [&](int d) { return static_cast<std::size_t>(plan.wanted[d]); };
  VLN::Internal::Rollback added([&] {
    for (int d = firstDepth(); d <= lastDepth(); ++d) {
      auto& tiles = depthTiles(d);
      auto const n = static_cast<std::size_t>(before[d]);
      if (tiles.size() > n) tiles.erase(tiles.begin() + static_cast<std::ptrdiff_t>(n), tiles.end());
    }
  });
  Internal::forEachDepth(firstDepth(), lastDepth(), [&](int d) {
    if (wanted(d) > depthTiles(d).size()) makeAdded(plan, d, block);
  });
  if (fill) fillAdded(plan, source, block, zeros);
  added.dismiss();

  m_allocations.take(blocks);
  Internal::forEachDepth(firstDepth(), lastDepth(), [&](int d) {
    if (wanted(d) == static_cast<std::size_t>(count(d))) return;
    auto& tiles = depthTiles(d);
    if (wanted(d) < tiles.size())
      tiles.erase(tiles.begin() + static_cast<std::ptrdiff_t>(wanted(d)), tiles.end());
    if (!m_useStaticAllocation) Internal::trimDepthTiles(tiles);
    count(d) = plan.wanted[d];
  });
  sumCounts();
  return true;
}

template <class T> void ChannelData<T>::makeAdded(Internal::GrowthPlan const& plan, int depth, T* block) {
  auto& tiles = depthTiles(depth);
  auto const wanted = static_cast<std::size_t>(plan.wanted[depth]);
  Internal::reserveDepthTiles(tiles, static_cast<std::int64_t>(wanted));
  auto const& added = plan.tiles[depth];
  if (!block || added.elements <= 0) return tiles.resize(wanted);
  // Where they belong at once: a table of tiles is long enough to be written only once.
  using Elements = Internal::UnwrittenElements;
  Elements const begin(0), end(added.elements);
  T* slot = block + added.base;
  for (auto n = wanted - tiles.size(); n > 0; --n, slot += added.stride)
    tiles.emplace_back(begin, end, TileDataAllocator<T>(slot, added.elements, m_callElementConstructor));
}

template <class T>
void ChannelData<T>::fillAdded(Internal::GrowthPlan const& plan, Internal::TileCounts const& source, T* block,
                               bool zeros) {
  bool const write = m_callElementConstructor && !zeros;
  auto const made = [&](int d) { return block && plan.tiles[d].elements >= 0; };
  bool allMade = true;
  for (int d = firstDepth(); d <= lastDepth(); ++d)
    allMade = allMade && (plan.wanted[d] <= count(d) || made(d));
  if (allMade && !write) return;
  plan.added.forEach(Internal::tileGrain(tileBytes()), [&](int d, std::int64_t begin, std::int64_t end) {
    if (made(d)) {
      auto const& added = plan.tiles[d];
      if (!write) return;
      T* slot = block + added.base + (begin - count(d)) * added.stride;
      if (added.stride == added.elements)
        return Internal::fillLongRun(slot, (end - begin) * added.elements, m_defaultValue);
      for (auto i = begin; i < end; ++i, slot += added.stride)
        Internal::fillRun(slot, added.elements, m_defaultValue);
      return;
    }
    auto& tiles = depthTiles(d);
    for (auto i = begin; i < end; ++i) {
      std::int64_t const n = m_layout.fixedSize()
                                 ? m_layout.size
                                 : std::max<std::int64_t>(0, source.elementCount(TreeIndex{i, d}));
      if (n == 0) continue;
      T* const slot = block ? block + plan.slots.at(d, i - count(d)) : nullptr;
      tiles[i] = newTile(n, slot);
    }
  });
}

template <class T>
void ChannelData<T>::moveTiles(TileRemovalList const& removed, FunctionRef<std::int64_t(int depth)> kept) {
  if (!m_data) return;
  int const last = std::min(lastDepth(), static_cast<int>(removed.size()) - 1);
  auto const moves = [](std::pair<std::int64_t, std::int64_t> const& p) { return p.first != p.second; };
  bool const any =
      std::any_of(removed.begin(), removed.begin() + std::max(0, last + 1),
                  [&](auto const& list) { return std::any_of(list.begin(), list.end(), moves); });
  if (!any) return;
  cloneData();
  // `body(target, source, dropped)` for each pair; the source of a dropped pair is of no further use.
  auto const forEachPair = [&](auto const& body) {
    Internal::forEachDepth(0, last, [&](int d) {
      auto const& list = removed[d];
      auto& tiles = depthTiles(d);
      auto const exists = [&](std::int64_t i) {
        return i >= 0 && i < static_cast<std::int64_t>(tiles.size());
      };
      std::int64_t const remaining = kept(d);
      ParallelOptions options;
      options.grain = Internal::tileGrain(tileBytes());
      parallelFor(
          0, static_cast<std::int64_t>(list.size()),
          [&](std::int64_t begin, std::int64_t end) {
            for (auto n = begin; n < end; ++n) {
              auto const [to, from] = list[n];
              if (to == from || !exists(to) || !exists(from)) continue;
              body(tiles[to], tiles[from], from >= remaining);
            }
          },
          options);
    });
  };
  forEachPair([](Vector& target, Vector& source, bool dropped) {
    if (!dropped) Internal::prepareAssign(target, source);
  });
  forEachPair([](Vector& target, Vector& source, bool dropped) {
    if (dropped)
      target.swap(source);
    else
      Internal::assignTile(target, source);
  });
}

namespace Internal {

/// The tiles of a storage in a new order. Where the order names no tile there is an empty one.
template <class T> class PermutedTiles {
public:
  PermutedTiles(TileArrays<T>& tiles, TilePermutation const& newToOld, int lastDepth)
      : m_tiles(tiles)
      , m_newToOld(newToOld)
      , m_lastDepth(lastDepth) {}

  TileVector<T>& operator()(int depth, std::int64_t n) const {
    static TileVector<T> const none;
    auto at = static_cast<std::size_t>(n);
    if (depth <= m_lastDepth) {
      auto const& list = m_newToOld[depth];
      if (at < list.size()) at = static_cast<std::size_t>(list[at]); // below 0: beyond every tile
    }
    auto& tiles = m_tiles[depth];
    return at < tiles.size() ? tiles[at] : const_cast<TileVector<T>&>(none);
  }

private:
  TileArrays<T>& m_tiles;
  TilePermutation const& m_newToOld;
  int m_lastDepth;
};

} // namespace Internal

template <class T> bool ChannelData<T>::permuteTiles(TilePermutation const& newToOld) {
  if (!m_data) return false;
  int const last = std::min(lastDepth(), static_cast<int>(newToOld.size()) - 1);
  bool const any = std::any_of(newToOld.begin(), newToOld.begin() + std::max(0, last + 1),
                               [](auto const& list) { return !list.empty(); });
  if (!any && !m_useStaticAllocation) return false;

  // A channel that holds its storage alone hands its tiles on; else, or into a static block, they are copied.
  bool const shared = storageIsShared();
  bool const steal = !m_useStaticAllocation && !shared &&
                     Internal::isPermutation(newToOld, firstDepth(), last, m_tileCounts);

  auto const old = m_data;
  Internal::PermutedTiles<T> const source(*old, newToOld, last);
  Internal::TileSlots slots;
  if (m_useStaticAllocation)
    slots = Internal::planSlots(
        firstDepth(), lastDepth(), m_tileCounts, [&](int d, std::int64_t i) { return source(d, i).size(); },
        [&](std::size_t n) { return slotElements(n); });
  Internal::BlockList blocks;
  void* const block = slots.total > 0 ? blocks.allocate(slots.total, sizeof(T)) : nullptr;
  if (slots.total > 0 && !block) return false;

  auto fresh = Ostil::makePtr<TileStorage<T>>();
  Internal::forEachDepth(firstDepth(), lastDepth(), [&](int d) { (*fresh)[d].resize(count(d)); });
  allTiles().forEach(Internal::tileGrain(tileBytes()), [&](int d, std::int64_t begin, std::int64_t end) {
    for (auto i = begin; i < end; ++i) {
      Vector& from = source(d, i);
      Vector& to = (*fresh)[d][i];
      if (steal) {
        to.swap(from);
      } else if (!from.empty()) {
        T* const slot = block ? static_cast<T*>(block) + slots.at(d, i) : nullptr;
        Vector tile = unwrittenTile(static_cast<std::int64_t>(from.size()), slot);
        std::memcpy(static_cast<void*>(tile.data()), from.data(), from.size() * sizeof(T));
        to.swap(tile);
      }
    }
  });
  // The tiles' blocks go where the tiles are.
  if (steal)
    fresh->adoptAll(*old);
  else if (shared)
    old->adopt(m_allocations);
  else
    m_allocations.clear();
  m_allocations.take(blocks);
  m_data = std::move(fresh);
  return true;
}

template <class T> void ChannelData<T>::removeDepths(int first, int last) {
  if (!m_data) return;
  first = std::max(first, 0);
  last = std::min(last, kChannelDepths - 1);
  bool const any = [&] {
    for (int d = first; d <= last; ++d)
      if (count(d) != 0 || !depthTiles(d).empty()) return true;
    return false;
  }();
  if (!any) return;
  separateWithout(first, last);
  for (int d = first; d <= last; ++d) count(d) = 0;
  sumCounts();
  Internal::forEachDepth(first, last, [&](int d) {
    auto& tiles = depthTiles(d);
    ParallelOptions options;
    options.grain = 256;
    parallelFor(
        0, static_cast<std::int64_t>(tiles.size()),
        [&](std::int64_t begin, std::int64_t end) {
          for (auto i = begin; i < end; ++i) Vector().swap(tiles[i]);
        },
        options);
    std::vector<Vector>().swap(tiles);
  });
}

template <class T> bool ChannelData<T>::resizeDepth(int depth, std::int64_t tileCount, int elementCount) {
  if (!m_data || depth < firstDepth() || depth > lastDepth()) return false;
  tileCount = std::max<std::int64_t>(0, tileCount);
  std::int64_t const before = count(depth);
  if (tileCount == before) return false;
  cloneData();
  if (count(depth) != before) return false;
  auto& tiles = depthTiles(depth);
  auto const n = static_cast<std::size_t>(tileCount);
  VLN::Internal::Rollback added([&] {
    if (static_cast<std::int64_t>(tiles.size()) > before)
      tiles.erase(tiles.begin() + static_cast<std::ptrdiff_t>(before), tiles.end());
  });
  if (n < tiles.size())
    tiles.erase(tiles.begin() + static_cast<std::ptrdiff_t>(n), tiles.end());
  else
    tiles.resize(n);
  for (auto i = before; i < tileCount; ++i) Internal::resizeVector(tiles[i], std::max(0, elementCount), T{});
  added.dismiss();
  m_tileCountTotal += tileCount - before;
  count(depth) = tileCount;
  return true;
}

template <class T> void ChannelData<T>::appendTiles(int depth, std::int64_t n) {
  if (!m_data || depth < firstDepth() || depth > lastDepth()) return;
  cloneData();
  auto& tiles = depthTiles(depth);
  Internal::reserveDepthTiles(tiles, static_cast<std::int64_t>(tiles.size()) + n);
  for (; n > 0; --n) {
    tiles.push_back(newTile());
    ++count(depth), ++m_tileCountTotal;
  }
}

template <class T> void ChannelData<T>::appendTiles(int depth, std::vector<Vector>& arriving) {
  if (!m_data || depth < firstDepth() || depth > lastDepth()) return;
  cloneData();
  auto& tiles = depthTiles(depth);
  auto const n = static_cast<std::int64_t>(arriving.size());
  Internal::reserveDepthTiles(tiles, static_cast<std::int64_t>(tiles.size()) + n);
  tiles.insert(tiles.end(), std::make_move_iterator(arriving.begin()),
               std::make_move_iterator(arriving.end()));
  count(depth) += n, m_tileCountTotal += n;
}

template <class T> void ChannelData<T>::growElements(Internal::TileCounts const& source) {
  if (!m_data) return;
  Spans spans;
  for (int d = 0; d <= lastDepth(); ++d) spans.add(d, 0, std::min(count(d), source.tileCount(d)));
  auto const wanted = [&](int d, std::int64_t i) { return source.elementCount(TreeIndex{i, d}); };
  auto const forEachShort = [&](auto const& body) {
    spans.forEach(64, [&](int d, std::int64_t begin, std::int64_t end) {
      auto& tiles = depthTiles(d);
      for (auto i = begin; i < end; ++i) {
        Vector& tile = tiles[i];
        std::int64_t const n = wanted(d, i);
        if (n > static_cast<std::int64_t>(tile.size())) body(tile, n);
      }
    });
  };
  if (storageIsShared()) {
    std::atomic<bool> any{false};
    forEachShort([&](Vector&, std::int64_t) { any.store(true, std::memory_order_relaxed); });
    if (!any) return;
    cloneData();
  }
  // Room first, so that all grow or none.
  forEachShort([](Vector& tile, std::int64_t n) { Internal::growOutOfBlock(tile, n); });
  forEachShort([](Vector& tile, std::int64_t n) { Internal::resizeOutOfBlock(tile, n, T{}); });
}

} // namespace VLN::TileTree3D
