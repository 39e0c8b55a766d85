// ChannelReader: the value of a channel at a position of tile space, for many reads of a volume that stays as
// it is.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/detail/BlockCursor.h"

#include <new>
#include <span>
#include <stdexcept>
#include <string>
#include <utility>

namespace VLN::TileTree3D {

/// Remembers the last block of tiles, and finds others through tables of its own, which copies share.
/// @pre Tree and channel outlive the reader. After either has changed, make a new one.
/// @cost Making the first: linear in the tiles of the deepest depth, about 10 bytes for each of them. A copy:
/// constant. A read: see value().
/// @threads One copy for each thread.
template <class ChannelT> class ChannelReader {
  using TraitsT = typename ChannelT::Traits;
  using Tables = Internal::ReadTables<TraitsT>;

public:
  using value_type = typename ChannelT::value_type;

  ChannelReader(Container<TraitsT> const& tree, ChannelT const& channel)
      : m_tables(Ostil::makePtr<Tables>(tree,
                                        [&](std::int64_t n) -> void const* {
                                          return elements(channel, {n, TraitsT::kMaxDepth});
                                        }))
      , m_tree(&tree)
      , m_channel(&channel)
      , m_blocks(*m_tables) {}
  ChannelReader(ChannelReader const& other)
      : m_tables(other.m_tables)
      , m_tree(other.m_tree)
      , m_channel(other.m_channel)
      , m_blocks(other.m_blocks) {}
  ChannelReader& operator=(ChannelReader const& other) {
    m_tables = other.m_tables, m_tree = other.m_tree, m_channel = other.m_channel, m_blocks = other.m_blocks;
    drop(std::exchange(m_coarse, nullptr));
    return *this;
  }
  // Inline on the ways of exceptions as well. Then nothing takes the address of a reader that is a function's
  // own, and what it remembers stays in registers.
  [[gnu::always_inline]] ~ChannelReader() {
    if (m_coarse) [[unlikely]]
      drop(m_coarse);
  }

  /// The sample that holds the position, of the deepest tile that has data.
  /// @space Tile space.
  /// @edges The channel's default value where no tile has data, and out of the domain.
  /// @cost In the block of the read before: one test, and two loads. In another with a tile of the deepest
  /// depth: one load more, and where blocks are read one after another, their samples are fetched ahead.
  /// Elsewhere a lookup in the tree.
  [[gnu::always_inline]] value_type const& value(int i, int j, int k) const noexcept {
    using Tile = typename ChannelT::ConstTile;
    value_type const* const sample =
        m_blocks.template element<value_type, Tile::kWidth, Tile::index(0, 0, 0)>(i, j, k);
    if (!sample) [[unlikely]] {
      Coarse const found = coarse(m_coarse, *m_tree, *m_channel, i, j, k);
      m_coarse = found.tiles;
      return *found.sample;
    }
    return *sample;
  }
  value_type const& value(int3 const& p) const noexcept { return value(p.x, p.y, p.z); }
  /// Many positions: values[n] = value(positions[n]). @shape As many values as positions.
  /// @cost At random places in a volume beyond the processor's caches a third to two thirds of as many single
  /// calls: what they read is fetched side by side. Else about the same.
  /// @error std::invalid_argument where there are not as many values as positions.
  void read(std::span<int3 const> positions, std::span<value_type> values) const {
    if (positions.size() != values.size())
      throw std::invalid_argument(std::to_string(positions.size()) + " positions with " +
                                  std::to_string(values.size()) + " values");
    using Tile = typename ChannelT::ConstTile;
    m_tables->read(positions.data(), positions.size(),
                   {sizeof(value_type), Tile::kWidth, Tile::index(0, 0, 0)}, values.data(),
                   [&](std::size_t n) { values[n] = value(positions[n]); });
  }

  /// Bytes of the tables.
  std::uint64_t memUsage() const { return m_tables->memUsage(); }

private:
  /// Null for a tile that the channel lacks, or that has fewer elements than a whole one.
  static value_type const* elements(ChannelT const& channel, TreeIndex const& at) {
    if (!channel.tileArrays() || at.depth < channel.minDepth() || at.depth > channel.depth()) return nullptr;
    auto const& tiles = (*channel.tileArrays())[at.depth];
    auto const n = static_cast<std::size_t>(at.index);
    return n < tiles.size() && tiles[n].size() >= std::size_t(ChannelT::kSize) ? tiles[n].data() : nullptr;
  }
  using Tiles = ConstTileAccessorOf<TraitsT>;
  struct Coarse {
    Tiles* tiles;
    value_type const* sample;
  };
  /// From the tile that a search in the tree finds, or from one above it.
  /// @param tiles The accessor of earlier searches, null for the first one, and where there is no memory for
  /// one.
  // What could throw would keep the caller's sums out of registers: none of x86's survives a call, and around
  // one with a way for exceptions the compiler does not save them.
  [[gnu::cold, gnu::noinline]] static Coarse coarse(Tiles* tiles, Container<TraitsT> const& tree,
                                                    ChannelT const& channel, int i, int j, int k) noexcept {
    if (!tiles) tiles = new (std::nothrow) Tiles(tree.tileAccessor());
    if (!tiles) [[unlikely]]
      return {nullptr, &coarse(tree.tileAccessor(), channel, i, j, k)};
    return {tiles, &coarse(*tiles, channel, i, j, k)};
  }
  static value_type const& coarse(Tiles const& tiles, ChannelT const& channel, int i, int j, int k) {
    TreeIndex at = tiles.treeIndex(i, j, k, TraitsT::kMaxDepth, false);
    while (at.valid()) {
      auto const& tile = tiles.tile(at);
      if (value_type const* const samples = elements(channel, at))
        return samples[ChannelT::ConstTile::index(tile.childDataIJK(i, j, k))];
      at = tile.parentTreeIndex();
    }
    return channel.defaultValue();
  }
  [[gnu::cold, gnu::noinline]] static void drop(Tiles* tiles) noexcept { delete tiles; }

  Ostil::Ptr<Tables> m_tables;
  Container<TraitsT> const* m_tree;
  ChannelT const* m_channel;
  mutable Tiles* m_coarse = nullptr;
  mutable Internal::BlockCursor<TraitsT> m_blocks;
};

} // namespace VLN::TileTree3D
