// Which tiles are stored with a halo. One lets a reader blend inside the tile without a look at its
// neighbours, and costs nearly twice the memory: a tile needs it where a neighbour on the high side is
// coarser; within the fraction asked for, coarse tiles keep theirs.
#include "GeometryVolume/nanovtt/ContainerLayoutImpl.h"

#include <algorithm>

namespace nanovtt::Internal {

void ContainerLayout::chooseHaloDepth(std::uint64_t total) {
  float const fraction = m_settings.haloFraction;
  auto const share = [&](int d) {
    return static_cast<float>(m_tileCountAccum[std::min(d, kTileCountAccumEntries - 1)]) /
           static_cast<float>(total);
  };
  int d = m_rootDepth + 1;
  for (float reached = 0; reached < fraction && d <= m_maxDepth; ++d) reached = share(d + 1);
  m_haloDepth = std::max(m_rootDepth + 1, d - 1);
  float const above = std::min(share(m_haloDepth), fraction);
  m_haloBudget = static_cast<std::int64_t>((fraction - above) * static_cast<float>(total));
}

bool ContainerLayout::wantsHalo(TileType const& tile, Tree::ConstTileAccessor const& accessor) const {
  int const d = tile.depth();
  if (!(m_settings.haloFraction > 0)) return false;
  if (d == m_rootDepth || m_settings.haloFraction >= 1) return true;
  bool coarser = false;
  for (int n = 1; n < 8; ++n) {
    TileType const& there =
        accessor.tileNeighbor(tile, VLN::TileTree3D::neighborDirection(n >> 2, n >> 1 & 1, n & 1));
    if (!there.valid() || there.depth() >= d) continue;
    if (there.depth() < d - 1) return true;
    coarser = true;
  }
  bool const past = d > m_haloDepth || (d == m_haloDepth && tile.index() >= m_haloBudget);
  bool const edge = d == m_maxDepth || tile.hasLeaves();
  return !past && (edge || coarser);
}

void ContainerLayout::planHalos() {
  std::uint64_t total = 0;
  for (int d = m_rootDepth; d <= m_maxDepth; ++d) total += static_cast<std::uint64_t>(m_tree.tileCount(d));
  if (total > 0) chooseHaloDepth(total);
  m_log.line("haloOptDepth = ", m_haloDepth, ", haloOptFraction = ", m_settings.haloFraction,
             ", haloOptBudget = ", m_haloBudget);

  bool const none = !(m_settings.haloFraction > 0);
  if (none || (m_settings.haloFraction >= 1 && m_deadTiles == 0)) {
    m_halo = none ? Halo::kNone : Halo::kAll;
  } else {
    m_halo = Halo::kSome;
    m_halosBefore.assign(std::size_t(tileCount()) + 1, 0);
    for (int d = m_rootDepth; d <= m_maxDepth; ++d) {
      forEachTileWithAccessor(m_tree, d, [&](TileType const& tile, std::int64_t n, auto const& accessor) {
        if (!inBlock(d, n)) m_halosBefore[number(d, n) + 1] = wantsHalo(tile, accessor);
      });
    }
    for (std::size_t n = 1; n < m_halosBefore.size(); ++n) m_halosBefore[n] += m_halosBefore[n - 1];
  }
  countHalos();
}

void ContainerLayout::countHalos() {
  m_haloTiles = m_halo == Halo::kSome ? m_halosBefore.back() : m_halo == Halo::kAll ? tileCount() : 0;
  // A number without a live tile has room as one without halo: offsets follow from numbers alone.
  m_plainTiles = tileCount() - m_haloTiles;
  if (coalesced()) {
    m_samplesBefore.assign(std::size_t(tileCount()) + 1, 0);
    for (int d = m_rootDepth; d <= m_maxDepth; ++d) {
      forEachTile(m_tree, d, [&](TileType const& tile, std::int64_t index) {
        if (inBlock(d, index)) return;
        std::uint32_t const n = number(d, index);
        std::uint64_t const width = (std::uint64_t(kTileWidth) << blockLevels(tile)) + hasHalo(n);
        m_samplesBefore[n + 1] = width * width * width;
      });
    }
    for (std::size_t n = 1; n < m_samplesBefore.size(); ++n) m_samplesBefore[n] += m_samplesBefore[n - 1];
  }
  double const share = tileCount() ? 100.0 * double(m_haloTiles) / double(tileCount()) : 0.0;
  m_log.line("numNanoVTTTiles = ", tileCount());
  m_log.line("numHaloTiles = ", m_haloTiles, " (", share, "%)");
  m_log.line("numNonHaloTiles = ", m_plainTiles);
  m_log.line("tdOffset[numNanoVTTTiles] = ", m_haloTiles);
}

} // namespace nanovtt::Internal
