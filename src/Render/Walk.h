// Walk: the pieces of a ray that matter, tile by tile.
//
//   ray ──┬───────┬───┬─┬─┬──┬────────┬──>     tiles whose weight is 0 are crossed at once, as large as they
//         │ 0     │ 0 │x│x│ 0│   no   │        are; a step climbs to the first tile that holds both sides and
//         └───────┴───┴─┴─┴──┴──root──┘        descends from there
#pragma once

#include "Render/FieldView.h"

namespace VLN::Render {

/// @space Local; directions are as long as they were in the world, where t is the distance.
struct Ray {
  Vec3 origin, direction, inverse;

  NANOVTT_HD Ray(Vec3 o, Vec3 d)
      : origin(o)
      , direction(d)
      , inverse{1 / d.x, 1 / d.y, 1 / d.z} {}
  NANOVTT_HD Vec3 at(float t) const { return origin + direction * t; }
};

/// Cuts [t0, t1] to a box. @return false when nothing is left.
/// @edges A ray along a side lies inside.
NANOVTT_HD inline bool clip(Ray const& ray, Vec3 low, Vec3 high, float& t0, float& t1) {
  for (int a = 0; a < 3; ++a) {
    float const o = ray.origin[a];
    if (ray.direction[a] == 0) {
      if (o < low[a] || o > high[a]) return false;
      continue;
    }
    float const u = (low[a] - o) * ray.inverse[a], v = (high[a] - o) * ray.inverse[a];
    float const near = u < v ? u : v, far = u < v ? v : u;
    t0 = near > t0 ? near : t0;
    t1 = far < t1 ? far : t1;
  }
  return t0 < t1;
}

/// A piece of the ray in one tile: that between t0 and t1.
struct Segment {
  std::uint32_t tile;
  Brick brick;
  float weight;
  Vec3 corner; ///< of the tile
  float scale; ///< samples to a unit of tile space
  float t0, t1;

  NANOVTT_HD Vec3 samples(Vec3 local) const { return (local - corner) * scale; }
};

/// The 4 x 4 x 4 cells of a tile, cut to the box [low, low + width) in cells.
NANOVTT_HD inline std::uint64_t cellsIn(int i, int j, int k, int width) {
  if (width >= 4) return ~std::uint64_t(0);
  std::uint64_t const row = ((std::uint64_t(1) << width) - 1) << i;
  std::uint64_t slab = 0, all = 0;
  for (int b = 0; b < width; ++b) slab |= row << 4 * (j + b);
  for (int c = 0; c < width; ++c) all |= slab << 16 * (k + c);
  return all;
}

class Walk {
public:
  /// Between t0 and t1, of which the part in the field's box is walked.
  NANOVTT_HD Walk(FieldView const& field, Ray const& ray, float t0, float t1)
      : m_field(field)
      , m_ray(ray) {
    m_inside = clip(ray, field.low, field.high, t0, t1);
    m_t = t0, m_end = t1;
    if (!m_inside) return;
    Vec3 const p = ray.at(t0);
    for (int a = 0; a < 3; ++a) {
      std::int32_t const v = floorOf(p[a]), low = floorOf(field.low[a]), high = -floorOf(-field.high[a]) - 1;
      m_cell[a] = v < low ? low : v > high ? high : v;
    }
  }

