// SampleRegion: the part of space that a sampler read last, a tile or a voxel without a child, and the
// samples that answer there.
#pragma once

#include "GeometryVolume/sampling/detail/SampleCell.h"

#include <array>
#include <bit>
#include <climits>

namespace VLN::TileTree3D::Internal {

/// The samples of a tile, and how positions lie among them.
struct TileSamples {
  float const* data;
  IntLanes corner; ///< of the tile
  SampleScale scale;
};

class SampleRegion {
public:
  /// @param depth What is asked for.
  bool holds(FloatLanes p, int depth) const {
    auto const inside = (p >= m_low) & (p < m_high);
    auto const both = std::bit_cast<std::array<std::int64_t, 2>>(inside); // the fourth lane is always inside
    return (both[0] & both[1]) == -1 && depth == m_depth;
  }
  TileSamples const& samples() const { return m_samples; }

  /// Holds nothing where its corners have no exact equal in float.
  /// @param depth What was asked for.
  void set(IntLanes corner, int width, int depth, TileSamples const& samples) {
    IntLanes const end = corner + width;
    m_low = __builtin_convertvector(corner, FloatLanes), m_high = __builtin_convertvector(end, FloatLanes);
    auto const exact = (__builtin_convertvector(m_low, IntLanes) == corner) &
                       (__builtin_convertvector(m_high, IntLanes) == end);
    m_low[3] = -__builtin_huge_valf(), m_high[3] = __builtin_huge_valf();
    m_depth = exact[0] & exact[1] & exact[2] ? depth : INT_MIN;
    m_samples = samples;
  }

private:
  FloatLanes m_low{}, m_high{};
  TileSamples m_samples{};
  int m_depth = INT_MIN;
};

} // namespace VLN::TileTree3D::Internal
