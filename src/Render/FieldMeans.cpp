// Coarse pictures: samples that stand for what lies about them.
//
//   +--+--+--+--+   A sample lies on the corner that eight voxels share, and takes the mean of the eight:
//   |  |  |  |  |   so nothing moves, and sums stay what they are.
//   +--+--x--+--+   The voxel of a tile is as wide as a tile two depths below it, whose mean is known.
//   |  |  |  |  |
//   +--+--+--+--+
#include "Reader/NanoVTTPath.h"
#include "Render/Field.h"
#include "Render/Threads.h"

#include <algorithm>
#include <cmath>
#include <limits>
#include <optional>

namespace VLN::Render {

using nanovtt::TileRef;

namespace {

constexpr std::int64_t kGrain = 64; // tiles of a piece of work

// Means of the voxels of one width.
class VoxelMeans {
public:
  /// @param limit The depth at which rays stop.
  VoxelMeans(FieldView const& view, nanovtt::BoundsReader const& bounds, std::int64_t width, int limit)
      : m_view(view)
      , m_bounds(bounds)
      , m_width(width)
      , m_limit(limit)
      , m_path(view.tree, depthOf(width)) {}

  std::int64_t width() const { return m_width; }

  /// @return NaN for a voxel that is drawn by finer samples, those of a merged block.
  float operator()(std::int64_t x, std::int64_t y, std::int64_t z) {
    auto const isOut = [](std::int64_t c) { return c < INT32_MIN || c > INT32_MAX; };
    if (isOut(x) || isOut(y) || isOut(z) ||
        !m_path.moveTo(static_cast<std::int32_t>(x), static_cast<std::int32_t>(y),
                       static_cast<std::int32_t>(z)))
      return m_view.background;
    TileRef const t = m_path.tile();
    if (t.width() == m_width) return m_bounds.mean(t.number);
    Brick const b = m_view.brick(t.number);
    std::int64_t const step = t.width() / b.core;
    if (t.depth <= m_limit && step < m_width) return std::numeric_limits<float>::quiet_NaN();
    auto const across = static_cast<int>(std::max<std::int64_t>(m_width / step, 1));
    auto const first = [&](std::int64_t p, std::int32_t corner) {
      return static_cast<int>((p - corner) / step);
    };
    int const i = first(x, t.corner.x), j = first(y, t.corner.y), k = first(z, t.corner.z);
    double sum = 0;
    for (int c = 0; c < across; ++c)
      for (int d = 0; d < across; ++d)
        for (int a = 0; a < across; ++a) sum += double(*b.at(i + a, j + d, k + c));
    return static_cast<float>(sum / (double(across) * across * across));
  }

private:
  static int depthOf(std::int64_t width) {
    int depth = nanovtt::kMaxDepth;
    while (std::int64_t(1) << (nanovtt::kTileSpaceBits - depth) < width) --depth;
    return depth;
  }

