// VoxelSamplerLinear: trilinear values of a float channel, and their gradient, at any position.
//
//   wide channel (E = D+1)            core channel (E = D)
//   the next tile's first samples     a cell inside the core is read in place; one on the tile's edge from a
//   are stored in each tile:          cache that holds one widened tile for each depth:
//   always read in place
//                                       corner samples (type 7)      any other offset type
//      0 1 2 3|4                        0 1 2 3|4                  -1|0 1 2 3|4
//
// Store wide where the field is sampled more often than it changes, for one D+1 tile in place of a D one; use
// the core channel where it changes often or memory is short, and walk through space in order.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/sampling/VoxelSampler.h"
#include "GeometryVolume/tiletree/Voxel.h"

#include <cstdint>
#include <vector>

namespace VLN::TileTree3D {

/// Entries of a sampler's cache that are searched for one depth: depth d has those from number d on.
extern VLN_API int const kCacheSizeCoarserLevels;

/// Refers to the volume, which must outlive it. A change of the tree or of the channel's values leaves what
/// the caches hold behind: make a new sampler then.
/// @pre The channel has followed the container.
template <class TraitsT, class Value, int Components, class Real, class Position, int, int>
class VLN_API VoxelSamplerLinear : public VoxelSampler<TraitsT, Real, Position> {
  static_assert(std::is_same_v<Value, float> && Components == 1, "instantiated for float");
  using Base = VoxelSampler<TraitsT, Real, Position>;

public:
  using Base::D;
  using typename Base::Accessor;
  using typename Base::ContainerT;
  using CoreChannel = Channel<TraitsT, float, D, 0>;
  using WideChannel = Channel<TraitsT, float, D + 1, 0>;
  using Topology = VoxelTopology<TraitsT>;

  /// A widened tile.
  template <class Tile> struct CacheEntry {
    std::int64_t tile = -1; ///< index in its depth; -1 when empty
    Tile data;
    std::uint64_t lastUse = 0;
  };
  using OneSidedTile = TileData<float, D + 1, 0>;
  using TwoSidedTile = TileData<float, D + 2, 0>;

  /// What begin() and end() give.
  struct ConstIterator {
    std::int32_t position = 0;
    bool operator==(ConstIterator const&) const = default;
  };

  VoxelSamplerLinear();
  /// On a channel that holds the high-side samples, as computeHalo() fills them. No cache is needed.
  VoxelSamplerLinear(ContainerT const& container, Topology const& topology, WideChannel const& channel);
  /// On a channel without halo. The cache that the offset type selects is filled while sampling.
  VoxelSamplerLinear(ContainerT const& container, Topology const& topology, CoreChannel const& channel);
  /// The copy begins with cold caches.
  VoxelSamplerLinear(VoxelSamplerLinear const& other);
  VoxelSamplerLinear& operator=(VoxelSamplerLinear const& other);
  ~VoxelSamplerLinear() override;

  /// "kLinear".
  char const* idString() const override;
  bool is_initialized() const { return m_container && m_topology && (m_channelCore || m_channelWide); }

  // Values. The default depth is the deepest of the tree, the default space world space.
  /// @edges The channel's default value where there is no tile at or above the depth, or only one above the
  /// channel's depths. Depths below the channel's deepest are those of the deepest.
  /// @numeric Single precision: four blends along x, two along y, one along z, each (b - a) * t + a.
  /// @cost One test of the last tile and eight reads where positions stay close to each other.
  float sample(Position const& position) const {
    return sample(position, TraitsT::kMaxDepth, kSamplerWorldSpace);
  }
  float sample(Position const& position, int depth) const {
    return sample(position, depth, kSamplerWorldSpace);
  }
  float sample(Position const& position, SamplerSpace space) const {
    return sample(position, TraitsT::kMaxDepth, space);
  }
  float sample(Position const& position, int depth, SamplerSpace space) const {
    TreeIndex tile;
    int3 ijk;
    Position weights;
    this->prepareToSample(position, space, tile, ijk, weights, std::min(depth, m_maxDepth), nullptr);
    return sample(tile, ijk, weights);
  }
  /// The interpolation proper, of a cell as prepareToSample() gives it.
  float sample(TreeIndex const& tile, int3 const& ijk, Position const& weights) const {
    if (!covers(tile)) return m_defaultValue;
    Cell const cell = cellOf(tile, ijk, weights);
    return cell.value();
  }

