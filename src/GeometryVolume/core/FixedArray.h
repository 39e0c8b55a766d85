#pragma once

#include <array>
#include <cstddef>

namespace VLN::Dense1D {

template <class T, std::size_t N> using FixedArray = std::array<T, N>;

} // namespace VLN::Dense1D
