// FieldView: one number at every place of a grid, ready for rays.
//
//   tile number ──> brick   its samples as floats, a cube of core + 1 along an axis: the high side belongs to
//                           the neighbours, so that every trilinear read stays in it
//               ──> weight  0 where nothing in the tile, or below it, matters to the picture
//               ──> cells   a bit for each of the 4 x 4 x 4 cells between its samples: whether it matters
//
// Positions are local: counted from the lowest corner of the roots, so that floats are fine enough. A ray
// walks tiles by Walk.h, single places are read by FieldPath here.
#pragma once

#include "Reader/NanoVTTReader.h"
#include "Render/Lanes.h"
#include "Render/Vec.h"

namespace VLN::Render {

/// Bits of an entry of FieldView::bricks.
inline constexpr std::uint64_t kBrickOffsetMask = 0xFFFFFFFFFFFFFull;   ///< in floats
inline constexpr int kBrickLevelsShift = 56;                            ///< of a merged block: log2(core / 4)
inline constexpr std::uint64_t kBrickGathered = std::uint64_t(1) << 63; ///< not in the buffer, but beside it

struct Brick {
  float const* samples;
  int core; ///< cells along an axis
  int stride;

  NANOVTT_HD float const* at(int i, int j, int k) const {
    return samples + (static_cast<std::int64_t>(k) * stride + j) * stride + i;
  }
};

struct FieldView {
  nanovtt::ContainerReader tree;
  float const* inBuffer = nullptr;
  float const* gathered = nullptr;
  std::uint64_t const* bricks = nullptr;
  float const* weights = nullptr;
  std::uint64_t const* cells = nullptr;
  float const* rootWeights = nullptr; ///< the largest of blocks of roots: see rootWeight()
  int rootShift = 0;                  ///< log2 of the width of a root
  int maxDepth = nanovtt::kMaxDepth;
  Vec3 low, high;       ///< local box of the samples, one more on each side: nothing lies outside
  float background = 0; ///< where there is no tile

  NANOVTT_HD Brick brick(std::uint32_t tile) const {
    std::uint64_t const e = bricks[tile];
    int const core = nanovtt::kTileWidth << (e >> kBrickLevelsShift & 7);
    return {(e & kBrickGathered ? gathered : inBuffer) + (e & kBrickOffsetMask), core, core + 1};
  }
  /// The largest weight of a block of roots 2^level wide on each axis, level 1 to 6.
  /// @pre The position lies in the table.
  NANOVTT_HD float rootWeight(int level, std::int32_t x, std::int32_t y, std::int32_t z) const {
    int const down = rootShift + level, bits = 6 - level;
    return rootWeights[rootWeightsAt(level) + ((z >> down << bits | y >> down) << bits | x >> down)];
  }
  /// Where the weights of a level begin: those of level 1 first.
  NANOVTT_HD static constexpr int rootWeightsAt(int level) {
    // 32^3 + 16^3 + ..., a geometric series
    return ((1 << 18) - (1 << 3 * (7 - level))) / 7;
  }
  /// The root that holds a local position.
  NANOVTT_HD std::uint32_t root(std::int32_t x, std::int32_t y, std::int32_t z) const {
    auto const i = static_cast<std::uint32_t>(x >> rootShift), j = static_cast<std::uint32_t>(y >> rootShift),
               k = static_cast<std::uint32_t>(z >> rootShift);
    if ((i | j | k) >= nanovtt::kRootTableWidth) return nanovtt::kNoTile;
    return tree.root((k * 64 + j) * 64 + i);
  }
};

/// @pre The result fits. @cost Less than std::floor, which is a call on plain x86-64.
NANOVTT_HD inline std::int32_t floorOf(float v) {
  auto const cut = static_cast<std::int32_t>(v);
  return cut - (static_cast<float>(cut) > v);
}

NANOVTT_HD inline float lerp(float a, float b, float f) { return (b - a) * f + a; }

NANOVTT_HD inline float trilinear(float const* p, int stride, float fx, float fy, float fz) {
  float const* const q = p + static_cast<std::int64_t>(stride) * stride;
  Lanes const low = Lanes::pairs(p, q), high = Lanes::pairs(p + stride, q + stride);
  Lanes const x = lerp(evens(low, high), odds(low, high), fx); // of p, q, and the rows above them
  Lanes const y = lerp(x, x.upper(), fy);
  return lerp(y.first(), y.second(), fz);
}

/// The cell of a brick that holds `u`, in samples from its first one, and the place in the cell.
struct Cell {
  std::int32_t at[4];
  Lanes in;
};
/// @edges The next one where there is none.
NANOVTT_HD inline Cell cellAt(Brick const& b, Lanes u) {
  Cell c;
  Lanes const most(static_cast<float>(b.core) - 0.5f);
  c.in = u - lesser(larger(u, Lanes(0.0f)), most).whole(c.at);
  return c;
}
NANOVTT_HD inline float trilinear(Brick const& b, Cell const& c) {
  return trilinear(b.at(c.at[0], c.at[1], c.at[2]), b.stride, c.in.first(), c.in.second(), c.in.third());
}

/// Blend at `u`, in samples from the brick's first one, 0 to core on each axis.
NANOVTT_HD inline float trilinear(Brick const& b, Vec3 u) { return trilinear(b, cellAt(b, Lanes(u))); }

/// The way from a root to a tile, kept from one place to the next: a step goes up only as far as the first
/// tile that holds both places, which the highest bit tells in which their coordinates differ.
struct FieldPath {
  struct Level {
    std::uint32_t tile;
    int depth;
    unsigned char const* table; ///< of children; none at the deepest depth
    int bits;                   ///< depths from the tile to those
  };
  Level level[nanovtt::kMaxDepth + 1];
  int height = 0; ///< levels that hold the position; 0 where there is no tile
  std::int32_t at[3] = {INT32_MIN, INT32_MIN, INT32_MIN};

