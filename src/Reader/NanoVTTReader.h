// Reads NanoVTT buffers in place, on the host and on a device.
//
//   BufferReader        the whole: container, and grids by number or name
//   ContainerReader     the tree: tiles at positions, parents, children
//   GridReader          one channel: its header, and the samples of tiles
//
//   position ── root slot ──> root ── child tables ──> tile number ── tile table ──> block of samples
//
// Nothing here tests a bound: bytes that come from outside go through validate() of NanoVTTValidate.h once,
// and then no lookup leaves the buffer. Readers are small values that own nothing; copy them freely.
//
// @threads Reading only; any number of threads.
#pragma once

#include "Reader/NanoVTTFormat.h"

namespace nanovtt {

/// A position in tile space.
struct Coord {
  std::int32_t x = 0, y = 0, z = 0;
};

/// A tile, and where it lies.
struct TileRef {
  std::uint32_t number = kNoTile;
  std::int32_t depth = -1;
  Coord corner;

  NANOVTT_HD bool valid() const { return number != kNoTile; }
  NANOVTT_HD std::int32_t width() const { return std::int32_t(1) << (kTileSpaceBits - depth); }
};

class ContainerReader {
public:
  ContainerReader() = default;
  NANOVTT_HD explicit ContainerReader(void const* buffer)
      : m_bytes(static_cast<unsigned char const*>(buffer))
      , m_rootDepth(load<std::int32_t>(m_bytes + kRootDepthOffset))
      , m_llc{load<std::int32_t>(m_bytes + kLlcOffset), load<std::int32_t>(m_bytes + kLlcOffset + 4),
              load<std::int32_t>(m_bytes + kLlcOffset + 8)} {}

  NANOVTT_HD std::uint64_t bufferSize() const { return load<std::uint64_t>(m_bytes + kBufferSizeOffset); }
  NANOVTT_HD std::uint64_t containerSize() const {
    return load<std::uint64_t>(m_bytes + kContainerSizeOffset);
  }
  NANOVTT_HD int rootDepth() const { return m_rootDepth; }
  /// Lowest corner of the roots.
  NANOVTT_HD Coord lowestCorner() const { return m_llc; }

  /// Number of tiles above a depth of 0..29, which is the number of the depth's first tile.
  NANOVTT_HD std::uint32_t tilesAbove(int depth) const {
    return load<std::uint32_t>(m_bytes + kTileCountAccumOffset + 4 * static_cast<std::uint64_t>(depth));
  }
  NANOVTT_HD std::uint32_t tileCount() const { return tilesAbove(kTileCountAccumEntries - 1); }
  NANOVTT_HD std::uint32_t tileCount(int depth) const { return tilesAbove(depth + 1) - tilesAbove(depth); }
  NANOVTT_HD int depthOf(std::uint32_t tile) const {
    int depth = m_rootDepth;
    while (tile >= tilesAbove(depth + 1)) ++depth;
    return depth;
  }

  /// The root in a slot of the root table, or kNoTile.
  NANOVTT_HD std::uint32_t root(std::uint32_t slot) const {
    return load<std::uint32_t>(m_bytes + kRootTableOffset + 4 * std::uint64_t(slot));
  }
  NANOVTT_HD Coord rootCorner(std::uint32_t slot) const {
    int const shift = kTileSpaceBits - m_rootDepth;
    return {at(m_llc.x, std::uint64_t(slot % 64) << shift),
            at(m_llc.y, std::uint64_t(slot / 64 % 64) << shift),
            at(m_llc.z, std::uint64_t(slot / 4096) << shift)};
  }
  /// @edges kNoTile for a root.
  NANOVTT_HD std::uint32_t parent(std::uint32_t tile) const {
    return load<std::uint32_t>(m_bytes + kChildOffsetsBase +
                               load<std::uint64_t>(m_bytes + kParentTableOffset) + 4 * std::uint64_t(tile));
  }

