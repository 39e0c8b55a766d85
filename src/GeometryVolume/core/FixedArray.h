// FixedArray, PerDepth: arrays of fixed length that take any integer as an index.
#pragma once

#include <array>
#include <cstddef>
#include <type_traits>

namespace VLN::Dense1D {

/// std::array, indexed by whatever integer is at hand: depths and directions are ints.
/// @pre As there: the index is at least 0 and below N.
template <class T, std::size_t N> struct FixedArray : std::array<T, N> {
  template <class I> constexpr T& operator[](I i) {
    static_assert(std::is_integral_v<I> || std::is_enum_v<I>);
    return std::array<T, N>::operator[](static_cast<std::size_t>(i));
  }
  template <class I> constexpr T const& operator[](I i) const {
    static_assert(std::is_integral_v<I> || std::is_enum_v<I>);
    return std::array<T, N>::operator[](static_cast<std::size_t>(i));
  }
};

} // namespace VLN::Dense1D

namespace VLN {

/// One entry for each depth, from 0 on.
template <class T, int Depths> using PerDepth = Dense1D::FixedArray<T, Depths>;

} // namespace VLN
