// Three numbers, for rays: on the host and on a device.
#pragma once

#include "Reader/NanoVTTFormat.h"

#include <cmath>

namespace VLN::Render {

template <class T> struct Vec {
  T x = 0, y = 0, z = 0;

  NANOVTT_HD T& operator[](int a) { return a == 0 ? x : a == 1 ? y : z; }
  NANOVTT_HD T operator[](int a) const { return a == 0 ? x : a == 1 ? y : z; }
  template <class U> NANOVTT_HD Vec<U> as() const {
    return {static_cast<U>(x), static_cast<U>(y), static_cast<U>(z)};
  }
};
using Vec3 = Vec<float>;
using Vec3d = Vec<double>;

template <class T> NANOVTT_HD Vec<T> operator+(Vec<T> a, Vec<T> b) {
  return {a.x + b.x, a.y + b.y, a.z + b.z};
}
template <class T> NANOVTT_HD Vec<T> operator-(Vec<T> a, Vec<T> b) {
  return {a.x - b.x, a.y - b.y, a.z - b.z};
}
template <class T> NANOVTT_HD Vec<T> operator-(Vec<T> a) { return {-a.x, -a.y, -a.z}; }
template <class T> NANOVTT_HD Vec<T> operator*(Vec<T> a, T s) { return {a.x * s, a.y * s, a.z * s}; }
template <class T> NANOVTT_HD Vec<T> operator*(Vec<T> a, Vec<T> b) {
  return {a.x * b.x, a.y * b.y, a.z * b.z};
}
template <class T> NANOVTT_HD T dot(Vec<T> a, Vec<T> b) { return a.x * b.x + a.y * b.y + a.z * b.z; }
template <class T> NANOVTT_HD Vec<T> cross(Vec<T> a, Vec<T> b) {
  return {a.y * b.z - a.z * b.y, a.z * b.x - a.x * b.z, a.x * b.y - a.y * b.x};
}
template <class T> NANOVTT_HD T length(Vec<T> a) { return std::sqrt(dot(a, a)); }
/// @edges A vector without length stays as it is.
template <class T> NANOVTT_HD Vec<T> normalized(Vec<T> a) {
  T const l = length(a);
  return l > 0 ? a * (1 / l) : a;
}

/// Rows of a matrix and a shift: p -> m p + t.
struct Affine {
  Vec3d rows[3] = {{1, 0, 0}, {0, 1, 0}, {0, 0, 1}};
  Vec3d shift;

  Vec3d vector(Vec3d v) const { return {dot(rows[0], v), dot(rows[1], v), dot(rows[2], v)}; }
  Vec3d point(Vec3d p) const { return vector(p) + shift; }
  /// The transposed matrix times a vector: gradients go the other way than points.
  Vec3d transposed(Vec3d v) const { return rows[0] * v.x + rows[1] * v.y + rows[2] * v.z; }
  /// Length of what an axis of unit length becomes.
  double edge(int a) const { return length(Vec3d{rows[0][a], rows[1][a], rows[2][a]}); }
  double determinant() const { return dot(rows[0], cross(rows[1], rows[2])); }
  /// @pre The determinant is not 0.
  Affine inverse() const {
    double const d = 1 / determinant();
    Vec3d const a = cross(rows[1], rows[2]) * d, b = cross(rows[2], rows[0]) * d,
                c = cross(rows[0], rows[1]) * d;
    Affine r{{{a.x, b.x, c.x}, {a.y, b.y, c.y}, {a.z, b.z, c.z}}, {}};
    r.shift = -r.vector(shift);
    return r;
  }
};

} // namespace VLN::Render
