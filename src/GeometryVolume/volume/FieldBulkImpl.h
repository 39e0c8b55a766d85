// BulkRuns: many positions, grouped so that threads may write their elements without meeting.
#pragma once

#include "GeometryVolume/volume/detail/VolumeData.h"

#include <cstdint>
#include <span>
#include <vector>

namespace VLN::TileTree3D::Internal {

/// Positions in a row that lie in one block.
struct BulkRun {
  FieldBlock* block;
  std::int64_t begin, count;
};

/// Runs by share, in the order of the positions: list `c * shares + s` holds those of share `s` in a chunk of
/// positions. A block belongs to one share. Whoever writes each share chunk by chunk writes what comes last
/// last, whatever the number of shares.
struct BulkRuns {
  std::size_t shares = 1;
  std::vector<std::vector<BulkRun>> lists;
};

/// Makes the tiles that are missing, and groups the positions.
/// @error std::out_of_range beyond the domain. Tiles may have been made then, which changes no value.
VLN_API BulkRuns planBulk(VolumeData& volume, FieldSlot& slot, std::span<int3 const> positions);

} // namespace VLN::TileTree3D::Internal
