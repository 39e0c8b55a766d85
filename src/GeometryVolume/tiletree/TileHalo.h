// Precomputed halos: what serves each of the 27 directions around a tile.
//
// Packed form of one record, bits from the low end of byte 0:
//
//   | 5: same-depth count | 6: coarser count | 5: direction  x same-depth count
//                                            | 5: direction, 2: level difference, 9: weight index  x coarser
//                                            count
//
// A level difference of 0 stands for more than 3.
#pragma once

#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/tiletree/HaloWeights.h"

namespace VLN::TileTree3D {

/// Neighbours of a tile with the number of levels that each is coarser. A dead tile has none.
template <class TraitsT> struct TileHalo {
  TileHalo() { levelDifference.fill(-1); }

  Dense1D::FixedArray<TreeIndex, kNeighborCount> neighbors;
  std::array<std::int8_t, kNeighborCount> levelDifference; ///< 0 same depth, -1 no tile
};

/// Where a packed record lies.
struct CompressedTileHalo {
  std::uint8_t const* bytes = nullptr;
  std::uint32_t size = 0;
};

/// Weight of the coarse sample that holds the first sample of a halo region, in the trilinear read of a
/// parent `levels` coarser, for samples on the voxels' low corners.
/// @formula The region's first sample in direction d lies at x = -1, 0 or W of the fine tile; on each axis
/// the weight is 1 minus the fraction of x measured in coarse samples.
template <class TraitsT>
VLN_API float haloWeight(Tile<TraitsT, TraitsT::kTileSize> const& tile, int direction, int levels);

/// Reads a packed record entry by entry: first the directions served at the tile's own depth, then those that
/// coarser tiles serve with a weight.
template <class TraitsT> class TileHaloVisitor {
public:
  /// Ended.
  TileHaloVisitor() = default;
  TileHaloVisitor(CompressedTileHalo const& record, HaloCompression const& table)
      : m_bytes(record.bytes)
      , m_table(&table)
      , m_end(false) {
    m_sameDepth = static_cast<int>(read(table.sameDepthBits));
    m_coarser = static_cast<int>(read(table.coarserBits));
    m_total = m_sameDepth + m_coarser;
    load();
  }

  bool end() const { return m_end; }
  int sameDepthCount() const { return m_sameDepth; }
  int coarserCount() const { return m_coarser; }
  int count() const { return m_total; }

  NeighborDirection direction() const { return static_cast<NeighborDirection>(m_direction); }
  /// 0 for the tile's own depth; 1 to 3, or 4 for more.
  int levelDifference() const { return m_levels; }
  /// 1 at the tile's own depth.
  float weight() const { return m_weight; }
  void next() {
    ++m_position;
    load();
  }

private:
  std::uint32_t read(int bits) {
    std::uint32_t value = 0;
    for (int b = 0; b < bits; ++b, ++m_bit)
      value |= static_cast<std::uint32_t>(m_bytes[m_bit / 8] >> (m_bit % 8) & 1) << b;
    return value;
  }
  void load() {
    m_end = m_position >= m_total;
    if (m_end) return;
    m_direction = static_cast<int>(read(5));
    m_levels = 0, m_weight = 1.0f;
    if (m_position < m_sameDepth) return;
    int const stored = static_cast<int>(read(2));
    m_levels = stored == 0 ? 4 : stored;
    m_weight = m_table->weights[read(m_table->weightBits)];
  }

  std::uint8_t const* m_bytes = nullptr;
  HaloCompression const* m_table = nullptr;
  int m_sameDepth = 0, m_coarser = 0, m_total = 0, m_position = 0, m_bit = 0;
  int m_direction = 0, m_levels = 0;
  float m_weight = 0.0f;
  bool m_end = true;
};

template <class TraitsT>
TileHaloVisitor<TraitsT> ConstTileAccessorOf<TraitsT>::tileHaloVisitor(TreeIndex const& at) const {
  return m_container->tileHaloVisitor(at);
}

} // namespace VLN::TileTree3D
