// Definitions of ChannelData: storage, copying, accounting. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/ChannelData.h"
#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <cstring>
#include <iostream>
#include <iterator>
#include <utility>

namespace VLN::TileTree3D {

template <class T>
ChannelData<T>::ChannelData(ChannelLayout const& layout)
    : m_layout(layout) {}

template <class T>
ChannelData<T>::ChannelData(ChannelLayout const& layout, T const* defaultValue,
                            DataElementInitializerType initializer, bool useStaticAllocation,
                            bool callElementConstructor, int minDepth, int depth)
    : m_defaultValue(defaultValue ? *defaultValue : T{})
    , m_initializer(initializer)
    , m_data(Ostil::makePtr<TileStorage<T>>())
    , m_useStaticAllocation(useStaticAllocation)
    , m_callElementConstructor(callElementConstructor)
    , m_rawCopy(!callElementConstructor)
    , m_minDepth(minDepth)
    , m_depth(depth)
    , m_layout(layout) {}

template <class T>
ChannelData<T>::ChannelData(ChannelData const& b)
    : m_defaultValue(b.m_defaultValue)
    , m_initializer(b.m_initializer)
    , m_data(b.m_data)
    , m_minDepth(b.m_minDepth)
    , m_depth(b.m_depth)
    , m_tileCounts(b.m_tileCounts)
    , m_tileCountTotal(b.m_tileCountTotal)
    , m_layout(b.m_layout) {}

template <class T> ChannelData<T>::~ChannelData() {
  Internal::BlockList none;
  replaceStorage(nullptr, none);
}

template <class T> std::int64_t ChannelData<T>::tileCount(int depth) const {
  if (depth == -1) return m_tileCountTotal;
  return depth >= 0 && depth < kChannelDepths ? count(depth) : 0;
}

template <class T> std::int64_t ChannelData<T>::elementCount(int depth) const {
  if (!m_data || depth < -1 || depth >= kChannelDepths) return 0;
  int const first = std::max(depth, 0), last = depth == -1 ? kChannelDepths - 1 : depth;
  std::int64_t sum = 0;
  for (int d = first; d <= last; ++d) {
    auto const& tiles = depthTiles(d);
    sum += parallelReduce(
        0, static_cast<std::int64_t>(tiles.size()), 16384, std::int64_t(0),
        [&](std::int64_t begin, std::int64_t end) {
          std::int64_t part = 0;
          for (auto i = begin; i < end; ++i) part += static_cast<std::int64_t>(tiles[std::size_t(i)].size());
          return part;
        },
        [](std::int64_t a, std::int64_t b) { return a + b; });
  }
  return sum;
}

template <class T> void ChannelData<T>::sumCounts() {
  m_tileCountTotal = 0;
  for (int d = firstDepth(); d <= lastDepth(); ++d) m_tileCountTotal += count(d);
}

template <class T> Internal::TileSpans ChannelData<T>::allTiles() const {
  Spans spans;
  for (int d = firstDepth(); d <= lastDepth(); ++d) spans.add(d, 0, count(d));
  return spans;
}

template <class T> std::int64_t ChannelData<T>::slotElements(std::size_t size) const {
  return Internal::tileSlotStride(std::max<std::int64_t>(m_layout.size, static_cast<std::int64_t>(size)),
                                  sizeof(T));
}

template <class T> TileVector<T> ChannelData<T>::unwrittenTile(std::int64_t n, T* slot) const {
  using Allocator = TileDataAllocator<T>;
  // Only static tiles keep the flag: a tile that grows must carry its elements along.
  return Internal::unwrittenVector(n, slot ? Allocator(slot, n, m_callElementConstructor) : Allocator(true));
}

template <class T> TileVector<T> ChannelData<T>::newTile(std::int64_t n, T* slot) const {
  Vector tile = unwrittenTile(n, slot);
  if (m_callElementConstructor) Internal::fillRun(tile.data(), n, m_defaultValue);
  return tile;
}

template <class T>
void ChannelData<T>::replaceStorage(Ostil::Ptr<TileStorage<T>> fresh, Internal::BlockList& blocks) noexcept {
  if (storageIsShared()) m_data->adopt(m_allocations);
  // The tiles go before the blocks that they lie in.
  Internal::BlockList left;
  left.take(m_allocations);
  m_data = std::move(fresh);
  m_allocations.take(blocks);
}

template <class T>
void ChannelData<T>::rebuild(TileArrays<T> const& source, Counts const& counts, TileValues values,
                             int skipFirst, int skipLast) {
  auto const skipped = [&](int d) { return d >= skipFirst && d <= skipLast; };
  Counts kept{};
  Spans spans;
  for (int d = firstDepth(); d <= lastDepth(); ++d) {
    if (skipped(d)) continue;
    kept[d] = counts[d];
    spans.add(d, 0, kept[d]);
  }
  Internal::TileSlots slots;
  if (m_useStaticAllocation)
    slots = Internal::planSlots(
        firstDepth(), lastDepth(), kept, [&](int d, std::int64_t i) { return source[d][i].size(); },
        [&](std::size_t n) { return slotElements(n); });
  Internal::BlockList blocks;
  void* const block = slots.total > 0 ? blocks.allocate(slots.total, sizeof(T)) : nullptr;
  auto fresh = Ostil::makePtr<TileStorage<T>>();
  if (block || slots.total == 0) {
    Internal::forEachDepth(firstDepth(), lastDepth(), [&](int d) { (*fresh)[d].resize(kept[d]); });
    spans.forEach(Internal::tileGrain(tileBytes()), [&](int d, std::int64_t begin, std::int64_t end) {
      for (auto i = begin; i < end; ++i) {
        std::size_t const n = source[d][i].size();
        if (n == 0) continue;
        T* const slot = block ? static_cast<T*>(block) + slots.at(d, static_cast<std::int64_t>(i)) : nullptr;
        Vector tile = unwrittenTile(static_cast<std::int64_t>(n), slot);
        std::memcpy(static_cast<void*>(tile.data()), values(d, static_cast<std::int64_t>(i)), n * sizeof(T));
        (*fresh)[d][i].swap(tile);
      }
    });
  } else {
    kept.fill(0);
  }
  m_tileCounts = kept;
  sumCounts();
  replaceStorage(std::move(fresh), blocks);
}

template <class T> void ChannelData<T>::separateWithout(int skipFirst, int skipLast) {
  if (!storageIsShared()) return;
  auto const old = m_data;
  auto const counts = m_tileCounts;
  auto const values = [&](int d, std::int64_t i) -> T const* { return (*old)[d][i].data(); };
  rebuild(*old, counts, values, skipFirst, skipLast);
}

template <class T> void ChannelData<T>::cloneData() { separateWithout(0, -1); }

template <class T> void ChannelData<T>::deepCopy(ChannelData const& source) {
  m_minDepth = source.m_minDepth;
  m_depth = source.m_depth;
  auto const old = source.m_data;
  if (!old) {
    Internal::BlockList none;
    return replaceStorage(nullptr, none);
  }
  auto const values = [&](int d, std::int64_t i) -> T const* { return (*old)[d][i].data(); };
  rebuild(*old, Counts(source.m_tileCounts), values, 0, -1);
}

template <class T> void ChannelData<T>::compactStorage() {
  if (!m_data) return;
  cloneData();
  Internal::forEachDepth(0, lastDepth(), [&](int d) {
    auto& tiles = depthTiles(d);
    parallelFor(0, static_cast<std::int64_t>(tiles.size()), [&](std::int64_t begin, std::int64_t end) {
      for (auto i = begin; i < end; ++i) {
        Vector& tile = tiles[i];
        // A static tile's room belongs to its block and cannot be given back alone.
        if (tile.capacity() == tile.size() || tile.get_allocator().isStatic()) continue;
        Vector exact = unwrittenTile(static_cast<std::int64_t>(tile.size()), nullptr);
        std::copy(tile.begin(), tile.end(), exact.begin());
        tile.swap(exact);
      }
    });
    if (tiles.capacity() == tiles.size()) return;
    std::vector<Vector> exact;
    exact.reserve(tiles.size());
    std::move(tiles.begin(), tiles.end(), std::back_inserter(exact));
    tiles.swap(exact);
  });
}

template <class T> void ChannelData<T>::memUse(std::uint64_t& used, std::uint64_t& allocated) const {
  used = allocated = sizeof(ChannelData);
  bool const blocks = !m_allocations.empty();
  if (m_data) {
    if (m_data.useCount() != 1)
      std::cerr << "Channel::Data.memUse(): Warning: 'm_data' not unique (use count = " << m_data.useCount()
                << ")\n";
    for (auto const& tiles : *m_data) {
      used += sizeof(tiles);
      allocated += sizeof(tiles);
      for (Vector const& tile : tiles) {
        used += tile.size() * sizeof(T);
        allocated += tile.capacity() * sizeof(T);
      }
    }
  }
  if (blocks) std::cerr << "Channel::Data.memUse(): Warning: not counting size of 'allocations'\n";
}

} // namespace VLN::TileTree3D
