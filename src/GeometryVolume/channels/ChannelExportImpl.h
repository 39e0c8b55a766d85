// Definitions of ChannelData: exchange with plain arrays. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/ChannelData.h"
#include "GeometryVolume/pools/ArrayPool.h"

#include <algorithm>
#include <cstring>

namespace VLN::TileTree3D {

/// Position of each tile's first element in the flat export.
template <class T> Internal::TileSlots ChannelData<T>::tileOffsets() const {
  return Internal::planSlots(
      firstDepth(), lastDepth(), m_tileCounts, [&](int d, std::int64_t i) { return depthTiles(d)[i].size(); },
      [](std::size_t n) { return static_cast<std::int64_t>(n); });
}

template <class T> Ostil::Ptr<Ostil::Array<T>> ChannelData<T>::exportFlat() const {
  auto const n = static_cast<std::uint64_t>(elementCount(-1));
  Ostil::Ptr<Ostil::Array<T>> array;
  if (ArrayPool::enabled()) array = ArrayPool::allocate<T>(T{}, n);
  if (!array) array = Ostil::makePtr<Ostil::Array<T>>(n);
  if (!m_data || n == 0) return array;
  auto const offsets = tileOffsets();
  T* const to = array->data();
  allTiles().forEach(Internal::tileGrain(tileBytes()), [&](int d, std::int64_t begin, std::int64_t end) {
    for (auto i = begin; i < end; ++i) {
      Vector const& tile = depthTiles(d)[i];
      std::copy(tile.begin(), tile.end(), to + offsets.at(d, static_cast<std::int64_t>(i)));
    }
  });
  return array;
}

template <class T> Ostil::Ptr<NestedArrays<T>> ChannelData<T>::exportNested() const {
  auto nested = Ostil::makePtr<NestedArrays<T>>(std::uint64_t(kChannelDepths));
  if (!m_data) return nested;
  using TileList = Ostil::Array<Ostil::Ptr<Ostil::Array<T>>>;
  for (int d = firstDepth(); d <= lastDepth(); ++d)
    (*nested)[static_cast<std::uint64_t>(d)] = Ostil::makePtr<TileList>(static_cast<std::uint64_t>(count(d)));
  allTiles().forEach(Internal::tileGrain(tileBytes()), [&](int d, std::int64_t begin, std::int64_t end) {
    auto& list = *(*nested)[static_cast<std::uint64_t>(d)];
    for (auto i = begin; i < end; ++i) {
      Vector const& tile = depthTiles(d)[i];
      auto array = Ostil::makePtr<Ostil::Array<T>>(std::uint64_t(tile.size()));
      std::copy(tile.begin(), tile.end(), array->data());
      list[i] = std::move(array);
    }
  });
  return nested;
}

template <class T> void ChannelData<T>::importValues(TileValues values) {
  if (!m_data || storageIsShared()) {
    // The values replace the old tiles in the copy; nothing of the old ones is read.
    auto const old = m_data ? m_data : Ostil::makePtr<TileStorage<T>>();
    rebuild(*old, Counts(m_tileCounts), values, 0, -1);
    return;
  }
  allTiles().forEach(Internal::tileGrain(tileBytes()), [&](int d, std::int64_t begin, std::int64_t end) {
    for (auto i = begin; i < end; ++i) {
      Vector& tile = vector(TreeIndex{i, d});
      T const* const from = tile.empty() ? nullptr : values(d, i);
      if (from) std::copy_n(from, tile.size(), tile.begin());
    }
  });
}

template <class T> void ChannelData<T>::importFlat(Ostil::Array<T> const& array) {
  if (static_cast<std::int64_t>(array.size()) != elementCount(-1)) return;
  auto const offsets = m_data ? tileOffsets() : Internal::TileSlots();
  importValues([&](int d, std::int64_t i) { return array.data() + offsets.at(d, i); });
}

template <class T> void ChannelData<T>::importNested(NestedArrays<T> const& nested) {
  if (nested.size() != static_cast<std::uint64_t>(kChannelDepths)) return;
  for (int d = 0; d < kChannelDepths; ++d) {
    auto const& list = nested[static_cast<std::uint64_t>(d)];
    std::uint64_t const tiles = m_data ? depthTiles(d).size() : 0;
    if ((list ? list->size() : 0) != tiles) return;
    for (std::uint64_t i = 0; i < tiles; ++i) {
      auto const& array = (*list)[i];
      if ((array ? array->size() : 0) != depthTiles(d)[i].size()) return;
    }
  }
  importValues([&](int d, std::int64_t i) -> T const* {
    return (*nested[static_cast<std::uint64_t>(d)])[static_cast<std::uint64_t>(i)]->data();
  });
}

} // namespace VLN::TileTree3D
