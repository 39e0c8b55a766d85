#pragma once

#include "Interop/OutputFile.h"
#include "Interop/VdbTypesImpl.h"

#include <functional>
#include <string>
#include <vector>

namespace VLN::Interop {

/// A grid that is made when its turn to be written has come, and goes after it.
struct GridInTurn {
  std::string name; ///< that the grid will have
  std::function<openvdb::GridBase::Ptr()> make;
};

/// Writes a .vdb file whole. The same grids give the same bytes.
/// @param onWriting Called once when all grids have been made.
/// @error FileError, and what making a grid throws.
/// @cost Holds the bytes of the file in memory once, and one grid at a time.
void writeVdbFile(OutputFile& file, std::vector<GridInTurn> const& grids, openvdb::MetaMap const& metadata,
                  std::function<void()> const& onWriting = {});
/// The same of one grid that is there.
void writeVdbFile(OutputFile& file, openvdb::GridBase::Ptr const& grid);

} // namespace VLN::Interop
