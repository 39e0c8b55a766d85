// CellTable: from a place to a tile in one step, for reads at random. A search through the tree takes two
// steps for each level, and at random places each of them waits for memory.
//
//   position ── cell ──> tile at the table's depth, or the deepest one above it ── child tables ──> tile
//
// Made by who reads a buffer, in memory of its own beside it; no part of the format. Where places lie near
// each other a cursor without one is as quick.
#pragma once

#include "Reader/NanoVTTReader.h"

namespace nanovtt {

/// @threads Reading only, once written; any number of threads.
class CellTable {
public:
  /// Of no cells: searches begin at the roots.
  CellTable() = default;
  /// A table about the deepest tiles, with the smallest cells that take no more memory than `mostBytes`. It
  /// has no cells yet: see write().
  /// @edges Of no cells where not even those of the roots fit.
  /// @cost Linear in the tiles.
  NANOVTT_HD CellTable(ContainerReader const& tree, std::uint64_t mostBytes) {
    if (tree.tileCount() == 0) return;
    std::uint32_t low[3] = {~0u, ~0u, ~0u}, high[3] = {0, 0, 0};
    int const deepest = tree.depthOf(tree.tileCount() - 1);
    tree.forEachTile([&](TileRef const& tile) {
      if (tile.depth != deepest) return;
      Coord const llc = tree.lowestCorner();
      std::uint32_t const from[3] = {offset(tile.corner.x, llc.x), offset(tile.corner.y, llc.y),
                                     offset(tile.corner.z, llc.z)};
      for (int a = 0; a < 3; ++a) {
        if (from[a] < low[a]) low[a] = from[a];
        if (from[a] > high[a]) high[a] = from[a];
      }
    });
    for (int depth = deepest; depth >= tree.rootDepth(); --depth) {
      int const shift = kTileSpaceBits - depth;
      std::uint64_t cells = 1;
      for (int a = 0; a < 3; ++a) {
        std::uint64_t const size = (high[a] >> shift) - (low[a] >> shift) + 1;
        cells = size > mostBytes / kCellBytes / cells ? ~std::uint64_t(0) : cells * size;
      }
      if (cells > mostBytes / kCellBytes) continue;
      m_depth = depth;
      for (int a = 0; a < 3; ++a) {
        m_low[a] = low[a] >> shift;
        m_size[a] = (high[a] >> shift) - m_low[a] + 1;
      }
      return;
    }
  }

  /// The same of 16 bytes for each tile at the most.
  NANOVTT_HD explicit CellTable(ContainerReader const& tree)
      : CellTable(tree, kCellBytes * (4 * std::uint64_t(tree.tileCount()) + 1024)) {}

  /// Bytes of the cells; 0 for a table without any.
  NANOVTT_HD std::uint64_t bytes() const {
    return m_depth < 0 ? 0 : kCellBytes * m_size[0] * std::uint64_t(m_size[1]) * m_size[2];
  }
  /// Depth of the tiles that are as wide as a cell; -1 for a table of no cells.
  NANOVTT_HD int depth() const { return m_depth; }

  /// Writes the cells, which searches then read. @param memory Of bytes(), aligned to four. It stays.
  /// @cost Linear in tiles and cells.
  NANOVTT_HD void write(ContainerReader const& tree, void* memory) {
    m_cells = static_cast<unsigned char const*>(memory);
    if (m_depth < 0) return;
    auto* const cells = static_cast<unsigned char*>(memory);
    std::memset(cells, 0xFF, bytes());
    static_assert(kNoTile == 0xFFFFFFFFu, "");
    int const shift = kTileSpaceBits - m_depth;
    // Each tile comes before its children, which write over what it wrote.
    tree.forEachTile([&](TileRef const& tile) {
      if (tile.depth > m_depth) return;
      Coord const llc = tree.lowestCorner();
      std::uint32_t const from[3] = {offset(tile.corner.x, llc.x), offset(tile.corner.y, llc.y),
                                     offset(tile.corner.z, llc.z)};
      std::uint32_t begin[3], end[3];
      for (int a = 0; a < 3; ++a) {
        std::uint32_t const first = from[a] >> shift, last = first + (1u << (m_depth - tile.depth));
        begin[a] = first > m_low[a] ? first - m_low[a] : 0;
        end[a] = last > m_low[a] ? last - m_low[a] : 0;
        if (end[a] > m_size[a]) end[a] = m_size[a];
      }
      for (std::uint32_t z = begin[2]; z < end[2]; ++z)
        for (std::uint32_t y = begin[1]; y < end[1]; ++y)
          for (std::uint32_t x = begin[0]; x < end[0]; ++x)
            store(cells + kCellBytes * index(x, y, z), tile.number);
    });
  }
  /// The same table whose cells lie elsewhere: on a device, where they have been copied to.
  NANOVTT_HD CellTable at(void const* cells) const {
    CellTable copy = *this;
    copy.m_cells = static_cast<unsigned char const*>(cells);
    return copy;
  }

  /// The cell of a place, from the lowest corner of the roots.
  /// @return false outside of the table, and for one without cells.
  NANOVTT_HD bool find(std::uint32_t x, std::uint32_t y, std::uint32_t z, std::uint32_t& tile) const {
    if (!m_cells || m_depth < 0) return false;
    int const shift = kTileSpaceBits - m_depth;
    // What lies below the table wraps to far above it.
    std::uint32_t const i = (x >> shift) - m_low[0], j = (y >> shift) - m_low[1], k = (z >> shift) - m_low[2];
    if (i >= m_size[0] || j >= m_size[1] || k >= m_size[2]) return false;
    tile = load<std::uint32_t>(m_cells + kCellBytes * index(i, j, k));
    return true;
  }

private:
  static constexpr std::uint64_t kCellBytes = 4;

  NANOVTT_HD static std::uint32_t offset(std::int32_t c, std::int32_t lowest) {
    return static_cast<std::uint32_t>(c) - static_cast<std::uint32_t>(lowest);
  }
  NANOVTT_HD std::uint64_t index(std::uint32_t x, std::uint32_t y, std::uint32_t z) const {
    return x + m_size[0] * (y + std::uint64_t(m_size[1]) * z);
  }

  unsigned char const* m_cells = nullptr;
  int m_depth = -1;
  std::uint32_t m_low[3] = {0, 0, 0}, m_size[3] = {0, 0, 0}; ///< in cells, from the lowest corner
};

} // namespace nanovtt
