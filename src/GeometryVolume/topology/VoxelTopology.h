// VoxelTopology: counts of a voxel grid by depth and tile, and where its samples lie.
#pragma once

#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/TreeCounts.h"
#include "GeometryVolume/topology/VoxelOffsetType.h"

namespace VLN::TileTree3D {

/// Each tile has at least kTDW x kTDW x kTDW elements. Counts are right only after update(): whoever changes
/// the tree runs it before the channels follow.
template <class TraitsT> class VLN_API VoxelTopology : public Component {
public:
  /// An empty name becomes Const::TileTreeVoxelTopologyName.
  VoxelTopology(Ostil::String const& name, VoxelOffsetType offsetType);
  VoxelTopology(VoxelTopology const& other);
  VoxelTopology& operator=(VoxelTopology const& other);
  ~VoxelTopology() override;

  void dump(std::ostream& os) const override;
  void memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const override;
  void copyTo(Ostil::Ptr<VLN::Component>& target) const override;
  /// Number of voxels: tiles x kTileSize.
  std::uint64_t size() const override;
  /// From a container: its tile counts and voxel size, kTDW^3 elements for each new tile. From another tree
  /// component: for each tile of this topology the larger of that component's element count and kTDW^3.
  /// Others are ignored.
  /// @edges A voxel size of 0 stores an infinite inverse.
  void update(VLN::Component const& source) override;
  std::int64_t elementCount(int depth) const override { return m_counts.elementCount(depth); }
  int elementCount(TreeIndex const& tile) const override { return m_counts.elementCount(tile); }
  std::int64_t tileCount(int depth) const override { return m_counts.tileCount(depth); }

  VoxelOffsetType offsetType() const { return m_offsetType; }
  /// @units sample widths
  float3 offset() const { return voxelOffset(m_offsetType); }
  /// Position of a sample, from world space into samples of the deepest depth.
  /// @formula p / voxel size - offset()
  float3 toTileSpace(float3 const& world) const { return world * m_voxelSizeInv - offset(); }
  /// @formula (p + offset()) * voxel size
  float3 toWorldSpace(float3 const& tile) const { return (tile + offset()) * m_voxelSize; }
  float voxelSize() const { return m_voxelSize; }

private:
  TreeCounts<TraitsT::kDepths> m_counts;
  VoxelOffsetType m_offsetType;
  float m_voxelSize = 1.0f;
  float m_voxelSizeInv = 1.0f;
};

} // namespace VLN::TileTree3D
