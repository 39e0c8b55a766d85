// What the exporter's sources, and tests that keep grids in memory, share.
#pragma once

#include "Interop/VdbExport.h"
#include "Interop/VdbTypesImpl.h"

#include <string>

namespace VLN::Interop {

/// The grids of volumes that importGrids() made, points aside, as they are written.
openvdb::GridPtrVec exportedGrids(VdbImport const& content, Progress const& progress = {});

openvdb::GridBase::Ptr makePointsGrid(PointSet const& points, std::string const& name);

} // namespace VLN::Interop
