// Vectors, matrices and boxes of the host's math library: plain records of one scalar type.
#pragma once

#include <cfloat>
#include <climits>
#include <type_traits>

namespace Velorn::Math {

template <class S> struct Vec2 {
  using Scalar = S;
  S x, y;
  bool operator==(Vec2 const&) const = default;
};

template <class S> struct Vec3 {
  using Scalar = S;
  S x, y, z;
  bool operator==(Vec3 const&) const = default;
  S& operator[](int axis) { return axis == 0 ? x : axis == 1 ? y : z; }
  S const& operator[](int axis) const { return axis == 0 ? x : axis == 1 ? y : z; }

  Vec3& operator+=(Vec3 const& b) { return x += b.x, y += b.y, z += b.z, *this; }
  Vec3& operator-=(Vec3 const& b) { return x -= b.x, y -= b.y, z -= b.z, *this; }
  Vec3& operator*=(S s) { return x *= s, y *= s, z *= s, *this; }
  friend Vec3 operator+(Vec3 a, Vec3 const& b) { return a += b; }
  friend Vec3 operator-(Vec3 a, Vec3 const& b) { return a -= b; }
  friend Vec3 operator*(Vec3 a, S s) { return a *= s; }
  friend Vec3 operator*(S s, Vec3 a) { return a *= s; }
};

template <class S> struct Vec4 {
  using Scalar = S;
  S x, y, z, w;
  bool operator==(Vec4 const&) const = default;
};

/// Row-major matrix.
template <class S, int Rows, int Columns> struct Matrix {
  using Scalar = S;
  S m[Rows][Columns];
  bool operator==(Matrix const&) const = default;
};

using float2 = Vec2<float>;
using float3 = Vec3<float>;
using float4 = Vec4<float>;
using double3 = Vec3<double>;
using int3 = Vec3<int>;
using float3x3 = Matrix<float, 3, 3>;
using float4x2 = Matrix<float, 4, 2>;
using float4x4 = Matrix<float, 4, 4>;

/// Axis-aligned box by its two corners. A default box is empty and grows by what it is given.
/// The empty box runs from the largest scalar to minus the largest scalar on each axis.
template <class V, class S = typename V::Scalar> struct bbox {
  static_assert(std::is_same_v<S, int> || std::is_same_v<S, float> || std::is_same_v<S, double>);
  static constexpr S kLargest = std::is_same_v<S, int>     ? S(INT_MAX)
                                : std::is_same_v<S, float> ? S(FLT_MAX)
                                                           : S(DBL_MAX);
  V min{kLargest, kLargest, kLargest};
  V max{-kLargest, -kLargest, -kLargest};

  bool empty() const { return min.x > max.x || min.y > max.y || min.z > max.z; }
  void grow(V const& p) {
    for (int a = 0; a < 3; ++a) {
      if (p[a] < min[a]) min[a] = p[a];
      if (p[a] > max[a]) max[a] = p[a];
    }
  }
  bool operator==(bbox const&) const = default;
};

} // namespace Velorn::Math
