// VoxelSampler: from a continuous position to a tile, a sample in it, and the weights of the next ones.
//
//   tile of depth d, D samples along its edge          l = (p - corner) * D / W[d] - offset
//
//    corner                                            i = floor(l), at most D-1      the cell's low sample
//      |----+----|----+----|----+----|----+----|       weight = l - i                  of the next sample
//           0         1         2         3            samples at + when the offset is one half,
//      0         1         2         3                 at | when it is 0
//
// Beyond the last sample the weight reaches and passes 1; before the first, with an offset, i is -1.
#pragma once

#include "GeometryVolume/sampling/detail/SampleCell.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelTopology.h"

namespace VLN::TileTree3D {

/// What a position is given in.
enum SamplerSpace : std::int32_t {
  kSamplerTileSpace = 0,
  kSamplerVoxelSpace = 1, ///< taken as tile space
  kSamplerWorldSpace = 2,
};

/// @threads A sampler belongs to one thread, const operations included: it remembers the last tile. Any
/// number of samplers may read one volume while nothing changes it.
template <class TraitsT, class Real, class Position> class VLN_API VoxelSampler {
  static_assert(std::is_same_v<Real, float> && std::is_same_v<Position, float3>, "instantiated for float");

public:
  using ContainerT = Container<TraitsT>;
  using Accessor = typename ContainerT::ConstTileAccessor;

  VoxelSampler() = default;
  VoxelSampler(ContainerT const& container, VoxelTopology<TraitsT> const& topology)
      : m_accessor(container.tileAccessor())
      , m_worldToTile(container.voxelSize() == 0.0f ? 0.0f : 1.0f / container.voxelSize())
      , m_offset(topology.offset())
      , m_offsetType(topology.offsetType()) {}
  VoxelSampler(VoxelSampler const&) = default;
  VoxelSampler& operator=(VoxelSampler const&) = default;
  virtual ~VoxelSampler();

  /// "kNone".
  virtual char const* idString() const;

  /// Finds the deepest tile at or above `depth` that holds the position, the sample at or below it on each
  /// axis, and the weights of the next samples.
  /// @param invVoxelWidth If given, 1 / width of the tile's voxels in tile space.
  /// @return false without a tile: `out` is then invalid, and the others stay as they were.
  /// @edges NaN and positions that no int32 holds have no tile.
  /// @numeric A place up to 1e-5 of a sample below the tile's first sample counts as on it.
  bool prepareToSample(Position position, SamplerSpace space, TreeIndex& out, int3& ijk, Position& weights,
                       int depth, Real* invVoxelWidth) const {
    SampleCell cell;
    bool const found = locate(position, space, depth, cell);
    out = cell.tile;
    if (!found) return false;
    if (invVoxelWidth) *invVoxelWidth = cell.invVoxelWidth;
    ijk = Internal::toInt3(cell.ijk);
    weights = Internal::toFloat3(cell.weights);
    return true;
  }

protected:
  static constexpr int D = TraitsT::kTDW;
  using SampleCell = Internal::SampleCell;

  Internal::FloatLanes toTileSpace(Position const& position, SamplerSpace space) const {
    auto const p = Internal::lanesOf(position);
    return space == kSamplerWorldSpace ? p * m_worldToTile : p;
  }
  /// @return false without a tile: of `cell` the tile alone is then set, and invalid.
  bool locate(Position const& position, SamplerSpace space, int depth, SampleCell& cell) const {
    auto const p = toTileSpace(position, space);
    return locate(p, Internal::floorLanesAnywhere(p), depth, cell);
  }
  /// The same for a position in tile space and its floor.
  bool locate(Internal::FloatLanes p, Internal::IntLanes c, int depth, SampleCell& cell) const {
    if (!m_last.holds(c, depth)) searchTile(c, depth);
    cell.tile = m_last.tile();
    if (cell.tile.depth < 0) return false;
    Internal::placeInCell<TraitsT>(p, m_last.corner(), m_offset, cell);
    return true;
  }
  void searchTile(Internal::IntLanes c, int depth) const {
    TreeIndex const at = depth < 0 ? TreeIndex{} : m_accessor.treeIndex(c[0], c[1], c[2], depth, false);
    m_last.set(at, m_accessor.cursorCorner(), c, depth);
  }

  Accessor m_accessor;
  mutable Internal::LastTile<TraitsT> m_last;
  Real m_worldToTile = 1.0f;
  Position m_offset{0.0f, 0.0f, 0.0f};
  VoxelOffsetType m_offsetType = kVoxelOffsetCorner;
};

} // namespace VLN::TileTree3D
