// VoxelSamplerLogger: records which tiles a sampling run touches, and tells how caches of other sizes would
// have fared.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/tiletree/TreeIndex.h"

#include <cstdint>

namespace VLN::TileTree3D {

/// A diagnostic tool. Samplers do not call it: log where a tile is fetched, with one key for each thread or
/// ray whose accesses are to be simulated apart from the others.
struct VLN_API VoxelSamplerLogger {
  VoxelSamplerLogger& operator=(VoxelSamplerLogger const&);
  VoxelSamplerLogger& operator=(VoxelSamplerLogger&&) noexcept;

  /// Drops what has been logged. @pre No logTile() runs meanwhile.
  static void beginLog();
  /// Appends an access to the sequence of `key`.
  /// @threads Any: different keys go on in parallel.
  static void logTile(TreeIndex const& tile, std::uint64_t key);
  /// Prints the report on standard output and drops what has been logged. For each cache size from 0 to 19:
  /// the misses above the first access of each tile, divided by those. Entries leave by age of insertion: a
  /// hit does not refresh one.
  /// @pre No logTile() runs meanwhile.
  /// @cost 20 passes over all accesses.
  static void endLog();
};

} // namespace VLN::TileTree3D
