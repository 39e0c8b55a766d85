// SampleCell: where a position lies among the samples of its tile, and what a sampler remembers of the tile
// that it found last.
#pragma once

#include "GeometryVolume/core/FixedArray.h"
#include "GeometryVolume/core/detail/SimdLanes.h"
#include "GeometryVolume/tiletree/TreeIndex.h"

#include <climits>

namespace VLN::TileTree3D::Internal {

/// The low sample of the cell that holds a position, and the weights of the next ones, in lanes.
struct SampleCell {
  TreeIndex tile;
  float invVoxelWidth;
  IntLanes ijk;
  FloatLanes weights;
};

/// Of a tile of each depth.
struct SampleScale {
  float invVoxelWidth; // kTW / W
  float samples;       // D / W
};
template <class TraitsT>
inline constexpr auto kSampleScales = [] {
  PerDepth<SampleScale, TraitsT::kDepths> scales{};
  for (int d = 0; d < TraitsT::kDepths; ++d) {
    auto const r = static_cast<float>(double(TraitsT::kTW) / TraitsT::width(d));
    constexpr int D = TraitsT::kTDW;
    scales[d] = {r, D == 2 * TraitsT::kTW ? r + r : static_cast<float>(double(D) / TraitsT::width(d))};
  }
  return scales;
}();

/// Puts a position of tile space into a cell of the tile of `kWidth` samples with this corner.
/// @param samples To a unit of tile space.
/// @pre The tile holds the position.
template <int kWidth>
[[gnu::always_inline]] inline void placeInCell(FloatLanes p, FloatLanes corner, float samples,
                                               FloatLanes offset, SampleCell& cell) {
  FloatLanes l = (p - corner) * samples - offset;
  FloatLanes const zero = {};
  // Up to 1e-5 below the first sample counts as on it.
  l = (l > zero) | (l <= lanesOf(-1e-5f)) ? l : zero;
  // In reach of int: the tile holds p.
  IntLanes const i = floorLanes(l), last = IntLanes{} + (kWidth - 1);
  cell.ijk = i < last ? i : last;
  cell.weights = l - __builtin_convertvector(cell.ijk, FloatLanes);
}
/// The same by the cell's tile, with the tile's corner.
template <class TraitsT>
[[gnu::always_inline]] inline void placeInCell(FloatLanes p, IntLanes tileCorner,
                                               Velorn::Math::float3 const& offset, SampleCell& cell) {
  SampleScale const& scale = kSampleScales<TraitsT>[cell.tile.depth];
  cell.invVoxelWidth = scale.invVoxelWidth;
  placeInCell<TraitsT::kTDW>(p, __builtin_convertvector(tileCorner, FloatLanes), scale.samples,
                             lanesOf(offset), cell);
}

/// The tile found last. Where it is coarser than was asked for, the voxel without a child that held the
/// point: whatever lies there has the same tile.
template <class TraitsT> class LastTile {
public:
  TreeIndex const& tile() const { return m_tile; }
  IntLanes corner() const { return m_corner; }
  /// Where positions are known to have the same tile when the same depth is asked for: a voxel, or the whole
  /// tile.
  IntLanes regionCorner() const { return m_depth == INT_MIN ? m_corner : m_leafCorner; }
  int regionWidth() const { return TraitsT::width(m_depth == INT_MIN ? m_tile.depth : m_tile.depth + 1); }

  bool holds(IntLanes c, int depth) const {
    auto const from = reinterpret_cast<UnsignedLanes>(c) - reinterpret_cast<UnsignedLanes>(m_leafCorner);
    auto const inside = from < m_leafWidth;
    return depth == m_depth && (inside[0] & inside[1] & inside[2]);
  }
  /// @param depth What was asked for.
  void set(TreeIndex const& tile, Velorn::Math::int3 const& corner, IntLanes c, int depth) {
    m_tile = tile;
    m_depth = INT_MIN;
    m_leafWidth = UnsignedLanes{}; // which holds nothing, whatever is asked for
    if (tile.depth < 0) return;
    m_corner = lanesOf(corner);
    if (tile.depth < (depth < TraitsT::kMaxDepth ? depth : TraitsT::kMaxDepth)) {
      m_depth = depth;
      m_leafCorner = lanesOf(TraitsT::align(toInt3(c), tile.depth + 1));
      m_leafWidth = UnsignedLanes{} + static_cast<std::uint32_t>(TraitsT::width(tile.depth + 1));
    }
  }

private:
  TreeIndex m_tile;
  IntLanes m_corner{};
  IntLanes m_leafCorner{};
  UnsignedLanes m_leafWidth{};
  int m_depth = INT_MIN;
};

} // namespace VLN::TileTree3D::Internal
