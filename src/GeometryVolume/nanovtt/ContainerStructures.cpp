// Two buffers beside the main one: where each tile lies, and who its neighbours are.
#include "GeometryVolume/nanovtt/ContainerLayoutImpl.h"

namespace nanovtt::Internal {

std::uint64_t ContainerLayout::structureSize(std::uint64_t rows) const {
  if (m_settings.textures) return blockSize(rows, m_settings.elementBytes);
  return m_settings.cubic ? cubicSize(rows, m_settings.elementBytes) : rows;
}

void ContainerLayout::makeTraversal(BufferMaker const& makeBuffer) const {
  std::uint64_t const size = structureSize(tileCount() * kTraversalRowBytes);
  std::uint8_t* const bytes = makeBuffer(BufferRole::kTraversal, size);
  fillZeros(bytes, size);
  for (int d = m_rootDepth; d <= m_maxDepth; ++d) {
    forEachTile(m_tree, d, [&](TileType const& tile, std::int64_t index) {
      std::uint8_t* const row = bytes + number(d, index) * kTraversalRowBytes;
      store<std::int32_t>(row, tile.ti());
      store<std::int32_t>(row + 4, tile.tj());
      store<std::int32_t>(row + 8, tile.tk());
      store<std::int32_t>(row + 12, d);
    });
  }
}

void ContainerLayout::makeNeighbors(BufferMaker const& makeBuffer) const {
  // Twice what the rows take: readers count on the size, and find the rows in the lower half.
  std::uint64_t const size = structureSize(tileCount() * kNeighborAllocatedRowBytes);
  std::uint8_t* const bytes = makeBuffer(BufferRole::kNeighbors, size);
  fillZeros(bytes, size);
  for (int d = m_rootDepth; d <= m_maxDepth; ++d) {
    forEachTileWithAccessor(m_tree, d, [&](TileType const& tile, std::int64_t n, auto const& accessor) {
      std::uint8_t* const row = bytes + number(d, n) * kNeighborRowBytes;
      for (int direction = 0; direction < VLN::TileTree3D::kNeighborCount; ++direction) {
        TileType const& there =
            accessor.tileNeighbor(tile, static_cast<VLN::TileTree3D::NeighborDirection>(direction));
        bool const numbered = there.valid() && there.depth() >= m_rootDepth;
        store<std::uint32_t>(row + 4 * direction, numbered ? number(there.depth(), there.index()) : kNoTile);
      }
    });
  }
}

} // namespace nanovtt::Internal
