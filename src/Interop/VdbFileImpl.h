// What Interop's own sources, and tests that speak OpenVDB themselves, share.
#pragma once

#include "Interop/VdbFile.h"
#include "Interop/VdbTypesImpl.h"

#include <vector>

namespace VLN::Interop {

struct VdbFile {
  std::string path;
  openvdb::GridPtrVec grids; ///< in the order of the file
  openvdb::MetaMap::Ptr metadata;
  std::vector<SkippedGrid> skipped; ///< grids of types that OpenVDB does not know
  std::uint64_t memoryBytes = 0;    ///< most that what is made of it may take; 0 for no bound
};

/// Probes a file as probeVdbFile() does, then reads all of it, nothing delayed.
/// @error FileError.
VLN_API VdbFile readVdbFile(std::string const& path, VdbReadLimits const& limits = {});

} // namespace VLN::Interop
