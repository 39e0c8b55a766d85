// Addition of one tile, and of those between, below a tile that is there. Included where tiles are added one
// after another: what each of them costs is a few stores, so that calls would cost more.
#pragma once

#include "GeometryVolume/core/RollbackImpl.h"
#include "GeometryVolume/tiletree/ContainerBuilderImpl.h"

#include <new>

namespace VLN::TileTree3D {

template <class TraitsT>
[[gnu::always_inline]] inline auto ContainerBuilder<TraitsT>::appendRecord(int depth) -> TileType& {
  auto& tiles = data().editTiles(depth);
  std::int64_t const n = tiles.size();
  tiles.growRaw(n + 1);
  return *new (static_cast<void*>(&tiles[n])) TileType;
}

template <class TraitsT>
[[gnu::always_inline]] inline TreeIndex
ContainerBuilder<TraitsT>::addDeepestTile(std::int64_t above, int slot, int3 const& corner) {
  if (data().hasDerived()) m_tree.tilesAdded();
  data().detachTiles();
  std::int64_t const index = data().m_tileCounts[kMaxDepth];
  appendRecord(kMaxDepth).init(above, corner.x, corner.y, corner.z, kMaxDepth, index);
  ++data().m_tileCounts[kMaxDepth];
  ++data().m_tileCountTotal;
  TileType& parent = editTile({above, kMaxDepth - 1});
  parent.childIndex(slot) = index;
  parent.setBranchSize(parent.branchSize() + kTileSize);
  return {index, kMaxDepth};
}

template <class TraitsT>
TreeIndex ContainerBuilder<TraitsT>::addTileBelow(TreeIndex above, int i, int j, int k, int depth) {
  if (data().hasDerived()) m_tree.tilesAdded();
  data().detachTiles();
  auto& counts = data().m_tileCounts;
  // Records that nothing leads to yet: taking them back needs no memory.
  VLN::Internal::Rollback records([&] {
    for (int d = above.depth + 1; d <= depth; ++d)
      if (tileCount(d) < data().tiles(d).size()) data().editTiles(d).resize(tileCount(d));
  });
  std::int64_t parent = above.index;
  for (int d = above.depth + 1; d <= depth; ++d) {
    std::int64_t const index = counts[d];
    appendRecord(d).init(parent, TraitsT::align(i, d), TraitsT::align(j, d), TraitsT::align(k, d), d, index);
    parent = index;
  }
  records.dismiss();
  std::int64_t size = 0;
  for (int d = depth; d > above.depth; --d) {
    TileType& made = editTile({counts[d], d});
    made.setBranchSize(size += kTileSize);
    TileType& over = editTile({made.parentIndex(), d - 1});
    over.childIndex(Internal::slotOfCorner(over, made.tijk())) = counts[d]++;
  }
  data().m_tileCountTotal += depth - above.depth;
  TileType& over = editTile(above);
  over.setBranchSize(over.branchSize() + size);
  return {parent, depth};
}

} // namespace VLN::TileTree3D
