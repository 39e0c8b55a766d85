// Definitions of ChannelData: following the tiles of a tree. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/ChannelData.h"
#include "GeometryVolume/channels/TileVectorOps.h"
#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <atomic>
#include <cstring>
#include <utility>

namespace VLN::TileTree3D {

namespace Internal {

/// Shortens or extends the tiles of a depth. New tiles are empty; `trim` drops capacity beyond twice the
/// size.
template <class T> void resizeDepthTiles(std::vector<TileVector<T>>& tiles, std::int64_t n, bool trim) {
  tiles.resize(static_cast<std::size_t>(n));
  if (!trim || !(static_cast<float>(tiles.capacity()) > 2.0f * static_cast<float>(tiles.size()))) return;
  std::vector<TileVector<T>> exact;
  exact.reserve(tiles.size());
  for (auto& tile : tiles) exact.push_back(std::move(tile));
  tiles.swap(exact);
}

/// Copies the elements of one tile to another. A static target keeps its slot while the elements fit.
template <class T> void assignTile(TileVector<T>& to, TileVector<T> const& from) {
  if (from.size() > to.capacity()) to = TileVector<T>(from.size(), TileDataAllocator<T>());
  to.resize(from.size());
  std::copy(from.begin(), from.end(), to.begin());
}

} // namespace Internal

template <class T> bool ChannelData<T>::resizeTiles(Internal::TileCounts const& source) {
  if (!m_data) return true;
  bool const fill = !m_allocateEmptyTileData;
  bool const fixed = m_layout.fixedSize();
  std::int64_t const stride = m_useStaticAllocation && fill ? slotElements(0) : 0;
  auto const plan = Internal::planGrowth(firstDepth(), lastDepth(), m_tileCounts, source, fixed, stride);
  if (!plan.changes) {
    sumCounts();
    return true;
  }
  void* block = nullptr;
  if (plan.blockElements > 0 && !(block = Internal::allocateBlock(plan.blockElements, sizeof(T))))
    return false;

  cloneData();
  if (block) m_allocations.push_back(block);
  Counts const before = m_tileCounts;
  Internal::forEachDepth(firstDepth(), lastDepth(), [&](int d) {
    auto const n = plan.wanted[static_cast<std::size_t>(d)];
    if (n == count(d)) return;
    Internal::resizeDepthTiles(depthTiles(d), n, !m_useStaticAllocation);
    count(d) = n;
  });
  if (fill) {
    plan.added.forEach(Internal::tileGrain(tileBytes()), [&](int d, std::int64_t begin, std::int64_t end) {
      auto const depth = static_cast<std::size_t>(d);
      auto& tiles = depthTiles(d);
      for (auto i = begin; i < end; ++i) {
        std::int64_t const n =
            fixed ? m_layout.size : std::max<std::int64_t>(0, source.elementCount(TreeIndex{i, d}));
        if (n == 0) continue;
        T* slot = nullptr;
        if (block) {
          std::int64_t const nth = i - before[depth];
          slot = static_cast<T*>(block) + (fixed ? plan.base[depth] + nth * stride : plan.slots.at(d, nth));
        }
        tiles[static_cast<std::size_t>(i)] = newTile(n, slot);
      }
    });
  }
  sumCounts();
  return true;
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
  Internal::forEachDepth(0, last, [&](int d) {
    auto const& list = removed[static_cast<std::size_t>(d)];
    auto& tiles = depthTiles(d);
    auto const exists = [&](std::int64_t i) { return i >= 0 && i < static_cast<std::int64_t>(tiles.size()); };
    std::int64_t const remaining = kept(d);
    ParallelOptions options;
    options.grain = Internal::tileGrain(tileBytes());
    parallelFor(
        0, static_cast<std::int64_t>(list.size()),
        [&](std::int64_t begin, std::int64_t end) {
          for (auto n = begin; n < end; ++n) {
            auto const [to, from] = list[static_cast<std::size_t>(n)];
            if (to == from || !exists(to) || !exists(from)) continue;
            Vector& target = tiles[static_cast<std::size_t>(to)];
            Vector& source = tiles[static_cast<std::size_t>(from)];
            if (from >= remaining)
              target.swap(source);
            else
              Internal::assignTile(target, source);
          }
        },
        options);
  });
}

template <class T> bool ChannelData<T>::permuteTiles(TilePermutation const& newToOld) {
  if (!m_data) return false;
  int const last = std::min(lastDepth(), static_cast<int>(newToOld.size()) - 1);
  auto const oldIndex = [&](int d, std::int64_t i) -> std::int64_t {
    if (d > last) return i;
    auto const& list = newToOld[static_cast<std::size_t>(d)];
    return i < static_cast<std::int64_t>(list.size()) ? list[static_cast<std::size_t>(i)] : i;
  };
  bool const any = std::any_of(newToOld.begin(), newToOld.begin() + std::max(0, last + 1),
                               [](auto const& list) { return !list.empty(); });
  if (!any && !m_useStaticAllocation) return false;

  // A channel that holds its storage alone hands its tiles on; else, or into a static block, they are copied.
  bool const shared = storageIsShared();
  bool const steal = !m_useStaticAllocation && !shared &&
                     Internal::isPermutation(newToOld, firstDepth(), last, m_tileCounts);

  auto const old = m_data;
  auto const source = [&](int d, std::int64_t i) -> Vector& {
    static Vector const none;
    std::int64_t const at = oldIndex(d, i);
    auto& tiles = (*old)[static_cast<std::size_t>(d)];
    return at >= 0 && at < static_cast<std::int64_t>(tiles.size()) ? tiles[static_cast<std::size_t>(at)]
                                                                   : const_cast<Vector&>(none);
  };
  Internal::TileSlots slots;
  if (m_useStaticAllocation)
    slots = Internal::planSlots(
        firstDepth(), lastDepth(), m_tileCounts, [&](int d, std::int64_t i) { return source(d, i).size(); },
        [&](std::size_t n) { return slotElements(n); });
  void* const block = slots.total > 0 ? Internal::allocateBlock(slots.total, sizeof(T)) : nullptr;
  if (slots.total > 0 && !block) return false;

  auto fresh = Ostil::makePtr<TileStorage<T>>();
  Internal::forEachDepth(firstDepth(), lastDepth(), [&](int d) {
    (*fresh)[static_cast<std::size_t>(d)].resize(static_cast<std::size_t>(count(d)));
  });
  allTiles().forEach(Internal::tileGrain(tileBytes()), [&](int d, std::int64_t begin, std::int64_t end) {
    auto const depth = static_cast<std::size_t>(d);
    for (auto i = begin; i < end; ++i) {
      Vector& from = source(d, i);
      Vector& to = (*fresh)[depth][static_cast<std::size_t>(i)];
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
    freeAndClearAllocations();
  m_data = std::move(fresh);
  if (block) m_allocations.push_back(block);
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
          for (auto i = begin; i < end; ++i) Vector().swap(tiles[static_cast<std::size_t>(i)]);
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
  m_tileCountTotal += tileCount - before;
  count(depth) = tileCount;
  auto& tiles = depthTiles(depth);
  tiles.resize(static_cast<std::size_t>(tileCount));
  for (auto i = before; i < tileCount; ++i)
    Internal::resizeVector(tiles[static_cast<std::size_t>(i)],
                           static_cast<std::size_t>(std::max(0, elementCount)), T{});
  return true;
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
        Vector& tile = tiles[static_cast<std::size_t>(i)];
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
  forEachShort([](Vector& tile, std::int64_t n) {
    Internal::resizeOutOfBlock(tile, static_cast<std::size_t>(n), T{});
  });
}

} // namespace VLN::TileTree3D
