#include "Render/Bounds.h"

#include "Render/GatherImpl.h"
#include "Render/Threads.h"

#include <atomic>
#include <limits>
#include <mutex>

namespace VLN::Render {

using nanovtt::kNoTile;
using nanovtt::TileRef;

namespace {

constexpr std::int64_t kGrain = 512; // tiles of a piece of work

// The box of samples that differ from the background, of the deepest tiles at each place.
struct SampleBox {
  std::int64_t low[3] = {INT64_MAX, INT64_MAX, INT64_MAX}, high[3] = {INT64_MIN, INT64_MIN, INT64_MIN};

  void join(SampleBox const& other) {
    for (int a = 0; a < 3; ++a)
      low[a] = std::min(low[a], other.low[a]), high[a] = std::max(high[a], other.high[a]);
  }
  void add(std::int64_t x, std::int64_t y, std::int64_t z, std::int64_t width) {
    std::int64_t const p[3] = {x, y, z};
    for (int a = 0; a < 3; ++a)
      low[a] = std::min(low[a], p[a]), high[a] = std::max(high[a], p[a] + width - 1);
  }
};

struct Ranges {
  std::vector<float> lows, highs;
  std::vector<double> means; ///< at first the part that the tile's own samples have in it
  SampleBox box;
};

// Of each tile's own samples.
Ranges ownRanges(nanovtt::ContainerReader const& tree, std::vector<TileRef> const& tiles, float background,
                 std::function<Brick(std::uint32_t, std::vector<float>&)> const& brick, int threads) {
  auto const count = static_cast<std::uint32_t>(tiles.size());
  Ranges all{std::vector<float>(count, std::numeric_limits<float>::infinity()),
             std::vector<float>(count, -std::numeric_limits<float>::infinity()),
             std::vector<double>(count),
             {}};
  std::mutex boxLock;
  forRanges(count, kGrain, threads, [&](std::int64_t begin, std::int64_t end) {
    SampleBox box;
    std::vector<float> room;
    for (auto n = static_cast<std::uint32_t>(begin); n < static_cast<std::uint32_t>(end); ++n) {
      TileRef const& tile = tiles[n];
      if (!tile.valid()) continue;
      Brick const b = brick(n, room);
      int const w = b.core + 1;
      float low = b.samples[0], high = low;
      for (int s = 1; s < w * w * w; ++s)
        low = std::min(low, b.samples[s]), high = std::max(high, b.samples[s]);
      all.lows[n] = low, all.highs[n] = high;

      // What lies in a child is the child's.
      bool const isCovered = tile.depth < nanovtt::kMaxDepth && tree.hasChildren(n);
      nanovtt::ContainerReader::Children const children =
          isCovered ? tree.children(n) : nanovtt::ContainerReader::Children();
      auto const across = isCovered ? static_cast<int>(children.across()) : 1;
      auto const child = [&](int s) { return s * across / b.core; };
      bool const mayGrow = low != background || high != background;
      std::int64_t const step = tile.width() / b.core;
      double sum = 0;
      for (int k = 0; k < b.core; ++k)
        for (int j = 0; j < b.core; ++j)
          for (int i = 0; i < b.core; ++i) {
            if (isCovered &&
                children[static_cast<std::uint32_t>((child(k) * across + child(j)) * across + child(i))] !=
                    kNoTile)
              continue;
            float const v = *b.at(i, j, k);
            sum += double(v);
            if (mayGrow && v != background)
              box.add(tile.corner.x + i * step, tile.corner.y + j * step, tile.corner.z + k * step, step);
          }
      all.means[n] = sum / (double(b.core) * b.core * b.core);
    }
    std::lock_guard const lock(boxLock);
    all.box.join(box);
  });
  return all;
}

// Codes of bounds and means.
class RowWriter {
public:
  RowWriter(unsigned char* rows, int bits, float low, float high)
      : m_rows(rows)
      , m_bits(bits)
      , m_last((1u << bits) - 1)
      , m_low(low)
      , m_high(high)
      , m_quantum((double(high) - double(low)) / m_last) {}

  void operator()(std::uint32_t tile, float low, float high, double mean) const {
    std::uint32_t from = 0, to = 0, middle = 0;
    if (m_quantum > 0) {
      from = code(std::floor((double(low) - double(m_low)) / m_quantum));
      to = code(std::ceil((double(high) - double(m_low)) / m_quantum));
      while (from > 0 && value(from) > low) --from;
      while (to < m_last && value(to) < high) ++to;
      double const bottom = double(value(from)), extent = double(value(to)) - bottom;
      if (extent > 0) middle = code(std::round((mean - bottom) / extent * m_last));
    }
    store(tile, 0, from), store(tile, 1, to), store(tile, 2, middle);
  }

private:
  std::uint32_t code(double c) const {
    return static_cast<std::uint32_t>(std::clamp(c, 0.0, double(m_last)));
  }
  float value(std::uint32_t c) const { return nanovtt::boundsValue(m_low, m_high, c, m_last); }
  void store(std::uint32_t tile, int n, std::uint32_t c) const {
    std::uint64_t const at = std::uint64_t(tile) * nanovtt::kBoundsRowCodes + static_cast<std::uint64_t>(n);
    if (m_bits == 8)
      m_rows[at] = static_cast<unsigned char>(c);
    else
      nanovtt::store(m_rows + 2 * at, static_cast<std::uint16_t>(c));
  }

