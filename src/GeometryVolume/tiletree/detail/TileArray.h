// TileArray: the growable array that holds the tiles of one depth.
#pragma once

#include <cstdint>

namespace VLN::TileTree3D {

/// Like a vector of tiles, except that growth moves the records bitwise: a tile owns nothing but its child
/// table, so that a record may change its address without cloning the table.
template <class TileT> class TileArray {
public:
  TileArray() = default;
  TileArray(TileArray const& other);
  TileArray& operator=(TileArray const&) = delete;
  ~TileArray();

  std::int64_t size() const { return m_size; }
  std::int64_t capacity() const { return m_capacity; }
  TileT& operator[](std::int64_t i) { return m_tiles[i]; }
  TileT const& operator[](std::int64_t i) const { return m_tiles[i]; }
  TileT* begin() { return m_tiles; }
  TileT* end() { return m_tiles + m_size; }
  TileT const* begin() const { return m_tiles; }
  TileT const* end() const { return m_tiles + m_size; }

  void reserve(std::int64_t capacity);
  /// Growing value-constructs records, shrinking frees the child tables of the dropped ones.
  void resize(std::int64_t n);
  /// Grows by records that the caller makes in place, each of them, before anything else happens here.
  /// @cost Half of resize() in writes, where records are made anyway.
  void growRaw(std::int64_t n);
  /// Drops records that own nothing, made or not.
  void shrinkRaw(std::int64_t n) { m_size = n; }
  /// Moves the record at `src` over that at `dst`, bitwise. What is left at `src` owns nothing.
  void relocate(std::int64_t dst, std::int64_t src);

  /// Memory for as many records as the array holds.
  class Room;
  /// What permute() needs.
  Room roomToPermute() const;
  /// Moves the record at i to perm[i], bitwise.
  void permute(std::int64_t const* perm, Room& room);
  void clear();

private:
  static TileT* block(TileT* old, std::int64_t capacity);
  std::int64_t grown(std::int64_t n) const;

  TileT* m_tiles = nullptr;
  std::int64_t m_size = 0;
  std::int64_t m_capacity = 0;
};

} // namespace VLN::TileTree3D
