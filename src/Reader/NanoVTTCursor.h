// Many reads of one grid, near each other: cursors remember the way to the last tile.
//
//   Cursor<GridType::kFp8>   the type and the build known when it is compiled: no switch in a read
//   GridCursor               float grids of every build, told apart in each read
#pragma once

#include "Reader/NanoVTTPath.h"

namespace nanovtt {

/// Samples of one type and build.
template <GridType kType> struct TypedSamples {
  using Value = typename SampleOf<kType>::Value;
  using Blend = typename SampleOf<kType>::Blend;

  NANOVTT_INLINE static TileBlock block(GridReader const& grid, std::uint32_t tile) {
    return grid.blockAs(kType, tile);
  }
  NANOVTT_HD static Value get(TileBlock const& block, std::uint64_t n) {
    if constexpr (kType == GridType::kFp4) {
      return of(block, block.samples[n >> 1] >> (4 * (n & 1)) & 15u);
    } else if constexpr (kType == GridType::kFp8) {
      return of(block, block.samples[n]);
    } else if constexpr (kType == GridType::kFp16) {
      return of(block, load<std::uint16_t>(block.samples + 2 * n));
    } else if constexpr (kType == GridType::kFpN) {
      return of(block, block.code(n));
    } else {
      return block.template get<Value>(n);
    }
  }

private:
  NANOVTT_HD static float of(TileBlock const& block, std::uint32_t code) {
    return block.minimum + static_cast<float>(code) * block.quantum;
  }
};

/// Samples of float grids of any build.
struct AnyFloatSamples {
  using Value = float;
  using Blend = float;
  NANOVTT_INLINE static TileBlock block(GridReader const& grid, std::uint32_t tile) {
    return grid.block(tile);
  }
  NANOVTT_HD static float get(TileBlock const& block, std::uint64_t n) { return block.getFloat(n); }
};

/// @pre A grid whose samples are such.
/// @threads One for each thread.
template <class Samples> class CursorOf {
public:
  using Value = typename Samples::Value;
  using Blend = typename Samples::Blend;

  /// @param maxDepth Deeper tiles are not read: a coarse picture of the same field.
  NANOVTT_HD explicit CursorOf(GridReader const& grid, int maxDepth = kMaxDepth)
      : CursorOf(grid, CellTable(), maxDepth) {}
  /// @param cells Where searches begin, for reads at random.
  NANOVTT_HD CursorOf(GridReader const& grid, CellTable const& cells, int maxDepth = kMaxDepth)
      : m_grid(grid)
      , m_path(grid.container(), cells, maxDepth)
      , m_llc(grid.container().lowestCorner())
      , m_default(load<Value>(grid.defaultValue().samples)) {
    if (cells.depth() < kMaxDepth - 1 || maxDepth < kMaxDepth) return;
    m_cells = cells;
    m_firstOfCells = grid.container().tilesAbove(cells.depth());
  }

  /// The sample that holds the position, of the deepest tile there; the default value where there is none.
  /// @space Tile space.
  /// @cost In the tile of the read before: one test and one load. Else up the tree as far as need be, and
  /// down; with cells as wide as the deepest tiles or their parents, a cell and a table or two.
  NANOVTT_HD Value value(std::int32_t x, std::int32_t y, std::int32_t z) {
    std::uint32_t const ux = distance(x, m_llc.x), uy = distance(y, m_llc.y), uz = distance(z, m_llc.z);
    if (!holds(ux, uy, uz) && !moveTo(x, y, z)) return m_default;
    return Samples::get(m_block, m_block.index(at(ux), at(uy), at(uz)));
  }

  /// The blend of the eight samples round a position, samples on the low corners of their voxels.
  /// @formula (b - a) * f + a along x, then y, then z; f is the position in the tile, in samples, less a
  /// whole number.
  /// @numeric Bit for bit what VoxelSamplerLinear gives of float channels with corner samples, where the
  /// buffer holds its eight samples.
  /// @edges Without a halo, samples beyond the tile are those of the tiles of its depth, and of coarser ones
  /// where there is none.
  /// @cost In a tile with halo: no other tile is looked at.
  NANOVTT_HD Blend trilinear(float x, float y, float z) {
    Cell c;
    return cellAt(x, y, z, c) ? c.value() : blend(m_default);
  }
  /// The blend, and its derivative in the cell about the position along x, y and z.
  /// @units Of the derivative: per unit of tile space.
  /// @edges Where there is no tile all three are 0.
  NANOVTT_HD Blend trilinear(float x, float y, float z, Blend gradient[3]) {
    Cell c;
    if (!cellAt(x, y, z, c)) {
      gradient[0] = gradient[1] = gradient[2] = Blend{};
      return blend(m_default);
    }
    c.slope(gradient);
    float const perUnit = 1 / static_cast<float>(std::int32_t(1) << m_shift);
    for (int a = 0; a < 3; ++a) gradient[a] = gradient[a] * perUnit;
    return c.value();
  }

  /// The tile that was read last. @pre The read before found one.
  NANOVTT_HD TileRef tile() const {
    return {m_number, m_depth, {corner(m_llc.x, m_x), corner(m_llc.y, m_y), corner(m_llc.z, m_z)}};
  }

private:
  /// Eight samples, and where the position lies between them.
  struct Cell {
    Blend v[8];
    float fx, fy, fz;

    NANOVTT_HD Blend value() const {
      Blend const y0 = lerp(lerp(v[0], v[1], fx), lerp(v[2], v[3], fx), fy);
      Blend const y1 = lerp(lerp(v[4], v[5], fx), lerp(v[6], v[7], fx), fy);
      return lerp(y0, y1, fz);
    }
    NANOVTT_HD void slope(Blend g[3]) const {
      g[0] = lerp(lerp(v[1] - v[0], v[3] - v[2], fy), lerp(v[5] - v[4], v[7] - v[6], fy), fz);
      g[1] = lerp(lerp(v[2] - v[0], v[3] - v[1], fx), lerp(v[6] - v[4], v[7] - v[5], fx), fz);
      g[2] = lerp(lerp(v[4] - v[0], v[5] - v[1], fx), lerp(v[6] - v[2], v[7] - v[3], fx), fy);
    }
  };
  NANOVTT_HD static Blend lerp(Blend const& a, Blend const& b, float f) { return (b - a) * f + a; }
  NANOVTT_HD static Blend blend(Value const& v) { return static_cast<Blend>(v); }

  NANOVTT_HD bool cellAt(float x, float y, float z, Cell& cell) {
    std::int32_t const px = floorOf(x), py = floorOf(y), pz = floorOf(z);
    std::uint32_t const ux = distance(px, m_llc.x), uy = distance(py, m_llc.y), uz = distance(pz, m_llc.z);
    if (!holds(ux, uy, uz) && !moveTo(px, py, pz)) return false;
    int i = at(ux), j = at(uy), k = at(uz);
    float const perSample = 1 / static_cast<float>(std::int32_t(1) << m_shift);
    cell.fx = place(x, corner(m_llc.x, ux), perSample, i);
    cell.fy = place(y, corner(m_llc.y, uy), perSample, j);
    cell.fz = place(z, corner(m_llc.z, uz), perSample, k);
    Blend* const v = cell.v;
    if (i + 1 < m_block.width && j + 1 < m_block.width && k + 1 < m_block.width) {
      std::uint64_t const n = m_block.index(i, j, k), dj = m_block.strideJ, dk = m_block.strideK;
      v[0] = sample(n), v[1] = sample(n + 1), v[2] = sample(n + dj), v[3] = sample(n + dj + 1);
      v[4] = sample(n + dk), v[5] = sample(n + dk + 1);
      v[6] = sample(n + dj + dk), v[7] = sample(n + dj + dk + 1);
    } else {
      for (int c = 0; c < 8; ++c) v[c] = sampleBeside(i + (c & 1), j + (c >> 1 & 1), k + (c >> 2));
    }
    return true;
  }
  /// Where a position lies between samples n and n + 1 of its tile.
  /// @param n In: the sample that holds its floor. As floats tell it, it may be the next one.
  NANOVTT_HD float place(float p, std::int32_t corner, float perSample, int& n) const {
    // From the corner of the tile of four samples: a merged block has many.
    std::int32_t const part =
        static_cast<std::int32_t>(static_cast<std::uint32_t>(n / kTileWidth * kTileWidth) << m_shift);
    float const l = (p - static_cast<float>(corner + part)) * perSample;
    int const low = l > 0 ? static_cast<int>(l) : 0, inPart = low < kTileWidth - 1 ? low : kTileWidth - 1;
    n = n / kTileWidth * kTileWidth + inPart;
    return l - static_cast<float>(inPart);
  }
  NANOVTT_HD Blend sample(std::uint64_t n) const { return blend(Samples::get(m_block, n)); }
  /// A sample of the tile, or beyond it on the high side.
  NANOVTT_HD Blend sampleBeside(int i, int j, int k) const {
    if (i < m_block.width && j < m_block.width && k < m_block.width) return sample(m_block.index(i, j, k));
    TileRef const here = tile();
    std::int64_t const x = here.corner.x + (std::int64_t(i) << m_shift),
                       y = here.corner.y + (std::int64_t(j) << m_shift),
                       z = here.corner.z + (std::int64_t(k) << m_shift);
    if (x > INT32_MAX || y > INT32_MAX || z > INT32_MAX) return blend(m_default);
    auto const px = static_cast<std::int32_t>(x), py = static_cast<std::int32_t>(y),
               pz = static_cast<std::int32_t>(z);
    // Samples of a merged block are those of the tiles at its bottom.
    TileRef const there = m_grid.container().find(px, py, pz, m_grid.sampleDepth(m_block, here));
    if (!there.valid()) return blend(m_default);
    TileBlock const b = Samples::block(m_grid, there.number);
    return blend(Samples::get(b, GridReader::sampleAt(b, there, px, py, pz)));
  }
  NANOVTT_HD static std::int32_t floorOf(float v) {
    // What no coordinate reaches lies out of every tree.
    if (!(v >= -2147483648.0f && v <= 2147483520.0f)) return INT32_MIN;
    auto const cut = static_cast<std::int32_t>(v);
    return cut - (static_cast<float>(cut) > v);
  }
  // Places are told from the lowest corner of the roots: there the corners of tiles are multiples of their
  // widths, and places in one cube of such a width differ in lower bits alone.
  NANOVTT_HD bool holds(std::uint32_t ux, std::uint32_t uy, std::uint32_t uz) const {
    return ((ux ^ m_x) | (uy ^ m_y) | (uz ^ m_z)) < m_width;
  }
  NANOVTT_HD static std::uint32_t distance(std::int32_t c, std::int32_t corner) {
    return static_cast<std::uint32_t>(c) - static_cast<std::uint32_t>(corner);
  }
  // Of the sample in the tile.
  NANOVTT_HD int at(std::uint32_t u) const { return static_cast<int>((u & m_inTile) >> m_shift); }
  // Of the tile.
  NANOVTT_HD std::int32_t corner(std::int32_t lowest, std::uint32_t u) const {
    return static_cast<std::int32_t>(static_cast<std::uint32_t>(lowest) + (u & ~m_inTile));
  }

  NANOVTT_HD bool moveTo(std::int32_t x, std::int32_t y, std::int32_t z) {
    m_width = 0;
    std::uint32_t const ux = distance(x, m_llc.x), uy = distance(y, m_llc.y), uz = distance(z, m_llc.z);
    std::uint32_t tile = kNoTile;
    if (m_cells.find(ux, uy, uz, tile)) {
      if (tile == kNoTile) return false;
      if (tile >= m_firstOfCells && (m_cells.depth() == kMaxDepth || toChild(tile, ux, uy, uz))) {
        take(tile, kMaxDepth);
        keep(ux, uy, uz, kTileSpaceBits - kMaxDepth);
        return true;
      }
    }
    if (!m_path.moveTo(x, y, z)) return false;
    take(m_path.number(), m_path.depth());
    // Of a tile above a refined place only the part is kept that has no deeper one.
    keep(ux, uy, uz, m_path.alikeShift());
    return true;
  }
  // From a tile above the deepest ones to the one at a place.
  NANOVTT_HD bool toChild(std::uint32_t& tile, std::uint32_t ux, std::uint32_t uy, std::uint32_t uz) const {
    constexpr int kShift = kTileSpaceBits - kMaxDepth;
    ContainerReader::Children const list = m_grid.container().children(tile);
    if (list.levels != 0) return false;
    std::uint32_t const child = list[(ux >> kShift & 1) | (uy >> kShift & 1) << 1 | (uz >> kShift & 1) << 2];
    if (child == kNoTile) return false;
    tile = child;
    return true;
  }
  NANOVTT_INLINE void take(std::uint32_t tile, int depth) {
    if (tile == m_number) return;
    m_block = Samples::block(m_grid, tile);
    m_number = tile, m_depth = depth;
    m_inTile = (1u << (kTileSpaceBits - depth)) - 1;
    m_shift = kTileSpaceBits - m_grid.sampleDepth(m_block, {tile, depth, {}}) - 2;
  }
  NANOVTT_HD void keep(std::uint32_t ux, std::uint32_t uy, std::uint32_t uz, int shift) {
    m_x = ux, m_y = uy, m_z = uz;
    m_width = 1u << shift;
  }

  // The coordinates of the last place lie apart, or the compiler reads two at once, which waits for the
  // stores of each.
  std::uint32_t m_x = 0;
  std::uint32_t m_width = 0; ///< of the cube about it that may be read without a search; 0: none
  int m_shift = 0;           ///< log2 of the width of a sample
  std::uint32_t m_y = 0;
  std::uint32_t m_inTile = 0; ///< bits of places in the tile
  std::uint32_t m_number = kNoTile;
  std::uint32_t m_z = 0;
  int m_depth = -1;
  TileBlock m_block;
  GridReader m_grid;
  TilePath m_path;
  Coord m_llc;
  CellTable m_cells; ///< of the deepest tiles or their parents
  std::uint32_t m_firstOfCells = 0;
  Value m_default;
};

template <GridType kType> using Cursor = CursorOf<TypedSamples<kType>>;
using GridCursor = CursorOf<AnyFloatSamples>;

} // namespace nanovtt
