#include "GeometryVolume/nanovtt/TileSamplesImpl.h"

#include <cstring>

namespace nanovtt::Internal {

namespace Internal3D = VLN::TileTree3D::Internal;

namespace {

constexpr auto& kTable = Internal3D::kHaloTable<Traits, 0, 0, 1, 0>;

} // namespace

struct TileSamples::Halo {
  Halo(Internal3D::UntypedTiles const& source, Tree::ConstTileAccessor const& accessor)
      : driver(source, kTable, accessor)
      , sampler(source, kTable.sourceWidth, kTable.sourceOrigin, VLN::TileTree3D::kVoxelOffsetCorner,
                accessor) {}

  Internal3D::HaloDriver<Traits> driver;
  Internal3D::HaloSampler<Traits> sampler;
};

std::uint8_t* TileSamples::work() {
  // new[] aligns for every element type.
  if (!m_work) m_work.reset(new std::uint8_t[kHaloTileSamples * m_task.source.ops->size]);
  return m_work.get();
}

void const* TileSamples::plain(TileType const& tile) {
  auto const& source = m_task.source;
  TileType const* from = &tile;
  while (from->depth() > source.maxDepth && !from->isRoot())
    from = &m_accessor.container()->tile(from->parentTreeIndex());
  if (void const* const samples = source.elements(from->treeIndex())) return samples;
  if (!m_workIsDefault) {
    std::uint8_t* const out = work();
    for (std::size_t n = 0; n < kTileSamples; ++n)
      std::memcpy(out + n * source.ops->size, source.defaultValue, source.ops->size);
    m_workIsDefault = true;
  }
  return m_work.get();
}

StoredTile TileSamples::get(TileType const& tile, bool halo) {
  if (!halo) return {plain(tile), kTileWidth};
  if (!m_halo) m_halo = std::make_shared<Halo>(m_task.source, m_accessor);
  m_workIsDefault = false;
  m_halo->driver.fill(tile, work(),
                      {VLN::TileTree3D::kHaloModeLinearCoarse, VLN::TileTree3D::kHaloAll, 0.0f, 1.0f,
                       VLN::TileTree3D::kVoxelOffsetCorner},
                      m_halo->sampler);
  if (!m_task.fixFog) return {m_work.get(), kHaloTileWidth};
  if (!m_fixed) m_fixed.reset(new std::uint8_t[kHaloTileSamples * m_task.source.ops->size]);
  m_task.fixFog(m_work.get(), m_task.settings.coarserTolerance, m_fixed.get());
  return {m_fixed.get(), kHaloTileWidth};
}

} // namespace nanovtt::Internal
