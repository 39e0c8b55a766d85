#include "GeometryVolume/core/ElementTypes.h"
#include "Interop/VdbGridBuilderImpl.h"
#include "Interop/VdbGridTypedImpl.h"

namespace VLN::Interop {

std::unique_ptr<GridSource> makeVectorSource(GridToRead const& from) {
  return sourceAmong<openvdb::Vec3SGrid, openvdb::Vec3DGrid
#if VLN_HAS_ELEMENT_INT3
                     ,
                     openvdb::Vec3IGrid
#endif
                     >(from);
}

openvdb::GridBase::Ptr makeVectorGrid(std::string const& type, GridToWrite const& from) {
  return gridAmong<openvdb::Vec3SGrid, openvdb::Vec3DGrid
#if VLN_HAS_ELEMENT_INT3
                   ,
                   openvdb::Vec3IGrid
#endif
                   >(type, from);
}

} // namespace VLN::Interop
