// What works on elements without their type, compiled for the usual sizes and once for all others.
#pragma once

#include <cstddef>
#include <type_traits>

namespace VLN::TileTree3D::Internal {

/// Calls f with the size of an element, for the usual ones as a constant.
template <class F> void withSize(std::size_t size, F const& f) {
  switch (size) {
  case 4:
    return f(std::integral_constant<std::size_t, 4>());
  case 8:
    return f(std::integral_constant<std::size_t, 8>());
  case 12:
    return f(std::integral_constant<std::size_t, 12>());
  default:
    return f(size);
  }
}

} // namespace VLN::TileTree3D::Internal
