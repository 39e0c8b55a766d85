// Coalescing: complete subtrees become dense blocks, under one number each.
//
//   head        f = 2: all 8 children, and all 64 below those           number, entry, child cube
//   children    f = 1                                                   nothing
//   bottom      f = 0: hold the samples, and may have children          samples in the block
#include "GeometryVolume/nanovtt/ContainerLayoutImpl.h"

#include <algorithm>

namespace nanovtt::Internal {

void ContainerLayout::findBlocks() {
  for (int d = m_rootDepth; d <= m_maxDepth; ++d) m_coalesced[d].resize(m_tree.tileCount(d));

  // Children before parents.
  for (int d = m_maxDepth - 1; d >= m_rootDepth; --d) {
    CoalescedTiles& here = m_coalesced[d];
    CoalescedTiles& below = m_coalesced[static_cast<std::size_t>(d) + 1];
    bool const last = d == m_maxDepth - 1;
    forEachTile(m_tree, d, [&](TileType const& tile, std::int64_t index) {
      int height = 0, children = 0, levels = -1;
      bool same = true;
      for (int slot = 0; slot < TileType::kTileSize; ++slot) {
        if (tile.childIndex(slot) < 0) continue;
        auto const child = static_cast<std::size_t>(tile.childIndex(slot));
        ++children;
        height = std::max(height, last ? 1 : below.height[child] + 1);
        if (levels < 0) levels = below.full[child];
        same = same && below.full[child] == levels;
      }
      here.height[index] = static_cast<std::uint8_t>(height);
      if (children != TileType::kTileSize) return;
      here.full[index] = last                                   ? 1
                         : same && levels < kMaxCoalescedLevels ? static_cast<std::uint8_t>(levels + 1)
                                                                : 0;
      if (here.full[index] == 0) return;
      for (int slot = 0; slot < TileType::kTileSize; ++slot) below.inBlock[tile.childIndex(slot)] = 1;
    });
  }
}

void ContainerLayout::numberBlocks() {
  for (int d = m_rootDepth + 1; d <= m_maxDepth; ++d) {
    auto& order = m_order[d];
    std::vector<std::uint32_t> before(order.size() + 1);
    for (std::size_t n = 0; n < order.size(); ++n) before[order[n] + 1] = !m_coalesced[d].inBlock[n];
    for (std::size_t n = 1; n < before.size(); ++n) before[n] += before[n - 1];
    for (auto& number : order) number = before[number];
    m_log.line("Compacted tiles[", d, "] from ", m_counts[d], " to ", before.back());
    m_counts[d] = before.back();
  }
}

int ContainerLayout::blockLevels(TileType const& tile) const {
  int const levels = fullLevels(tile.treeIndex());
  if (levels == 0 || tile.depth() == m_rootDepth) return levels;
  return fullLevels(tile.parentTreeIndex()) == 0 ? levels : 0;
}

TileType const& ContainerLayout::blockHead(TileType const& tile) const {
  TileType const* head = &tile;
  while (inBlock(head->depth(), head->index())) head = &m_tree.tile(head->parentTreeIndex());
  return *head;
}

} // namespace nanovtt::Internal
