// The element types of channels, from the one table in cmake/VlnElementTypes.cmake:
//
//   VLN_FOR_EACH_ELEMENT_TYPE(X)        X(type, name) for each type that this build instantiates. A full
//                                       build has all 18; CMake's VLN_ELEMENT_TYPES narrows the list for
//                                       quick and sanitizer builds.
//   VLN_FOR_EACH_FLAT_ELEMENT_TYPE(X)   the same for those that flat buffers hold, in the order of their ids.
//   VLN_FOR_EACH_KNOWN_ELEMENT_TYPE(X)  X(type, name, pool, flat, vdb) for all, built or not.
//   VLN_ELEMENT_FLOAT(X)                X(type, name) where the build has the type, else nothing; one for
//                                       each name.
#pragma once

#include "GeometryVolume/core/ElementTypesConfig.h"
#include "Velorn/Math.h"

#include <cstdint>

namespace VLN::TileTree3D {

/// What the table says of an element type.
struct ElementTypeInfo {
  char const* name;    ///< "float3", "uint8", ...
  int poolIndex;       ///< place among the stores of the channel pool, as its log numbers them
  int flatId;          ///< number of the grid type in flat buffers; 0: they do not hold it
  char const* vdbType; ///< grid type of .vdb files that keeps all its values; empty: none
};

/// Left undefined for what is no element type.
template <class T> struct ElementTypeOf;

#define VLN_ELEMENT_ROW(type, name, pool, flat, vdb)                                                         \
  template <> struct ElementTypeOf<type> { static constexpr ElementTypeInfo kInfo{#name, pool, flat, vdb}; };
VLN_FOR_EACH_KNOWN_ELEMENT_TYPE(VLN_ELEMENT_ROW)
#undef VLN_ELEMENT_ROW

template <class T> inline constexpr ElementTypeInfo const& kElementType = ElementTypeOf<T>::kInfo;

#define VLN_ELEMENT_ROW(...) +1
inline constexpr int kElementTypeCount = 0 VLN_FOR_EACH_KNOWN_ELEMENT_TYPE(VLN_ELEMENT_ROW);
#undef VLN_ELEMENT_ROW

} // namespace VLN::TileTree3D
