// What Interop's own sources, and tests that speak OpenVDB themselves, share.
#pragma once

#include "Interop/VdbFile.h"
#include "Interop/VdbTypesImpl.h"

#include <functional>
#include <vector>

namespace VLN::Interop {

struct VdbFile {
  std::string path;
  openvdb::GridPtrVec grids; ///< in the order of the file
  openvdb::MetaMap::Ptr metadata;
  std::vector<SkippedGrid> skipped; ///< grids of types that OpenVDB does not know
  std::uint64_t memoryBytes = 0;    ///< most that what is made of it may take; 0 for no bound
};

/// Reads all of a file, nothing delayed.
/// @param told As of readChecked(); where a child process reads first, nobody is told.
/// @error FileError.
VLN_API VdbFile readVdbFile(std::string const& path, VdbReadLimits const& limits = {},
                            std::function<void(double)> const& told = {});

} // namespace VLN::Interop
