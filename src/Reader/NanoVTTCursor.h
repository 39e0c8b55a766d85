// GridCursor: many reads of one float grid, near each other. It remembers the last tile.
#pragma once

#include "Reader/NanoVTTReader.h"

namespace nanovtt {

/// @pre A grid of float samples, of any build.
/// @threads One for each thread.
class GridCursor {
public:
  /// @param maxDepth Deeper tiles are not read: a coarse picture of the same field.
  NANOVTT_HD explicit GridCursor(GridReader const& grid, int maxDepth = kMaxDepth)
      : m_grid(grid)
      , m_default(grid.defaultValue().getFloat(0))
      , m_maxDepth(maxDepth) {}

  /// The sample that holds the position, of the deepest tile there; the default value where there is none.
  /// @space Tile space.
  /// @cost In the tile of the read before: one test and one load. Else a search from the root table.
  NANOVTT_HD float value(std::int32_t x, std::int32_t y, std::int32_t z) {
    if (!holds(x, y, z) && !moveTo(x, y, z)) return m_default;
    return m_block.getFloat(
        m_block.index(at(x, m_tile.corner.x), at(y, m_tile.corner.y), at(z, m_tile.corner.z)));
  }

  /// The blend of the eight samples round a position, samples on the low corners of their voxels.
  /// @formula (b - a) * f + a along x, then y, then z.
  /// @edges Without a halo, samples beyond the tile are those of the deepest tiles that hold their places.
  /// @cost In a tile with halo: no other tile is looked at.
  NANOVTT_HD float trilinear(float x, float y, float z) {
    Cell c;
    return cellAt(x, y, z, c) ? c.value() : m_default;
  }
  /// The blend, and its derivative in the cell about the position.
  /// @units Of the derivative: per unit of tile space.
  /// @edges Where there is no tile all three are 0.
  NANOVTT_HD float trilinear(float x, float y, float z, float gradient[3]) {
    Cell c;
    if (!cellAt(x, y, z, c)) {
      gradient[0] = gradient[1] = gradient[2] = 0;
      return m_default;
    }
    c.slope(gradient);
    float const perUnit = 1 / static_cast<float>(std::int32_t(1) << m_shift);
    for (int a = 0; a < 3; ++a) gradient[a] *= perUnit;
    return c.value();
  }

private:
  /// Eight samples, and where the position lies between them.
  struct Cell {
    float v[8];
    float fx, fy, fz;

