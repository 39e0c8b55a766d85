#include "Render/Bricks.h"

#include "Render/Threads.h"

#include <algorithm>
#include <cmath>

namespace VLN::Render {

using nanovtt::kNoTile;
using nanovtt::TileRef;

namespace {

constexpr float kLargest = 1e38f; // the range of two such values is finite

// A box that is read from one tile alone: from the tile's own samples, none of its children.
struct Item {
  std::int64_t low[3];
  std::int64_t width;
  int level; ///< of the widest bricks whose samples are as near to each other as the tile's
};

class Packer {
public:
  Packer(Field const& field, PackOptions const& options)
      : m_view(field.wholeView())
      , m_tiles(field.tiles())
      , m_options(options) {
    // Coarse samples are means of those of the next depth, where there is one.
    m_isMean = options.depth < finestDepth(field);
    m_view.maxDepth = std::max(options.depth + m_isMean, m_view.tree.rootDepth());
    m_packed.depth = options.depth;
    m_step = std::int64_t(1) << (nanovtt::kMaxDepth - options.depth);
    m_packed.spacing = static_cast<double>(m_step);
    for (int a = 0; a < 3; ++a) m_fieldOrigin[a] = static_cast<std::int64_t>(field.origin()[a]);
  }

  PackedField pack() {
    for (TileRef const& t : m_tiles)
      if (t.valid()) addTile(t);
    if (m_items.empty()) return std::move(m_packed);
    place();
    std::vector<std::uint32_t> all(m_items.size());
    for (std::size_t n = 0; n < all.size(); ++n) all[n] = static_cast<std::uint32_t>(n);
    divide({0, 0, 0, static_cast<std::uint32_t>(m_packed.levels), 0, 0}, all);
    if (m_packed.bricks.size() <= m_options.mostBricks) fill();
    return std::move(m_packed);
  }

private:
  // The items of a tile: all of it, or the places of missing children.
  void addTile(TileRef const& t) {
    if (t.depth > m_view.maxDepth) return;
    Brick const b = m_view.brick(t.number);
    std::int64_t const spacing = t.width() / b.core;
    int level = 0;
    while (m_step << 2 * (level + 1) <= spacing) ++level;
    int across = 1;
    nanovtt::ContainerReader::Children children;
    if (t.depth < nanovtt::kMaxDepth) {
      children = m_view.tree.children(t.number);
      // All of a tile's children lie at one depth.
      if (t.depth + children.levels + 1 <= m_view.maxDepth) across = static_cast<int>(children.across());
    }
    std::int64_t const corner[3] = {t.corner.x - m_fieldOrigin[0], t.corner.y - m_fieldOrigin[1],
                                    t.corner.z - m_fieldOrigin[2]};
    std::int64_t const width = t.width() / across;
    for (int n = 0; n < across * across * across; ++n) {
      if (across > 1 && children[static_cast<std::uint32_t>(n)] != kNoTile) continue;
      std::int64_t const at[3] = {n % across * width, n / across % across * width,
                                  n / across / across * width};
      if (isBackground(b, at, width, spacing)) continue;
      m_items.push_back({{corner[0] + at[0], corner[1] + at[1], corner[2] + at[2]}, width, level});
    }
  }

  bool isBackground(Brick const& b, std::int64_t const at[3], std::int64_t width,
                    std::int64_t spacing) const {
    // A child may be narrower than the samples of its parent are apart.
    int first[3], last[3];
    for (int a = 0; a < 3; ++a)
      first[a] = static_cast<int>(at[a] / spacing),
      last[a] = static_cast<int>((at[a] + width + spacing - 1) / spacing);
    for (int k = first[2]; k <= last[2]; ++k)
      for (int j = first[1]; j <= last[1]; ++j)
        for (int i = first[0]; i <= last[0]; ++i)
          if (*b.at(i, j, k) != m_view.background) return false;
    return true;
  }

