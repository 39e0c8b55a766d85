// Element types as numbers: their components, and the list of those that files bring.
#pragma once

#include "GeometryVolume/core/ElementTypes.h"

namespace VLN::Interop {

/// What the components of an element type are.
template <class T> struct ScalarOf { using type = T; };
template <class T>
requires requires { typename T::Scalar; }
struct ScalarOf<T> {
  using type = typename T::Scalar;
};

template <class T> inline constexpr int kComponentsOf = sizeof(T) / sizeof(typename ScalarOf<T>::type);

/// A scalar itself, or a component of a vector: those lie one behind the other.
template <class T> typename ScalarOf<T>::type componentOf(T const& value, int c) {
  return reinterpret_cast<typename ScalarOf<T>::type const*>(&value)[c];
}

} // namespace VLN::Interop

/// Expands X(type, name) for each element type that a file of any format brings, as far as this build has it:
/// what flat buffers hold, and of .vdb files masks (as bytes) and vectors of integers.
#define VLN_FOR_EACH_FILE_ELEMENT_TYPE(X)                                                                    \
  VLN_FOR_EACH_FLAT_ELEMENT_TYPE(X)                                                                          \
  VLN_ELEMENT_UINT8(X)                                                                                       \
  VLN_ELEMENT_INT3(X)