  /// The children of a tile: 2^(levels + 1) along an axis, x fastest, that many levels and one more below it.
  struct Children {
    unsigned char const* table = nullptr;
    int levels = 0;

    NANOVTT_HD std::uint32_t across() const { return 2u << levels; }
    NANOVTT_HD std::uint32_t count() const { return 8u << 3 * levels; }
    /// @edges kNoTile for a missing child.
    NANOVTT_HD std::uint32_t operator[](std::uint32_t n) const {
      return load<std::uint32_t>(table + 4 * std::uint64_t(n));
    }
  };
  /// @pre The tile is not at the deepest depth. All entries of a tile without children are kNoTile.
  NANOVTT_HD Children children(std::uint32_t tile) const {
    auto const entry = load<std::uint64_t>(m_bytes + kChildOffsetsBase + 8 * std::uint64_t(tile));
    return {m_bytes + kChildOffsetsBase + (entry & kOffsetMask),
            static_cast<int>(entry >> kChildLevelsShift)};
  }
  /// Whether any entry of children() is a tile.
  /// @pre The tile is not at the deepest depth.
  NANOVTT_HD bool hasChildren(std::uint32_t tile) const {
    // The parent table follows the last entry, which names the table that all tiles without children share.
    std::uint64_t const last = load<std::uint64_t>(m_bytes + kParentTableOffset) - 8;
    return children(tile).table !=
           m_bytes + kChildOffsetsBase +
               (load<std::uint64_t>(m_bytes + kChildOffsetsBase + last) & kOffsetMask);
  }

  /// The deepest tile at or above `maxDepth` that holds the point.
  /// @edges Not valid when there is none. Tiles inside a coalesced block are found as the block's tile.
  NANOVTT_HD TileRef find(std::int32_t x, std::int32_t y, std::int32_t z, int maxDepth = kMaxDepth) const {
    std::int64_t const dx = std::int64_t(x) - m_llc.x, dy = std::int64_t(y) - m_llc.y,
                       dz = std::int64_t(z) - m_llc.z;
    int const shift = kTileSpaceBits - m_rootDepth;
    if (maxDepth < m_rootDepth || (dx | dy | dz) < 0 || (dx | dy | dz) >> shift >= kRootTableWidth) return {};
    std::uint32_t number =
        root(static_cast<std::uint32_t>(((dz >> shift) * 64 + (dy >> shift)) * 64 + (dx >> shift)));
    if (number == kNoTile) return {};
    int depth = m_rootDepth;
    while (depth < kMaxDepth) {
      Children const list = children(number);
      int const next = depth + list.levels + 1;
      if (next > maxDepth) break;
      std::int64_t const mask = list.across() - 1;
      int const bits = list.levels + 1, down = kTileSpaceBits - next;
      auto const n = (dx >> down & mask) | (dy >> down & mask) << bits | (dz >> down & mask) << 2 * bits;
      std::uint32_t const child = list[static_cast<std::uint32_t>(n)];
      if (child == kNoTile) break;
      number = child;
      depth = next;
    }
    std::int64_t const inside = (std::int64_t(1) << (kTileSpaceBits - depth)) - 1;
    return {number, depth, {at(m_llc.x, dx & ~inside), at(m_llc.y, dy & ~inside), at(m_llc.z, dz & ~inside)}};
  }

  /// The finest tile, no deeper than this one, at an offset of so many of its widths on each axis.
  /// @edges Not valid where there is none. NeighborReader answers the same by one read, for offsets of -1 to
  /// 1, where its structure was made.
  NANOVTT_HD TileRef neighbor(TileRef const& tile, int dx, int dy, int dz) const {
    std::int64_t const w = tile.width(), x = tile.corner.x + dx * w, y = tile.corner.y + dy * w,
                       z = tile.corner.z + dz * w;
    auto const isOut = [](std::int64_t c) { return c < INT32_MIN || c > INT32_MAX; };
    if (isOut(x) || isOut(y) || isOut(z)) return {};
    return find(static_cast<std::int32_t>(x), static_cast<std::int32_t>(y), static_cast<std::int32_t>(z),
                tile.depth);
  }

