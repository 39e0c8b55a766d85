// The structures that may lie beside a buffer: where each tile is, and who stands round it.
#pragma once

#include "Reader/NanoVTTReader.h"

namespace nanovtt {

/// @pre The bytes have a row for each tile: sections of a .nvtt file tell their length, and holdsRows()
/// whether it suffices.
class TraversalReader {
public:
  TraversalReader() = default;
  NANOVTT_HD explicit TraversalReader(void const* rows)
      : m_rows(static_cast<unsigned char const*>(rows)) {}
  NANOVTT_HD static bool holdsRows(std::uint64_t bytes, std::uint32_t tiles) {
    return bytes / kTraversalRowBytes >= tiles;
  }

  /// The tile of a number: tiles in the order of their numbers are those of one depth after the other.
  NANOVTT_HD TileRef tile(std::uint32_t number) const {
    unsigned char const* const row = m_rows + kTraversalRowBytes * number;
    return {number,
            load<std::int32_t>(row + 12),
            {load<std::int32_t>(row), load<std::int32_t>(row + 4), load<std::int32_t>(row + 8)}};
  }

private:
  unsigned char const* m_rows = nullptr;
};

class NeighborReader {
public:
  NeighborReader() = default;
  NANOVTT_HD explicit NeighborReader(void const* rows)
      : m_rows(static_cast<unsigned char const*>(rows)) {}
  NANOVTT_HD static bool holdsRows(std::uint64_t bytes, std::uint32_t tiles) {
    return bytes / kNeighborRowBytes >= tiles;
  }

  /// The finest tile, no deeper than this one, at an offset of -1, 0 or 1 of its widths on each axis; kNoTile
  /// where there is none.
  /// @pre The number that comes back is checked against the number of tiles where the bytes are from outside:
  /// validate() looks at the buffer alone.
  NANOVTT_HD std::uint32_t neighbor(std::uint32_t tile, int dx, int dy, int dz) const {
    auto const n = static_cast<std::uint64_t>(((dx + 1) * 3 + dy + 1) * 3 + dz + 1);
    return load<std::uint32_t>(m_rows + kNeighborRowBytes * std::uint64_t(tile) + 4 * n);
  }

private:
  unsigned char const* m_rows = nullptr;
};

} // namespace nanovtt