  unsigned char* m_rows;
  int m_bits;
  std::uint32_t m_last;
  float m_low, m_high;
  double m_quantum;
};

} // namespace

std::vector<unsigned char> boundsOf(nanovtt::GridReader const& grid, std::vector<TileRef> const& tiles,
                                    float background,
                                    std::function<Brick(std::uint32_t, std::vector<float>&)> const& brick,
                                    bool isAllFinite, BoundsOptions const& options) {
  auto const& tree = grid.container();
  auto const count = static_cast<std::uint32_t>(tiles.size());
  Ranges r = ownRanges(tree, tiles, background, brick, options.threads);
  // Children have larger numbers than their parents.
  float low = std::numeric_limits<float>::infinity(), high = -low;
  for (std::uint32_t n = count; n-- > 0;) {
    if (!tiles[n].valid()) continue;
    low = std::min(low, r.lows[n]), high = std::max(high, r.highs[n]);
    std::uint32_t const parent = tree.parent(n);
    if (parent == kNoTile) continue;
    r.lows[parent] = std::min(r.lows[parent], r.lows[n]);
    r.highs[parent] = std::max(r.highs[parent], r.highs[n]);
    r.means[parent] += std::ldexp(r.means[n], -3 * (tiles[n].depth - tiles[parent].depth));
  }
  if (!(low <= high)) low = high = 0;

  std::vector<unsigned char> bytes(nanovtt::boundsBytes(count, options.bits));
  auto const put = [&](std::uint64_t at, auto const& value) { nanovtt::store(bytes.data() + at, value); };
  put(nanovtt::kBoundsTilesOffset, count);
  put(nanovtt::kBoundsBitsOffset, static_cast<std::uint32_t>(options.bits));
  put(nanovtt::kBoundsLowOffset, low), put(nanovtt::kBoundsHighOffset, high);
  put(nanovtt::kBoundsFlagsOffset, isAllFinite ? nanovtt::kBoundsAllFinite : 0u);
  for (int a = 0; a < 3; ++a) {
    bool const isEmpty = r.box.low[a] > r.box.high[a];
    auto const first = isEmpty ? 1 : std::clamp<std::int64_t>(r.box.low[a], INT32_MIN, INT32_MAX),
               last = isEmpty ? 0 : std::clamp<std::int64_t>(r.box.high[a], INT32_MIN, INT32_MAX);
    put(nanovtt::kBoundsBoxOffset + 4 * static_cast<std::uint64_t>(a), static_cast<std::int32_t>(first));
    put(nanovtt::kBoundsBoxOffset + 4 * static_cast<std::uint64_t>(a + 3), static_cast<std::int32_t>(last));
  }
  RowWriter const write(bytes.data() + nanovtt::kBoundsRowsOffset, options.bits, low, high);
  forRanges(count, kGrain, options.threads, [&](std::int64_t begin, std::int64_t end) {
    for (auto n = static_cast<std::uint32_t>(begin); n < static_cast<std::uint32_t>(end); ++n)
      if (tiles[n].valid()) write(n, r.lows[n], r.highs[n], r.means[n]);
  });
  return bytes;
}

std::vector<unsigned char> makeBounds(nanovtt::GridReader const& grid, BoundsOptions const& options) {
  Scalar const scalar(grid, options.component);
  Gather const gather{grid, scalar};
  std::vector<TileRef> tiles(grid.container().tileCount());
  grid.container().forEachTile([&](TileRef const& t) { tiles[t.number] = t; });
  std::atomic<bool> allFinite = true;
  auto const brick = [&](std::uint32_t n, std::vector<float>& room) {
    auto const block = grid.block(n);
    if (liesReady(block)) {
      if (isAllFinite(block))
        return Brick{reinterpret_cast<float const*>(block.samples), block.core, block.core + 1};
      allFinite = false;
    }
    room.resize(brickSamples(block.core));
    gather(tiles[n], block, room.data());
    return Brick{room.data(), block.core, block.core + 1};
  };
  auto bytes = boundsOf(grid, tiles, scalar.background(), brick, true, options);
  if (!allFinite) nanovtt::store(bytes.data() + nanovtt::kBoundsFlagsOffset, std::uint32_t(0));
  return bytes;
}

} // namespace VLN::Render
