#include "Render/PixelBlocks.h"

#include "Render/Walk.h"

#include <algorithm>
#include <cmath>

namespace VLN::Render {

namespace {

/// Tiles are looked into that are seen wider than this, in pixels.
constexpr double kFinePixels = 2 * PixelBlocks::kWidth;

struct Cube {
  std::int32_t x, y, z;
  int shift; ///< log2 of the width
};

// Throws boxes on the picture.
class Splatter {
public:
  using Span = PixelBlocks::Span;

  Splatter(FieldView const& field, Affine const& toWorld, Camera const& camera, int width, int height,
           std::vector<Span>& spans)
      : m_field(field)
      , m_across((width + PixelBlocks::kWidth - 1) / PixelBlocks::kWidth)
      , m_down((height + PixelBlocks::kWidth - 1) / PixelBlocks::kWidth)
      , m_scale{0.5 * width / camera.halfWidth / PixelBlocks::kWidth,
                0.5 * height / camera.halfHeight / PixelBlocks::kWidth}
      , m_middle{0.5 * width / PixelBlocks::kWidth, 0.5 * height / PixelBlocks::kWidth}
      , m_spans(spans) {
    m_spans.assign(static_cast<std::size_t>(m_across) * static_cast<std::size_t>(m_down), {});
    auto const seen = [&](Vec3d d) {
      return Vec3d{dot(d, camera.right), -dot(d, camera.up), dot(d, camera.forward)};
    };
    m_origin = seen(toWorld.point({}) - camera.position);
    for (int a = 0; a < 3; ++a)
      m_edge[a] = seen({toWorld.rows[0][a], toWorld.rows[1][a], toWorld.rows[2][a]});
    m_pixel = PixelBlocks::kWidth * std::max(m_scale[0], m_scale[1]);
    for (int corner = 0; corner < 4; ++corner) {
      Vec3d const diagonal =
          m_edge[0] * (corner & 1 ? -1.0 : 1.0) + m_edge[1] * (corner & 2 ? -1.0 : 1.0) + m_edge[2];
      m_radius = std::max(m_radius, 0.5 * length(diagonal));
    }
  }

  void visit(std::uint32_t tile, int depth, Cube const& cube) {
    if (!(m_field.weights[tile] > 0) || isBeside(cube)) return;
    int const shift = FieldPath::shiftOf(depth);
    if (depth >= m_field.maxDepth) return splat(cube);
    auto const children = m_field.tree.children(tile);
    int const bits = children.levels + 1, childDepth = depth + bits, childShift = shift - bits;
    if (childDepth > m_field.maxDepth || !m_field.tree.hasChildren(tile) || isSmall(cube)) return splat(cube);
    int const across = 1 << bits;
    for (int k = 0; k < across; ++k)
      for (int j = 0; j < across; ++j)
        for (int i = 0; i < across; ++i) {
          Cube const part{cube.x + (i << childShift), cube.y + (j << childShift), cube.z + (k << childShift),
                          childShift};
          auto const child = children[static_cast<std::uint32_t>((k * across + j) * across + i)];
          if (child != nanovtt::kNoTile)
            visit(child, childDepth, part);
          else if (bits > 1 || m_field.cells[tile] & cellsIn(2 * i, 2 * j, 2 * k, 2))
            splat(part); // the tile's own
        }
  }

private:
  Vec3d middleOf(Cube const& c) const {
    double const half = 0.5 * double(std::int64_t(1) << c.shift);
    return m_origin + m_edge[0] * (c.x + half) + m_edge[1] * (c.y + half) + m_edge[2] * (c.z + half);
  }
  double radiusOf(Cube const& c) const { return m_radius * double(std::int64_t(1) << c.shift); }
  bool isSmall(Cube const& c) const {
    double const radius = radiusOf(c), distance = length(middleOf(c)) - radius;
    return distance > 0 && 2 * radius * m_pixel < kFinePixels * distance;
  }