  /// Skips tiles of no weight. @return false at the end of the ray.
  /// @param above Tiles of no more weight are skipped as well.
  NANOVTT_HD bool next(Segment& s, float above = 0) {
    while (m_inside && m_t < m_end) {
      m_path.climb(m_cell[0], m_cell[1], m_cell[2]);
      int shift = m_field.rootShift; // of the region that is alike
      bool matters = false;
      if (m_path.height == 0) {
        int const empty = emptyLevel(above);
        shift += empty;
        if (empty == 0) {
          std::uint32_t const root = m_field.root(m_cell[0], m_cell[1], m_cell[2]);
          if (root != nanovtt::kNoTile) m_path.push(m_field, root, nanovtt::kTileSpaceBits - shift);
        }
      }
      if (m_path.height != 0) {
        for (;;) {
          auto const& top = m_path.top();
          shift = FieldPath::shiftOf(top.depth);
          if (!(m_field.weights[top.tile] > above)) break;
          matters = true;
          if (top.depth >= m_field.maxDepth) break;
          int depth;
          std::uint32_t const child = m_path.child(depth);
          if (depth > m_field.maxDepth) break;
          if (child == nanovtt::kNoTile) {
            // A part of the tile's own, whose cells tell whether it matters.
            int const tileShift = shift;
            shift = FieldPath::shiftOf(depth);
            if (depth == top.depth + 1) {
              int const half = tileShift - 1;
              matters =
                  m_field.cells[top.tile] & cellsIn(m_cell[0] >> half << 1 & 2, m_cell[1] >> half << 1 & 2,
                                                    m_cell[2] >> half << 1 & 2, 2);
            }
            break;
          }
          matters = false;
          m_path.push(m_field, child, depth);
        }
      }
      bool const done = leave(shift, s);
      if (matters) {
        auto const& top = m_path.top();
        int const tileShift = FieldPath::shiftOf(top.depth);
        s.tile = top.tile;
        s.brick = m_field.brick(top.tile);
        s.weight = m_field.weights[top.tile];
        s.scale = static_cast<float>(s.brick.core) / static_cast<float>(std::int64_t(1) << tileShift);
        for (int a = 0; a < 3; ++a) s.corner[a] = static_cast<float>(m_path.at[a] >> tileShift << tileShift);
        if (s.t1 > s.t0) {
          m_inside = !done;
          return true;
        }
      }
      if (done) break;
    }
    return false;
  }

private:
  /// log2 of the width, in roots, of the largest block about the cell in which nothing matters; 0 when the
  /// root itself is to be looked at.
  NANOVTT_HD int emptyLevel(float above) const {
    std::int32_t const x = m_cell[0], y = m_cell[1], z = m_cell[2];
    if (static_cast<std::uint32_t>(x | y | z) >> m_field.rootShift >= nanovtt::kRootTableWidth) return 0;
    int level = 3;
    if (m_field.rootWeight(level, x, y, z) > above) {
      for (--level; level > 0; --level)
        if (!(m_field.rootWeight(level, x, y, z) > above)) break;
      return level;
    }
    while (level < 6 && !(m_field.rootWeight(level + 1, x, y, z) > above)) ++level;
    return level;
  }
  /// Goes on behind the region of that width round the cell. @return true at the end.
  NANOVTT_HD bool leave(int shift, Segment& s) {
    float t = m_end;
    int axis = -1;
    std::int32_t low[3];
    std::int32_t const width = std::int32_t(1) << shift;
    for (int a = 0; a < 3; ++a) {
      low[a] = m_cell[a] >> shift << shift;
      float const d = m_ray.direction[a];
      if (d == 0) continue;
      float const out =
          (static_cast<float>(d > 0 ? low[a] + width : low[a]) - m_ray.origin[a]) * m_ray.inverse[a];
      if (out < t) t = out, axis = a;
    }
    if (t < m_t) t = m_t; // by rounding
    s.t0 = m_t, s.t1 = t;
    m_t = t;
    if (axis < 0) return true;
    for (int a = 0; a < 3; ++a) {
      std::int32_t const v = floorOf(m_ray.origin[a] + m_ray.direction[a] * t), last = low[a] + width - 1;
      m_cell[a] = a == axis    ? (m_ray.direction[a] > 0 ? low[a] + width : low[a] - 1)
                  : v < low[a] ? low[a]
                  : v > last   ? last
                               : v;
    }
    return false;
  }

  FieldView const& m_field;
  Ray const& m_ray;
  FieldPath m_path;
  std::int32_t m_cell[3] = {0, 0, 0};
  float m_t, m_end;
  bool m_inside;
};

} // namespace VLN::Render
