#include "Render/Field.h"

#include "Render/Bounds.h"
#include "Render/GatherImpl.h"
#include "Render/Threads.h"

#include <algorithm>
#include <cmath>
#include <limits>
#include <map>
#include <mutex>
#include <stdexcept>
#include <string>
#include <tuple>

namespace VLN::Render {

using nanovtt::GridReader;
using nanovtt::kNoTile;
using nanovtt::TileBlock;
using nanovtt::TileRef;

namespace {

constexpr std::int64_t kGrain = 512; // tiles of a piece of work
/// Beyond it, a float's steps are a sixteenth of a voxel.
constexpr double kWidestBox = 1 << 20;

} // namespace

Field::Field(GridReader const& grid, FieldOptions const& options)
    : m_grid(grid) {
  Scalar const scalar(grid, options.component);
  auto const& tree = grid.container();
  std::uint32_t const count = tree.tileCount();
  m_view.tree = tree;
  m_view.background = scalar.background();
  m_tiles.resize(count);
  tree.forEachTile([&](TileRef const& t) { m_tiles[t.number] = t; });
  // Bounds that were made before are those of lengths.
  bool const hasBounds =
      options.bounds && (options.component < 0 || nanovtt::componentCount(grid.type()) == 1);
  if (hasBounds) m_bounds = nanovtt::BoundsReader(options.bounds);

  fillBricks(scalar, hasBounds && m_bounds.isAllFinite(), options.threads);
  if (!hasBounds) {
    m_madeBounds = boundsOf(grid, m_tiles, scalar.background(),
                            [&](std::uint32_t n, std::vector<float>&) { return m_view.brick(n); }, true,
                            {options.component, 16, options.threads});
    m_bounds = nanovtt::BoundsReader(m_madeBounds.data());
  }

  // The header's box also counts samples of coarse tiles, which stand for more than what is active.
  double lowest[3], highest[3];
  m_isEmpty = false;
  for (int a = 0; a < 3; ++a) {
    lowest[a] = grid.tileBox(a), highest[a] = double(grid.tileBox(a + 3)) - 1;
    if (highest[a] < lowest[a]) m_isEmpty = true;
  }
  if (!m_isEmpty && m_bounds.box(0) <= m_bounds.box(3))
    for (int a = 0; a < 3; ++a)
      lowest[a] = std::max(lowest[a], double(m_bounds.box(a))),
      highest[a] = std::min(highest[a], double(m_bounds.box(a + 3)));
  for (int a = 0; a < 3; ++a) m_isEmpty = m_isEmpty || highest[a] < lowest[a];
  if (m_isEmpty) std::fill_n(lowest, 3, 0.0), std::fill_n(highest, 3, 0.0);
  place(lowest, highest);
}

void Field::fillBricks(Scalar const& scalar, bool isAllFinite, int threads) {
  auto const count = static_cast<std::uint32_t>(m_tiles.size());
  m_bricks.resize(count);
  std::vector<std::uint8_t> gathered(count);
  forRanges(count, kGrain, threads, [&](std::int64_t begin, std::int64_t end) {
    for (auto n = static_cast<std::uint32_t>(begin); n < static_cast<std::uint32_t>(end); ++n) {
      if (!m_tiles[n].valid()) continue;
      TileBlock const b = m_grid.block(n);
      gathered[n] = !liesReady(b) || !(isAllFinite || VLN::Render::isAllFinite(b));
    }
  });
  auto const* const first = reinterpret_cast<unsigned char const*>(m_grid.name()) - nanovtt::kGridNameOffset;
  std::uint64_t next = 0;
  for (std::uint32_t n = 0; n < count; ++n) {
    if (!m_tiles[n].valid()) continue;
    TileBlock const b = m_grid.block(n);
    if (gathered[n]) {
      m_bricks[n] = next | kBrickGathered;
      next += static_cast<std::uint64_t>(brickSamples(b.core));
    } else {
      m_bricks[n] = static_cast<std::uint64_t>(b.samples - first) / 4;
    }
    m_bricks[n] |= static_cast<std::uint64_t>(levelsOf(b)) << kBrickLevelsShift;
  }
  m_gatheredCount = next;
  m_gathered.resize(next);
  m_view.inBuffer = reinterpret_cast<float const*>(first);
  m_view.gathered = m_gathered.data();
  m_view.bricks = m_bricks.data();
  Gather const gather{m_grid, scalar};
  forRanges(count, kGrain, threads, [&](std::int64_t begin, std::int64_t end) {
    for (auto n = static_cast<std::uint32_t>(begin); n < static_cast<std::uint32_t>(end); ++n)
      if (gathered[n])
        gather(m_tiles[n], m_grid.block(n), m_gathered.data() + (m_bricks[n] & kBrickOffsetMask));
  });
}

void Field::place(double const lowest[3], double const highest[3]) {
  auto const& tree = m_view.tree;
  m_view.rootShift = nanovtt::kTileSpaceBits - tree.rootDepth();
  auto const llc = tree.lowestCorner();
  double const corner[3] = {double(llc.x), double(llc.y), double(llc.z)};
  double const rootWidth = std::ldexp(1.0, m_view.rootShift);
  for (int a = 0; a < 3; ++a) {
    if (highest[a] - lowest[a] > kWidestBox || highest[a] - corner[a] > 16 * kWidestBox ||
        rootWidth > kWidestBox)
      throw std::invalid_argument("its box is wider than " + std::to_string(int(kWidestBox)) + " voxels");
    m_origin[a] = corner[a];
    m_activeLow[a] = static_cast<float>(lowest[a] - m_origin[a]);
    m_activeHigh[a] = static_cast<float>(highest[a] - m_origin[a]);
    m_view.low[a] = m_activeLow[a] - 1, m_view.high[a] = m_activeHigh[a] + 1;
  }
}

void Field::weigh(Weight const& weight, int threads) {
  m_weights.assign(m_tiles.size(), 0);
  m_cells.assign(m_tiles.size(), 0);
  // Rays come to no deeper ones.
  std::int64_t const count = m_view.tree.tilesAbove(m_view.maxDepth + 1);
  forRanges(count, kGrain, threads, [&](std::int64_t begin, std::int64_t end) {
    for (auto n = static_cast<std::uint32_t>(begin); n < static_cast<std::uint32_t>(end); ++n) {
      if (!m_tiles[n].valid()) continue;
      auto const [from, to] = range(n);
      m_weights[n] = weight(from, to);
      if (!(m_weights[n] > 0)) continue;
      Brick const b = m_view.brick(n);
      // Cells of a merged block share bits.
      int const share = b.core / nanovtt::kTileWidth;
      for (int c = 0; c < nanovtt::kTileSamples; ++c) {
        int const i = c % 4 * share, j = c / 4 % 4 * share, k = c / 16 * share;
        float low = *b.at(i, j, k), high = low;
        for (int z = k; z <= k + share; ++z)
          for (int y = j; y <= j + share; ++y)
            for (int x = i; x <= i + share; ++x) {
              float const v = *b.at(x, y, z);
              low = std::min(low, v), high = std::max(high, v);
            }
        if (weight(low, high) > 0) m_cells[n] |= std::uint64_t(1) << c;
      }
    }
  });
  m_rootWeights.assign(FieldView::rootWeightsAt(7), 0);
  for (std::uint32_t slot = 0; slot < nanovtt::kMaxRoots; ++slot) {
    std::uint32_t const root = m_view.tree.root(slot);
    if (root == kNoTile || !(m_weights[root] > 0)) continue;
    for (int level = 1; level <= 6; ++level) {
      int const bits = 6 - level;
      auto const block =
          (slot / 4096 >> level << bits | slot / 64 % 64 >> level) << bits | slot % 64 >> level;
      float& most = m_rootWeights[static_cast<std::size_t>(FieldView::rootWeightsAt(level)) + block];
      most = std::max(most, m_weights[root]);
    }
  }
  m_view.rootWeights = m_rootWeights.data();
  m_view.weights = m_weights.data();
  m_view.cells = m_cells.data();
}

bool Field::isFinest(std::uint32_t n) const {
  TileRef const& t = m_tiles[n];
  return t.valid() && t.width() >> 2 == 1 << (m_bricks[n] >> kBrickLevelsShift & 7);
}

std::vector<Vec3> Field::outline(std::function<bool(float, float)> const& shows) const {
  // Of each row of tiles along x the ends are enough.
  std::map<std::tuple<std::int32_t, std::int32_t, int>, std::pair<std::int32_t, std::int32_t>> rows;
  for (std::uint32_t n = 0; n < m_tiles.size(); ++n) {
    TileRef const& t = m_tiles[n];
    if (!isFinest(n)) continue;
    if (!shows(m_bounds.low(n), m_bounds.high(n))) continue;
    auto const [at, isNew] = rows.try_emplace({t.corner.y, t.corner.z, t.width()}, t.corner.x, t.corner.x);
    auto& [low, high] = at->second;
    low = std::min(low, t.corner.x), high = std::max(high, t.corner.x);
  }
  std::vector<Vec3> corners;
  auto const add = [&](Vec3d from, Vec3d to) {
    Vec3 ends[2];
    for (int a = 0; a < 3; ++a) {
      ends[0][a] = std::clamp(static_cast<float>(from[a] - m_origin[a]), m_activeLow[a], m_activeHigh[a]);
      ends[1][a] = std::clamp(static_cast<float>(to[a] - m_origin[a]), m_activeLow[a], m_activeHigh[a]);
    }
    for (int c = 0; c < 8; ++c) corners.push_back({ends[c & 1].x, ends[c >> 1 & 1].y, ends[c >> 2].z});
  };
  for (auto const& [key, range] : rows) {
    auto const [y, z, width] = key;
    add({double(range.first), double(y), double(z)},
        {double(range.second) + width, double(y) + width, double(z) + width});
  }
  if (corners.empty()) add(m_origin + m_activeLow.as<double>(), m_origin + m_activeHigh.as<double>());
  return corners;
}

std::vector<float> Field::sortedValues(std::size_t count) const {
  FieldView const whole = wholeView();
  std::vector<float> values;
  std::vector<std::uint32_t> deepest;
  for (std::uint32_t n = 0; n < m_tiles.size(); ++n)
    if (isFinest(n)) deepest.push_back(n);
  if (deepest.empty())
    for (std::uint32_t n = 0; n < m_tiles.size(); ++n)
      if (m_tiles[n].valid()) deepest.push_back(n);
  std::size_t samples = 0;
  for (std::uint32_t n : deepest) {
    auto const core = static_cast<std::size_t>(whole.brick(n).core);
    samples += core * core * core;
  }
  std::size_t const step = 1 + samples / std::max<std::size_t>(count, 1);
  std::size_t next = 0, at = 0;
  for (std::uint32_t n : deepest) {
    Brick const b = whole.brick(n);
    for (int k = 0; k < b.core; ++k)
      for (int j = 0; j < b.core; ++j)
        for (int i = 0; i < b.core; ++i, ++at) {
          if (at != next) continue;
          next += step;
          float const v = *b.at(i, j, k);
          if (v != m_view.background) values.push_back(v);
        }
  }
  std::sort(values.begin(), values.end());
  return values;
}

} // namespace VLN::Render
