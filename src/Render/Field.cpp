#include "Render/Field.h"

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
using nanovtt::GridType;
using nanovtt::kNoTile;
using nanovtt::TileBlock;
using nanovtt::TileRef;

namespace {

constexpr std::int64_t kGrain = 512; // tiles of a piece of work
/// Beyond it, a float's steps are a sixteenth of a voxel.
constexpr double kWidestBox = 1 << 20;

int brickSamples(int core) { return (core + 1) * (core + 1) * (core + 1); }

// A sample of any grid as the one number that is drawn.
class Scalar {
public:
  Scalar(GridReader const& grid, int component)
      : m_components(nanovtt::componentCount(grid.type()))
      , m_component(component) {
    if (component >= m_components)
      throw std::invalid_argument("its samples have no component " + std::to_string(component));
    m_background = static_cast<float>(raw(grid.defaultValue(), 0));
    if (!std::isfinite(m_background)) m_background = 0;
  }
  float operator()(TileBlock const& block, std::uint64_t n) const {
    auto const v = static_cast<float>(raw(block, n));
    return std::isfinite(v) ? v : m_background;
  }
  float background() const { return m_background; }

private:
  double raw(TileBlock const& block, std::uint64_t n) const {
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

// Whether the brick of a tile can be used where it lies.
bool liesReady(TileBlock const& b) {
  if (b.type != GridType::kFloat || !b.hasHalo() || b.strideJ != static_cast<std::uint64_t>(b.width))
    return false;
  int const count = brickSamples(b.core);
  for (int n = 0; n < count; ++n)
    if (!std::isfinite(b.get<float>(static_cast<std::uint64_t>(n)))) return false;
  return true;
}

// The box of samples that differ from the background, of the deepest tiles at each place.
struct SampleBox {
  std::int64_t low[3] = {INT64_MAX, INT64_MAX, INT64_MAX}, high[3] = {INT64_MIN, INT64_MIN, INT64_MIN};

  bool empty() const { return low[0] > high[0]; }
  void join(SampleBox const& other) {
    for (int a = 0; a < 3; ++a)
      low[a] = std::min(low[a], other.low[a]), high[a] = std::max(high[a], other.high[a]);
  }
  void grow(nanovtt::ContainerReader const& tree, TileRef const& tile, Brick const& b, float background) {
    std::int32_t const step = tile.width() / b.core;
    bool const isInner = tile.depth < nanovtt::kMaxDepth;
    auto const children = isInner ? tree.children(tile.number) : nanovtt::ContainerReader::Children();
    auto const across = static_cast<int>(isInner ? children.across() : 1);
    for (int k = 0; k < b.core; ++k)
      for (int j = 0; j < b.core; ++j)
        for (int i = 0; i < b.core; ++i) {
          if (*b.at(i, j, k) == background) continue;
          auto const child = [&](int s) { return s * across / b.core; };
          if (isInner &&
              children[static_cast<std::uint32_t>((child(k) * across + child(j)) * across + child(i))] !=
                  kNoTile)
            continue;
          std::int64_t const p[3] = {tile.corner.x + std::int64_t(i) * step,
                                     tile.corner.y + std::int64_t(j) * step,
                                     tile.corner.z + std::int64_t(k) * step};
          for (int a = 0; a < 3; ++a)
            low[a] = std::min(low[a], p[a]), high[a] = std::max(high[a], p[a] + step - 1);
        }
  }
};

} // namespace

// Fills bricks; what lies beyond the high sides is asked of the neighbours, each of which is looked up once.
struct Field::Gather {
  GridReader const& grid;
  Scalar const& scalar;

