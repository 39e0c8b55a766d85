#pragma once

#include "Interop/OutputFile.h"
#include "Interop/VdbTypesImpl.h"

namespace VLN::Interop {

/// Writes a .vdb file whole. The same grids give the same bytes.
/// @error FileError.
/// @cost Holds the bytes of the file in memory once.
void writeVdbFile(OutputFile& file, openvdb::GridPtrVec const& grids, openvdb::MetaMap const& metadata = {});

} // namespace VLN::Interop