  // Values with gradients
  /// @formula The derivative of the trilinear cell in world space, times 2 kTW / D: exact for the
  /// power-of-two shape, whose voxels are two samples wide, and twice the derivative for the odd one.
  /// @edges A zero gradient where sample() gives the default value for want of a tile.
  float sampleGradient(Position const& position, Position* gradient) const {
    return sampleGradient(position, TraitsT::kMaxDepth, kSamplerWorldSpace, gradient);
  }
  float sampleGradient(Position const& position, int depth, Position* gradient) const {
    return sampleGradient(position, depth, kSamplerWorldSpace, gradient);
  }
  float sampleGradient(Position const& position, SamplerSpace space, Position* gradient) const {
    return sampleGradient(position, TraitsT::kMaxDepth, space, gradient);
  }
  float sampleGradient(Position const& position, int depth, SamplerSpace space, Position* gradient) const {
    TreeIndex tile;
    int3 ijk;
    Position weights;
    float invVoxelWidth = 0.0f;
    bool const found = this->prepareToSample(position, space, tile, ijk, weights, std::min(depth, m_maxDepth),
                                             &invVoxelWidth);
    if (!found || !covers(tile)) {
      *gradient = {0.0f, 0.0f, 0.0f};
      return m_defaultValue;
    }
    Cell const cell = cellOf(tile, ijk, weights);
    float const g = invVoxelWidth * 2.0f * m_invVoxelSize;
    *gradient = cell.slope() * g;
    return cell.value();
  }

  // Samples of voxels are not read: these are placeholders.
  float sample(Voxel<TraitsT> const&, int3 const&) const { return 0.0f; }
  float sample(Voxel<TraitsT> const&, int, int, int) const { return 0.0f; }
  ConstIterator begin(Voxel<TraitsT> const&, int3 const&) const { return {}; }
  ConstIterator begin(Voxel<TraitsT> const&, int, int, int) const { return {}; }
  ConstIterator end(Voxel<TraitsT> const&, int3 const&) const { return {}; }
  ConstIterator end(Voxel<TraitsT> const&, int, int, int) const { return {}; }

protected:
  /// The core channel's tile at exactly `depth` that holds a point of tile space; an empty handle without
  /// one.
  ConstTileData<float, D, 0> findTile(int i, int j, int k, int depth) const;
  /// The entry that holds the tile, filled if it does not yet.
  CacheEntry<OneSidedTile>& updateCache(std::int64_t tile, int depth,
                                        std::vector<CacheEntry<OneSidedTile>>& cache) const;
  CacheEntry<TwoSidedTile>& updateCache(std::int64_t tile, int depth,
                                        std::vector<CacheEntry<TwoSidedTile>>& cache) const;

  // Eight samples and the weights between them.
  struct Cell {
    float const* low;
    int width;
    Position weights;

    static float lerp(float a, float b, float t) { return (b - a) * t + a; }
    float value() const {
      float const *const p = low, *const q = low + width * width;
      int const w = width;
      float const a = lerp(lerp(p[0], p[1], weights.x), lerp(p[w], p[w + 1], weights.x), weights.y);
      float const b = lerp(lerp(q[0], q[1], weights.x), lerp(q[w], q[w + 1], weights.x), weights.y);
      return lerp(a, b, weights.z);
    }
    /// Derivatives by the weights.
    Position slope() const {
      float const *const p = low, *const q = low + width * width;
      int const w = width;
      auto const [x, y, z] = weights;
      return {lerp(lerp(p[1] - p[0], p[w + 1] - p[w], y), lerp(q[1] - q[0], q[w + 1] - q[w], y), z),
              lerp(lerp(p[w] - p[0], p[w + 1] - p[1], x), lerp(q[w] - q[0], q[w + 1] - q[1], x), z),
              lerp(lerp(q[0] - p[0], q[1] - p[1], x), lerp(q[w] - p[w], q[w + 1] - p[w + 1], x), y)};
    }
  };

