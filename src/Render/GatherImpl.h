// How bricks come about: a sample of any grid as the one number that is drawn, and the samples of a tile with
// the layer beyond its high sides.
#pragma once

#include "Render/FieldView.h"

#include <algorithm>
#include <cmath>
#include <stdexcept>
#include <string>

namespace VLN::Render {

inline int brickSamples(int core) { return (core + 1) * (core + 1) * (core + 1); }
inline int levelsOf(nanovtt::TileBlock const& b) {
  int levels = 0;
  for (int core = b.core; core > nanovtt::kTileWidth; core /= 2) ++levels;
  return levels;
}

/// @error std::invalid_argument for a component that the grid lacks.
class Scalar {
public:
  Scalar(nanovtt::GridReader const& grid, int component)
      : m_components(nanovtt::componentCount(grid.type()))
      , m_component(component) {
    if (component >= m_components)
      throw std::invalid_argument("its samples have no component " + std::to_string(component));
    m_background = static_cast<float>(raw(grid.defaultValue(), 0));
    if (!std::isfinite(m_background)) m_background = 0;
  }
  float operator()(nanovtt::TileBlock const& block, std::uint64_t n) const {
    auto const v = static_cast<float>(raw(block, n));
    return std::isfinite(v) ? v : m_background;
  }
  float background() const { return m_background; }

private:
  double raw(nanovtt::TileBlock const& block, std::uint64_t n) const {
    if (m_components == 1 || m_component >= 0) return block.getComponent(n, std::max(m_component, 0));
    double sum = 0;
    for (int c = 0; c < m_components; ++c) {
      double const v = block.getComponent(n, c);
      sum += v * v;
    }
    return std::sqrt(sum);
  }

  int m_components, m_component;
  float m_background = 0;
};

/// Whether samples lie as a brick needs them; some may yet be no finite numbers.
inline bool liesReady(nanovtt::TileBlock const& b) {
  return b.type == nanovtt::GridType::kFloat && b.hasHalo() &&
         b.strideJ == static_cast<std::uint64_t>(b.width);
}
inline bool isAllFinite(nanovtt::TileBlock const& b) {
  int const count = brickSamples(b.core);
  for (int n = 0; n < count; ++n)
    if (!std::isfinite(b.get<float>(static_cast<std::uint64_t>(n)))) return false;
  return true;
}

/// Fills bricks; what lies beyond the high sides is asked of the neighbours, each of which is looked up once.
struct Gather {
  nanovtt::GridReader const& grid;
  Scalar const& scalar;

  void operator()(nanovtt::TileRef const& tile, nanovtt::TileBlock const& b, float* out) const {
    int const width = b.core + 1, own = b.width;
    std::int32_t const step = tile.width() / b.core;
    int const depth = nanovtt::GridReader::sampleDepth(b, tile);
    struct Side {
      nanovtt::TileRef tile;
      nanovtt::TileBlock block;
      bool known = false;
    } sides[8];
    for (int k = 0; k < width; ++k)
      for (int j = 0; j < width; ++j)
        for (int i = 0; i < width; ++i, ++out) {
          if (i < own && j < own && k < own) {
            *out = scalar(b, b.index(i, j, k));
            continue;
          }
          Side& side = sides[(i == b.core) | (j == b.core) << 1 | (k == b.core) << 2];
          std::int64_t const p[3] = {tile.corner.x + std::int64_t(i) * step,
                                     tile.corner.y + std::int64_t(j) * step,
                                     tile.corner.z + std::int64_t(k) * step};
          if (std::max({p[0], p[1], p[2]}) > INT32_MAX) {
            *out = scalar.background();
            continue;
          }
          auto const x = static_cast<std::int32_t>(p[0]), y = static_cast<std::int32_t>(p[1]),
                     z = static_cast<std::int32_t>(p[2]);
          if (!side.known || !holdsAlone(side.tile, depth, x, y, z)) {
            side.known = true;
            side.tile = grid.container().find(x, y, z, depth);
            if (side.tile.valid()) side.block = grid.block(side.tile.number);
          }
          *out = side.tile.valid()
                     ? scalar(side.block, nanovtt::GridReader::sampleAt(side.block, side.tile, x, y, z))
                     : scalar.background();
        }
  }

private:
  // Only a tile of the depth that is asked for has nothing below it that is.
  static bool holdsAlone(nanovtt::TileRef const& t, int depth, std::int32_t x, std::int32_t y,
                         std::int32_t z) {
    auto const inside = [&](std::int32_t c, std::int32_t corner) {
      return c >= corner && c - std::int64_t(corner) < t.width();
    };
    return t.valid() && t.depth == depth && inside(x, t.corner.x) && inside(y, t.corner.y) &&
           inside(z, t.corner.z);
  }
};

} // namespace VLN::Render
