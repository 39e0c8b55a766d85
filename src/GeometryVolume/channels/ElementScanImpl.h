// The scan of re-tiling: which points left their tiles, and where they go.
//
//   positions of a tile   x y z x | y z x y | z x y z     four points in three registers
//                         compared with the tile's borders: a bit for each point that left
//   who left              the tile found last? one of those found before? else looked up in the tree
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cmath>
#include <cstdint>
#include <vector>

#ifdef __SSE2__
#define VLN_SCAN_SSE2 1
#include <emmintrin.h>
#endif

namespace VLN::TileTree3D::Internal {

inline constexpr float kReach = 5.368709e+08f, kLast = 536870880.0f; // 2^29, and the float before it
static_assert(kReach == 536870912.0f);
inline constexpr std::int64_t kTilesOfARange = 50;
inline constexpr std::int64_t kDropped = -1, kWaiting = -2;

template <class TraitsT> using PositionsOf = Channel<TraitsT, float3, TraitsT::kTileDataWidth, 0>;

/// What a scan found.
struct Found {
  std::vector<ElementToFrom> moves;
  std::vector<std::uint64_t> waiting; // positions in `moves` whose tile does not exist yet
  std::vector<int3> missing;          // corners of those tiles

  void append(ElementToFrom const* found, std::size_t n) {
    for (std::size_t i = 0; i < n; ++i)
      if (found[i].to == kWaiting) waiting.push_back(moves.size() + i);
    moves.insert(moves.end(), found, found + n);
  }
};

/// The smallest float that is not below `v`: comparing floats with it is comparing them with `v`.
inline float ceilToFloat(double v) {
  auto const f = static_cast<float>(v);
  return double(f) < v ? std::nextafter(f, kReach) : f;
}

inline float3 scaled(float3 const& p, float s) { return {p.x * s, p.y * s, p.z * s}; }

/// The tile-space positions that lie in a tile.
class TileBox {
public:
  /// Holds nothing.
  TileBox() = default;
  TileBox(int3 const& corner, std::int32_t width) {
    // Within the reach, q lies in the tile exactly when floor(q) does.
    constexpr std::int32_t kExact = 1 << 23; // floats hold sums of two such numbers
    auto const isExact = [](std::int32_t v) { return v > -kExact && v < kExact; };
    bool const exact = isExact(corner.x) & isExact(corner.y) & isExact(corner.z) & isExact(width);
    for (int a = 0; a < 3; ++a) {
      auto const low = static_cast<float>(corner[a]);
      m_low[a] = exact ? low : std::max(ceilToFloat(corner[a]), -kLast);
      m_high[a] = exact ? low + static_cast<float>(width)
                        : std::min(ceilToFloat(static_cast<double>(corner[a]) + width), kReach);
    }
    m_high[3] = 1; // for a lane that holds 0
  }

  /// Whether a point lies in the tile when multiplied with `scale`.
  bool holds(float3 const& p, float scale) const {
    // Written so that what is no number is outside.
#ifdef VLN_SCAN_SSE2
    __m128 const xy = _mm_loadl_pi(_mm_setzero_ps(), reinterpret_cast<__m64 const*>(&p.x));
    __m128 const q = _mm_mul_ps(_mm_movelh_ps(xy, _mm_load_ss(&p.z)), _mm_set1_ps(scale));
    return _mm_movemask_ps(
               _mm_and_ps(_mm_cmpge_ps(q, _mm_loadu_ps(m_low)), _mm_cmplt_ps(q, _mm_loadu_ps(m_high)))) == 15;
#else
    float3 const q = scaled(p, scale);
    return (q.x >= m_low[0]) & (q.x < m_high[0]) & (q.y >= m_low[1]) & (q.y < m_high[1]) & (q.z >= m_low[2]) &
           (q.z < m_high[2]);
#endif
  }

