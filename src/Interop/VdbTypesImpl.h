// The grids of OpenVDB that are read and written here, compiled once: a tree of one type of value takes
// seconds of every source that makes or reads one.
#pragma once

#include <openvdb/openvdb.h>

// Three lists, each for a source of its own: VdbTypes*.cpp.
#define VLN_FOR_EACH_VDB_REAL_GRID(X) X(FloatGrid) X(DoubleGrid) X(Int32Grid)
#define VLN_FOR_EACH_VDB_OTHER_GRID(X) X(Int64Grid) X(BoolGrid) X(MaskGrid)
#define VLN_FOR_EACH_VDB_VECTOR_GRID(X) X(Vec3SGrid) X(Vec3DGrid) X(Vec3IGrid)

#define VLN_VDB_INSTANTIATE(GridT)                                                                           \
  template class openvdb::tree::Tree<openvdb::GridT::TreeType::RootNodeType>;                                \
  template class openvdb::Grid<openvdb::GridT::TreeType>;
#define VLN_VDB_ELSEWHERE(GridT)                                                                             \
  extern template class openvdb::tree::Tree<openvdb::GridT::TreeType::RootNodeType>;                         \
  extern template class openvdb::Grid<openvdb::GridT::TreeType>;

VLN_FOR_EACH_VDB_REAL_GRID(VLN_VDB_ELSEWHERE)
VLN_FOR_EACH_VDB_OTHER_GRID(VLN_VDB_ELSEWHERE)
VLN_FOR_EACH_VDB_VECTOR_GRID(VLN_VDB_ELSEWHERE)
