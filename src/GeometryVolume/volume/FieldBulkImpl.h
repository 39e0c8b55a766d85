// BulkRuns: many positions, grouped so that threads may write their elements without meeting.
#pragma once

#include "GeometryVolume/volume/detail/VolumeData.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

namespace VLN::TileTree3D::Internal {

/// Consecutive positions in one block. They are a row, each one sample behind the one before it along an
/// axis, or loose.
struct BulkRun {
  static constexpr std::uint8_t kLoose = 3;

  FieldBlock const* block;
  std::uint32_t begin; ///< from the chunk's first position
  std::uint8_t count, axis;
  std::uint8_t slot, element; ///< of a row's first position
};

/// Runs by chunks of `grain` positions and by shares, in the order of the positions. A block belongs to one
/// share: whoever writes each share chunk by chunk writes what comes last last, whatever the number of
/// shares.
struct BulkRuns {
  std::size_t grain = 0, chunks = 0, shares = 1;
  std::vector<std::vector<BulkRun>> lists;
  std::vector<FieldBlocks>
      made; ///< for each chunk, copies of blocks that were not there when it was looked at

  std::vector<BulkRun>& list(std::size_t chunk, std::size_t share) { return lists[chunk * shares + share]; }
  std::vector<BulkRun> const& list(std::size_t chunk, std::size_t share) const {
    return lists[chunk * shares + share];
  }
};

/// Makes the tiles that are missing, and groups the positions.
/// @error std::out_of_range beyond the domain. Tiles may have been made then, which changes no value.
VLN_API BulkRuns planBulk(VolumeData& volume, FieldSlot& slot, std::span<int3 const> positions);

template <int kAxis, class T>
[[gnu::always_inline]] inline void writeRow(BulkRun const& row, T const* values) {
  constexpr std::size_t kStride = 1 << 2 * kAxis;
  auto const tile = [&](std::size_t slot) { return static_cast<T*>(row.block->tiles[slot].loadAcquire()); };
  std::size_t const element = row.element, slot = row.slot, slotBehind = slot + (1u << kAxis);
  if (row.count == 8) {
    T* const first = tile(slot) + element;
    T* const second = tile(slotBehind) + element;
    if constexpr (kAxis == 0) {
      std::copy_n(values, 4, first);
      std::copy_n(values + 4, 4, second);
    } else {
      for (std::size_t n = 0; n < 4; ++n) first[n * kStride] = values[n];
      for (std::size_t n = 0; n < 4; ++n) second[n * kStride] = values[4 + n];
    }
    return;
  }
  std::size_t const along = element / kStride & 3, count = row.count, inTile = std::min(count, 4 - along);
  T* to = tile(slot) + element;
  for (std::size_t n = 0; n < inTile; ++n) to[n * kStride] = values[n];
  if (count == inTile) return;
  to = tile(slotBehind) + element - along * kStride;
  for (std::size_t n = inTile; n < count; ++n) to[(n - inTile) * kStride] = values[n];
}

/// Writes the elements of a run, whose positions and values these are.
template <class T>
[[gnu::always_inline]] inline void writeRun(BulkRun const& run, int3 const* positions, T const* values) {
  switch (run.axis) {
  case 0:
    return writeRow<0>(run, values);
  case 1:
    return writeRow<1>(run, values);
  case 2:
    return writeRow<2>(run, values);
  default:
    for (std::size_t n = 0; n < run.count; ++n) {
      auto const at = FieldBlock::place(positions[n].x, positions[n].y, positions[n].z);
      static_cast<T*>(run.block->tile(at))[at.element()] = values[n];
    }
  }
}

} // namespace VLN::TileTree3D::Internal
