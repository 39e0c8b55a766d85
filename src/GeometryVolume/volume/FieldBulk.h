// BulkRuns: many positions, grouped so that threads may write their elements without meeting.
#pragma once

#include "GeometryVolume/volume/VolumeData.h"

#include <cstdint>
#include <span>
#include <vector>

namespace VLN::TileTree3D::Internal {

/// Positions in a row that lie in one block.
struct BulkRun {
  FieldBlock* block;
  std::int64_t begin, count;
};

/// Runs by bucket. Those of one block are in one bucket, in the order of the positions: who writes the
/// buckets in parallel, each in its order, writes what comes last last.
struct BulkRuns {
  static constexpr std::size_t kBuckets = 256;
  std::vector<BulkRun> runs;
  std::vector<std::size_t> ends; ///< of each bucket; one bucket alone for one thread
};

/// Makes the tiles that are missing, and groups the positions.
/// @error std::out_of_range beyond the domain, before anything has changed.
VLN_API BulkRuns planBulk(VolumeData& volume, FieldSlot& slot, std::span<int3 const> positions);

} // namespace VLN::TileTree3D::Internal
