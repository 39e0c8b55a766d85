// validate(): whether bytes from outside are a NanoVTT buffer that every lookup of NanoVTTReader.h can be
// trusted with.
//
// One pass over the tables in the order of the tiles. What follows from the format is computed and compared,
// so the tables have one right form: child tables and tile data lie one after the other without gap or
// overlap; a child lies in its own depth's range of numbers, which is deeper than its parent's, and names
// that parent, so there are no cycles; every tile is referred to exactly once.
#pragma once

#include "Reader/NanoVTTFormat.h"

namespace nanovtt {

struct Validation {
  /// Null when all is well.
  char const* message = nullptr;
  /// Offset of the byte, from the buffer's start, at which the first fault was seen.
  std::uint64_t position = 0;

  NANOVTT_HD bool ok() const { return !message; }
};

namespace Internal {

class Validator {
public:
  NANOVTT_HD Validator(void const* bytes, std::uint64_t length)
      : m_bytes(static_cast<unsigned char const*>(bytes))
      , m_length(length) {}

  NANOVTT_HD Validation run() {
    if (sizes() && roots() && tree() && padding()) grids();
    return m_result;
  }

private:
  template <class T> NANOVTT_HD T get(std::uint64_t offset) const { return load<T>(m_bytes + offset); }
  NANOVTT_HD bool fail(char const* message, std::uint64_t position) {
    m_result = {message, position};
    return false;
  }
  NANOVTT_HD std::uint64_t tilesAbove(int depth) const {
    return get<std::uint32_t>(kTileCountAccumOffset + 4 * static_cast<std::uint64_t>(depth));
  }
  NANOVTT_HD static std::int64_t width(int depth) { return std::int64_t(1) << (kTileSpaceBits - depth); }
  /// Spreads a tile's number, so that sums over sets of tiles tell sets apart.
  NANOVTT_HD static std::uint64_t mix(std::uint64_t n) {
    n = (n + 0x9E3779B97F4A7C15ull) * 0xBF58476D1CE4E5B9ull;
    return (n ^ n >> 29) * 0x94D049BB133111EBull;
  }
  NANOVTT_HD static bool isFinite(double v) { return v - v == 0; }

  // --- Container: every size before anything that lies behind it is read
  // ---------------------------------------

  NANOVTT_HD bool sizes() {
    if (m_length < kContainerFixedBytes) return fail("shorter than an empty container", m_length);
    m_bufferSize = get<std::uint64_t>(kBufferSizeOffset);
    if (m_bufferSize > m_length) return fail("buffer size is beyond the end", kBufferSizeOffset);
    m_containerSize = get<std::uint64_t>(kContainerSizeOffset);
    if (m_containerSize > m_bufferSize) return fail("container size is beyond the end", kContainerSizeOffset);
    if (m_containerSize < kContainerFixedBytes || m_containerSize % kSectionAlignment)
      return fail("container size", kContainerSizeOffset);

    m_rootDepth = get<std::int32_t>(kRootDepthOffset);
    if (m_rootDepth < 0 || m_rootDepth > kMaxDepth) return fail("root depth", kRootDepthOffset);
    for (int d = 0; d < kTileCountAccumEntries; ++d) {
      bool const ok = d <= m_rootDepth ? tilesAbove(d) == 0 : tilesAbove(d) >= tilesAbove(d - 1);
      if (!ok) return fail("tile counts", kTileCountAccumOffset + 4 * static_cast<std::uint64_t>(d));
    }
    m_tiles = tilesAbove(kTileCountAccumEntries - 1);
    m_nonFinest = tilesAbove(kMaxDepth);
    if (get<std::uint64_t>(kParentTableOffset) != (m_nonFinest + 1) * 8)
      return fail("parent table offset", kParentTableOffset);

    // Neither sum can wrap: numbers of tiles have 32 bits.
    std::uint64_t const tables = childTablesStart(m_tiles, m_nonFinest);
    std::uint64_t const room = m_containerSize - kContainerFixedBytes;
    if (tables > room) return fail("the container is too small for its tiles", kContainerSizeOffset);
    m_sentinel = get<std::uint64_t>(childEntryAt(m_nonFinest));
    if (m_sentinel < tables || m_sentinel > room) return fail("sentinel offset", childEntryAt(m_nonFinest));
    if (m_containerSize != padSection(kContainerFixedBytes + m_sentinel))
      return fail("container size", kContainerSizeOffset);
    for (std::uint64_t n = 0; n < kSentinelBytes; ++n)
      if (m_bytes[kChildOffsetsBase + m_sentinel + n] != 0xFF)
        return fail("sentinel", kChildOffsetsBase + m_sentinel + n);
    return true;
  }

