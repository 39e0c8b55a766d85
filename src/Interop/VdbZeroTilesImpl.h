// Tiles of zeros that take no memory before somebody writes to them.
//
// Grids that share a tree mostly have nothing where another one lies, and most backgrounds are zero. Tiles of
// such places lie in blocks that the system hands out as zeros: it finds memory for a page of them at the
// first write.
#pragma once

#include "GeometryVolume/channels/ChannelData.h"
#include "GeometryVolume/channels/detail/TileVectorOps.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <memory>
#include <mutex>
#include <new>

namespace VLN::Interop {

/// Whether all bytes of some values are zero.
template <class T> bool areZeros(T const* values, std::size_t count) {
  static_assert(std::is_trivially_copyable_v<T>);
  std::uint64_t any = 0, word;
  char const* const bytes = reinterpret_cast<char const*>(values);
  std::size_t n = 0, size = count * sizeof(T);
  for (; n + sizeof word <= size; n += sizeof word) {
    std::memcpy(&word, bytes + n, sizeof word);
    any |= word;
  }
  for (; n < size; ++n) any |= static_cast<unsigned char>(bytes[n]);
  return any == 0;
}

/// Makes such tiles for one channel.
template <class T> class ZeroTiles {
public:
  /// Tiles that one thread has at hand.
  class Run {
    friend class ZeroTiles;
    T* m_next = nullptr;
    std::int64_t m_left = 0;
  };

  /// @param elements In a tile.
  explicit ZeroTiles(std::int64_t elements)
      : m_elements(elements)
      , m_stride(TileTree3D::Internal::tileSlotStride(elements, sizeof(T))) {}

  /// Makes a tile in place of an empty one.
  /// @error std::bad_alloc; the tile stays empty.
  /// @threads Each with a run of its own.
  void make(Run& run, TileVector<T>& tile) {
    if (run.m_left == 0) refill(run);
    T* const slot = run.m_next;
    run.m_next += m_stride;
    --run.m_left;
    // Nothing is thrown from here on. To move a vector costs more than to make it.
    std::destroy_at(&tile);
    ::new (static_cast<void*>(&tile)) TileVector<T>(
        TileTree3D::Internal::unwrittenVector(m_elements, TileDataAllocator<T>(slot, m_elements, true)));
  }
  /// Leaves the blocks to the storage that the tiles are in.
  void leaveTo(TileTree3D::TileStorage<T>& storage) { storage.adopt(m_blocks); }

private:
  // Blocks grow with what was asked for: where zeros have to be written after all, few are written in vain.
  static constexpr std::int64_t kRun = 16, kFirst = 64, kMost = 1 << 14;

  void refill(Run& run) {
    std::lock_guard const lock(m_mutex);
    if (m_rest.m_left == 0) {
      auto* const block = static_cast<T*>(m_blocks.allocateZeros(m_tiles * m_stride, sizeof(T)));
      if (!block) throw std::bad_alloc();
      m_rest.m_next = block;
      m_rest.m_left = m_tiles;
      m_tiles = std::min(2 * m_tiles, kMost);
    }
    run.m_next = m_rest.m_next;
    run.m_left = kRun;
    m_rest.m_next += kRun * m_stride;
    m_rest.m_left -= kRun;
  }

  std::int64_t m_elements, m_stride;
  std::mutex m_mutex;
  std::int64_t m_tiles = kFirst; ///< of the next block
  Run m_rest;                    ///< of the last block
  TileTree3D::Internal::BlockList m_blocks;
};

} // namespace VLN::Interop
