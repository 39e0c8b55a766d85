// How the array of a depth's tiles grows, shrinks and is put in another order.
#pragma once

#include "GeometryVolume/core/HugePagesImpl.h"
#include "GeometryVolume/tiletree/detail/TileArray.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <utility>

namespace VLN::TileTree3D {

template <class TileT> class TileArray<TileT>::Room {
public:
  Room() = default;
  explicit Room(TileT* room)
      : m_room(room) {}
  TileT* get() const { return m_room.get(); }
  TileT* release() { return m_room.release(); }

private:
  struct Free {
    void operator()(TileT* room) const { std::free(static_cast<void*>(room)); }
  };
  std::unique_ptr<TileT, Free> m_room;
};

/// The system moves a large block's pages instead of copying them, and old ones need not be mapped anew.
template <class TileT> TileT* TileArray<TileT>::block(TileT* old, std::int64_t capacity) {
  auto const bytes = static_cast<std::size_t>(std::max<std::int64_t>(capacity, 1)) * sizeof(TileT);
  void* const room = std::realloc(static_cast<void*>(old), bytes);
  if (!room) throw std::bad_alloc();
  VLN::Internal::preferHugePages(room, bytes);
  return static_cast<TileT*>(room);
}

template <class TileT>
TileArray<TileT>::TileArray(TileArray const& other)
    : TileArray() { // made from here on: what a record's copy throws frees the block
  reserve(other.m_size);
  std::uninitialized_copy(other.begin(), other.end(), m_tiles);
  m_size = other.m_size;
}
template <class TileT> TileArray<TileT>::~TileArray() { clear(); }

template <class TileT> void TileArray<TileT>::reserve(std::int64_t capacity) {
  if (capacity <= m_capacity) return;
  m_tiles = block(m_tiles, capacity);
  m_capacity = capacity;
}
template <class TileT> std::int64_t TileArray<TileT>::grown(std::int64_t n) const {
  return n > m_capacity ? std::max(n, m_capacity + m_capacity / 2) : m_capacity;
}
template <class TileT> void TileArray<TileT>::resize(std::int64_t n) {
  if (n < m_size) {
    std::destroy(m_tiles + n, m_tiles + m_size);
  } else {
    reserve(grown(n));
    std::uninitialized_value_construct(m_tiles + m_size, m_tiles + n);
  }
  m_size = n;
}
template <class TileT> void TileArray<TileT>::growRaw(std::int64_t n) {
  reserve(grown(n));
  m_size = n;
}
template <class TileT> void TileArray<TileT>::relocate(std::int64_t dst, std::int64_t src) {
  std::destroy_at(m_tiles + dst);
  std::memcpy(static_cast<void*>(m_tiles + dst), static_cast<void const*>(m_tiles + src), sizeof(TileT));
  new (static_cast<void*>(m_tiles + src)) TileT;
}
template <class TileT> auto TileArray<TileT>::roomToPermute() const -> Room {
  return Room(block(nullptr, m_size));
}
template <class TileT> void TileArray<TileT>::permute(std::int64_t const* perm, Room& room) {
  for (std::int64_t i = 0; i < m_size; ++i)
    std::memcpy(static_cast<void*>(room.get() + perm[i]), static_cast<void const*>(m_tiles + i),
                sizeof(TileT));
  std::free(static_cast<void*>(m_tiles));
  m_tiles = room.release();
  m_capacity = m_size;
}
template <class TileT> void TileArray<TileT>::clear() {
  std::destroy(m_tiles, m_tiles + m_size);
  std::free(static_cast<void*>(m_tiles));
  m_tiles = nullptr;
  m_size = m_capacity = 0;
}

} // namespace VLN::TileTree3D