  NANOVTT_HD bool roots() {
    std::int64_t const low = -(std::int64_t(1) << (kTileSpaceBits - 1)), w = width(m_rootDepth);
    std::int64_t llc[3];
    for (int a = 0; a < 3; ++a) {
      std::uint64_t const at = kLlcOffset + 4 * static_cast<std::uint64_t>(a);
      llc[a] = get<std::int32_t>(at);
      if (m_tiles && (llc[a] < low || (llc[a] - low) % w)) return fail("lowest corner", at);
      m_low[a] = llc[a];
    }
    std::uint64_t const count = tilesAbove(m_rootDepth + 1);
    std::uint64_t found = 0;
    std::uint32_t last[3] = {0, 0, 0};
    for (std::uint32_t slot = 0; slot < kMaxRoots; ++slot) {
      std::uint64_t const at = kRootTableOffset + 4 * std::uint64_t(slot);
      // Most slots are empty: two at a time.
      if (slot % 2 == 0 && get<std::uint64_t>(at) == ~std::uint64_t(0)) {
        ++slot;
        continue;
      }
      std::uint64_t const number = get<std::uint32_t>(at);
      if (number == kNoTile) continue;
      if (number >= count) return fail("a root's number", at);
      std::uint32_t const place[3] = {slot % 64, slot / 64 % 64, slot / 4096};
      for (int a = 0; a < 3; ++a) {
        if (place[a] <= last[a]) continue;
        last[a] = place[a];
        if (llc[a] + (place[a] + 1) * w > -low) return fail("a root outside of tile space", at);
      }
      ++found;
      m_references += mix(number);
    }
    if (m_tiles)
      for (int a = 0; a < 3; ++a)
        if (llc[a] + w > -low) return fail("lowest corner", kLlcOffset + 4 * static_cast<std::uint64_t>(a));
    for (int a = 0; a < 3; ++a) m_high[a] = llc[a] + (last[a] + 1) * w;
    if (found != count) return fail("number of roots", kRootTableOffset);
    return true;
  }

  NANOVTT_HD std::uint64_t childEntryAt(std::uint64_t tile) const { return kChildOffsetsBase + 8 * tile; }
  NANOVTT_HD std::uint64_t parentAt(std::uint64_t tile) const {
    return kChildOffsetsBase + (m_nonFinest + 1) * 8 + 4 * tile;
  }

  NANOVTT_HD bool tree() {
    m_nextTable = childTablesStart(m_tiles, m_nonFinest);
    std::uint64_t numbers = 0;
    for (int d = m_rootDepth; d <= kMaxDepth; ++d)
      for (std::uint64_t tile = tilesAbove(d); tile < tilesAbove(d + 1); ++tile) {
        std::uint64_t const parent = get<std::uint32_t>(parentAt(tile));
        // Upwards, too, every way ends at a root.
        if (d == m_rootDepth ? parent != kNoTile : parent >= tilesAbove(d))
          return fail("a tile's parent", parentAt(tile));
        if (d < kMaxDepth && !children(tile, d)) return false;
        numbers += mix(tile);
      }
    if (m_nextTable != m_sentinel)
      return fail("child tables and sentinel do not meet", childEntryAt(m_nonFinest));
    if (numbers != m_references) return fail("a tile is referred to never or twice", kRootTableOffset);
    return true;
  }

  NANOVTT_HD bool children(std::uint64_t tile, int depth) {
    auto const entry = get<std::uint64_t>(childEntryAt(tile));
    if (entry == m_sentinel) return true;
    auto const levels = static_cast<int>(entry >> kChildLevelsShift);
    int const childDepth = depth + levels + 1;
    if (levels > kMaxCoalescedLevels || childDepth > kMaxDepth)
      return fail("a block's levels", childEntryAt(tile));
    // Tables lie in the order of their tiles; so offsets are known, and bits between offset and levels are 0.
    if (entry != (m_nextTable | static_cast<std::uint64_t>(levels) << kChildLevelsShift))
      return fail("child offset", childEntryAt(tile));
    std::uint64_t const bytes = kChildTableBytes << 3 * levels;
    if (bytes > m_sentinel - m_nextTable)
      return fail("child table is beyond the sentinel", childEntryAt(tile));
    m_blocks |= levels > 0;
    std::uint64_t const table = kChildOffsetsBase + m_nextTable, first = tilesAbove(childDepth),
                        end = tilesAbove(childDepth + 1);
    for (std::uint64_t at = table; at < table + bytes; at += 4) {
      std::uint64_t const child = get<std::uint32_t>(at);
      if (child == kNoTile) continue;
      if (child < first || child >= end) return fail("a child's number", at);
      if (get<std::uint32_t>(parentAt(child)) != tile) return fail("a child has another parent", at);
      m_references += mix(child);
    }
    m_nextTable += bytes;
    return true;
  }