  // Where bricks begin: all of one level begin at multiples of their width, in tile space.
  void place() {
    int coarsest = 0;
    std::int64_t low[3] = {INT64_MAX, INT64_MAX, INT64_MAX}, high[3] = {INT64_MIN, INT64_MIN, INT64_MIN};
    for (Item const& item : m_items) {
      coarsest = std::max(coarsest, item.level);
      for (int a = 0; a < 3; ++a)
        low[a] = std::min(low[a], item.low[a]), high[a] = std::max(high[a], item.low[a] + item.width);
    }
    std::int64_t const grain = kPackedCore * m_step << 2 * coarsest;
    std::int64_t extent = 0;
    for (int a = 0; a < 3; ++a) {
      std::int64_t const tile = low[a] + m_fieldOrigin[a];
      m_origin[a] = low[a] - ((tile % grain + grain) % grain);
      m_packed.origin[a] = static_cast<double>(m_origin[a]);
      extent = std::max(extent, high[a] - m_origin[a]);
    }
    // More levels than any brick has: the root is divided.
    m_packed.levels = coarsest + 1;
    while (kPackedCore * m_step << 2 * m_packed.levels < extent) ++m_packed.levels;
  }

  std::int64_t widthOf(std::uint32_t level) const { return kPackedCore * m_step << 2 * level; }

  // One brick where no item asks for narrower ones, else its parts.
  void divide(PackedBrick const& cell, std::vector<std::uint32_t> const& items) {
    if (m_packed.bricks.size() > m_options.mostBricks) return;
    int finest = INT32_MAX;
    for (std::uint32_t n : items) finest = std::min(finest, m_items[n].level);
    if (finest >= static_cast<int>(cell.level)) {
      m_packed.bricks.push_back(cell);
      return;
    }
    std::int64_t const width = widthOf(cell.level - 1);
    std::int64_t const corner[3] = {m_origin[0] + cell.x * 4 * width, m_origin[1] + cell.y * 4 * width,
                                    m_origin[2] + cell.z * 4 * width};
    std::vector<std::uint32_t> parts[64];
    for (std::uint32_t n : items) {
      std::int64_t first[3], last[3];
      for (int a = 0; a < 3; ++a) {
        std::int64_t const from = m_items[n].low[a] - corner[a];
        first[a] = std::max<std::int64_t>(from, 0) / width;
        last[a] = std::min<std::int64_t>((from + m_items[n].width - 1) / width, 3);
      }
      for (std::int64_t k = first[2]; k <= last[2]; ++k)
        for (std::int64_t j = first[1]; j <= last[1]; ++j)
          for (std::int64_t i = first[0]; i <= last[0]; ++i) parts[(k * 4 + j) * 4 + i].push_back(n);
    }
    for (std::uint32_t n = 0; n < 64; ++n)
      if (!parts[n].empty())
        divide({cell.x * 4 + n % 4, cell.y * 4 + n / 4 % 4, cell.z * 4 + n / 16, cell.level - 1, 0, 0},
               parts[n]);
  }

  void fill() {
    auto& bricks = m_packed.bricks;
    auto& codes = m_packed.codes;
    codes.resize(bricks.size() * kPackedSamples);
    forRanges(static_cast<std::int64_t>(bricks.size()), 16, m_options.threads,
              [&](std::int64_t begin, std::int64_t end) {
                for (auto n = begin; n < end; ++n) fillBrick(bricks[n], codes.data() + n * kPackedSamples);
              });
    // What is one value needs no codes, and the background no brick.
    std::size_t kept = 0, coded = 0;
    for (std::size_t n = 0; n < bricks.size(); ++n) {
      PackedBrick const& b = bricks[n];
      if (b.low == b.high && b.low == m_view.background) continue;
      if (b.low < b.high)
        std::copy_n(codes.begin() + static_cast<std::ptrdiff_t>(n * kPackedSamples), kPackedSamples,
                    codes.begin() + static_cast<std::ptrdiff_t>(coded++ * kPackedSamples));
      bricks[kept++] = b;
    }
    bricks.resize(kept);
    codes.resize(coded * kPackedSamples);
  }

