// TileArray: the growable array that holds the tiles of one depth.
#pragma once

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>

namespace VLN::TileTree3D {

/// Like a vector of tiles, except that growth moves the records bitwise: a tile owns nothing but its child
/// table, so that a record may change its address without cloning the table.
template <class TileT> class TileArray {
public:
  TileArray() = default;
  TileArray(TileArray const& other)
      : TileArray() { // made from here on: what a record's copy throws frees the block
    reserve(other.m_size);
    std::uninitialized_copy(other.begin(), other.end(), m_tiles);
    m_size = other.m_size;
  }
  TileArray& operator=(TileArray const&) = delete;
  ~TileArray() { clear(); }

  std::int64_t size() const { return m_size; }
  std::int64_t capacity() const { return m_capacity; }
  TileT& operator[](std::int64_t i) { return m_tiles[i]; }
  TileT const& operator[](std::int64_t i) const { return m_tiles[i]; }
  TileT* begin() { return m_tiles; }
  TileT* end() { return m_tiles + m_size; }
  TileT const* begin() const { return m_tiles; }
  TileT const* end() const { return m_tiles + m_size; }

  void reserve(std::int64_t capacity) {
    if (capacity <= m_capacity) return;
    m_tiles = block(m_tiles, capacity);
    m_capacity = capacity;
  }
  /// Growing value-constructs records, shrinking frees the child tables of the dropped ones.
  void resize(std::int64_t n) {
    if (n < m_size) {
      std::destroy(m_tiles + n, m_tiles + m_size);
    } else {
      if (n > m_capacity) reserve(std::max(n, m_capacity + m_capacity / 2));
      std::uninitialized_value_construct(m_tiles + m_size, m_tiles + n);
    }
    m_size = n;
  }
  /// Grows by records that the caller makes in place, each of them, before anything else happens here.
  /// @cost Half of resize() in writes, where records are made anyway.
  void growRaw(std::int64_t n) {
    if (n > m_capacity) reserve(std::max(n, m_capacity + m_capacity / 2));
    m_size = n;
  }
  /// Drops records that own nothing, made or not.
  void shrinkRaw(std::int64_t n) { m_size = n; }
  /// Moves the record at `src` over that at `dst`, bitwise. What is left at `src` owns nothing.
  void relocate(std::int64_t dst, std::int64_t src) {
    std::destroy_at(m_tiles + dst);
    std::memcpy(static_cast<void*>(m_tiles + dst), static_cast<void const*>(m_tiles + src), sizeof(TileT));
    new (static_cast<void*>(m_tiles + src)) TileT;
  }

  struct Free {
    void operator()(TileT* room) const { std::free(static_cast<void*>(room)); }
  };
  using Room = std::unique_ptr<TileT, Free>;
  /// What permute() needs.
  Room roomToPermute() const { return Room(block(nullptr, m_size)); }
  /// Moves the record at i to perm[i], bitwise.
  void permute(std::int64_t const* perm, Room room) {
    for (std::int64_t i = 0; i < m_size; ++i)
      std::memcpy(static_cast<void*>(room.get() + perm[i]), static_cast<void const*>(m_tiles + i),
                  sizeof(TileT));
    std::free(static_cast<void*>(m_tiles));
    m_tiles = room.release();
    m_capacity = m_size;
  }
  void clear() {
    std::destroy(m_tiles, m_tiles + m_size);
    std::free(static_cast<void*>(m_tiles));
    m_tiles = nullptr;
    m_size = m_capacity = 0;
  }

private:
  /// The system moves a large block's pages instead of copying them, and old ones need not be mapped anew.
  static TileT* block(TileT* old, std::int64_t capacity) {
    auto const bytes = static_cast<std::size_t>(std::max<std::int64_t>(capacity, 1)) * sizeof(TileT);
    void* const room = std::realloc(static_cast<void*>(old), bytes);
    if (!room) throw std::bad_alloc();
    return static_cast<TileT*>(room);
  }

  TileT* m_tiles = nullptr;
  std::int64_t m_size = 0;
  std::int64_t m_capacity = 0;
};

} // namespace VLN::TileTree3D
