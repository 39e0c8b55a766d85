// Opens the protected operations of Container and Tile to tests.
#pragma once

#include "GeometryVolume/tiletree/ContainerDataImpl.h"

namespace VLN::TileTree3D {

struct ContainerTestAccess {
  template <class T> static auto const& data(Container<T> const& tree) { return *tree.getData(); }
  template <class T> static auto& editData(Container<T>& tree) {
    return const_cast<ContainerData<T>&>(*tree.getData());
  }
  template <class T> static TreeIndex tileIndex(Container<T> const& tree, int3 const& p, int depth) {
    return tree.tileIndex(p.x, p.y, p.z, depth);
  }
  template <class T> static auto const& tile(Container<T> const& tree, int3 const& p, int depth) {
    return tree.tile(p.x, p.y, p.z, depth);
  }
  template <class T> static TreeIndex addTile(Container<T>& tree, int3 const& p, int depth) {
    return tree.addTile(p.x, p.y, p.z, depth);
  }
  template <class T> static TreeIndex addTile(Container<T>& tree, VoxelCoord const& at) {
    return tree.addTile(at);
  }
  template <class T> static auto& editTile(Container<T>& tree, TreeIndex const& at) {
    editData(tree).detachTiles();
    return tree.editTile(at);
  }
  template <class T> static std::int64_t allocateTile(Container<T>& tree, int depth) {
    typename Container<T>::TileType* made = nullptr;
    std::int64_t const index = tree.allocateTile(depth, made);
    return made == &tree.editTile({index, depth}) ? index : -1;
  }
  template <class T> static void allocateTiles(Container<T>& tree, int depth, std::int64_t n) {
    tree.allocateTiles(depth, n);
  }
  template <class T> static void resize(Container<T>& tree, std::int64_t n, int depth) {
    tree.resize(n, depth);
  }
  template <class T> static std::int64_t tileCapacity(Container<T> const& tree, int depth) {
    return tree.tileCapacity(depth);
  }
  template <class T>
  static void reallocateTile(Container<T>& tree, std::int64_t dst, std::int64_t src, int depth) {
    tree.reallocateTile(dst, src, depth);
  }
  template <class T> static void addRoot(Container<T>& tree, TreeIndex const& at) {
    tree.addRoot(tree.tile(at));
  }
  template <class T> static void removeRoot(Container<T>& tree, TreeIndex const& at) {
    tree.removeRoot(tree.tile(at));
  }
  template <class T> static void tilesAdded(Container<T>& tree) { tree.tilesAdded(); }
  template <class T>
  static void tilesRemoved(Container<T>& tree,
                           std::vector<std::vector<std::pair<std::int64_t, std::int64_t>>> const* moves) {
    tree.tilesRemoved(moves);
  }
  template <class T> static void setBranchSizes(Container<T>& tree) { tree.setBranchSizes(); }
  template <class T> static int incrementAffinityUse(Container<T> const& tree) {
    return tree.incrementAffinityPartitionerUseCount();
  }
  template <class T> static int decrementAffinityUse(Container<T> const& tree) {
    return tree.decrementAffinityPartitionerUseCount();
  }
  template <class T> static int affinityUse(Container<T> const& tree) {
    return data(tree).m_affinityUseCount.load();
  }
  /// Marks a tile as removed without compaction: its slot in the parent and its root entry go, the record
  /// stays in the array.
  template <class T> static void killLeafTile(Container<T>& tree, TreeIndex const& at) {
    auto const& t = tree.tile(at);
    if (t.isRoot())
      tree.removeRoot(t);
    else
      editTile(tree, t.parentTreeIndex()).childIndex(t) = -1;
    editTile(tree, at).invalidate();
    tree.tilesAdded();
  }
};

} // namespace VLN::TileTree3D

namespace Support {

using Access = VLN::TileTree3D::ContainerTestAccess;

/// A tile whose protected operations are open.
template <class TraitsT, int N = TraitsT::kTileSize> struct OpenTile : VLN::TileTree3D::Tile<TraitsT, N> {
  using Base = VLN::TileTree3D::Tile<TraitsT, N>;
  using Base::init;
  using Base::m_branchSize;
  using Base::m_depth;
  using Base::m_index;
  using Base::m_parent;
  using Base::m_tijk;
  using Base::m_valid;

  OpenTile() = default;
  OpenTile(int i, int j, int k, int depth, std::int64_t index = 0, std::int64_t parent = -1) {
    init(parent, i, j, k, depth, index);
  }
};

} // namespace Support