  FieldView const& m_view;
  nanovtt::BoundsReader const& m_bounds;
  std::int64_t m_width;
  int m_limit;
  nanovtt::TilePath m_path;
};

// The brick of a tile: each sample the mean of the eight voxels about it. Beside what is drawn by finer
// samples it stays what it is, so that both meet.
void fillMeans(TileRef const& tile, Brick const& own, VoxelMeans& voxels, std::vector<float>& room,
               float* out) {
  int const core = own.core;
  int const width = core + 2; // voxels from one before the tile to one behind it
  room.resize(width * width * width);
  float* v = room.data();
  std::int64_t const w = voxels.width();
  for (int k = -1; k <= core; ++k)
    for (int j = -1; j <= core; ++j)
      for (int i = -1; i <= core; ++i)
        *v++ = voxels(tile.corner.x + i * w, tile.corner.y + j * w, tile.corner.z + k * w);
  for (int k = 0; k <= core; ++k)
    for (int j = 0; j <= core; ++j)
      for (int i = 0; i <= core; ++i) {
        double sum = 0;
        for (int c = 0; c < 8; ++c)
          sum += double(room[((k + (c >> 2)) * width + j + (c >> 1 & 1)) * width + i + (c & 1)]);
        *out++ = std::isnan(sum) ? *own.at(i, j, k) : static_cast<float>(sum / 8);
      }
}

} // namespace

FieldView Field::wholeView() const {
  FieldView view = m_view;
  view.bricks = m_bricks.data();
  view.maxDepth = nanovtt::kMaxDepth;
  for (int a = 0; a < 3; ++a) view.low[a] = m_activeLow[a] - 1, view.high[a] = m_activeHigh[a] + 1;
  return view;
}

void Field::limitDepth(int depth, int threads) {
  if (depth == m_view.maxDepth) return;
  m_limitedRanges.clear();
  m_gathered.resize(m_gatheredCount);
  m_view.gathered = m_gathered.data();
  m_view.bricks = m_bricks.data();
  m_view.maxDepth = depth;
  // Coarse samples spread what there is as far as the next one.
  auto const reach = static_cast<float>(1 << (nanovtt::kMaxDepth - depth));
  for (int a = 0; a < 3; ++a)
    m_view.low[a] = m_activeLow[a] - reach, m_view.high[a] = m_activeHigh[a] + reach;
  if (depth < nanovtt::kMaxDepth) makeMeans(depth, threads);
}

void Field::makeMeans(int depth, int threads) {
  auto const& tree = m_view.tree;
  std::uint32_t const end = tree.tilesAbove(depth + 1);
  std::vector<std::uint32_t> coarse; // tiles where rays stop above others
  std::uint64_t floats = m_gatheredCount;
  m_limitedBricks.assign(m_bricks.begin(), m_bricks.begin() + end);
  m_limitedRanges.resize(end);
  for (std::uint32_t n = 0; n < end; ++n) {
    m_limitedRanges[n] = {m_bounds.low(n), m_bounds.high(n)};
    TileRef const& t = m_tiles[n];
    if (!t.valid() || !tree.hasChildren(n) || t.depth + tree.children(n).levels + 1 <= depth) continue;
    coarse.push_back(n);
    std::uint64_t const levels = m_bricks[n] >> kBrickLevelsShift & 7, core = std::uint64_t(4) << levels;
    m_limitedBricks[n] = floats | kBrickGathered | levels << kBrickLevelsShift;
    floats += (core + 1) * (core + 1) * (core + 1);
  }
  m_gathered.resize(floats);
  m_view.gathered = m_gathered.data();
  FieldView const whole = wholeView();
  forRanges(static_cast<std::int64_t>(coarse.size()), kGrain, threads,
            [&](std::int64_t begin, std::int64_t to) {
              std::vector<float> room;
              std::optional<VoxelMeans> voxels;
              for (std::int64_t c = begin; c < to; ++c) {
                std::uint32_t const n = coarse[c];
                int const core = whole.brick(n).core;
                std::int64_t const width = m_tiles[n].width() / core;
                if (!voxels || voxels->width() != width) voxels.emplace(whole, m_bounds, width, depth);
                float* const out = m_gathered.data() + (m_limitedBricks[n] & kBrickOffsetMask);
                fillMeans(m_tiles[n], whole.brick(n), *voxels, room, out);
                auto& [low, high] = m_limitedRanges[n];
                for (int s = 0; s < (core + 1) * (core + 1) * (core + 1); ++s) {
                  // The background about the tiles may be no value of theirs.
                  out[s] = std::clamp(out[s], m_bounds.low(), m_bounds.high());
                  low = std::min(low, out[s]), high = std::max(high, out[s]);
                }
              }
            });
  for (std::uint32_t n = end; n-- > 0;) {
    std::uint32_t const parent = tree.parent(n);
    if (parent == nanovtt::kNoTile) continue;
    auto& [low, high] = m_limitedRanges[parent];
    low = std::min(low, m_limitedRanges[n].first), high = std::max(high, m_limitedRanges[n].second);
  }
  m_view.bricks = m_limitedBricks.data();
}

} // namespace VLN::Render
