// Addition of single tiles, and of those between them and the tree. Included by Container.cpp alone.
#pragma once

#include "GeometryVolume/core/Canceller.h"
#include "GeometryVolume/tiletree/ContainerAppendImpl.h"

#include <algorithm>
#include <cstdint>
#include <utility>
#include <vector>

namespace VLN::TileTree3D {

template <class TraitsT> TreeIndex ContainerBuilder<TraitsT>::makeTile(int i, int j, int k, int depth) {
  TileType* made = nullptr;
  std::int64_t const index = m_tree.allocateTile(depth, made);
  made->init(-1, TraitsT::align(i, depth), TraitsT::align(j, depth), TraitsT::align(k, depth), depth, index);
  m_tree.tilesAdded();
  return {index, depth};
}

template <class TraitsT> TreeIndex ContainerBuilder<TraitsT>::addTile(int i, int j, int k, int depth) {
  if (!TraitsT::isDepth(depth) || !TraitsT::inDomain(i, j, k)) return {};
  TreeIndex const found = m_tree.tileIndex(i, j, k, depth);
  if (found.depth == depth) return found;
  if (found.valid()) return addTileBelow(found, i, j, k, depth);
  Growth growth(data());
  TreeIndex const made = addRootTile(i, j, k, depth, growth);
  growth.keep();
  return made;
}

template <class TraitsT>
TreeIndex ContainerBuilder<TraitsT>::addRootTile(int i, int j, int k, int depth, Growth& growth) {
  TreeIndex const made = makeTile(i, j, k, depth);
  m_tree.addRoot(tile(made));
  // It may stand above existing roots, which then hang below it.
  adoptDeeperRoots(depth, growth);
  return made;
}

template <class TraitsT>
std::int64_t ContainerBuilder<TraitsT>::insertChild(TreeIndex parent, TreeIndex child) {
  data().detachTiles();
  int3 const ijk = tile(parent).childIJK(tile(child));
  int const slot = TileType::slotOf(ijk.x, ijk.y, ijk.z);
  if (!tile(parent).isLeaf(slot)) {
    insertChild(tile(parent).childTreeIndex(slot), child);
    return 0;
  }
  std::int64_t added = 0;
  if (child.depth == parent.depth + 1) {
    editTile(child).setParentIndex(parent.index);
    editTile(parent).childIndex(slot) = child.index;
    added = tile(child).branchSize();
  } else {
    int3 const corner = tile(parent).childTIJK(ijk);
    TreeIndex const between = makeTile(corner.x, corner.y, corner.z, parent.depth + 1);
    editTile(between).setParentIndex(parent.index);
    editTile(parent).childIndex(slot) = between.index;
    insertChild(between, child);
    added = tile(between).branchSize();
  }
  editTile(parent).setBranchSize(tile(parent).branchSize() + added);
  return added;
}

template <class TraitsT>
void ContainerBuilder<TraitsT>::listNewTiles(Counts const& before, TileLists* newTiles) const {
  for (int d = 0; newTiles && d <= kMaxDepth; ++d) {
    for (std::int64_t n = before[d]; n < tileCount(d); ++n) (*newTiles)[d].append(tile({n, d}).tijk());
  }
}

template <class TraitsT> bool ContainerBuilder<TraitsT>::adoptDeeperRoots(int depth, Growth& growth) {
  bool deeper = false;
  for (int d = depth + 1; d <= kMaxDepth; ++d) deeper |= m_tree.rootCount(d) > 0;
  if (!deeper) return false;
  // Roots never overlap, so a root of this depth that holds a deeper one is new.
  auto& roots = data().m_roots;
  std::vector<std::pair<TreeIndex, RootTable::iterator>> adoptions;
  for (auto root = roots.begin(); root != roots.end(); ++root) {
    VoxelCoord const& at = root->first;
    if (at.depth <= depth) continue;
    auto const above = roots.find(
        {TraitsT::align(at.i, depth), TraitsT::align(at.j, depth), TraitsT::align(at.k, depth), depth});
    if (above != roots.end()) adoptions.emplace_back(above->second, root);
  }
  growth.reserve(adoptions.size());
  for (auto const& [parent, root] : adoptions) insertChild(parent, root->second);
  for (auto const& adoption : adoptions) growth.adopt(adoption.second);
  return !adoptions.empty();
}

namespace Internal {

/// By their signs, without a jump for each slot.
template <class TileType> std::int64_t countChildren(TileType const& t) {
  std::int64_t none = 0;
  for (int slot = 0; slot < TileType::kTileSize; ++slot)
    none += static_cast<std::int64_t>(static_cast<std::uint64_t>(t.childIndex(slot)) >> 63);
  return TileType::kTileSize - none;
}

} // namespace Internal

template <class TraitsT> void ContainerBuilder<TraitsT>::setBranchSizes(Cancellation cancellation) {
  // What a bottom-up traversal would do, as one loop over each array: nothing but sums of children.
  Canceller::cancelID(Canceller::kTraverse);
  data().detachTiles();
  for (int d = kMaxDepth; d >= 0; --d) {
    auto& tiles = data().editTiles(d);
    auto const* const below = d < kMaxDepth ? data().tiles(d + 1).begin() : nullptr;
    bool const belowIsDeepest = d + 1 == kMaxDepth; // whose sizes are known
    // The host is asked whether to go on wherever there are tiles, also where none needs to be looked at.
    bool const all = d < kMaxDepth || data().m_tilesHandedOut;
    std::int64_t const count = all ? tiles.size() : std::min<std::int64_t>(1, tiles.size());
    parallelFor(0, count,
                [&](std::int64_t begin, std::int64_t end) {
                  for (std::int64_t n = begin; n < end; ++n) {
                    TileType& t = tiles[n];
                    if (!t.valid()) continue;
                    std::int64_t size = kTileSize;
                    if (belowIsDeepest)
                      size += kTileSize * Internal::countChildren(t);
                    else if (below)
                      for (int slot = 0; slot < kTileSize; ++slot) {
                        std::int64_t const child = t.childIndex(slot);
                        if (child >= 0) size += below[child].branchSize();
                      }
                    if (t.branchSize() != size) t.setBranchSize(size);
                  }
                },
                {.grain = 1024, .cancellation = cancellation});
    Canceller::cancelID(Canceller::kTraverse);
  }
}

} // namespace VLN::TileTree3D
