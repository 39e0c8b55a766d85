// What Interop's own sources, and tests that speak OpenVDB themselves, share.
#pragma once

#include "Interop/VdbFile.h"
#include "Interop/VdbPackedLeavesImpl.h"
#include "Interop/VdbTypesImpl.h"

#include <functional>
#include <map>
#include <memory>
#include <vector>

namespace VLN::Interop {

struct VdbFile {
  std::string path;
  openvdb::GridPtrVec grids; ///< in the order of the file
  openvdb::MetaMap::Ptr metadata;
  std::vector<SkippedGrid> skipped; ///< grids of types that OpenVDB does not know
  std::uint64_t memoryBytes = 0;    ///< most that what is made of it may take; 0 for no bound
  /// Of the grids whose leaves have no buffers: the voxels lie here instead, until a channel is made of them.
  std::map<openvdb::GridBase const*, std::shared_ptr<PackedLeaves>> packed;
};

/// Where the voxels of leaves may lie.
enum class LeafMemory {
  kOwn,   ///< in the buffers of the leaves, as OpenVDB has them
  kPacked ///< or side by side, for one who imports the grids and does nothing else with them
};

/// Reads all of a file, nothing delayed.
/// @param told As of readChecked(); where a child process reads first, nobody is told.
/// @error FileError.
VLN_API VdbFile readVdbFile(std::string const& path, VdbReadLimits const& limits = {},
                            std::function<void(double)> const& told = {},
                            LeafMemory leafMemory = LeafMemory::kOwn);

} // namespace VLN::Interop
