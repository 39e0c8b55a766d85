// ElementTraits<T>: scalar type and components of an element type, and how its values blend.
#pragma once

#include "Velorn/Math.h"

#include <cmath>
#include <cstdint>
#include <limits>
#include <type_traits>

namespace VLN::TileTree3D {

namespace Internal {

template <class T> struct ElementShape {
  static_assert(std::is_arithmetic_v<T>);
  using Scalar = T;
  static constexpr int kRows = 1, kColumns = 1;
};
template <class S> struct ElementShape<Velorn::Math::Vec2<S>> {
  using Scalar = S;
  static constexpr int kRows = 2, kColumns = 1;
};
template <class S> struct ElementShape<Velorn::Math::Vec3<S>> {
  using Scalar = S;
  static constexpr int kRows = 3, kColumns = 1;
};
template <class S> struct ElementShape<Velorn::Math::Vec4<S>> {
  using Scalar = S;
  static constexpr int kRows = 4, kColumns = 1;
};
template <class S, int Rows, int Columns> struct ElementShape<Velorn::Math::Matrix<S, Rows, Columns>> {
  using Scalar = S;
  static constexpr int kRows = Rows, kColumns = Columns;
};

} // namespace Internal

/// Facts about an element type: one of the 18 of channels.
///
///   scalar                         blends in
///   float                          float
///   8- and 16-bit integers         float, which holds each of their values
///   double, 32- and 64-bit         double
///
/// Vectors and matrices blend by component.
template <class T> struct ElementTraits {
  using Scalar = typename Internal::ElementShape<T>::Scalar;
  /// Type that weighted sums of components are formed in.
  using Blend =
      std::conditional_t<std::is_same_v<Scalar, float> || (std::is_integral_v<Scalar> && sizeof(Scalar) <= 2),
                         float, double>;
  static constexpr int kRows = Internal::ElementShape<T>::kRows;
  static constexpr int kColumns = Internal::ElementShape<T>::kColumns;
  static constexpr int kComponents = kRows * kColumns;
  static constexpr bool kIsInteger = std::is_integral_v<Scalar>;

  static_assert(std::is_trivially_copyable_v<T> && std::is_trivially_destructible_v<T>);
  static_assert(sizeof(T) == kComponents * sizeof(Scalar), "elements are arrays of their components");

  /// Components in memory order: x, y, z, w, and the rows of a matrix one after the other.
  static Scalar& component(T& value, int c) { return reinterpret_cast<Scalar*>(&value)[c]; }
  static Scalar const& component(T const& value, int c) { return reinterpret_cast<Scalar const*>(&value)[c]; }

  static T zero() { return T{}; }

  static Blend toBlend(Scalar s) { return static_cast<Blend>(s); }
  /// Back to the scalar type.
  /// @numeric Integers drop the fraction, as a cast does, and saturate at the ends of their range; NaN gives
  /// 0.
  static Scalar fromBlend(Blend b) {
    if constexpr (kIsInteger) {
      // Both bounds are powers of two (or zero), so they are exact in Blend; the upper one is exclusive.
      using Limits = std::numeric_limits<Scalar>;
      constexpr Blend low = static_cast<Blend>(Limits::min());
      constexpr Blend end = static_cast<Blend>(Limits::max() / 2 + 1) * 2;
      if (b >= end) return Limits::max();
      if (b <= low) return Limits::min();
      return b == b ? static_cast<Scalar>(b) : Scalar(0);
    } else {
      return b;
    }
  }

  /// (b - a) * f + a for each component.
  static T lerp(T const& a, T const& b, Blend f) {
    T result;
    for (int c = 0; c < kComponents; ++c) {
      Blend const from = toBlend(component(a, c));
      component(result, c) = fromBlend((toBlend(component(b, c)) - from) * f + from);
    }
    return result;
  }
  /// Every component times `f`.
  static T scaled(T const& a, Blend f) {
    T result;
    for (int c = 0; c < kComponents; ++c) component(result, c) = fromBlend(toBlend(component(a, c)) * f);
    return result;
  }
  /// Square root of the sum of the squared differences of the components, formed in double. For a scalar that
  /// is the absolute difference.
  static double distance(T const& a, T const& b) {
    if constexpr (kComponents == 1) return difference(component(a, 0), component(b, 0));
    double sum = 0;
    for (int c = 0; c < kComponents; ++c) {
      double const d = difference(component(a, c), component(b, c));
      sum += d * d;
    }
    return std::sqrt(sum);
  }

private:
  static double difference(Scalar a, Scalar b) {
    if constexpr (kIsInteger) {
      // In integers first: two 64-bit values may differ by less than double can tell.
      auto const x = static_cast<std::uint64_t>(a), y = static_cast<std::uint64_t>(b);
      return static_cast<double>(a > b ? x - y : y - x);
    } else {
      return std::abs(static_cast<double>(a) - static_cast<double>(b));
    }
  }
};

} // namespace VLN::TileTree3D