  NANOVTT_HD bool padding() {
    for (std::uint64_t n = kContainerFixedBytes + m_sentinel; n < m_containerSize; ++n)
      if (m_bytes[n]) return fail("container's padding", n);
    return true;
  }

  // --- Grids
  // ----------------------------------------------------------------------------------------------------

  NANOVTT_HD bool grids() {
    std::uint64_t start = m_containerSize;
    if (isEnd(start)) return true;
    std::uint32_t count = 1;
    for (std::uint32_t n = 0; n < count; ++n) {
      if (!grid(start, n)) return false;
      auto const said = get<std::uint32_t>(start + kGridCountOffset);
      if (n ? said != count : said == 0) return fail("grid count", start + kGridCountOffset);
      count = said;
      start += get<std::uint64_t>(start + kGridSizeOffset);
    }
    return isEnd(start) || fail("more grids than are counted", start);
  }
  /// The last grid, or a container alone, is followed by zeros or by nothing.
  NANOVTT_HD bool isEnd(std::uint64_t start) const {
    return m_bufferSize - start < 8 || get<std::uint64_t>(start) == 0;
  }

  NANOVTT_HD bool grid(std::uint64_t start, std::uint32_t index) {
    std::uint64_t const left = m_bufferSize - start, table = (m_tiles + 1) * 8;
    if (left < kGridHeaderBytes || left - kGridHeaderBytes < table)
      return fail("a grid's header is beyond the end", start);
    if (get<std::uint64_t>(start + kGridMagicOffset) != kGridMagic) return fail("grid magic", start);
    if (get<std::uint32_t>(start + kGridVersionOffset) != kGridVersion)
      return fail("grid version", start + kGridVersionOffset);
    if (get<std::uint32_t>(start + kGridFlagsOffset)) return fail("grid flags", start + kGridFlagsOffset);
    if (get<std::uint32_t>(start + kGridIndexOffset) != index)
      return fail("grid index", start + kGridIndexOffset);
    auto const size = get<std::uint64_t>(start + kGridSizeOffset);
    if (size > left || size < kGridHeaderBytes + table) return fail("grid size", start + kGridSizeOffset);
    if (m_bytes[start + kGridNameOffset + kGridNameBytes - 1])
      return fail("a grid's name has no end", start + kGridNameOffset + kGridNameBytes - 1);
    auto const type = static_cast<GridType>(get<std::uint32_t>(start + kGridTypeOffset));
    if (!elementBytes(type)) return fail("grid type", start + kGridTypeOffset);
    auto const gridClass = get<std::uint32_t>(start + kGridClassOffset);
    if (gridClass > (type == GridType::kFloat || isQuantised(type) ? 2u : 0u))
      return fail("grid class", start + kGridClassOffset);
    if (get<std::int64_t>(start + kGridBlindMetadataOffset))
      return fail("blind metadata", start + kGridBlindMetadataOffset);
    if (get<std::uint32_t>(start + kGridBlindMetadataCountOffset))
      return fail("blind metadata", start + kGridBlindMetadataCountOffset);
    if (get<std::uint64_t>(start + kTreeContainerOffset) != start + kTreeOffset)
      return fail("container offset", start + kTreeContainerOffset);
    if (get<std::uint64_t>(start + kTreeSizeOffset) != size - kTreeOffset)
      return fail("tree size", start + kTreeSizeOffset);

    std::uint64_t const end = get<std::uint64_t>(start + kTileTableOffset + 8 * m_tiles);
    if (end > size - kGridHeaderBytes || size != padSection(kGridHeaderBytes + end))
      return fail("end of the tile data", start + kTileTableOffset + 8 * m_tiles);
    for (std::uint64_t n = start + kGridHeaderBytes + end; n < start + size; ++n)
      if (m_bytes[n]) return fail("grid's padding", n);
    return map(start) && boxes(start) && tileTable(start, type, end);
  }

