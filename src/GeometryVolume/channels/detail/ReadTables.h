// ReadTables: where the finest tiles of a channel lie in memory, by position.
//
//   cells            nodes                          blocks
//   dense box of     (only where the box is too     for each slot the elements of a tile of the
//   block ids   -->  wide for a dense one)     -->  deepest depth, null where there is none
//
// A block is the place of a tile one level above the deepest, whether that tile exists or not. A read touches
// a cell, a block and the element: neither tile records nor the records of element vectors.
#pragma once

#include "GeometryVolume/channels/detail/ElementRows.h"
#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/tiletree/Container.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace VLN::TileTree3D::Internal {

template <class TraitsT> class VLN_API ReadTables {
public:
  static constexpr int kBlockDepth = TraitsT::kMaxDepth - 1;
  static constexpr int kBlockWidth = TraitsT::width(kBlockDepth);
  /// Slots as in a tile.
  struct alignas(64) Block {
    std::array<void const*, TraitsT::kTileSize> tiles{};

    void const* tile(std::size_t slot) const { return tiles[slot]; }
  };

  /// `elements` gives the elements of a tile of the deepest depth, null for one without.
  /// @cost Linear in the tiles of the deepest depth.
  ReadTables(Container<TraitsT> const& tree, FunctionRef<void const*(std::int64_t tile)> elements);

  /// The block that holds the point; noBlock() where no tile of the deepest depth is near, and out of the
  /// domain.
  Block const* block(int i, int j, int k) const noexcept {
    if (m_cellDepth != kBlockDepth) return blockInNodes(i, j, k);
    auto const* const cell = cellIfBlocks(i, j, k);
    return cell ? &m_blocks[*cell] : &noBlock();
  }
  /// Asks for the elements of a block's tiles, unless that is `fetched`, and for those of the block at a
  /// point.
  /// @return The latter.
  Block const* fetch(Block const& here, Block const* fetched, int i, int j, int k,
                     std::size_t tileBytes) const noexcept;
  /// @param values Gets an element for each of `count` positions.
  /// @param missing Called with the numbers of positions without a tile of the deepest depth, whose values it
  /// is to give.
  void read(int3 const* positions, std::size_t count, ElementRows const& rows, void* values,
            FunctionRef<void(std::size_t n)> missing) const;
  /// A block without tiles.
  Block const& noBlock() const { return m_blocks.front(); }
  std::uint64_t memUsage() const;

private:
  using Node = std::array<std::int32_t, TraitsT::kTileSize>;

  /// Slot, in its parent, of the tile of depth `d` at an offset.
  static std::size_t slot(std::uint32_t const* u, int d) {
    std::uint32_t n = 0;
    for (int a = 2; a >= 0; --a) {
      std::uint32_t const digit =
          TraitsT::quotient(u[a], d) - TraitsT::quotient(u[a], d - 1) * std::uint32_t(TraitsT::kTW);
      n = n * std::uint32_t(TraitsT::kTW) + digit;
    }
    return n;
  }
  /// Of blocks: beyond the last one where there is none.
  std::uint32_t cellOf(int c, std::size_t axis) const {
    // Blocks lie at multiples of their width. The domain is a quarter of all integers: positions below the
    // box wrap to far above it.
    if constexpr (TraitsT::kTW == 2)
      return (static_cast<std::uint32_t>(c) - m_low[axis]) / std::uint32_t(kBlockWidth);
    else
      return TraitsT::quotient(TraitsT::offset(c), kBlockDepth) - m_origin[axis];
  }
  /// The cell that holds a point, where each block has one; null beyond them.
  std::int32_t const* cellIfBlocks(int i, int j, int k) const {
    // Depth and so the divisions are known here.
    std::uint32_t const x = cellOf(i, 0), y = cellOf(j, 1), z = cellOf(k, 2);
    if (x >= m_size[0] || y >= m_size[1] || z >= m_size[2]) return nullptr;
    return &m_cells[x + m_size[0] * (y + std::size_t(m_size[1]) * z)];
  }
  Block const* blockInNodes(int i, int j, int k) const noexcept;
  void chooseCells(Container<TraitsT> const& tree);
  /// The block of a tile's corner, made when there is none.
  Block& makeBlock(int3 const& corner);

  int m_cellDepth = 0;
  std::array<std::uint32_t, 3> m_origin{0, 0, 0}, m_size{0, 0, 0}; ///< in cells
  std::array<std::uint32_t, 3> m_low{0, 0, 0};                     ///< corner in tile space
  // The first node leads to itself and the first block is empty, so that a missing entry is a 0.
  std::vector<std::int32_t> m_cells;
  std::vector<Node> m_nodes;
  std::vector<Block> m_blocks;
};

} // namespace VLN::TileTree3D::Internal
