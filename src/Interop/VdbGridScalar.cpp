#include "GeometryVolume/core/ElementTypes.h"
#include "Interop/VdbGridBuilderImpl.h"
#include "Interop/VdbGridTypedImpl.h"

namespace VLN::Interop {

std::unique_ptr<GridSource> makeScalarSource(GridToRead const& from) {
  return sourceAmong<openvdb::FloatGrid, openvdb::Int32Grid, openvdb::Int64Grid, openvdb::BoolGrid
#if VLN_HAS_ELEMENT_DOUBLE
                     ,
                     openvdb::DoubleGrid
#endif
                     >(from);
}

openvdb::GridBase::Ptr makeScalarGrid(std::string const& type, GridToWrite const& from) {
  return gridAmong<openvdb::FloatGrid, openvdb::Int32Grid, openvdb::Int64Grid, openvdb::BoolGrid
#if VLN_HAS_ELEMENT_DOUBLE
                   ,
                   openvdb::DoubleGrid
#endif
                   >(type, from);
}

} // namespace VLN::Interop