  /// Calls f(TileRef) for every tile: each before its children.
  template <class F> NANOVTT_HD void forEachTile(F&& f) const {
    for (std::uint32_t slot = 0; slot < kMaxRoots; ++slot) {
      std::uint32_t const number = root(slot);
      if (number != kNoTile) forBranch(TileRef{number, m_rootDepth, rootCorner(slot)}, f);
    }
  }
  /// The same for a tile and all below it.
  template <class F> NANOVTT_HD void forBranch(TileRef const& top, F&& f) const {
    struct Level {
      TileRef tile;
      Children list;
      std::uint32_t next;
    } stack[kMaxDepth + 1];
    int height = 0;
    f(top);
    if (top.depth < kMaxDepth) stack[height++] = {top, children(top.number), 0};
    while (height > 0) {
      Level& level = stack[height - 1];
      if (level.next == level.list.count()) {
        --height;
        continue;
      }
      std::uint32_t const n = level.next++, number = level.list[n];
      if (number == kNoTile) continue;
      int const depth = level.tile.depth + level.list.levels + 1;
      int const shift = kTileSpaceBits - depth;
      std::uint32_t const across = level.list.across();
      TileRef const child{number,
                          depth,
                          {at(level.tile.corner.x, std::uint64_t(n % across) << shift),
                           at(level.tile.corner.y, std::uint64_t(n / across % across) << shift),
                           at(level.tile.corner.z, std::uint64_t(n / across / across) << shift)}};
      f(child);
      if (depth < kMaxDepth) stack[height++] = {child, children(number), 0};
    }
  }

private:
  NANOVTT_HD static std::int32_t at(std::int32_t corner, std::int64_t offset) {
    return static_cast<std::int32_t>(corner + offset);
  }
  NANOVTT_HD static std::int32_t at(std::int32_t corner, std::uint64_t offset) {
    return at(corner, static_cast<std::int64_t>(offset));
  }

  unsigned char const* m_bytes = nullptr;
  std::int32_t m_rootDepth = 0;
  Coord m_llc;
};

/// The stored samples of a tile: a cube of `core` samples along an axis, and with a halo one layer more on
/// the high side of each.
struct TileBlock {
  unsigned char const* samples = nullptr;
  GridType type = GridType::kFloat;
  std::int32_t core = kTileWidth;
  std::int32_t width = kTileWidth;
  /// Steps of j and k, in samples. Wider than the block in textures.
  std::uint64_t strideJ = 4, strideK = 16;
  /// Quantised: value = minimum + code * quantum.
  float minimum = 0, quantum = 0;
  int bits = 0;

