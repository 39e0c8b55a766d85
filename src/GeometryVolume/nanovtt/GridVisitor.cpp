#include "GeometryVolume/nanovtt/GridVisitorImpl.h"

#include <algorithm>
#include <bit>
#include <cstring>

namespace nanovtt::Internal {

namespace {

/// Bits of the 64 samples in the 2 x 2 x 2 under each voxel without a child.
std::uint64_t leafSamples(TileType const& tile) {
  constexpr std::uint64_t kFirstVoxel = 0x0000000000330033ull; // samples 0, 1 of rows 0, 1 of slices 0, 1
  if (tile.isLeaf()) return ~0ull;
  std::uint64_t mask = 0;
  for (int slot = 0; slot < TileType::kTileSize; ++slot) {
    int3 const at = TileType::childIJK(slot);
    if (tile.isLeaf(slot)) mask |= kFirstVoxel << (2 * at.x + 8 * at.y + 32 * at.z);
  }
  return mask;
}

/// Smallest and largest coordinate of the set bits along each axis.
void extentOf(std::uint64_t mask, int low[3], int high[3]) {
  std::uint32_t slices = 0, rows = 0, columns = 0;
  for (int k = 0; k < 4; ++k) {
    auto const slice = static_cast<std::uint32_t>(mask >> (16 * k) & 0xFFFF);
    slices |= std::uint32_t(slice != 0) << k;
    rows |= slice;
  }
  std::uint32_t const all = rows;
  rows = 0;
  for (int j = 0; j < 4; ++j) {
    std::uint32_t const row = all >> (4 * j) & 0xF;
    rows |= std::uint32_t(row != 0) << j;
    columns |= row;
  }
  std::uint32_t const sets[3] = {columns, rows, slices};
  for (int a = 0; a < 3; ++a) {
    low[a] = std::countr_zero(sets[a]);
    high[a] = static_cast<int>(std::bit_width(sets[a])) - 1;
  }
}

void growBy(ActiveBox& box, TileType const& tile, std::uint64_t mask) {
  if (mask == 0) return;
  int low[3], high[3];
  extentOf(mask, low, high);
  int const w = tile.voxelDataWidth();
  ActiveBox part;
  for (int a = 0; a < 3; ++a) {
    part.low[a] = tile.tijk()[a] + (low[a] - 2) * w;
    part.high[a] = tile.tijk()[a] + (high[a] + 2) * w;
  }
  box.join(part);
}

/// Whether no sample of the tile can make the box larger.
bool holds(ActiveBox const& box, TileType const& tile) {
  int const w = tile.voxelDataWidth();
  for (int a = 0; a < 3; ++a)
    if (tile.tijk()[a] - 2 * w < box.low[a] || tile.tijk()[a] + 5 * w > box.high[a]) return false;
  return true;
}

} // namespace

void GridVisitor::visit(int depth, std::int64_t begin, std::int64_t end) {
  ContainerLayout const& layout = m_task.layout;
  for (std::int64_t n = begin; n < end; ++n) {
    TileType const& tile = layout.tree().tile(n, depth);
    if (!tile.valid()) continue;
    if (layout.coalesced())
      GridVisitor::beginTile(tile);
    else
      storeTile(tile, layout.number(depth, n));
  }
}

void GridVisitor::beginTile(TileType const& tile) {
  ContainerLayout const& layout = m_task.layout;
  if (!layout.inBlock(tile.depth(), tile.index()))
    return storeTile(tile, layout.number(tile.depth(), tile.index()));

  TileType const& head = layout.blockHead(tile);
  int const bottom = head.depth() + layout.blockLevels(head);
  if (tile.depth() < bottom) return; // all its voxels are refined, and others hold its data
  bool halo = layout.hasHalo(layout.number(head.depth(), head.index()));
  // Away from the block's high edge the core is all that is stored, and the halo computation leaves a core
  // as it is: but not below the channel's last depth, where it blends, nor under the fog fix, which looks
  // beyond it.
  if (halo && !m_task.fixFog && tile.depth() <= m_task.source.maxDepth) {
    bool touches = false;
    for (int a = 0; a < 3; ++a)
      touches |= tile.tijk()[a] + tile.tileVoxelWidth() == head.tijk()[a] + head.tileVoxelWidth();
    halo = touches;
  }
  StoredTile const stored = m_samples.get(tile, halo);
  storeInBlock(tile, head, stored);
  grow(tile, stored);
}

void GridVisitor::storeTile(TileType const& tile, std::uint32_t number) {
  ContainerLayout const& layout = m_task.layout;
  bool const halo = layout.hasHalo(number);
  StoredTile const stored = m_samples.get(tile, halo);
  std::uint64_t const offset = m_task.offset(number);
  int const levels = layout.coalesced() ? layout.blockLevels(tile) : 0;
  store(m_task.table() + 8 * std::uint64_t(number), m_task.entry(number, offset, halo, levels));
  if (m_task.quantised())
    quantise(stored, number, m_task.table() + offset);
  else if (m_task.bricksAcross > 0)
    storeBrick(number, stored);
  else if (levels == 0)
    std::memcpy(m_task.table() + offset, stored.samples, halo ? m_task.haloBytes : m_task.plainBytes);
  grow(tile, stored);
}

void GridVisitor::storeInBlock(TileType const& bottom, TileType const& head, StoredTile const& tile) const {
  ContainerLayout const& layout = m_task.layout;
  std::uint32_t const number = layout.number(head.depth(), head.index());
  int const core = kTileWidth << layout.blockLevels(head);
  std::uint64_t const width = static_cast<std::uint64_t>(core) + layout.hasHalo(number);
  std::uint64_t const size = elementBytes(m_task.type);
  std::uint64_t low[3];
  int count[3];
  for (int a = 0; a < 3; ++a) {
    int const at = (bottom.tijk()[a] - head.tijk()[a]) / bottom.voxelDataWidth();
    low[a] = static_cast<std::uint64_t>(at);
    // The block's halo comes with the tiles at its high edge.
    count[a] = layout.hasHalo(number) && at + kTileWidth == core ? kHaloTileWidth : kTileWidth;
  }
  std::uint8_t* const block = m_task.table() + m_task.offset(number);
  auto const* const from = static_cast<std::uint8_t const*>(tile.samples);
  auto const across = static_cast<std::uint64_t>(tile.width);
  for (std::uint64_t k = 0; k < static_cast<std::uint64_t>(count[2]); ++k)
    for (std::uint64_t j = 0; j < static_cast<std::uint64_t>(count[1]); ++j)
      std::memcpy(block + ((((low[2] + k) * width) + low[1] + j) * width + low[0]) * size,
                  from + (k * across + j) * across * size, static_cast<std::uint64_t>(count[0]) * size);
}

void GridVisitor::storeBrick(std::uint32_t number, StoredTile const& tile) const {
  std::uint64_t const size = elementBytes(m_task.type), width = m_task.bricksAcross * kHaloTileWidth;
  GridTask::Brick const at = m_task.brick(number);
  std::uint8_t* const brick =
      m_task.table() + m_task.tableBytes() +
      ((at.z * kHaloTileWidth * width + at.y * kHaloTileWidth) * width + at.x * kHaloTileWidth) * size;
  auto const* from = static_cast<std::uint8_t const*>(tile.samples);
  for (std::uint64_t k = 0; k < kHaloTileWidth; ++k)
    for (std::uint64_t j = 0; j < kHaloTileWidth; ++j, from += kHaloTileWidth * size)
      std::memcpy(brick + (k * width + j) * width * size, from, kHaloTileWidth * size);
}

void GridVisitor::grow(TileType const& tile, StoredTile const& stored) {
  bool const known = holds(m_boxes.all, tile);
  if (known && (!m_task.fixFog || holds(m_boxes.aboveThreshold, tile))) return;
  std::uint64_t const counted = tile.depth() == m_task.layout.rootDepth() ? ~0ull : leafSamples(tile);
  if (counted == 0) return;
  if (!known) growBy(m_boxes.all, tile, active(stored, 0) & counted);
  if (m_task.fixFog)
    growBy(m_boxes.aboveThreshold, tile,
           active(stored, m_task.settings.coarserTolerance + 1.1920929e-7f) & counted);
}

} // namespace nanovtt::Internal
