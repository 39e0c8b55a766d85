// Branch sizes and the self-checks of a tree.
#pragma once

#include "GeometryVolume/tiletree/Container.h"

namespace VLN::TileTree3D {

/// Sets each tile's branch size to its own voxels plus the branches of its children. Needs a bottom-up order
/// with a barrier after each depth.
template <class TraitsT> class BranchSizeVisitor final : public Visitor<Container<TraitsT>> {
public:
  using Data = ContainerData<TraitsT>;
  using TileType = typename Data::TileType;

  explicit BranchSizeVisitor(Data const& data)
      : m_data(data) {
    this->setEndTileOverridden(false);
  }
  using Visitor<Container<TraitsT>>::beginTile;
  void beginTile(TileType& tile) override {
    std::int64_t size = TraitsT::kTileSize;
    for (auto child = tile.begin(); child != tile.end(); ++child) {
      TreeIndex const at = child.treeIndex();
      size += m_data.tiles(at.depth)[at.index].branchSize();
    }
    tile.setBranchSize(size);
  }
  bool visitInteriorVoxel(TileType&, int3 const&) override { return true; }
  using Visitor<Container<TraitsT>>::visitInteriorVoxel;
  BranchSizeVisitor* clone() const override { return new BranchSizeVisitor(m_data); }

private:
  Data const& m_data;
};

template <class TraitsT> bool checkBranchSizes(Container<TraitsT> const& tree, bool verbose);
template <class TraitsT> bool checkConsistency(Container<TraitsT> const& tree, bool verbose);

} // namespace VLN::TileTree3D