  NANOVTT_HD bool hasHalo() const { return width != core; }
  NANOVTT_HD std::uint64_t index(int i, int j, int k) const {
    return static_cast<std::uint64_t>(i) + static_cast<std::uint64_t>(j) * strideJ +
           static_cast<std::uint64_t>(k) * strideK;
  }
  NANOVTT_HD std::uint32_t code(std::uint64_t n) const {
    if (bits == 16) return load<std::uint16_t>(samples + 2 * n);
    std::uint64_t const bit = n * static_cast<std::uint64_t>(bits);
    return samples[bit >> 3] >> (bit & 7) & ((1u << bits) - 1);
  }
  /// A sample as it is stored. T is the grid's element type.
  /// @pre The grid is not quantised.
  template <class T> NANOVTT_HD T get(std::uint64_t n) const { return load<T>(samples + n * sizeof(T)); }
  /// A sample of a float grid, of every build.
  NANOVTT_HD float getFloat(std::uint64_t n) const {
    return bits ? minimum + static_cast<float>(code(n)) * quantum : get<float>(n);
  }
  /// A component of a sample of any grid.
  NANOVTT_HD double getComponent(std::uint64_t n, int c) const {
    unsigned char const* const p = samples + n * elementBytes(type);
    auto const component = static_cast<std::uint64_t>(c);
    switch (type) {
    case GridType::kDouble:
    case GridType::kDouble3:
      return load<double>(p + 8 * component);
    case GridType::kInt16:
      return load<std::int16_t>(p);
    case GridType::kInt32:
      return load<std::int32_t>(p);
    case GridType::kInt64:
      return static_cast<double>(load<std::int64_t>(p));
    case GridType::kUInt32:
      return load<std::uint32_t>(p);
    case GridType::kFloat3:
    case GridType::kFloat4:
      return static_cast<double>(load<float>(p + 4 * component));
    default:
      return static_cast<double>(getFloat(n));
    }
  }
};

/// A vector as a grid holds it.
template <class C, int N> struct Vec {
  C v[N];

  NANOVTT_HD friend Vec operator+(Vec a, Vec const& b) {
    for (int n = 0; n < N; ++n) a.v[n] += b.v[n];
    return a;
  }
  NANOVTT_HD friend Vec operator-(Vec a, Vec const& b) {
    for (int n = 0; n < N; ++n) a.v[n] -= b.v[n];
    return a;
  }
  NANOVTT_HD friend Vec operator*(Vec a, float f) {
    for (int n = 0; n < N; ++n) a.v[n] *= static_cast<C>(f);
    return a;
  }
};

/// What a sample of a grid type is, and what samples are blended in: float for 16 bits and less, double for
/// more.
template <GridType> struct SampleOf {
  using Value = float; // also of all quantised builds
  using Blend = float;
};
#define NANOVTT_SAMPLE(type, value, blend)                                                                   \
  template <> struct SampleOf<GridType::type> {                                                              \
    using Value = value;                                                                                     \
    using Blend = blend;                                                                                     \
  };
NANOVTT_SAMPLE(kDouble, double, double)
NANOVTT_SAMPLE(kInt16, std::int16_t, float)
NANOVTT_SAMPLE(kInt32, std::int32_t, double)
NANOVTT_SAMPLE(kInt64, std::int64_t, double)
NANOVTT_SAMPLE(kUInt32, std::uint32_t, double)
using Float3 = Vec<float, 3>;
using Float4 = Vec<float, 4>;
using Double3 = Vec<double, 3>;
NANOVTT_SAMPLE(kFloat3, Float3, Float3)
NANOVTT_SAMPLE(kFloat4, Float4, Float4)
NANOVTT_SAMPLE(kDouble3, Double3, Double3)
#undef NANOVTT_SAMPLE

/// Components of one sample.
NANOVTT_HD constexpr int componentCount(GridType type) {
  return type == GridType::kFloat3 || type == GridType::kDouble3 ? 3 : type == GridType::kFloat4 ? 4 : 1;
}

class GridReader {
public:
  GridReader() = default;
  /// @param grid The grid's first byte.
  NANOVTT_HD GridReader(void const* grid, ContainerReader const& container)
      : m_bytes(static_cast<unsigned char const*>(grid))
      , m_container(container)
      , m_tiles(container.tileCount())
      , m_type(static_cast<GridType>(load<std::uint32_t>(m_bytes + kGridTypeOffset))) {
    // The first tile's brick is the second one, at x = 1; no byte offset is that small.
    if (m_tiles && !isQuantised(m_type) && (entry(0) & kOffsetMask) == kHaloTileWidth) {
      std::uint64_t const samples = (entry(m_tiles) - tableBytes()) / elementBytes(m_type);
      while (m_textureWidth * m_textureWidth * m_textureWidth < samples) m_textureWidth += kHaloTileWidth;
    }
  }