  NANOVTT_HD bool map(std::uint64_t start) {
    auto const size = get<double>(start + kGridVoxelSizeOffset);
    if (!(size > 0) || !isFinite(size)) return fail("voxel size", start + kGridVoxelSizeOffset);
    for (std::uint64_t n = 8; n < 24; n += 8)
      if (get<double>(start + kGridVoxelSizeOffset + n) != size)
        return fail("voxel size", start + kGridVoxelSizeOffset + n);
    for (std::uint64_t n = 0; n < 9; ++n) {
      bool const diagonal = n % 4 == 0;
      double const scale = diagonal ? size : 0, inverse = diagonal ? 1 / size : 0;
      if (!mapValues(start, kMapMatrixFOffset + 4 * n, kMapMatrixDOffset + 8 * n, scale) ||
          !mapValues(start, kMapInverseFOffset + 4 * n, kMapInverseDOffset + 8 * n, inverse))
        return false;
    }
    for (std::uint64_t n = 0; n < 3; ++n)
      if (!mapValues(start, kMapTranslationFOffset + 4 * n, kMapTranslationDOffset + 8 * n, 0)) return false;
    return mapValues(start, kMapTaperFOffset, kMapTaperDOffset, 1);
  }
  /// Equal up to the rounding of the float that voxel sizes come from. Infinities of very small sizes are
  /// equal.
  NANOVTT_HD bool mapValues(std::uint64_t start, std::uint64_t f, std::uint64_t d, double wanted) {
    if (!isNear(static_cast<double>(get<float>(start + f)), wanted)) return fail("map", start + f);
    if (!isNear(get<double>(start + d), wanted)) return fail("map", start + d);
    return true;
  }
  NANOVTT_HD static bool isNear(double a, double b) {
    double const difference = a < b ? b - a : a - b, bound = (b < 0 ? -b : b) * 1e-5;
    return a == b || difference <= bound || (b > 3e38 && a > 3e38);
  }

  NANOVTT_HD bool boxes(std::uint64_t start) {
    bool empty = false;
    for (int a = 0; a < 3; ++a) {
      std::uint64_t const n = static_cast<std::uint64_t>(a), at = start + kTreeBBoxOffset + 4 * n,
                          worldAt = start + kGridWorldBBoxOffset + 8 * n;
      std::int64_t const low = get<std::int32_t>(at), high = get<std::int32_t>(at + 12);
      auto const worldLow = get<double>(worldAt), worldHigh = get<double>(worldAt + 24);
      if (a == 0) empty = low > high;
      if ((low > high) != empty) return fail("tile-space box", at);
      if (empty ? !(worldLow > worldHigh) : !(worldLow <= worldHigh)) return fail("world box", worldAt);
      if (empty) continue;
      // Two samples of margin around what is active.
      std::int64_t const margin = width(m_rootDepth) / 2;
      if (low < m_low[a] - margin || high > m_high[a] + margin) return fail("tile-space box", at);
      auto const size = get<double>(start + kGridVoxelSizeOffset);
      if (!isNear(worldLow, size * static_cast<double>(low))) return fail("world box", worldAt);
      if (!isNear(worldHigh, size * static_cast<double>(high))) return fail("world box", worldAt + 24);
    }
    return true;
  }

  NANOVTT_HD bool tileTable(std::uint64_t start, GridType type, std::uint64_t end) {
    std::uint64_t const table = (m_tiles + 1) * 8, at = start + kTileTableOffset;
    if (end < table) return fail("end of the tile data", at + 8 * m_tiles);
    if (isQuantised(type)) {
      if (m_blocks) return fail("a quantised grid over coalesced blocks", start + kGridTypeOffset);
      return quantisedTable(at, type, end);
    }
    // The brick of the first tile; offsets in bytes are never that small.
    if (m_tiles && (get<std::uint64_t>(at) & kOffsetMask) == kHaloTileWidth)
      return textureTable(at, type, end);
    std::uint64_t next = table;
    for (int d = m_rootDepth; d <= kMaxDepth; ++d)
      for (std::uint64_t tile = tilesAbove(d); tile < tilesAbove(d + 1); ++tile) {
        auto const entry = get<std::uint64_t>(at + 8 * tile);
        std::uint64_t const levels = entry >> kTileLevelsShift, across = entry >> kTileWidthShift & 0xFF;
        if ((entry & kOffsetMask) != next) return fail("a tile's offset", at + 8 * tile);
        if (levels > kMaxCoalescedLevels || d + static_cast<int>(levels) > kMaxDepth)
          return fail("a tile's levels", at + 8 * tile);
        std::uint64_t const core = std::uint64_t(kTileWidth) << levels;
        if (across != core && across != core + 1) return fail("a tile's width", at + 8 * tile);
        if ((levels || m_blocks) && d < kMaxDepth && !levelsAgree(tile, levels))
          return fail("a tile's levels", at + 8 * tile);
        std::uint64_t const bytes = across * across * across * elementBytes(type);
        if (bytes > end - next) return fail("a tile's samples are beyond the end", at + 8 * tile);
        next += bytes;
      }
    // A texture without tiles has the brick of no tile.
    if (m_tiles == 0) next += end != next ? tileBytes(type, true) : 0;
    return next == end || fail("end of the tile data", at + 8 * m_tiles);
  }
  /// A block's children lie below its bottom; a complete block has none.
  NANOVTT_HD bool levelsAgree(std::uint64_t tile, std::uint64_t levels) const {
    auto const entry = get<std::uint64_t>(childEntryAt(tile));
    return entry >> kChildLevelsShift == levels || entry == m_sentinel;
  }

