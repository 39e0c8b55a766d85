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
    return sample(*m_block, steps(i, j, k));
  }
  /// The same for tiles whose elements lie kWidth in a row from element kFirst on.
  /// @return The element itself; null where there is no such tile.
  /// @cost As find(). Where blocks are read one after another, what they hold is fetched ahead.
  template <class T, int kWidth, int kFirst> T const* element(int i, int j, int k) {
    Steps at = steps(i, j, k);
    ++m_reads;
    if (!at.inBlock()) [[unlikely]] {
      move<sizeof(T) * kWidth * kWidth * kWidth>(i, j, k);
      at = steps(i, j, k);
    }
    auto const place = BlockPlaces<TraitsT::kTW, TraitsT::kTDW, kWidth, kFirst>::find(at.x, at.y, at.z);
    auto const* const tile = static_cast<T const*>(m_block->tiles[place.slot()]);
    return tile ? tile + place.element() : nullptr;
  }

  /// Moves to the block of a point.
  void seek(int i, int j, int k) {
    if (!steps(i, j, k).inBlock()) [[unlikely]]
      move<0>(i, j, k);
  }
  typename Tables::Block const& block() const { return *m_block; }
  /// A sample of the block that holds a point.
  static FinestSample findIn(typename Tables::Block const& block, int i, int j, int k) {
    return sample(block, {step(i, alignToBlock(i)), step(j, alignToBlock(j)), step(k, alignToBlock(k))});
  }

private:
  static constexpr auto kBlockWidth = std::uint32_t(Tables::kBlockWidth);
  /// Blocks of a power of two lie at multiples of their width: within one, a coordinate and the corner's
  /// differ in the lowest bits alone, and these are the distance.
  static constexpr bool kBits = TraitsT::kTW == 2;

  /// From the corner of the block, on each axis.
  struct Steps {
    std::uint32_t x, y, z;
    bool inBlock() const {
      return kBits ? (x | y | z) < kBlockWidth : x < kBlockWidth && y < kBlockWidth && z < kBlockWidth;
    }
  };
  static FinestSample sample(typename Tables::Block const& block, Steps const& at) {
    auto const [x, y, z] = at;
    constexpr std::uint32_t w = TraitsT::kTDW, slots = TraitsT::kTW;
    // Sums of whole tile widths before the division: powers of two need one shift then.
    return {block.tiles[((x - x % w) + slots * ((y - y % w) + slots * (z - z % w))) / w], x % w, y % w,
            z % w};
  }
  Steps steps(int i, int j, int k) const { return {step(i, m_x), step(j, m_y), step(k, m_z)}; }
  static std::uint32_t step(int c, int corner) {
    auto const a = static_cast<std::uint32_t>(c), b = static_cast<std::uint32_t>(corner);
    return kBits ? a ^ b : a - b;
  }
  /// @param kBytes Of the elements of a tile; 0 for reads that fetch what they need themselves.
  template <std::size_t kBytes> [[gnu::always_inline]] void move(int i, int j, int k) {
    auto const* const block = m_tables->block(i, j, k);
    // Out of the domain, too, the corner is less than a block away, and the block is the empty one.
    int const x = alignToBlock(i), y = alignToBlock(j), z = alignToBlock(k);
    if constexpr (kBits && kBytes > 0 && kBytes <= kMostBytes) {
      if (m_reads > kManyReads) [[unlikely]]
        m_fetched = m_tables->fetch(*block, m_fetched, next(x, m_x), next(y, m_y), next(z, m_z), kBytes);
      m_reads /= 2;
    }
    m_block = block, m_x = x, m_y = y, m_z = z;
  }
  /// One step on from `c`, which came from `before`.
  static int next(int c, int before) {
    return static_cast<int>(2 * static_cast<std::uint32_t>(c) - static_cast<std::uint32_t>(before));
  }
  static int alignToBlock(int c) {
    if constexpr (kBits)
      return c & -int(kBlockWidth);
    else
      return TraitsT::align(c, Tables::kBlockDepth);
  }

  /// In the last blocks, so that much of the next one will be read as well. Rows of a box and short walks
  /// read less in one go.
  static constexpr std::uint32_t kManyReads = 48;
  /// Of a tile that is fetched ahead: a block of larger ones would drive out what is read now.
  static constexpr std::size_t kMostBytes = 512;

  // The corner's coordinates lie apart, or the compiler stores two at once, for which reads of one have to
  // wait.
  int m_x = TraitsT::kMinTileCoord;
  std::uint32_t m_reads = 0; ///< by element() in the block, and half of those before, and so on
  Tables const* m_tables = nullptr;
  int m_y = TraitsT::kMinTileCoord;
  typename Tables::Block const* m_block = nullptr;
  typename Tables::Block const* m_fetched = nullptr; ///< the one ahead
  int m_z = TraitsT::kMinTileCoord;
};

/// Tables that several readers make together: see SharedReadTablesImpl.h.
template <class TraitsT> struct SharedReadTables;

} // namespace VLN::TileTree3D::Internal
