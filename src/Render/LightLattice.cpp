#include "Render/LightLatticeImpl.h"

#include "Render/Threads.h"

#include <algorithm>
#include <cmath>
#include <utility>

namespace VLN::Render {

namespace {

void sweep(LightView const& v, std::vector<float> const& extinctions, Vec3 toLight,
           float LightView::Shares::*share, LightView::Shares* light) {
  // In lattice steps; the axis along which most planes are crossed.
  Vec3 const d = toLight * v.scale;
  int axis = 0;
  for (int a = 1; a < 3; ++a)
    if (std::abs(d[a]) > std::abs(d[axis])) axis = a;
  int const b = (axis + 1) % 3, c = (axis + 2) % 3;
  float const toPlane = 1 / std::abs(d[axis]); // world length
  bool const up = d[axis] > 0;                 // the light stands at the high end
  std::int64_t stride[3] = {1, v.size[0], std::int64_t(v.size[0]) * v.size[1]};
  for (int n = 1; n < v.size[axis]; ++n) {
    int const plane = up ? v.size[axis] - 1 - n : n, before = up ? plane + 1 : plane - 1;
    for (int k = 0; k < v.size[c]; ++k)
      for (int j = 0; j < v.size[b]; ++j) {
        float const y = static_cast<float>(j) + d[b] * toPlane, z = static_cast<float>(k) + d[c] * toPlane;
        int const y0 = static_cast<int>(std::floor(y)), z0 = static_cast<int>(std::floor(z));
        float const fy = y - static_cast<float>(y0), fz = z - static_cast<float>(z0);
        float lit = 0, thick = 0;
        for (int corner = 0; corner < 4; ++corner) {
          int const yy = y0 + (corner & 1), zz = z0 + (corner >> 1);
          float const w = (corner & 1 ? fy : 1 - fy) * (corner >> 1 ? fz : 1 - fz);
          if (yy < 0 || zz < 0 || yy >= v.size[b] || zz >= v.size[c]) {
            lit += w;
            continue;
          }
          auto const at = before * stride[axis] + yy * stride[b] + zz * stride[c];
          lit += w * light[at].*share, thick += w * extinctions[at];
        }
        auto const here = plane * stride[axis] + j * stride[b] + k * stride[c];
        float const mean = 0.5f * (thick + extinctions[here]);
        light[here].*share = lit * decay(Lanes(mean * toPlane)).first();
      }
  }
}

} // namespace

LightLattice sweepLights(FogView const& fog, Vec3 toLight, Vec3 up, Vec3 spacing, int threads) {
  LightLattice lattice;
  LightView& v = lattice.view;
  std::size_t points = 1;
  for (int a = 0; a < 3; ++a) {
    float const extent = fog.field.high[a] - fog.field.low[a];
    v.size[a] = 1 + std::max(1, static_cast<int>(std::ceil(extent / spacing[a])));
    v.scale[a] = static_cast<float>(v.size[a] - 1) / extent;
    points *= static_cast<std::size_t>(v.size[a]);
  }
  v.low = fog.field.low;
  lattice.values.assign(points, {1, 1});
  v.values = lattice.values.data();

  std::vector<float> extinctions(points);
  // Of all points first, which need no order.
  std::int64_t const rows = std::int64_t(v.size[1]) * v.size[2];
  forRanges(rows, 64, threads, [&](std::int64_t begin, std::int64_t end) {
    FieldPath path;
    for (std::int64_t row = begin; row < end; ++row)
      for (int i = 0; i < v.size[0]; ++i) {
        Vec3 const lattice3{static_cast<float>(i), static_cast<float>(row % v.size[1]),
                            static_cast<float>(row / v.size[1])};
        Vec3 const p = v.low + Vec3{lattice3.x / v.scale.x, lattice3.y / v.scale.y, lattice3.z / v.scale.z};
        float const value = path.value(fog.field, p);
        float place;
        if (path.height > 0) extinctions[row * v.size[0] + i] = fog.extinction(value, place);
      }
  });
  sweep(v, extinctions, toLight, &LightView::Shares::direct, lattice.values.data());
  sweep(v, extinctions, up, &LightView::Shares::above, lattice.values.data());
  return lattice;
}

} // namespace VLN::Render