  NANOVTT_HD ContainerReader const& container() const { return m_container; }
  NANOVTT_HD char const* name() const { return reinterpret_cast<char const*>(m_bytes + kGridNameOffset); }
  NANOVTT_HD GridType type() const { return m_type; }
  NANOVTT_HD GridClass gridClass() const {
    return static_cast<GridClass>(load<std::uint32_t>(m_bytes + kGridClassOffset));
  }
  NANOVTT_HD std::uint64_t gridSize() const { return load<std::uint64_t>(m_bytes + kGridSizeOffset); }
  NANOVTT_HD std::uint32_t gridIndex() const { return load<std::uint32_t>(m_bytes + kGridIndexOffset); }
  NANOVTT_HD std::uint32_t gridCount() const { return load<std::uint32_t>(m_bytes + kGridCountOffset); }
  NANOVTT_HD std::uint64_t checksum() const { return load<std::uint64_t>(m_bytes + kGridChecksumOffset); }
  /// World length of a tile-space unit.
  NANOVTT_HD double voxelSize() const { return load<double>(m_bytes + kGridVoxelSizeOffset); }
  /// Box of the active samples: n 0..2 its minimum, 3..5 its maximum. The minimum of an empty box is above
  /// its maximum.
  NANOVTT_HD std::int32_t tileBox(int n) const {
    return load<std::int32_t>(m_bytes + kTreeBBoxOffset + 4 * static_cast<std::uint64_t>(n));
  }
  NANOVTT_HD double worldBox(int n) const {
    return load<double>(m_bytes + kGridWorldBBoxOffset + 8 * static_cast<std::uint64_t>(n));
  }
  /// The value where there is no tile, as a block of one sample.
  NANOVTT_HD TileBlock defaultValue() const {
    TileBlock block;
    block.samples = m_bytes + kTreeDefaultOffset;
    block.type = isQuantised(m_type) ? GridType::kFloat : m_type;
    block.core = block.width = 1;
    return block;
  }
  NANOVTT_HD bool isTexture() const { return m_textureWidth != 0; }
  /// Samples along an axis of the texture, and its first byte.
  NANOVTT_HD std::uint64_t textureWidth() const { return m_textureWidth; }
  NANOVTT_HD unsigned char const* textureData() const { return m_bytes + kTileTableOffset + tableBytes(); }

  /// The samples of a tile.
  NANOVTT_INLINE TileBlock block(std::uint32_t tile) const { return blockAs(m_type, tile); }
  /// The same where the type is known when it is compiled. @pre It is the grid's.
  NANOVTT_INLINE TileBlock blockAs(GridType type, std::uint32_t tile) const {
    std::uint64_t const e = entry(tile);
    TileBlock block;
    block.type = type;
    block.samples = m_bytes + kTileTableOffset + (e & kOffsetMask);
    if (isQuantised(type)) {
      block.minimum = load<float>(block.samples + kQuantisedMinimumOffset);
      block.quantum = load<float>(block.samples + kQuantisedQuantumOffset);
      bool halo = false;
      if (type == GridType::kFpN) {
        int const logBits = block.samples[kFpNLogBitsOffset];
        block.bits = 1 << logBits;
        halo = load<std::uint16_t>(block.samples + kFpNPayloadOffset) == (kFpNHaloCodes / 8) << logBits;
        block.samples += kFpNRecordBytes;
      } else {
        block.bits = codeBits(type);
        halo = (entry(tile + 1) & kOffsetMask) - (e & kOffsetMask) == tileBytes(type, true);
        block.samples += kQuantisedCodesOffset;
      }
      block.width = halo ? kHaloTileWidth : kTileWidth;
    } else {
      block.width = static_cast<std::int32_t>(e >> kTileWidthShift & 0xFF);
      block.core = kTileWidth << (e >> kTileLevelsShift);
    }
    block.strideJ = static_cast<std::uint64_t>(block.width);
    if (isTexture()) {
      block.strideJ = m_textureWidth;
      std::uint64_t const x = e & 0xFFFF, y = e >> 16 & 0xFFFF, z = e >> 32 & 0xFFFF;
      block.samples = textureData() + (x + m_textureWidth * (y + m_textureWidth * z)) * elementBytes(type);
    }
    block.strideK = block.strideJ * (isTexture() ? m_textureWidth : static_cast<std::uint64_t>(block.width));
    return block;
  }