  NANOVTT_HD Level const& top() const { return level[height - 1]; }
  NANOVTT_HD static int shiftOf(int depth) { return nanovtt::kTileSpaceBits - depth; }

  /// Drops the levels that do not hold the new position, which may leave none.
  NANOVTT_HD void climb(std::int32_t x, std::int32_t y, std::int32_t z) {
    auto const differ = static_cast<std::uint32_t>((x ^ at[0]) | (y ^ at[1]) | (z ^ at[2]));
    while (height > 0 && differ >> shiftOf(top().depth)) --height;
    at[0] = x, at[1] = y, at[2] = z;
  }
  NANOVTT_HD void push(FieldView const& f, std::uint32_t tile, int depth) {
    Level& l = level[height++];
    l.tile = tile, l.depth = depth;
    if (depth == nanovtt::kMaxDepth) return;
    auto const list = f.tree.children(tile);
    l.table = list.table, l.bits = list.levels + 1;
  }
  /// Depth and number of the child that holds the position.
  NANOVTT_HD std::uint32_t child(int& depth) const {
    Level const& l = top();
    depth = l.depth + l.bits;
    int const down = shiftOf(depth), bits = l.bits;
    std::int32_t const mask = (1 << bits) - 1;
    auto const n = static_cast<std::uint32_t>((at[0] >> down & mask) | (at[1] >> down & mask) << bits |
                                              (at[2] >> down & mask) << 2 * bits);
    return nanovtt::load<std::uint32_t>(l.table + 4 * n);
  }
  /// To the deepest tile at a position. @return false where there is none.
  NANOVTT_HD bool moveTo(FieldView const& f, std::int32_t x, std::int32_t y, std::int32_t z) {
    climb(x, y, z);
    if (height == 0) {
      std::uint32_t const root = f.root(x, y, z);
      if (root == nanovtt::kNoTile) return false;
      push(f, root, nanovtt::kTileSpaceBits - f.rootShift);
    }
    while (top().depth < f.maxDepth) {
      int depth;
      std::uint32_t const next = child(depth);
      if (next == nanovtt::kNoTile || depth > f.maxDepth) break;
      push(f, next, depth);
    }
    return true;
  }
  /// The blend at a local position; the background where there is no tile.
  NANOVTT_HD float value(FieldView const& f, Vec3 p) {
    if (!(p.x > f.low.x && p.y > f.low.y && p.z > f.low.z && p.x < f.high.x && p.y < f.high.y &&
          p.z < f.high.z))
      return f.background;
    std::int32_t const x = floorOf(p.x), y = floorOf(p.y), z = floorOf(p.z);
    if (!moveTo(f, x, y, z)) return f.background;
    Brick const b = f.brick(top().tile);
    int const shift = shiftOf(top().depth);
    float const scale = static_cast<float>(b.core) / static_cast<float>(1 << shift);
    Vec3 const corner{static_cast<float>(x >> shift << shift), static_cast<float>(y >> shift << shift),
                      static_cast<float>(z >> shift << shift)};
    return trilinear(b, (p - corner) * scale);
  }
};

} // namespace VLN::Render
