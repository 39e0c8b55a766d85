// BulkRuns: many positions, grouped so that threads may write their elements without meeting.
#pragma once

#include "GeometryVolume/volume/PartPlacesImpl.h"
#include "GeometryVolume/volume/detail/VolumeData.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <memory>
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
  std::unique_ptr<BulkPlace[]> places; ///< of loose positions
  std::vector<std::vector<BulkRun>> lists;
  std::vector<FieldBlocks>
      made; ///< for each chunk, copies of blocks that were not there when it was looked at

  /// For each chunk the tiles that were made for it; the first of its runs in one writes their background.
  /// Before, they are unwritten: memory is written when it is about to be written again.
  std::vector<std::vector<BlockTiles>> tilesMade;

  /// To all tiles that are still unwritten.
  void writeBackground(FieldSlot const& slot) {
    for (auto& chunk : tilesMade)
      for (BlockTiles& tiles : chunk) slot.writeBackground(tiles);
  }
  /// Which share writes a block. Shares are made of cubes of 32 samples: small enough to balance, and wide
  /// enough that positions in order are read in order.
  std::size_t shareOf(int3 const& at) const {
    auto const x = static_cast<std::uint32_t>(at.x) >> 5, y = static_cast<std::uint32_t>(at.y) >> 5,
               z = static_cast<std::uint32_t>(at.z) >> 5;
    return (x + 3 * y + 5 * z) % shares;
  }
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

/// Writes the elements of a run, whose places and values these are.
template <class T>
[[gnu::always_inline]] inline void writeRun(BulkRun const& run, BulkPlace const* places, T const* values) {
  switch (run.axis) {
  case 0:
    return writeRow<0>(run, values);
  case 1:
    return writeRow<1>(run, values);
  case 2:
    return writeRow<2>(run, values);
  default:
    auto const& tiles = run.block->tiles;
    std::size_t const count = run.count;
    for (std::size_t n = 0; n < count; ++n)
      static_cast<T*>(tiles[places[n].slot].loadAcquire())[places[n].element] = values[n];
  }
}

} // namespace VLN::TileTree3D::Internal
