// Values of any element type from a number, for tests.
#pragma once

#include "GeometryVolume/channels/ElementTraits.h"

#include <cstdint>

namespace VLN::Test {

/// A value whose components all derive from `n` and differ from each other.
template <class T> T value(std::uint64_t n) {
  using Traits = TileTree3D::ElementTraits<T>;
  T v{};
  for (int c = 0; c < Traits::kComponents; ++c)
    Traits::component(v, c) = static_cast<typename Traits::Scalar>(n + static_cast<std::uint64_t>(100 * c));
  return v;
}

} // namespace VLN::Test