  void operator()(TileRef const& tile, TileBlock const& b, float* out) const {
    int const width = b.core + 1, own = b.width;
    std::int32_t const step = tile.width() / b.core;
    struct Side {
      TileRef tile;
      TileBlock block;
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
          if (!side.known || !holdsAlone(side.tile, x, y, z)) {
            side.known = true;
            side.tile = grid.container().find(x, y, z);
            if (side.tile.valid()) side.block = grid.block(side.tile.number);
          }
          *out = side.tile.valid() ? scalar(side.block, GridReader::sampleAt(side.block, side.tile, x, y, z))
                                   : scalar.background();
        }
  }

private:
  // Only a tile of the deepest depth has nothing below it anywhere.
  static bool holdsAlone(TileRef const& t, std::int32_t x, std::int32_t y, std::int32_t z) {
    auto const inside = [&](std::int32_t c, std::int32_t corner) {
      return c >= corner && c - std::int64_t(corner) < t.width();
    };
    return t.valid() && t.depth == nanovtt::kMaxDepth && inside(x, t.corner.x) && inside(y, t.corner.y) &&
           inside(z, t.corner.z);
  }
};

Field::Field(GridReader const& grid, FieldOptions const& options)
    : m_grid(grid) {
  Scalar const scalar(grid, options.component);
  auto const& tree = grid.container();
  std::uint32_t const count = tree.tileCount();
  m_view.tree = tree;
  m_view.background = scalar.background();
  m_tiles.resize(count);
  tree.forEachTile([&](TileRef const& t) { m_tiles[t.number] = t; });

  // Where each brick lies.
  m_bricks.resize(count);
  std::vector<std::uint8_t> gathered(count);
  forRanges(count, kGrain, options.threads, [&](std::int64_t begin, std::int64_t end) {
    for (auto n = static_cast<std::uint32_t>(begin); n < static_cast<std::uint32_t>(end); ++n)
      gathered[n] = m_tiles[n].valid() && !liesReady(grid.block(n));
  });
  auto const* const first = reinterpret_cast<unsigned char const*>(grid.name()) - nanovtt::kGridNameOffset;
  std::uint64_t beside = 0;
  for (std::uint32_t n = 0; n < count; ++n) {
    if (!m_tiles[n].valid()) continue;
    TileBlock const b = grid.block(n);
    std::uint64_t levels = 0;
    for (int core = b.core; core > nanovtt::kTileWidth; core /= 2) ++levels;
    if (gathered[n]) {
      m_bricks[n] = beside | kBrickBeside;
      beside += static_cast<std::uint64_t>(brickSamples(b.core));
    } else {
      m_bricks[n] = static_cast<std::uint64_t>(b.samples - first) / 4;
    }
    m_bricks[n] |= levels << kBrickLevelsShift;
  }
  m_beside.resize(beside);
  m_view.inBuffer = reinterpret_cast<float const*>(first);
  m_view.beside = m_beside.data();
  m_view.bricks = m_bricks.data();

  // Bricks, and the bounds of each one's own samples.
  std::vector<float> lows(count), highs(count);
  m_means.resize(count);
  Gather const gather{grid, scalar};
  SampleBox box;
  std::mutex boxLock;
  forRanges(count, kGrain, options.threads, [&](std::int64_t begin, std::int64_t end) {
    SampleBox own;
    for (auto n = static_cast<std::uint32_t>(begin); n < static_cast<std::uint32_t>(end); ++n) {
      lows[n] = std::numeric_limits<float>::infinity(), highs[n] = -lows[n];
      if (!m_tiles[n].valid()) continue;
      if (gathered[n]) gather(m_tiles[n], grid.block(n), m_beside.data() + (m_bricks[n] & kBrickOffsetMask));
      Brick const b = m_view.brick(n);
      double sum = 0;
      for (int k = 0; k <= b.core; ++k)
        for (int j = 0; j <= b.core; ++j)
          for (int i = 0; i <= b.core; ++i) {
            float const v = *b.at(i, j, k);
            lows[n] = std::min(lows[n], v), highs[n] = std::max(highs[n], v);
            if (i < b.core && j < b.core && k < b.core) sum += double(v);
          }
      m_means[n] = static_cast<float>(sum / (double(b.core) * b.core * b.core));
      if (lows[n] != scalar.background() || highs[n] != scalar.background())
        own.grow(tree, m_tiles[n], b, scalar.background());
    }
    std::lock_guard const lock(boxLock);
    box.join(own);
  });
  // The header's box also counts samples of coarse tiles, which stand for more than what is active.
  double lowest[3], highest[3];
  m_isEmpty = false;
  for (int a = 0; a < 3; ++a) {
    lowest[a] = grid.tileBox(a), highest[a] = double(grid.tileBox(a + 3)) - 1;
    if (highest[a] < lowest[a]) m_isEmpty = true;
  }
  if (!m_isEmpty && !box.empty())
    for (int a = 0; a < 3; ++a)
      lowest[a] = std::max(lowest[a], double(box.low[a])),
      highest[a] = std::min(highest[a], double(box.high[a]));
  for (int a = 0; a < 3; ++a) m_isEmpty = m_isEmpty || highest[a] < lowest[a];
  if (m_isEmpty) std::fill_n(lowest, 3, 0.0), std::fill_n(highest, 3, 0.0);
  place(lowest, highest);

  // Children have larger numbers than their parents.
  std::vector<double> below(count), covered(count);
  for (std::uint32_t n = count; n-- > 0;) {
    if (!m_tiles[n].valid()) continue;
    if (covered[n] > 0) m_means[n] = static_cast<float>(below[n] + (1 - covered[n]) * double(m_means[n]));
    std::uint32_t const parent = tree.parent(n);
    if (parent == kNoTile) continue;
    lows[parent] = std::min(lows[parent], lows[n]), highs[parent] = std::max(highs[parent], highs[n]);
    double const share = std::ldexp(1.0, -3 * (m_tiles[n].depth - m_tiles[parent].depth));
    below[parent] += share * double(m_means[n]), covered[parent] += share;
  }

  m_low = std::numeric_limits<float>::infinity(), m_high = -m_low;
  for (std::uint32_t n = 0; n < count; ++n)
    m_low = std::min(m_low, lows[n]), m_high = std::max(m_high, highs[n]);
  if (!(m_low <= m_high)) m_low = m_high = 0;
  m_quantum = (double(m_high) - double(m_low)) / 65535;
  m_bounds.resize(count);
  for (std::uint32_t n = 0; n < count; ++n) {
    TileBounds& b = m_bounds[n];
    b = {0, 0};
    if (!m_tiles[n].valid() || m_quantum == 0) continue;
    auto const code = [&](double v) { return static_cast<std::uint16_t>(std::clamp(v, 0.0, 65535.0)); };
    b.low = code(std::floor((double(lows[n]) - double(m_low)) / m_quantum));
    b.high = code(std::ceil((double(highs[n]) - double(m_low)) / m_quantum));
    while (b.low > 0 && value(b.low) > lows[n]) --b.low;
    while (b.high < 65535 && value(b.high) < highs[n]) ++b.high;
  }
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

float Field::value(std::uint16_t code) const {
  if (code == 65535) return m_high;
  return static_cast<float>(double(m_low) + code * m_quantum);
}

void Field::weigh(Weight const& weight, int threads) {
  m_weights.assign(m_bounds.size(), 0);
  m_cells.assign(m_bounds.size(), 0);
  forRanges(static_cast<std::int64_t>(m_bounds.size()), kGrain, threads,
            [&](std::int64_t begin, std::int64_t end) {
              for (auto n = static_cast<std::uint32_t>(begin); n < static_cast<std::uint32_t>(end); ++n) {
                if (!m_tiles[n].valid()) continue;
                m_weights[n] = weight(value(m_bounds[n].low), value(m_bounds[n].high));
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
  m_rootWeights.assign(static_cast<std::size_t>(FieldView::rootWeightsAt(7)), 0);
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
  return t.valid() && t.width() == m_view.brick(n).core;
}

std::vector<Vec3> Field::outline(std::function<bool(float, float)> const& shows) const {
  // Of each row of tiles along x the ends are enough.
  std::map<std::tuple<std::int32_t, std::int32_t, int>, std::pair<std::int32_t, std::int32_t>> rows;
  for (std::uint32_t n = 0; n < m_tiles.size(); ++n) {
    TileRef const& t = m_tiles[n];
    if (!isFinest(n)) continue;
    if (!shows(value(m_bounds[n].low), value(m_bounds[n].high))) continue;
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
  std::vector<float> values;
  std::vector<std::uint32_t> deepest;
  for (std::uint32_t n = 0; n < m_tiles.size(); ++n)
    if (isFinest(n)) deepest.push_back(n);
  if (deepest.empty())
    for (std::uint32_t n = 0; n < m_tiles.size(); ++n)
      if (m_tiles[n].valid()) deepest.push_back(n);
  std::size_t samples = 0;
  for (std::uint32_t n : deepest) {
    auto const core = static_cast<std::size_t>(m_view.brick(n).core);
    samples += core * core * core;
  }
  std::size_t const step = 1 + samples / std::max<std::size_t>(count, 1);
  std::size_t next = 0, at = 0;
  for (std::uint32_t n : deepest) {
    Brick const b = m_view.brick(n);
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