    NANOVTT_HD float value() const {
      float const y0 = lerp(lerp(v[0], v[1], fx), lerp(v[2], v[3], fx), fy);
      float const y1 = lerp(lerp(v[4], v[5], fx), lerp(v[6], v[7], fx), fy);
      return lerp(y0, y1, fz);
    }
    NANOVTT_HD void slope(float g[3]) const {
      g[0] = lerp(lerp(v[1] - v[0], v[3] - v[2], fy), lerp(v[5] - v[4], v[7] - v[6], fy), fz);
      g[1] = lerp(lerp(v[2] - v[0], v[3] - v[1], fx), lerp(v[6] - v[4], v[7] - v[5], fx), fz);
      g[2] = lerp(lerp(v[4] - v[0], v[5] - v[1], fx), lerp(v[6] - v[2], v[7] - v[3], fx), fy);
    }
  };
  NANOVTT_HD bool cellAt(float x, float y, float z, Cell& cell) {
    std::int32_t const px = floorOf(x), py = floorOf(y), pz = floorOf(z);
    if (!holds(px, py, pz) && !moveTo(px, py, pz)) return false;
    float const width = static_cast<float>(std::int32_t(1) << m_shift);
    int const i = at(px, m_tile.corner.x), j = at(py, m_tile.corner.y), k = at(pz, m_tile.corner.z);
    cell.fx = (x - static_cast<float>(m_tile.corner.x + (i << m_shift))) / width;
    cell.fy = (y - static_cast<float>(m_tile.corner.y + (j << m_shift))) / width;
    cell.fz = (z - static_cast<float>(m_tile.corner.z + (k << m_shift))) / width;
    float* const v = cell.v;
    if (i + 1 < m_block.width && j + 1 < m_block.width && k + 1 < m_block.width) {
      std::uint64_t const n = m_block.index(i, j, k), dj = m_block.strideJ, dk = m_block.strideK;
      v[0] = m_block.getFloat(n), v[1] = m_block.getFloat(n + 1);
      v[2] = m_block.getFloat(n + dj), v[3] = m_block.getFloat(n + dj + 1);
      v[4] = m_block.getFloat(n + dk), v[5] = m_block.getFloat(n + dk + 1);
      v[6] = m_block.getFloat(n + dj + dk), v[7] = m_block.getFloat(n + dj + dk + 1);
    } else {
      std::int32_t const step = std::int32_t(1) << m_shift;
      std::int32_t const cx = m_tile.corner.x + (i << m_shift), cy = m_tile.corner.y + (j << m_shift),
                         cz = m_tile.corner.z + (k << m_shift);
      for (int c = 0; c < 8; ++c)
        v[c] = static_cast<float>(m_grid.valueAt(cx + (c & 1 ? step : 0), cy + (c & 2 ? step : 0),
                                                 cz + (c & 4 ? step : 0), 0, m_maxDepth));
    }
    return true;
  }
  NANOVTT_HD static float lerp(float a, float b, float f) { return (b - a) * f + a; }
  NANOVTT_HD static std::int32_t floorOf(float v) {
    // What no coordinate reaches lies out of every tree.
    if (!(v >= -2147483648.0f && v <= 2147483520.0f)) return INT32_MIN;
    auto const cut = static_cast<std::int32_t>(v);
    return cut - (static_cast<float>(cut) > v);
  }
  NANOVTT_HD bool holds(std::int32_t x, std::int32_t y, std::int32_t z) const {
    return distance(x, m_tile.corner.x) < m_width && distance(y, m_tile.corner.y) < m_width &&
           distance(z, m_tile.corner.z) < m_width;
  }
  NANOVTT_HD static std::uint32_t distance(std::int32_t c, std::int32_t corner) {
    return static_cast<std::uint32_t>(c) - static_cast<std::uint32_t>(corner);
  }
  NANOVTT_HD int at(std::int32_t c, std::int32_t corner) const {
    return static_cast<int>(distance(c, corner) >> m_shift);
  }
  NANOVTT_HD bool moveTo(std::int32_t x, std::int32_t y, std::int32_t z) {
    m_tile = m_grid.container().find(x, y, z, m_maxDepth);
    m_width = 0;
    if (!m_tile.valid()) return false;
    // A tile found above a refined place holds that place no longer than to its next child: only tiles
    // without children are kept whole.
    m_block = m_grid.block(m_tile.number);
    m_shift = kTileSpaceBits - m_tile.depth - 2;
    for (int core = m_block.core; core > kTileWidth; core /= 2) --m_shift;
    bool const leaf = m_tile.depth == m_maxDepth || m_tile.depth == kMaxDepth || isChildless(m_tile.number);
    m_width = leaf ? static_cast<std::uint32_t>(m_tile.width()) : 0;
    return true;
  }
  NANOVTT_HD bool isChildless(std::uint32_t tile) const {
    auto const list = m_grid.container().children(tile);
    for (std::uint32_t n = 0; n < list.count(); ++n)
      if (list[n] != kNoTile) return false;
    return true;
  }

  GridReader m_grid;
  float m_default;
  int m_maxDepth;
  TileRef m_tile;
  TileBlock m_block;
  std::uint32_t m_width = 0; ///< of what may be read without a search; 0: nothing
  int m_shift = 0;           ///< log2 of the width of a sample
};

} // namespace nanovtt
