// Voxel: one voxel of a tile, as the voxel iterator yields it.
#pragma once

#include "GeometryVolume/tiletree/Tile.h"

namespace VLN::TileTree3D {

/// @pre The tile that it names stays where it is: no growth of the tree while a Voxel is used.
template <class TraitsT> class Voxel {
public:
  using TileType = Tile<TraitsT, TraitsT::kTileSize>;

  Voxel() = default;
  Voxel(TileType const& tile, int slot)
      : m_tile(&tile)
      , m_at(tile.treeIndex(), TileType::childIJK(slot))
      , m_slot(slot) {}

  TileType const& tile() const { return *m_tile; }
  /// Corner in tile space.
  int3 tijk() const { return m_tile->childTIJK(m_at.ijk); }
  int3 const& ijk() const { return m_at.ijk; }
  int slot() const { return m_slot; }
  std::int64_t childIndex() const { return m_tile->childIndex(m_slot); }
  TreeIndex childTreeIndex() const { return m_tile->childTreeIndex(m_slot); }
  bool isLeaf() const { return m_tile->isLeaf(m_slot); }
  int voxelWidth() const { return m_tile->voxelWidth(); }
  int depth() const { return m_tile->depth(); }
  std::int64_t index() const { return m_tile->index(); }
  std::int64_t parentIndex() const { return m_tile->parentIndex(); }
  TreeIndex parentTreeIndex() const { return m_tile->parentTreeIndex(); }
  bool isRoot() const { return m_tile->isRoot(); }
  bool atMaxDepth() const { return m_tile->atMaxDepth(); }
  TreeIndex treeIndex() const { return m_at; }
  VoxelTreeIndex const& voxelTreeIndex() const { return m_at; }
  /// By index, depth and position.
  bool operator==(Voxel const& b) const { return m_at == b.m_at; }

private:
  TileType const* m_tile = nullptr;
  VoxelTreeIndex m_at;
  std::int32_t m_slot = 0;
};

} // namespace VLN::TileTree3D
