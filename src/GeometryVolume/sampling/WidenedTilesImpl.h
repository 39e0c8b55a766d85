// Definitions of VoxelSamplerLinear: tiles widened by the samples around them, and the few that it keeps.
// Only VoxelSamplerLinear.cpp includes this.
#pragma once

#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"

#include <algorithm>
#include <array>
#include <vector>

namespace VLN::TileTree3D {

#define VLN_SAMPLER_TEMPLATE                                                                                 \
  template <class TraitsT, class Value, int Components, class Real, class Position, int A, int B>
#define VLN_SAMPLER VoxelSamplerLinear<TraitsT, Value, Components, Real, Position, A, B>

// The entry that holds the tile, or null.
VLN_SAMPLER_TEMPLATE template <class Tile>
auto VLN_SAMPLER::probe(std::int64_t tile, int depth, Cache<Tile>& cache) const -> CacheEntry<Tile>* {
  if (m_lastTile[depth] == tile) return &cache[m_lastSlot[depth]];
  for (int n = depth; n < depth + kCacheSizeCoarserLevels; ++n) {
    auto& entry = cache[n];
    if (entry.tile != tile) continue;
    entry.lastUse = m_accessCount;
    m_lastTile[depth] = tile, m_lastSlot[depth] = n;
    return &entry;
  }
  return nullptr;
}

// The first empty entry of the depth, else the one not used for longest.
VLN_SAMPLER_TEMPLATE template <class Tile> int VLN_SAMPLER::chooseSlot(int depth, Cache<Tile>& cache) const {
  int slot = depth;
  for (int n = depth; n < depth + kCacheSizeCoarserLevels; ++n) {
    auto const& entry = cache[n];
    if (entry.tile < 0) return n;
    if (entry.lastUse < cache[slot].lastUse) slot = n;
  }
  return slot;
}

// Names what the entry now holds: only when it is complete, so that nothing meets it half-filled.
VLN_SAMPLER_TEMPLATE template <class Tile>
auto VLN_SAMPLER::keep(std::int64_t tile, int depth, int slot, Cache<Tile>& cache) const
    -> CacheEntry<Tile>& {
  auto& entry = cache[slot];
  entry.tile = tile;
  m_lastTile[depth] = tile;
  m_lastSlot[depth] = slot;
  return entry;
}

VLN_SAMPLER_TEMPLATE bool VLN_SAMPLER::hasUsableParent(typename ContainerT::TileType const& tile) const {
  return tile.depth() != 0 && tile.parentIndex() >= 0 && tile.depth() > m_minDepth;
}

VLN_SAMPLER_TEMPLATE auto VLN_SAMPLER::updateCache(std::int64_t index, int depth,
                                                   std::vector<CacheEntry<OneSidedTile>>& cache) const
    -> CacheEntry<OneSidedTile>& {
  if (auto* const found = probe(index, depth, cache)) return *found;
  int const slot = chooseSlot(depth, cache);
  auto& entry = cache[slot];
  entry.tile = -1, entry.lastUse = m_accessCount;
  if (!entry.data) entry.data = OneSidedTile(OneSidedTile::kSize);
  auto const& tile = m_container->tile(index, depth);
  auto& accessor = const_cast<Accessor&>(m_tileAccessor);
  if (hasUsableParent(tile)) {
    auto& parent = updateCache(tile.parentIndex(), depth - 1, cache);
    setHaloTile<TraitsT, float, 0, 0, 1, 0>(tile, &m_container->tile(tile.parentTreeIndex()), *m_channelCore,
                                            entry.data, kHaloModeReplicate, accessor, parent.data);
  } else {
    OneSidedTile none;
    setHaloTile<TraitsT, float, 0, 0, 1, 0>(tile, nullptr, *m_channelCore, entry.data, kHaloModeReplicate,
                                            accessor, none);
  }
  return keep(index, depth, slot, cache);
}

VLN_SAMPLER_TEMPLATE auto VLN_SAMPLER::updateCache(std::int64_t index, int depth,
                                                   std::vector<CacheEntry<TwoSidedTile>>& cache) const
    -> CacheEntry<TwoSidedTile>& {
  if (auto* const found = probe(index, depth, cache)) return *found;
  int const slot = chooseSlot(depth, cache);
  auto& entry = cache[slot];
  entry.tile = -1, entry.lastUse = m_accessCount;
  if (!entry.data) entry.data = TwoSidedTile(TwoSidedTile::kSize);
  auto const& tile = m_container->tile(index, depth);
  if (hasUsableParent(tile))
    fillTwoSided(tile, updateCache(tile.parentIndex(), depth - 1, cache).data, entry.data);
  else
    fillTwoSidedRoot(tile, entry.data);
  return keep(index, depth, slot, cache);
}

// Core from the tile; a halo sample on the low sides from the tile found two units of tile space away, where
// that is another one; all else blended from the parent's widened tile.
VLN_SAMPLER_TEMPLATE void VLN_SAMPLER::fillTwoSided(typename ContainerT::TileType const& tile,
                                                    TwoSidedTile const& parent, TwoSidedTile& out) const {
  int const depth = tile.depth();
  auto const own = m_channelCore->tileData(tile.treeIndex());
  std::array<ConstTileData<float, D, 0>, kNeighborCount> around;
  for (int n = 0; n < kNeighborCount; ++n) {
    int3 const step = neighborOffset(n);
    // Two units never leave a tile upwards, not even the narrowest: nothing can be found there.
    if (n == kNeighborSelf || step.x > 0 || step.y > 0 || step.z > 0) continue;
    auto found = findTile(tile.ti() + 2 * step.x, tile.tj() + 2 * step.y, tile.tk() + 2 * step.z, depth);
    if (found && found.data() != own.data()) around[n] = found;
  }

  struct Axis {
    int low;
    float fraction;
  };
  int3 const child = m_container->tile(tile.parentTreeIndex()).childIJK(tile);
  std::array<std::array<Axis, D + 2>, 3> axes;
  for (int a = 0; a < 3; ++a) {
    float const o = this->m_offset[a];
    for (int q = -1; q <= D; ++q) {
      float const x = (static_cast<float>(child[a] * D + q) + o) / static_cast<float>(TraitsT::kTW) - o;
      int const low = std::min(toIntFloor(x), D - 1);
      axes[a][q + 1] = {low, x - static_cast<float>(low)};
    }
  }

  auto const side = [](int q) { return q < 0 ? -1 : q >= D ? 1 : 0; };
  auto const flat = [](int i, int j, int k) { return (i + 1) + (D + 2) * ((j + 1) + (D + 2) * (k + 1)); };
  for (int k = -1; k <= D; ++k)
    for (int j = -1; j <= D; ++j)
      for (int i = -1; i <= D; ++i) {
        int const si = side(i), sj = side(j), sk = side(k);
        float& value = out(flat(i, j, k));
        if (si == 0 && sj == 0 && sk == 0) {
          value = own(i, j, k);
        } else if (auto const& there = around[neighborDirection(si, sj, sk)]; there) {
          value = there(i - si * D, j - sj * D, k - sk * D);
        } else {
          Axis const &x = axes[0][i + 1], &y = axes[1][j + 1], &z = axes[2][k + 1];
          float const* const low = parent.data()->data() + flat(x.low, y.low, z.low);
          value = CellCorners{low, D + 2, {x.fraction, y.fraction, z.fraction, 0.0f}}.value();
        }
      }
}

// Without a coarser tile the field ends at the default value: reflected about it for samples inside the
// voxel, and equal to it on the low and far faces for samples on them.
VLN_SAMPLER_TEMPLATE void VLN_SAMPLER::fillTwoSidedRoot(typename ContainerT::TileType const& tile,
                                                        TwoSidedTile& out) const {
  auto const own = m_channelCore->tileData(tile.treeIndex());
  for (int k = 0; k < D; ++k)
    for (int j = 0; j < D; ++j)
      for (int i = 0; i < D; ++i) out(i + 1, j + 1, k + 1) = own(i, j, k);
  for (int a = 0; a < 3; ++a) {
    int const u = (a + 1) % 3, v = (a + 2) % 3;
    int3 p{};
    auto const at = [&](int c) -> float& {
      int3 q = p;
      q[a] = c;
      return out(q);
    };
    for (p[v] = 0; p[v] < D + 2; ++p[v])
      for (p[u] = 0; p[u] < D + 2; ++p[u]) {
        if (this->m_offsetType & 1 << a) {
          at(0) = at(1) = at(D + 1) = m_defaultValue;
        } else {
          at(0) = 2.0f * m_defaultValue - at(1);
          at(D + 1) = 2.0f * m_defaultValue - at(D);
        }
      }
  }
}

} // namespace VLN::TileTree3D
