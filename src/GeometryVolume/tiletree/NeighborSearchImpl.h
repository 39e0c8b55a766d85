// NeighborSearch: collects the distinct tiles around a tile.
#pragma once

#include "GeometryVolume/tiletree/TileAccessor.h"

#include <set>

namespace VLN::TileTree3D {

template <class TraitsT> class NeighborSearch {
public:
  using TileType = typename Container<TraitsT>::TileType;

  NeighborSearch(ConstTileAccessorOf<TraitsT> const& accessor, std::vector<TreeIndex>& list)
      : m_accessor(accessor)
      , m_tree(*accessor.container())
      , m_list(list) {}

  /// The tiles at the 27 offsets, with what faces `t` below them down to `depth`.
  void aroundTile(TileType const& t, int depth) {
    for (int n = 0; n < kNeighborCount; ++n) {
      int3 const offset = neighborOffset(n);
      TileType const& found = m_accessor.tileNeighbor(t, offset, t.depth(), false);
      if (!found.valid()) continue;
      if (found.depth() < t.depth() || depth <= t.depth())
        add(found);
      else
        addFacing(found, offset, depth);
    }
  }

  /// The tiles around each leaf voxel of `t`, one level deeper where they exist, and `t` when it has leaf
  /// voxels.
  void aroundLeafVoxels(TileType const& t) {
    if (t.atMaxDepth()) {
      aroundTile(t, t.depth());
      return;
    }
    bool anyLeaf = false;
    for (int slot = 0; slot < TraitsT::kTileSize; ++slot) {
      if (!t.isLeaf(slot)) continue;
      anyLeaf = true;
      int3 const corner = t.childTIJK(t.childIJK(slot));
      std::int64_t const v = t.voxelWidth();
      for (int n = 0; n < kNeighborCount; ++n) {
        if (n == kNeighborSelf) continue;
        int3 const d = neighborOffset(n);
        std::int64_t const p[3] = {corner.x + v * d.x, corner.y + v * d.y, corner.z + v * d.z};
        bool inDomain = true;
        for (std::int64_t const c : p) inDomain &= c >= TraitsT::kMinTileCoord && c <= TraitsT::kMaxTileCoord;
        if (!inDomain) continue;
        TileType const& found = m_accessor.tile(static_cast<int>(p[0]), static_cast<int>(p[1]),
                                                static_cast<int>(p[2]), t.depth() + 1, false);
        if (found.valid()) add(found);
      }
    }
    if (anyLeaf) add(t);
  }

private:
  void add(TileType const& t) {
    if (m_seen.insert(t.treeIndex()).second) m_list.push_back(t.treeIndex());
  }

  /// Adds a tile and those of its descendants that face the centre: on an axis with a step, the slots on the
  /// near side; on one without, all slots.
  void addFacing(TileType const& t, int3 const& offset, int depth) {
    add(t);
    if (t.depth() >= depth || t.atMaxDepth()) return;
    for (auto child = t.begin(); child != t.end(); ++child) {
      int3 const ijk = t.childIJK(*child);
      bool faces = true;
      for (int a = 0; a < 3; ++a) {
        if (offset[a] != 0) faces &= ijk[a] == (offset[a] > 0 ? 0 : TraitsT::kTW - 1);
      }
      if (faces) addFacing(m_tree.tile(child.treeIndex()), offset, depth);
    }
  }

  ConstTileAccessorOf<TraitsT> const& m_accessor;
  Container<TraitsT> const& m_tree;
  std::vector<TreeIndex>& m_list;
  std::set<TreeIndex> m_seen;
};

} // namespace VLN::TileTree3D
