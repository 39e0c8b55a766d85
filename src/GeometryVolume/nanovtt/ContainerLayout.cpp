#include "GeometryVolume/nanovtt/ContainerLayoutImpl.h"

#include "GeometryVolume/channels/Channel.h"

#include <algorithm>
#include <cmath>
#include <stdexcept>

namespace nanovtt::Internal {

namespace {

constexpr int kRootsAcross = static_cast<int>(kRootTableWidth);
using FloatChannel = VLN::TileTree3D::Channel<Traits, float, 4, 0>;

/// Samples of a tile, or null where the channel has none.
float const* samples(FloatChannel const* channel, TreeIndex const& at) {
  if (!channel || !channel->tileArrays() || at.depth < channel->minDepth() || at.depth > channel->depth())
    return nullptr;
  auto const& tiles = (*channel->tileArrays())[at.depth];
  auto const n = static_cast<std::size_t>(at.index);
  return n < tiles.size() && tiles[n].size() >= std::size_t(kTileSamples) ? tiles[n].data() : nullptr;
}

} // namespace

bool ContainerLayout::plan(VLN::Object const& object, BufferMaker const& makeBuffer) {
  chooseRootDepth();
  raiseToCoarseContent(object);
  reportRoots();
  if (!rootsFit()) return false;
  numberTiles();
  if (coalesced()) {
    findBlocks();
    numberBlocks();
  }
  countTiles();
  if (m_settings.traversal) makeTraversal(makeBuffer);
  if (m_settings.neighbors) makeNeighbors(makeBuffer);
  planChildTables();
  planHalos();
  return true;
}

// --- Roots ---

/// Entries of the root table along the longest axis.
int ContainerLayout::rootEntries(int depth, int& size, int3& lowest) const {
  VLN::TileTree3D::bbox<int3, int> box;
  m_tree.tileSpaceBounds(depth, box);
  size = 0, lowest = {0, 0, 0};
  if (box.empty()) return 0;
  lowest = box.min;
  for (int a = 0; a < 3; ++a) size = std::max(size, box.max[a] - box.min[a]);
  return size / Tree::tileVoxelWidth(depth);
}

void ContainerLayout::chooseRootDepth() {
  int size;
  m_rootDepth = 0;
  int const limit = std::max(m_settings.rootLevelLimit, m_settings.finestLevel);
  for (int d = kMaxDepth - std::clamp(limit, 0, kMaxDepth); d > 0; --d) {
    if (m_tree.tileCount(d) > 0 && rootEntries(d, size, m_lowest) <= kRootsAcross) {
      m_rootDepth = d;
      return;
    }
  }
  rootEntries(m_rootDepth, size, m_lowest);
}

/// What is visible in coarse tiles pulls the root depth up to them.
void ContainerLayout::raiseToCoarseContent(VLN::Object const& object) {
  auto const fog = object.component<FloatChannel>("voxel_fog_density");
  auto const distance = object.component<FloatChannel>("voxel_signed_distance");
  auto const visible = [&](TileType const& tile) {
    float const* const fogs = samples(fog.get(), tile.treeIndex());
    float const* const distances = samples(distance.get(), tile.treeIndex());
    if (!fogs && !distances) return false;
    for (int n = 0; n < kTileSamples; ++n) {
      if (!tile.isLeaf(n % 4 / 2, n / 4 % 4 / 2, n / 32)) continue;
      if (fogs && std::abs(fogs[n] - fog->defaultValue()) > 0) return true;
      if (distances && distances[n] < 0) return true;
    }
    return false;
  };
  int const chosen = m_rootDepth;
  for (int d = 0; (fog || distance) && d < m_rootDepth; ++d) {
    std::atomic<bool> found = false;
    forEachTile(m_tree, d, [&](TileType const& tile, std::int64_t) {
      if (!found.load(std::memory_order_relaxed) && visible(tile))
        found.store(true, std::memory_order_relaxed);
    });
    if (found) m_rootDepth = d;
  }
  if (m_rootDepth == chosen) return;
  // Coarser depths can have roots of their own, further out than the table reaches.
  int size;
  while (rootEntries(m_rootDepth, size, m_lowest) > kRootsAcross && m_rootDepth > 0) --m_rootDepth;
}

void ContainerLayout::reportRoots() const {
  if (!m_log) return;
  int size;
  int3 lowest;
  int const entries = rootEntries(m_rootDepth, size, lowest);
  m_log.line("Building perfect hash table at depth ", m_rootDepth);
  m_log.line(" maxTileSpaceSize = ", size);
  m_log.line(" maxTileSpaceEntries = ", entries);
  m_log.line(" llc = ", lowest.x, ", ", lowest.y, ", ", lowest.z);
  m_log.line(" tvw = ", Tree::tileVoxelWidth(m_rootDepth));
  m_log.line("rootDepth = ", m_rootDepth);
  m_log.line("number of roots = ", m_tree.tileCount(m_rootDepth));
  m_log.line("maxRoots = ", kMaxRoots);
}

bool ContainerLayout::rootsFit() const {
  for (int d = m_rootDepth + 1; d <= kMaxDepth; ++d) {
    if (m_tree.rootCount(d) == 0) continue;
    std::cerr << "VTTToNanoVTT: roots at depths finer than rootDepth (in this case " << m_rootDepth
              << " not supported)\n";
    return false;
  }
  return true;
}

// --- Numbers ---

void ContainerLayout::numberTiles() {
  std::vector<std::vector<std::int64_t>> morton;
  if (m_settings.morton) m_tree.computeMortonPermutations(morton);
  for (int d = m_rootDepth; d <= m_maxDepth; ++d) {
    std::int64_t const count = m_tree.tileCount(d);
    if (count >= std::int64_t(kNoTile)) throw std::runtime_error("VTTToNanoVTT: too many tiles to number");
    m_counts[d] = static_cast<std::uint32_t>(count);
    if (!m_settings.morton && !coalesced()) continue;
    auto& order = m_order[d];
    order.resize(count);
    VLN::parallelFor(0, count,
                     [&](std::int64_t begin, std::int64_t end) {
                       for (auto n = begin; n < end; ++n)
                         order[n] = static_cast<std::uint32_t>(m_settings.morton ? morton[d][n] : n);
                     },
                     {.grain = 16384});
  }
}

void ContainerLayout::countTiles() {
  std::uint64_t total = 0;
  for (int d = 0; d < kTileCountAccumEntries; ++d) {
    m_tileCountAccum[d] = static_cast<std::uint32_t>(total);
    if (d >= m_rootDepth && d <= m_maxDepth) total += m_counts[d];
    if (total >= kNoTile) throw std::runtime_error("VTTToNanoVTT: too many tiles to number");
  }
  std::atomic<std::uint64_t> live = 0;
  for (int d = m_rootDepth; d <= m_maxDepth; ++d) {
    VLN::parallelFor(0, m_tree.tileCount(d),
                     [&](std::int64_t begin, std::int64_t end) {
                       std::uint64_t count = 0;
                       for (std::int64_t n = begin; n < end; ++n)
                         count += m_tree.tile(n, d).valid() && !inBlock(d, n);
                       live.fetch_add(count, std::memory_order_relaxed);
                     },
                     {.grain = 4096});
  }
  m_deadTiles = total - live;
  m_notFinest = tileCount() - depthCount(kMaxDepth);
}

bool ContainerLayout::hasChildTable(TileType const& tile) const {
  if (tile.depth() >= m_maxDepth || tile.isLeaf()) return false;
  int const levels = coalesced() ? blockLevels(tile) : 0;
  return levels == 0 || levels != height(tile);
}

void ContainerLayout::planChildTables() {
  m_childOffsets.assign(m_notFinest + 1, 0);
  std::atomic<std::uint64_t> withChildren = 0;
  for (int d = m_rootDepth; d <= std::min(m_maxDepth, kMaxDepth - 1); ++d) {
    forEachTile(m_tree, d, [&](TileType const& tile, std::int64_t index) {
      if (inBlock(d, index) || !hasChildTable(tile)) return;
      int const levels = coalesced() ? blockLevels(tile) : 0;
      m_childOffsets[number(d, index) + 1] =
          levels > 0 ? std::uint64_t(4) << (3 * (levels + 1)) : kChildTableBytes;
      withChildren.fetch_add(1, std::memory_order_relaxed);
    });
  }
  m_withChildren = withChildren;

  std::uint64_t const tables = childTablesStart(tileCount(), m_notFinest);
  m_childOffsets[0] = tables;
  for (std::size_t n = 1; n < m_childOffsets.size(); ++n) m_childOffsets[n] += m_childOffsets[n - 1];
  std::uint64_t const sentinel = m_childOffsets.back();
  for (std::size_t n = 0; n + 1 < m_childOffsets.size(); ++n)
    if (m_childOffsets[n] == m_childOffsets[n + 1]) m_childOffsets[n] = sentinel;

  std::uint64_t const size = kContainerFixedBytes + sentinel;
  m_size = padSection(size);
  double const share = m_notFinest ? 100.0 * double(m_withChildren) / double(m_notFinest) : 0.0;
  m_log.line("numNonLeavesAtCoarserDepths = ", m_withChildren, " (", share, "%)");
  m_log.line("Container size alignment = ", size % kSectionAlignment);
}

} // namespace nanovtt::Internal