  /// Whether a cube lies on the far side of an edge of the picture, or behind the camera.
  bool isBeside(Cube const& c) const {
    Vec3d const p = middleOf(c);
    double const radius = 1.01 * radiusOf(c);
    bool beside = p.z + radius < 0;
    for (int a = 0; a < 2; ++a) {
      double const h = m_middle[a] / m_scale[a]; // half the picture, at distance 1
      beside = beside || std::abs(p[a]) - h * p.z > radius * std::hypot(1, h);
    }
    return beside;
  }

  // A little larger than it is: rays are counted in floats.
  void splat(Cube const& c) {
    double const width = double(std::int64_t(1) << c.shift),
                 most = double(std::max({std::abs(c.x), std::abs(c.y), std::abs(c.z)})) + width;
    double const half = 0.5 * width + 1e-3 * width + 1e-6 * most;
    Vec3d const middle = middleOf(c);
    double const radius = m_radius * 2 * half, distance = length(middle);
    double nearest = 1e300, low[2] = {1e300, 1e300}, high[2] = {-1e300, -1e300};
    Vec3d const ex = m_edge[0] * half, ey = m_edge[1] * half, ez = m_edge[2] * half;
    for (int corner = 0; corner < 8; ++corner) {
      Vec3d const p = middle + (corner & 1 ? ex : -ex) + (corner & 2 ? ey : -ey) + (corner & 4 ? ez : -ez);
      nearest = std::min(nearest, p.z);
      double const by = 1 / p.z; // of use where all corners lie before the camera
      for (int a = 0; a < 2; ++a) {
        double const at = p[a] * by * m_scale[a];
        low[a] = std::min(low[a], at), high[a] = std::max(high[a], at);
      }
    }
    if (middle.z + radius < 0) return;
    // No point lies nearer than its part along the way to the middle.
    double const along =
        distance > 0
            ? (std::abs(dot(ex, middle)) + std::abs(dot(ey, middle)) + std::abs(dot(ez, middle))) / distance
            : radius;
    Span const span{static_cast<float>(std::max({distance - along, nearest, 0.0}) * (1 - 1e-6)),
                    static_cast<float>((distance + radius) * (1 + 1e-6))};
    int from[2] = {0, 0}, to[2] = {m_across - 1, m_down - 1};
    if (nearest > 1e-9 * distance)
      for (int a = 0; a < 2; ++a) {
        double const last = to[a];
        from[a] = static_cast<int>(std::clamp(std::floor(low[a] + m_middle[a] - 0.01), 0.0, last + 1));
        to[a] = static_cast<int>(std::clamp(std::floor(high[a] + m_middle[a] + 0.01), -1.0, last));
      }
    for (int y = from[1]; y <= to[1]; ++y)
      for (int x = from[0]; x <= to[0]; ++x) {
        Span& s = m_spans[static_cast<std::size_t>(y) * static_cast<std::size_t>(m_across) +
                          static_cast<std::size_t>(x)];
        s.near = std::min(s.near, span.near), s.far = std::max(s.far, span.far);
      }
  }

  FieldView const& m_field;
  int m_across, m_down;
  double m_scale[2], m_middle[2]; ///< from x / z to blocks
  double m_pixel;                 ///< pixels to a unit at distance 1
  Vec3d m_origin, m_edge[3];      ///< local space as the camera sees it: right, down, into the picture
  double m_radius = 0;            ///< of the sphere round a voxel
  std::vector<Span>& m_spans;
};

} // namespace

PixelBlocks::PixelBlocks(FieldView const& field, Affine const& toWorld, Camera const& camera, int width,
                         int height)
    : m_across((width + kWidth - 1) / kWidth) {
  Splatter splatter(field, toWorld, camera, width, height, m_spans);
  int const depth = nanovtt::kTileSpaceBits - field.rootShift;
  for (std::uint32_t slot = 0; slot < nanovtt::kMaxRoots; ++slot) {
    std::uint32_t const root = field.tree.root(slot);
    if (root == nanovtt::kNoTile) continue;
    auto const at = [&](int bits) { return static_cast<std::int32_t>(slot >> bits & 63) << field.rootShift; };
    splatter.visit(root, depth, {at(0), at(6), at(12), field.rootShift});
  }
}

} // namespace VLN::Render
