// BlockCursor: the last block of ReadTables that was read from.
#pragma once

#include "GeometryVolume/channels/detail/BlockPlaces.h"
#include "GeometryVolume/channels/detail/ReadTables.h"

namespace VLN::TileTree3D::Internal {

/// A sample of a tile of the deepest depth; without elements where there is no such tile.
struct FinestSample {
  void const* elements;
  std::uint32_t i, j, k; ///< within the tile
};

/// @pre The tables outlive it.
/// @threads One for each thread.
template <class TraitsT> class BlockCursor {
public:
  using Tables = ReadTables<TraitsT>;

  BlockCursor() = default;
  explicit BlockCursor(Tables const& tables)
      : m_tables(&tables)
      , m_block(&tables.noBlock()) {}

  bool isOpen() const { return m_tables; }
  /// @pre isOpen().
  /// @cost In the block of the last one: a test, and one load. Elsewhere two loads more.
  FinestSample find(int i, int j, int k) {
    seek(i, j, k);
    std::uint32_t const x = within(i, m_corner.x), y = within(j, m_corner.y), z = within(k, m_corner.z);
    constexpr std::uint32_t w = TraitsT::kTDW, slots = TraitsT::kTW;
    // Sums of whole tile widths before the division: powers of two need one shift then.
    return {m_block->tiles[((x - x % w) + slots * ((y - y % w) + slots * (z - z % w))) / w], x % w, y % w,
            z % w};
  }

  /// The same for tiles whose elements lie kWidth in a row from element kFirst on.
  /// @return The element itself; null where there is no such tile.
  template <class T, int kWidth, int kFirst> T const* element(int i, int j, int k) {
    seek(i, j, k);
    auto const at = BlockPlaces<TraitsT::kTW, TraitsT::kTDW, kWidth, kFirst>::find(
        within(i, m_corner.x), within(j, m_corner.y), within(k, m_corner.z));
    auto const* const tile = static_cast<T const*>(m_block->tiles[at.slot()]);
    return tile ? tile + at.element() : nullptr;
  }

  /// Moves to the block of a point.
  void seek(int i, int j, int k) {
    if (inBlock(i, j, k)) [[likely]]
      return;
    m_block = m_tables->block(i, j, k);
    // Out of the domain, too, the corner is less than a block away, and the block is the empty one.
    m_corner = TraitsT::align(int3{i, j, k}, Tables::kBlockDepth);
  }
  void prefetch() const { __builtin_prefetch(m_block); }

private:
  static constexpr auto kBlockWidth = std::uint32_t(Tables::kBlockWidth);

  /// Distance from the corner of the point's block.
  static std::uint32_t within(int c, int corner) {
    if constexpr (TraitsT::kTW == 2)
      return static_cast<std::uint32_t>(c) % kBlockWidth; // blocks lie at multiples of their width
    else
      return static_cast<std::uint32_t>(c) - static_cast<std::uint32_t>(corner);
  }
  bool inBlock(int i, int j, int k) const {
    if constexpr (TraitsT::kTW == 2)
      return static_cast<std::uint32_t>((i ^ m_corner.x) | (j ^ m_corner.y) | (k ^ m_corner.z)) < kBlockWidth;
    else
      return within(i, m_corner.x) < kBlockWidth && within(j, m_corner.y) < kBlockWidth &&
             within(k, m_corner.z) < kBlockWidth;
  }

  Tables const* m_tables = nullptr;
  typename Tables::Block const* m_block = nullptr;
  int3 m_corner{TraitsT::kMinTileCoord, TraitsT::kMinTileCoord, TraitsT::kMinTileCoord};
};

/// Tables that several readers make together: see SharedReadTablesImpl.h.
template <class TraitsT> struct SharedReadTables;

} // namespace VLN::TileTree3D::Internal
