// Where a ray first meets the surface on which a field has a value, and what stands round the place.
//
//   tile ─ cells whose corners lie on both sides (a bit each) ─ root of the cubic along the ray
#pragma once

#include "Render/Random.h"
#include "Render/Walk.h"

namespace VLN::Render {

/// A trilinear blend along a ray is a cubic: c[0] + c[1] s + c[2] s^2 + c[3] s^3.
/// @source H. Hansson-Söderlund, A. Evans, T. Akenine-Möller, "Ray Tracing of Signed Distance Function
/// Grids", JCGT 11(3), 2022, with the signs of the field itself.
/// @param o, d The ray in the cell, which is the unit cube.
NANOVTT_HD inline void cubicAlong(float const* p, int stride, Vec3 o, Vec3 d, float c[4]) {
  float const* const q = p + static_cast<std::int64_t>(stride) * stride;
  float const k0 = p[0], k1 = p[1] - p[0], k2 = p[stride] - p[0], k3 = p[stride + 1] - p[stride] - k1;
  float const a = q[1] - q[0], b = q[stride] - q[0];
  float const k4 = q[0] - k0, k5 = a - k1, k6 = b - k2, k7 = q[stride + 1] - q[stride] - a - k3;
  // f = k0 + k1 x + k2 y + k3 xy + z (k4 + k5 x + k6 y + k7 xy)
  float const m1 = k1 + k5 * o.z, m2 = k2 + k6 * o.z, m3 = k3 + k7 * o.z;
  float const oxy = o.x * o.y, dxy = d.x * d.y, cross = o.x * d.y + o.y * d.x;
  c[0] = k0 + k4 * o.z + o.x * m1 + o.y * m2 + oxy * m3;
  c[1] = d.x * m1 + d.y * m2 + cross * m3 + d.z * (k4 + k5 * o.x + k6 * o.y + k7 * oxy);
  c[2] = dxy * m3 + d.z * (k5 * d.x + k6 * d.y + k7 * cross);
  c[3] = k7 * dxy * d.z;
}

/// The first place in [0, end] where c[0] + ... + c[3] s^3 goes from below 0 to not below it, or back; below
/// 0 when there is none.
/// @formula The cubic stays between its Bernstein coefficients; where they do not rise or fall it may have
/// extrema. Between those, where the derivative's roots are, the cubic is monotonic; there regula falsi with
/// the Illinois rule, to a part in a million of `end`.
/// @source G. Marmitt and others, "Fast and Accurate Ray-Voxel Intersection Techniques for Iso-Surface Ray
/// Tracing", VMV 2004.
NANOVTT_HD inline float firstRoot(float const c[4], float end) {
  auto const f = [&](float s) { return c[0] + s * (c[1] + s * (c[2] + s * c[3])); };
  // Between its Bernstein coefficients the cubic stays. Where they rise or fall it has no extremum.
  float const third = end / 3, b1 = c[0] + third * c[1], b2 = c[0] + third * (2 * c[1] + end * c[2]),
              last = f(end);
  bool const isBelow = c[0] < 0;
  if ((b1 < 0) == isBelow && (b2 < 0) == isBelow && (last < 0) == isBelow) return -1;
  bool const isMonotonic =
      isBelow ? c[0] <= b1 && b1 <= b2 && b2 <= last : c[0] >= b1 && b1 >= b2 && b2 >= last;
  float stops[3];
  int count = 0;
  float const a = 3 * c[3], b = 2 * c[2], root = isMonotonic ? 0 : b * b - 4 * a * c[1];
  if (root > 0) {
    // The form without cancellation.
    float const q = -0.5f * (b + (b < 0 ? -std::sqrt(root) : std::sqrt(root)));
    float e0 = a != 0 ? q / a : -1, e1 = q != 0 ? c[1] / q : -1;
    if (e1 < e0) {
      float const swap = e0;
      e0 = e1, e1 = swap;
    }
    if (e0 > 0 && e0 < end) stops[count++] = e0;
    if (e1 > 0 && e1 < end && e1 != e0) stops[count++] = e1;
  }
  stops[count++] = end;
  float s0 = 0, f0 = c[0];
  for (int n = 0; n < count; ++n) {
    float s1 = stops[n], f1 = f(s1);
    if ((f0 < 0) == (f1 < 0)) {
      s0 = s1, f0 = f1;
      continue;
    }
    int side = 0;
    for (int step = 0; step < 24 && s1 - s0 > 1e-6f * end; ++step) {
      float s = (f0 * s1 - f1 * s0) / (f0 - f1);
      if (!(s > s0 && s < s1)) break;
      float const v = f(s);
      if (v == 0) return s;
      if ((v < 0) == (f0 < 0)) {
        s0 = s, f0 = v;
        if (side == -1) f1 *= 0.5f;
        side = -1;
      } else {
        s1 = s, f1 = v;
        if (side == 1) f0 *= 0.5f;
        side = 1;
      }
    }
    return f1 == 0 ? s1 : f0 == f1 ? s0 : (f0 * s1 - f1 * s0) / (f0 - f1);
  }
  return -1;
}

/// Whether a surface may lie in a range of values. One that touches the value from above has none: the zeros
/// round a field that is dense and positive are no surface.
NANOVTT_HD inline bool crosses(float low, float high, float iso) { return low < iso && high >= iso; }

/// Between what is below a value and what is not.
/// @pre The field was weighed by crosses().
/// @return false when the ray meets none between t0 and t1.
NANOVTT_HD inline bool hitSurface(FieldView const& field, Ray const& ray, float t0, float t1, float iso,
                                  float& hit) {
  Walk walk(field, ray, t0, t1);
  Segment s;
  while (walk.next(s)) {
    Vec3 const d = ray.direction * s.scale;
    std::uint64_t const cells = field.cells[s.tile];
    int const last = s.brick.core - 1;
    Vec3 const u = s.samples(ray.at(s.t0));
    float const width = 1 / s.scale; // of a cell
    int cell[3], way[3];
    float next[3], step[3];
    Vec3 const o = s.samples(ray.origin);
    for (int a = 0; a < 3; ++a) {
      int const n = static_cast<int>(u[a]);
      cell[a] = n < 0 ? 0 : n > last ? last : n;
      bool const rises = d[a] > 0;
      way[a] = rises ? 1 : -1;
      step[a] = (rises ? width : -width) * ray.inverse[a];
      next[a] = d[a] == 0 ? 3.4e38f
                          : (s.corner[a] + static_cast<float>(cell[a] + rises) * width - ray.origin[a]) *
                                ray.inverse[a];
    }
    float t = s.t0;
    for (;;) {
      float const near = next[1] < next[2] ? next[1] : next[2], first = next[0] < near ? next[0] : near;
      float const leave = first < s.t1 ? first : s.t1;
      bool matters = true;
      if (last == 3) matters = cells >> (cell[0] + 4 * cell[1] + 16 * cell[2]) & 1;
      if (matters && leave > t) {
        Vec3 const at = o + d * t;
        Vec3 const in{at.x - static_cast<float>(cell[0]), at.y - static_cast<float>(cell[1]),
                      at.z - static_cast<float>(cell[2])};
        float c[4];
        cubicAlong(s.brick.at(cell[0], cell[1], cell[2]), s.brick.stride, in, d, c);
        c[0] -= iso;
        float const root = firstRoot(c, leave - t);
        if (root >= 0) {
          hit = t + root;
          return true;
        }
      }
      t = leave > t ? leave : t;
      if (!(first < s.t1)) break;
      // Without branches, which nobody could foretell. Through an edge it goes at once.
      for (int a = 0; a < 3; ++a) {
        bool const here = next[a] == first;
        cell[a] += here ? way[a] : 0;
        next[a] += here ? step[a] : 0;
      }
      if ((cell[0] | cell[1] | cell[2]) & ~last) break;
    }
  }
  return false;
}

/// Central differences over one sample on each side, of blends: smooth from cell to cell.
/// @space Per unit of local space.
NANOVTT_HD inline Vec3 gradientAt(FieldView const& field, Vec3 p) {
  FieldPath path;
  path.value(field, p);
  float const h = path.height == 0 ? 1.0f
                                   : static_cast<float>(1 << FieldPath::shiftOf(path.top().depth)) /
                                         static_cast<float>(field.brick(path.top().tile).core);
  Vec3 g;
  for (int a = 0; a < 3; ++a) {
    Vec3 q = p;
    q[a] = p[a] + h;
    float const above = path.value(field, q);
    q[a] = p[a] - h;
    g[a] = (above - path.value(field, q)) / (2 * h);
  }
  return g;
}

} // namespace VLN::Render
