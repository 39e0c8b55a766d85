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

#include "GeometryVolume/core/SimdLanes.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelTopology.h"

#include <array>

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

  /// What prepareToSample() gives, in lanes.
  struct SampleCell {
    TreeIndex tile;
    float invVoxelWidth;
    Internal::IntLanes ijk;
    Internal::FloatLanes weights;
  };
  Internal::FloatLanes toTileSpace(Position const& position, SamplerSpace space) const {
    auto const p = Internal::lanesOf(position);
    return space == kSamplerWorldSpace ? p * m_worldToTile : p;
  }
  /// @return false without a tile: of `cell` the tile alone is then set, and invalid.
  bool locate(Position const& position, SamplerSpace space, int depth, SampleCell& cell) const {
    using namespace Internal;
    FloatLanes const p = toTileSpace(position, space);
    return locate(p, floorLanesAnywhere(p), depth, cell);
  }
  /// The same for a position in tile space and its floor.
  bool locate(Internal::FloatLanes p, Internal::IntLanes c, int depth, SampleCell& cell) const {
    if (!inLeafVoxel(c, depth) && !searchTile(c, depth)) {
      cell.tile = {};
      return false;
    }
    cell.tile = m_found;
    place(p, m_foundCorner, cell);
    return true;
  }
  /// Whether the tile found last is that of the point too, because it has no child there.
  bool inLeafVoxel(Internal::IntLanes c, int depth) const {
    using Internal::UnsignedLanes;
    auto const from = reinterpret_cast<UnsignedLanes>(c) - reinterpret_cast<UnsignedLanes>(m_leafCorner);
    auto const inside = from < m_leafWidth;
    return depth == m_leafDepth && (inside[0] & inside[1] & inside[2]);
  }
  bool searchTile(Internal::IntLanes c, int depth) const {
    m_found = depth < 0 ? TreeIndex{} : m_accessor.treeIndex(c[0], c[1], c[2], depth, false);
    m_leafDepth = -1;
    if (m_found.depth < 0) return false;
    m_foundCorner = Internal::lanesOf(m_accessor.cursorCorner());
    if (m_found.depth < (depth < TraitsT::kMaxDepth ? depth : TraitsT::kMaxDepth)) {
      m_leafDepth = depth;
      m_leafCorner = Internal::lanesOf(TraitsT::align(Internal::toInt3(c), m_found.depth + 1));
      m_leafWidth = Internal::UnsignedLanes{} + static_cast<std::uint32_t>(TraitsT::width(m_found.depth + 1));
    }
    return true;
  }
  /// The cell of a position in tile space, within the tile of `cell`.
  void place(Internal::FloatLanes p, Internal::IntLanes tileCorner, SampleCell& cell) const {
    using namespace Internal;
    Scale const& scale = kScales[static_cast<std::size_t>(cell.tile.depth)];
    cell.invVoxelWidth = scale.invVoxelWidth;
    auto const corner = __builtin_convertvector(tileCorner, FloatLanes);
    FloatLanes l = (p - corner) * scale.samples - lanesOf(m_offset);
    FloatLanes const zero = {};
    // Up to 1e-5 below the first sample counts as on it.
    l = (l > zero) | (l <= lanesOf(-1e-5f)) ? l : zero;
    // In reach of int: the tile holds p.
    IntLanes const i = floorLanes(l), last = IntLanes{} + (D - 1);
    cell.ijk = i < last ? i : last;
    cell.weights = l - __builtin_convertvector(cell.ijk, FloatLanes);
  }

  Accessor m_accessor;
  // The tile found last. Where it is coarser than asked for, the voxel without a child that holds the point.
  mutable TreeIndex m_found;
  mutable Internal::IntLanes m_foundCorner{};
  mutable Internal::IntLanes m_leafCorner{};
  mutable Internal::UnsignedLanes m_leafWidth{};
  mutable int m_leafDepth = -1; ///< what was asked for; -1: none
  Real m_worldToTile = 1.0f;
  Position m_offset{0.0f, 0.0f, 0.0f};
  VoxelOffsetType m_offsetType = kVoxelOffsetCorner;

private:
  struct Scale {
    float invVoxelWidth; // kTW / W
    float samples;       // D / W
  };
  static constexpr auto kScales = [] {
    std::array<Scale, static_cast<std::size_t>(TraitsT::kDepths)> scales{};
    for (int d = 0; d < TraitsT::kDepths; ++d) {
      auto const r = static_cast<float>(double(TraitsT::kTW) / TraitsT::width(d));
      scales[static_cast<std::size_t>(d)] = {
          r, TraitsT::kTDW == 2 * TraitsT::kTW
                 ? r + r
                 : static_cast<float>(double(TraitsT::kTDW) / TraitsT::width(d))};
    }
    return scales;
  }();
};

} // namespace VLN::TileTree3D