  /// The depth whose tiles have samples as fine as the block: that of the tile, or of a merged block's
  /// bottom.
  NANOVTT_HD static int sampleDepth(TileBlock const& block, TileRef const& tile) {
    int depth = tile.depth;
    for (std::int32_t core = block.core; core > kTileWidth; core >>= 1) ++depth;
    return depth;
  }
  /// Index, in the block of the tile, of the sample that holds a point of the tile.
  NANOVTT_HD static std::uint64_t sampleAt(TileBlock const& block, TileRef const& tile, std::int32_t x,
                                           std::int32_t y, std::int32_t z) {
    int const shift = kMaxDepth - sampleDepth(block, tile);
    return block.index((x - tile.corner.x) >> shift, (y - tile.corner.y) >> shift,
                       (z - tile.corner.z) >> shift);
  }

  /// Component of the sample that holds a point, of the deepest tile there at or above `maxDepth`; that of
  /// the default value where there is no tile.
  NANOVTT_HD double valueAt(std::int32_t x, std::int32_t y, std::int32_t z, int c = 0,
                            int maxDepth = kMaxDepth) const {
    TileRef const tile = m_container.find(x, y, z, maxDepth);
    if (!tile.valid()) return defaultValue().getComponent(0, c);
    TileBlock const b = block(tile.number);
    return b.getComponent(sampleAt(b, tile, x, y, z), c);
  }

private:
  NANOVTT_HD std::uint64_t entry(std::uint32_t tile) const {
    return load<std::uint64_t>(m_bytes + kTileTableOffset + 8 * std::uint64_t(tile));
  }
  NANOVTT_HD std::uint64_t tableBytes() const { return (std::uint64_t(m_tiles) + 1) * 8; }

  unsigned char const* m_bytes = nullptr;
  ContainerReader m_container;
  std::uint32_t m_tiles = 0;
  GridType m_type = GridType::kFloat;
  std::uint64_t m_textureWidth = 0;
};

class BufferReader {
public:
  BufferReader() = default;
  NANOVTT_HD explicit BufferReader(void const* buffer)
      : m_bytes(static_cast<unsigned char const*>(buffer))
      , m_container(buffer) {
    std::uint64_t const start = m_container.containerSize(), size = m_container.bufferSize();
    // Behind a container alone the buffer is zero.
    if (start <= size && size - start >= kGridHeaderBytes + 8 &&
        load<std::uint64_t>(m_bytes + start) == kGridMagic)
      m_gridCount = load<std::uint32_t>(m_bytes + start + kGridCountOffset);
  }

  NANOVTT_HD ContainerReader const& container() const { return m_container; }
  NANOVTT_HD std::uint32_t gridCount() const { return m_gridCount; }
  /// Offset of a grid from the buffer's start. @cost Linear in `n`.
  NANOVTT_HD std::uint64_t gridOffset(std::uint32_t n) const {
    std::uint64_t start = m_container.containerSize();
    for (; n; --n) start += load<std::uint64_t>(m_bytes + start + kGridSizeOffset);
    return start;
  }
  NANOVTT_HD GridReader grid(std::uint32_t n) const {
    return GridReader(m_bytes + gridOffset(n), m_container);
  }
  /// The number of the first grid of that name; gridCount() when there is none.
  NANOVTT_HD std::uint32_t find(char const* name) const {
    std::uint64_t start = m_container.containerSize();
    for (std::uint32_t n = 0; n < m_gridCount; ++n) {
      if (equal(reinterpret_cast<char const*>(m_bytes + start + kGridNameOffset), name)) return n;
      start += load<std::uint64_t>(m_bytes + start + kGridSizeOffset);
    }
    return m_gridCount;
  }

private:
  NANOVTT_HD static bool equal(char const* a, char const* b) {
    for (; *a && *a == *b; ++a, ++b) {}
    return *a == *b;
  }

  unsigned char const* m_bytes = nullptr;
  ContainerReader m_container;
  std::uint32_t m_gridCount = 0;
};

} // namespace nanovtt
