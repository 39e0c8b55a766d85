// PointTopology: counts of points by depth and tile. A tile holds any number of points, possibly none.
#pragma once

#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/TreeCounts.h"

namespace VLN::TileTree3D {

/// Counts are right only after update(): whoever changes the tree runs it before the channels follow.
template <class TraitsT> class VLN_API PointTopology : public Component {
public:
  /// An empty name becomes Const::TileTreePointTopologyName.
  explicit PointTopology(Ostil::String const& name);
  PointTopology(PointTopology const& other);
  PointTopology& operator=(PointTopology const& other);
  ~PointTopology() override;

  void dump(std::ostream& os) const override;
  void memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const override;
  void copyTo(Ostil::Ptr<VLN::Component>& target) const override;
  /// Number of points.
  std::uint64_t size() const override;
  /// From a container: its tile counts; a new tile holds no points, and the element counts stay. From another
  /// tree component: each tile's element count exactly. Others are ignored.
  void update(VLN::Component const& source) override;
  std::int64_t elementCount(int depth) const override { return m_counts.elementCount(depth); }
  int elementCount(TreeIndex const& tile) const override { return m_counts.elementCount(tile); }
  std::int64_t tileCount(int depth) const override { return m_counts.tileCount(depth); }

private:
  TreeCounts<TraitsT::kDepths> m_counts;
};

} // namespace VLN::TileTree3D