  std::uint64_t accessCount() const { return m_accessCount; }

private:
  template <class Tile> using Cache = std::vector<CacheEntry<Tile>>;

  bool covers(TreeIndex const& tile) const {
    return tile.index >= 0 && tile.depth >= std::max(m_minDepth, 0);
  }
  Cell cellOf(TreeIndex const& tile, int3 const& ijk, Position const& weights) const {
    if (m_channelWide) return wideCell(tile, ijk, weights);
    ++m_accessCount;
    int const low = this->m_offsetType == kVoxelOffsetCorner ? 0 : 1;
    auto const inside = [low](int i) { return i >= low && i + 1 < D; };
    if (inside(ijk.x) && inside(ijk.y) && inside(ijk.z))
      return {m_channelCore->tileArrays()
                      ->
                      operator[](static_cast<std::size_t>(tile.depth))[static_cast<std::size_t>(tile.index)]
                      .data() +
                  ijk.x + D * (ijk.y + D * ijk.z),
              D, weights};
    return cachedCell(tile, ijk, weights);
  }
  Cell wideCell(TreeIndex const& tile, int3 const& ijk, Position weights) const {
    constexpr int w = D + 1;
    int3 at = ijk;
    // Below the first sample: extrapolate from the first cell, as the last one does at the top.
    if ((at.x | at.y | at.z) < 0) {
      if (at.x < 0) at.x = 0, weights.x -= 1.0f;
      if (at.y < 0) at.y = 0, weights.y -= 1.0f;
      if (at.z < 0) at.z = 0, weights.z -= 1.0f;
    }
    auto const& data = (*m_channelWide->tileArrays())[static_cast<std::size_t>(tile.depth)]
                                                     [static_cast<std::size_t>(tile.index)];
    return {data.data() + at.x + w * (at.y + w * at.z), w, weights};
  }
  Cell cachedCell(TreeIndex const& tile, int3 const& ijk, Position const& weights) const;

  void bind(CoreChannel const* core, WideChannel const* wide);
  void forgetTiles();
  template <class Tile> CacheEntry<Tile>* probe(std::int64_t tile, int depth, Cache<Tile>& cache) const;
  template <class Tile> int chooseSlot(int depth, Cache<Tile>& cache) const;
  template <class Tile>
  CacheEntry<Tile>& keep(std::int64_t tile, int depth, int slot, Cache<Tile>& cache) const;
  bool hasUsableParent(typename ContainerT::TileType const& tile) const;
  void fillTwoSided(typename ContainerT::TileType const& tile, TwoSidedTile const& parent,
                    TwoSidedTile& out) const;
  void fillTwoSidedRoot(typename ContainerT::TileType const& tile, TwoSidedTile& out) const;

  static constexpr std::size_t kDepths = static_cast<std::size_t>(TraitsT::kDepths);

  Accessor m_tileAccessor;
  VoxelOffsetType m_offsetTypeLinear = kVoxelOffsetCorner;
  mutable Cache<OneSidedTile> m_cacheOneSided;
  mutable Cache<TwoSidedTile> m_cacheTwoSided;
  mutable std::uint64_t m_accessCount = 0;
  mutable std::array<std::int64_t, kDepths> m_lastTile;
  mutable std::array<std::int32_t, kDepths> m_lastSlot;
  ContainerT const* m_container = nullptr;
  CoreChannel const* m_channelCore = nullptr;
  WideChannel const* m_channelWide = nullptr;
  Topology const* m_topology = nullptr;
  float m_invVoxelSize = 1.0f;
  float m_defaultValue = 0.0f;
  std::int32_t m_minDepth = 0;
  std::int32_t m_maxDepth = TraitsT::kMaxDepth;
};

/// The sampler of a shape, for float channels and float positions.
template <class TraitsT>
using FloatVoxelSamplerLinear = VoxelSamplerLinear<TraitsT, float, 1, float, float3, 0, 0>;

} // namespace VLN::TileTree3D