  void fillBrick(PackedBrick& brick, std::uint8_t* codes) const {
    std::int64_t const spacing = m_step << 2 * brick.level, width = widthOf(brick.level);
    std::int64_t const corner[3] = {m_origin[0] + brick.x * width, m_origin[1] + brick.y * width,
                                    m_origin[2] + brick.z * width};
    float values[kPackedSamples];
    if (m_isMean && brick.level == 0)
      readMeans(corner, values);
    else
      read(corner, spacing, kPackedWidth, values);
    for (float& v : values) v = std::clamp(v, -kLargest, kLargest);
    auto const [least, most] = std::minmax_element(values, values + kPackedSamples);
    brick.low = *least, brick.high = *most;
    if (!(brick.low < brick.high)) return;
    double low = double(brick.low), step = (double(brick.high) - low) / 255;
    if (brick.low < 0 && brick.high > 0) {
      // 0 is a code: rounded to either side, a plateau of zeros would be full of surfaces.
      step = (double(brick.high) - low) / 254;
      low = -std::ceil(-low / step) * step;
      brick.low = static_cast<float>(low), brick.high = static_cast<float>(low + 255 * step);
    }
    for (int n = 0; n < kPackedSamples; ++n)
      codes[n] =
          static_cast<std::uint8_t>(std::clamp(std::lround((double(values[n]) - low) / step), 0l, 255l));
  }

  // Values of a cube of that many samples along an axis.
  void read(std::int64_t const corner[3], std::int64_t spacing, int width, float* out) const {
    FieldPath path;
    for (int k = 0; k < width; ++k)
      for (int j = 0; j < width; ++j)
        for (int i = 0; i < width; ++i)
          *out++ = path.value(m_view, {static_cast<float>(corner[0] + i * spacing),
                                       static_cast<float>(corner[1] + j * spacing),
                                       static_cast<float>(corner[2] + k * spacing)});
  }

  // From samples twice as near to each other, by a tent of 1/4, 1/2, 1/4 along each axis in turn.
  void readMeans(std::int64_t const corner[3], float* out) const {
    constexpr int kFine = 2 * kPackedWidth + 1;
    std::int64_t const half = m_step / 2;
    std::int64_t const first[3] = {corner[0] - half, corner[1] - half, corner[2] - half};
    std::vector<float> values(kFine * kFine * kFine);
    read(first, half, kFine, values.data());
    int size[3] = {kFine, kFine, kFine};
    for (int axis = 0; axis < 3; ++axis) {
      int const stride = axis == 0 ? 1 : axis == 1 ? size[0] : size[0] * size[1];
      int to[3] = {size[0], size[1], size[2]};
      to[axis] = kPackedWidth;
      std::size_t n = 0; // behind what is still read
      for (int k = 0; k < to[2]; ++k)
        for (int j = 0; j < to[1]; ++j)
          for (int i = 0; i < to[0]; ++i, ++n) {
            int const at[3] = {axis == 0 ? 2 * i : i, axis == 1 ? 2 * j : j, axis == 2 ? 2 * k : k};
            float const* const v = values.data() + (at[2] * size[1] + at[1]) * size[0] + at[0];
            // Equal values stay equal.
            values[n] = v[0] == v[stride] && v[stride] == v[2 * stride]
                            ? v[0]
                            : 0.25f * v[0] + 0.5f * v[stride] + 0.25f * v[2 * stride];
          }
      size[axis] = kPackedWidth;
    }
    std::copy_n(values.begin(), kPackedSamples, out);
  }

  FieldView m_view;
  std::vector<TileRef> const& m_tiles;
  bool m_isMean = false;
  PackOptions const m_options;
  PackedField m_packed;
  std::int64_t m_step, m_fieldOrigin[3], m_origin[3];
  std::vector<Item> m_items;
};

} // namespace

int finestDepth(Field const& field) {
  FieldView const whole = field.wholeView();
  int depth = 0;
  for (TileRef const& t : field.tiles()) {
    if (!t.valid()) continue;
    int own = t.depth;
    for (int core = whole.brick(t.number).core; core > nanovtt::kTileWidth; core /= 2) ++own;
    depth = std::max(depth, own);
  }
  return depth;
}

PackedField packField(Field const& field, PackOptions const& options) {
  return Packer(field, options).pack();
}

} // namespace VLN::Render
