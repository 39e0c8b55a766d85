// Writing the container section that was planned.
#include "GeometryVolume/nanovtt/ContainerLayoutImpl.h"

#include <algorithm>
#include <cstring>

namespace nanovtt::Internal {

void ContainerLayout::clear(std::uint8_t* bytes) const {
  // All but the root table, which is filled whole.
  fillZeros(bytes, kRootTableOffset);
  fillZeros(bytes + kLlcOffset, m_size - kLlcOffset);
}

void ContainerLayout::write(std::uint8_t* bytes, std::uint64_t bufferSize) const {
  store<std::uint64_t>(bytes + kBufferSizeOffset, bufferSize);
  store<std::uint64_t>(bytes + kContainerSizeOffset, m_size);
  std::memcpy(bytes + kTileCountAccumOffset, m_tileCountAccum.data(), sizeof m_tileCountAccum);
  store<std::int32_t>(bytes + kLlcOffset, m_lowest.x);
  store<std::int32_t>(bytes + kLlcOffset + 4, m_lowest.y);
  store<std::int32_t>(bytes + kLlcOffset + 8, m_lowest.z);
  store<std::int32_t>(bytes + kRootDepthOffset, m_rootDepth);
  store<std::uint64_t>(bytes + kParentTableOffset, (m_notFinest + 1) * 8);
  writeRoots(bytes);
  if (m_log) {
    m_log.line("voxelSize = ", m_tree.voxelSize());
    for (int d = 0; d < kTileCountAccumEntries; ++d)
      m_log.line("tileCountAccum[", d, "] = ", m_tileCountAccum[d]);
    for (int d = 0; d <= kMaxDepth; ++d) m_log.line("tileCount[", d, "] = ", depthCount(d));
    m_log.line("BufferSize = ", bufferSize);
  }

  std::atomic<std::uint64_t> blocks = 0;
  for (int d = m_rootDepth; d <= m_maxDepth; ++d) {
    forEachTile(m_tree, d, [&](TileType const& tile, std::int64_t) {
      writeTile(bytes, tile);
      if (coalesced() && blockLevels(tile) > 0) blocks.fetch_add(1, std::memory_order_relaxed);
    });
  }
  if (m_deadTiles > 0) {
    // Nobody reaches these numbers, but a look at them finds a tile without parent and children.
    for (int d = m_rootDepth; d <= m_maxDepth; ++d) {
      for (std::int64_t n = 0; n < m_tree.tileCount(d); ++n) {
        if (m_tree.tile(n, d).valid()) continue;
        std::uint32_t const at = number(d, n);
        store<std::uint32_t>(bytes + kChildOffsetsBase + (m_notFinest + 1) * 8 + 4 * std::uint64_t(at),
                             kNoTile);
        if (d < kMaxDepth) store(bytes + kChildOffsetsBase + 8 * std::uint64_t(at), m_childOffsets.back());
      }
    }
  }
  m_log.line("numTilesCoalesced = ", blocks.load());

  std::uint64_t const sentinel = m_childOffsets.back();
  store<std::uint64_t>(bytes + kChildOffsetsBase + 8 * m_notFinest, sentinel);
  std::memset(bytes + kChildOffsetsBase + sentinel, 0xFF, kSentinelBytes);
  reportSize();
}

void ContainerLayout::writeRoots(std::uint8_t* bytes) const {
  std::uint8_t* const table = bytes + kRootTableOffset;
  std::memset(table, 0xFF, std::size_t(kMaxRoots) * 4);
  std::uint32_t const shift = static_cast<std::uint32_t>(kTileSpaceBits - m_rootDepth);
  std::uint32_t const low[3] = {static_cast<std::uint32_t>(m_lowest.x),
                                static_cast<std::uint32_t>(m_lowest.y),
                                static_cast<std::uint32_t>(m_lowest.z)};
  forEachTile(m_tree, m_rootDepth, [=, this](TileType const& tile, std::int64_t n) {
    std::uint32_t const x = (static_cast<std::uint32_t>(tile.ti()) - low[0]) >> shift;
    std::uint32_t const y = (static_cast<std::uint32_t>(tile.tj()) - low[1]) >> shift;
    std::uint32_t const z = (static_cast<std::uint32_t>(tile.tk()) - low[2]) >> shift;
    if (std::max({x, y, z}) < kRootTableWidth)
      store<std::uint32_t>(table + 4 * ((z * kRootTableWidth + y) * kRootTableWidth + x),
                           number(m_rootDepth, n));
  });
}

void ContainerLayout::writeTile(std::uint8_t* bytes, TileType const& tile) const {
  int const d = tile.depth();
  if (inBlock(d, tile.index())) {
    if (fullLevels(tile.treeIndex()) == 0 && d < m_maxDepth) writeBlockChildren(bytes, tile);
    return;
  }
  std::uint32_t const n = number(d, tile.index());
  std::uint32_t parent = kNoTile;
  if (d > m_rootDepth && !tile.isRoot()) {
    TileType const& above = m_tree.tile(tile.parentTreeIndex());
    TileType const& owner = coalesced() ? blockHead(above) : above;
    parent = number(owner.depth(), owner.index());
  }
  store<std::uint32_t>(bytes + kChildOffsetsBase + (m_notFinest + 1) * 8 + 4 * std::uint64_t(n), parent);
  if (d == kMaxDepth) return;

  bool const children = hasChildTable(tile);
  int const levels = coalesced() && children ? blockLevels(tile) : 0;
  store<std::uint64_t>(bytes + kChildOffsetsBase + 8 * std::uint64_t(n),
                       m_childOffsets[n] | static_cast<std::uint64_t>(levels) << kChildLevelsShift);
  if (!children || levels > 0) return;
  std::uint8_t* const table = bytes + kChildOffsetsBase + m_childOffsets[n];
  for (int slot = 0; slot < TileType::kTileSize; ++slot)
    store<std::uint32_t>(table + 4 * slot, childNumber(tile, slot));
}

/// The children of a tile at the bottom of a block, in the cube of the block's head.
void ContainerLayout::writeBlockChildren(std::uint8_t* bytes, TileType const& bottom) const {
  TileType const& head = blockHead(bottom);
  if (!hasChildTable(head)) return;
  std::uint8_t* const cube = bytes + kChildOffsetsBase + m_childOffsets[number(head.depth(), head.index())];
  int const across = 2 << blockLevels(head);
  int const width = bottom.childTileVoxelWidth();
  int3 const low{(bottom.ti() - head.ti()) / width, (bottom.tj() - head.tj()) / width,
                 (bottom.tk() - head.tk()) / width};
  for (int slot = 0; slot < TileType::kTileSize; ++slot) {
    int3 const at = low + TileType::childIJK(slot);
    store<std::uint32_t>(cube + 4 * (at.x + across * (at.y + across * at.z)), childNumber(bottom, slot));
  }
}

void ContainerLayout::reportSize() const {
  if (!m_log) return;
  auto const megabytes = [](double bytes) { return bytes / 1024 / 1024; };
  // What one child table for each tile with children would take.
  std::uint64_t inner = 0;
  for (int d = m_rootDepth; d < m_maxDepth; ++d)
    for (std::int64_t n = 0; n < m_tree.tileCount(d); ++n)
      inner += m_tree.tile(n, d).valid() && !m_tree.tile(n, d).isLeaf();
  double const plain = double(kContainerFixedBytes) + double(kChildTableBytes) * double(inner);
  double const saved = double(m_size) - plain;
  double const share = m_notFinest ? 100.0 * double(m_withChildren) / double(m_notFinest) : 0.0;
  m_log.line("numNonLeavesAtCoarserDepths = ", m_withChildren, " (", share, "%)");
  m_log.line("Container size = ", megabytes(double(m_size)), " MB");
  m_log.line("Container hash table size = ", 1, " MB");
  m_log.line("Potential container memory savings = ", megabytes(saved), " MB, ", 100 * saved / double(m_size),
             "%");
  m_log.line("Potential total memory savings: before: ", megabytes(double(m_size)),
             "MB, after: ", megabytes(plain), "MB");
}

} // namespace nanovtt::Internal