  NANOVTT_HD bool quantisedTable(std::uint64_t at, GridType type, std::uint64_t end) {
    std::uint64_t next = (m_tiles + 1) * 8;
    for (std::uint64_t tile = 0; tile < m_tiles; ++tile) {
      if (get<std::uint64_t>(at + 8 * tile) != next) return fail("a tile's offset", at + 8 * tile);
      std::uint64_t bytes = 0;
      if (type == GridType::kFpN) {
        if (kFpNRecordBytes > end - next) return fail("a tile's codes are beyond the end", at + 8 * tile);
        std::uint64_t const record = at + next;
        std::uint64_t const payload = get<std::uint16_t>(record + kFpNPayloadOffset);
        unsigned const logBits = m_bytes[record + kFpNLogBitsOffset];
        if (logBits > 4) return fail("bits of a tile's codes", record + kFpNLogBitsOffset);
        if (payload != 8u << logBits && payload != 16u << logBits)
          return fail("bytes of a tile's codes", record + kFpNPayloadOffset);
        if (m_bytes[record + kFpNReservedOffset]) return fail("a reserved byte", record + kFpNReservedOffset);
        bytes = kFpNRecordBytes + payload;
      } else {
        // The last tile's next entry is the end of all.
        auto const following = get<std::uint64_t>(at + 8 * tile + 8);
        bytes = tileBytes(type, following - next == tileBytes(type, true));
      }
      if (bytes > end - next) return fail("a tile's codes are beyond the end", at + 8 * tile);
      next += bytes;
    }
    return next == end || fail("end of the tile data", at + 8 * m_tiles);
  }

  NANOVTT_HD bool textureTable(std::uint64_t at, GridType type, std::uint64_t end) {
    if (m_blocks) return fail("a texture over coalesced blocks", at);
    std::uint64_t q = 1;
    while (q * q * q < m_tiles + 1) ++q; // at most 1626 steps
    std::uint64_t const across = q * kHaloTileWidth;
    if (end - (m_tiles + 1) * 8 != across * across * across * elementBytes(type))
      return fail("size of the texture", at + 8 * m_tiles);
    for (std::uint64_t tile = 0; tile < m_tiles; ++tile) {
      std::uint64_t const c = tile + 1;
      if (get<std::uint64_t>(at + 8 * tile) != textureEntry(c % q, c / q % q, c / (q * q)))
        return fail("a tile's brick", at + 8 * tile);
    }
    return true;
  }

  unsigned char const* m_bytes;
  std::uint64_t m_length;
  Validation m_result;
  std::uint64_t m_bufferSize = 0, m_containerSize = 0;
  std::uint64_t m_tiles = 0, m_nonFinest = 0;
  int m_rootDepth = 0;
  std::uint64_t m_sentinel = 0;
  std::uint64_t m_nextTable = 0;
  /// Sum of mix() over all that root and child tables refer to.
  std::uint64_t m_references = 0;
  /// Some tile is an incomplete coalesced block.
  bool m_blocks = false;
  /// What the roots span in tile space.
  std::int64_t m_low[3] = {0, 0, 0}, m_high[3] = {0, 0, 0};
};

} // namespace Internal

/// Whether every lookup in a buffer of that length stays in it, and its tables have the form that they
/// should.
/// @edges Of samples, checksums and reserved bytes it says nothing: any value is a value.
/// @cost One pass over the tables, not over the samples; a few words of memory. Reads nothing beyond
/// `length`.
NANOVTT_HD inline Validation validate(void const* bytes, std::uint64_t length) {
  return Internal::Validator(bytes, length).run();
}

} // namespace nanovtt