  /// Which of up to 64 points lie outside when multiplied with `scale`: a bit each.
  std::uint64_t outside(float3 const* points, int count, float scale) const {
    std::uint64_t bits = 0;
    int n = 0;
#ifdef VLN_SCAN_SSE2
    static_assert(sizeof(float3) == 3 * sizeof(float));
    auto const within = [scales = _mm_set1_ps(scale)](__m128 v, __m128 low, __m128 high) {
      __m128 const q = _mm_mul_ps(v, scales);
      return _mm_and_ps(_mm_cmpge_ps(q, low), _mm_cmplt_ps(q, high));
    };
    __m128 const lowX = _mm_set1_ps(m_low[0]), highX = _mm_set1_ps(m_high[0]), lowY = _mm_set1_ps(m_low[1]),
                 highY = _mm_set1_ps(m_high[1]), lowZ = _mm_set1_ps(m_low[2]), highZ = _mm_set1_ps(m_high[2]);
    for (; n + 4 <= count; n += 4) {
      // Four points, axis by axis.
      float const* const p = &points[n].x;
      __m128 const a = _mm_loadu_ps(p), b = _mm_loadu_ps(p + 4), c = _mm_loadu_ps(p + 8);
      __m128 const yzyz = _mm_shuffle_ps(a, b, _MM_SHUFFLE(1, 0, 2, 1)),
                   xyxy = _mm_shuffle_ps(b, c, _MM_SHUFFLE(2, 1, 3, 2));
      __m128 const inX = within(_mm_shuffle_ps(a, xyxy, _MM_SHUFFLE(2, 0, 3, 0)), lowX, highX),
                   inY = within(_mm_shuffle_ps(yzyz, xyxy, _MM_SHUFFLE(3, 1, 2, 0)), lowY, highY),
                   inZ = within(_mm_shuffle_ps(yzyz, c, _MM_SHUFFLE(3, 0, 3, 1)), lowZ, highZ);
      auto const in = static_cast<unsigned>(_mm_movemask_ps(_mm_and_ps(inX, _mm_and_ps(inY, inZ))));
      bits |= static_cast<std::uint64_t>(in ^ 15u) << n;
    }
#endif
    for (; n < count; ++n) bits |= static_cast<std::uint64_t>(!holds(points[n], scale)) << n;
    return bits;
  }

private:
  float m_low[4]{}, m_high[4]{};
};

/// Finds the tiles of one depth that points move to. Points that leave one tile mostly go to a few: those
/// found last are kept.
template <class TraitsT> class Destinations {
public:
  Destinations(Container<TraitsT> const& tree, int depth)
      : m_accessor(tree.tileAccessor())
      , m_scale(1.0f / tree.voxelSize())
      , m_depth(depth)
      , m_shift(std::countr_zero(static_cast<unsigned>(TraitsT::width(depth)))) {
    m_seen.fill({{0, 0, 0}, kNothing});
  }

  /// @return The tile that holds a point, kDropped, or kWaiting with its corner in `missing`.
  std::int64_t find(float3 const& point, std::vector<int3>& missing) {
    return m_box.holds(point, m_scale) ? m_tile : findAfresh(scaled(point, m_scale), missing);
  }

private:
  std::int64_t findAfresh(float3 const& q, std::vector<int3>& missing) {
    // Written so that what is no number is out of reach.
    if (!(std::abs(q.x) < kReach && std::abs(q.y) < kReach && std::abs(q.z) < kReach)) return kDropped;
    auto const cornerOf = [this](float v) {
      auto const cut = static_cast<std::int32_t>(v); // the reach is well within its range
      return TraitsT::align(cut - (static_cast<float>(cut) > v ? 1 : 0), m_depth);
    };
    int3 const corner{cornerOf(q.x), cornerOf(q.y), cornerOf(q.z)};
    Seen& seen = m_seen[slot(corner.x) | slot(corner.y) << kBits | slot(corner.z) << 2 * kBits];
    if (seen.tile == kNothing || seen.corner != corner) {
      TreeIndex const there = m_accessor.treeIndex(corner.x, corner.y, corner.z, m_depth, true);
      seen = {corner, there.valid() ? there.index : kWaiting};
      if (!there.valid()) missing.push_back(corner);
    }
    m_box = TileBox(corner, TraitsT::width(m_depth));
    return m_tile = seen.tile;
  }

  static constexpr std::int64_t kNothing = -3;
  static constexpr int kBits = 2;
  struct Seen {
    int3 corner;
    std::int64_t tile;
  };
  /// Neighbours differ in it.
  std::size_t slot(std::int32_t c) const {
    return (static_cast<std::uint32_t>(c) >> m_shift) & ((1u << kBits) - 1);
  }

  ConstTileAccessorOf<TraitsT> m_accessor;
  float m_scale;
  int m_depth, m_shift;
  TileBox m_box; // of the tile found last
  std::int64_t m_tile = kNothing;
  std::array<Seen, std::size_t(1) << 3 * kBits> m_seen;
};

/// Asks for the elements of a tile that will be read soon.
inline void prefetch(TileVector<float3> const& tile) {
  constexpr std::size_t kLine = 64, kMost = 16 * kLine;
  auto const* const bytes = reinterpret_cast<char const*>(tile.data());
  for (std::size_t at = 0, n = std::min(tile.size() * sizeof(float3), kMost); at < n; at += kLine)
    __builtin_prefetch(bytes + at);
}

/// Scans tiles of a depth, one after another.
template <class TraitsT> class TileScan {
public:
  TileScan(Container<TraitsT> const& tree, PositionsOf<TraitsT> const& positions, int depth)
      : m_tree(tree)
      , m_tiles((*positions.tileArrays())[depth])
      , m_depth(depth)
      , m_scale(1.0f / tree.voxelSize())
      , m_destinations(tree, depth) {}

  /// Calls `body(moves, count)` for the moves of the points that left a tile, block by block.
  template <class Body> void scan(std::int64_t i, std::vector<int3>& missing, Body const& body) {
    constexpr std::int64_t kAhead = 2;
    if (i + kAhead < static_cast<std::int64_t>(m_tiles.size())) prefetch(m_tiles[i + kAhead]);
    auto const& tile = m_tree.tile(i, m_depth);
    if (!tile.valid()) return;
    auto const& held = m_tiles[i];
    float3 const* const points = held.data();
    TileBox const box(tile.tijk(), tile.tileVoxelWidth());
    constexpr int kBlock = 64;
    std::array<ElementToFrom, kBlock> moves;
    for (int first = 0, count = static_cast<int>(held.size()); first < count; first += kBlock) {
      std::uint64_t left = box.outside(points + first, std::min(count - first, kBlock), m_scale);
      if (left == 0) continue;
      std::size_t n = 0;
      for (; left != 0; left &= left - 1) {
        int const element = first + std::countr_zero(left);
        moves[n++] = {m_destinations.find(points[element], missing), i, element, m_depth};
      }
      body(moves.data(), n);
    }
  }

private:
  Container<TraitsT> const& m_tree;
  std::vector<TileVector<float3>> const& m_tiles;
  int m_depth;
  float m_scale;
  Destinations<TraitsT> m_destinations;
};

/// What a scan of some tiles found, in less room than moves take: when all points have moved far, there is
/// one for each.
struct FoundPart {
  struct Left {
    std::int64_t to;
    std::int32_t element;
    std::int32_t tile; // counted from the first of the part
  };
  std::vector<Left> left;
  std::vector<int3> missing;
};

template <class TraitsT>
Found scanSerially(Container<TraitsT> const& tree, PositionsOf<TraitsT> const& positions, int depth,
                   std::int64_t tiles) {
  Found all;
  auto const most = static_cast<double>(positions.elementCount(depth));
  TileScan<TraitsT> scan(tree, positions, depth);
  for (std::int64_t i = 0; i < tiles; ++i) {
    scan.scan(i, all.missing, [&](ElementToFrom const* moves, std::size_t n) {
      if (std::size_t const needed = all.moves.size() + n; needed > all.moves.capacity()) {
        // As many as there will be if it goes on like this, and some more.
        double const share = static_cast<double>(i + 1) / static_cast<double>(tiles);
        double const expected = static_cast<double>(needed) * (1.5 + 1 / share);
        all.moves.reserve(std::max(needed, static_cast<std::size_t>(std::min(expected, most))));
      }
      all.append(moves, n);
    });
  }
  return all;
}

template <class TraitsT>
Found scanDepth(Container<TraitsT> const& tree, PositionsOf<TraitsT> const& positions, int depth) {
  std::int64_t const tiles = std::min(tree.tileCount(depth), positions.tileCount(depth));
  if (parallelThreads() == 1) return scanSerially(tree, positions, depth, tiles);
  std::vector<FoundPart> parts(chunkCount(0, tiles, kTilesOfARange));
  parallelChunks(0, tiles, kTilesOfARange, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    TileScan<TraitsT> scan(tree, positions, depth);
    FoundPart& part = parts[chunk];
    for (std::int64_t i = begin; i < end; ++i)
      scan.scan(i, part.missing, [&](ElementToFrom const* moves, std::size_t n) {
        for (; n > 0; --n, ++moves)
          part.left.push_back({moves->to, moves->fromElement, static_cast<std::int32_t>(i - begin)});
      });
  });
  // Parts are consecutive: the moves are sorted by source.
  Found all;
  std::size_t count = 0;
  for (FoundPart const& part : parts) count += part.left.size();
  all.moves.reserve(count);
  std::array<ElementToFrom, 64> moves;
  std::int64_t begin = 0;
  for (FoundPart const& part : parts) {
    for (std::size_t at = 0; at < part.left.size();) {
      std::size_t n = 0;
      for (; n < moves.size() && at < part.left.size(); ++n, ++at)
        moves[n] = {part.left[at].to, begin + part.left[at].tile, part.left[at].element, depth};
      all.append(moves.data(), n);
    }
    all.missing.insert(all.missing.end(), part.missing.begin(), part.missing.end());
    begin += kTilesOfARange;
  }
  return all;
}

} // namespace VLN::TileTree3D::Internal
