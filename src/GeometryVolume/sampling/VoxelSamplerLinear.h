// VoxelSamplerLinear: trilinear values of a float channel, and their gradient, at any position.
//
//   wide channel (E = D+1)            core channel (E = D)
//   the next tile's first samples     a cell inside the core is read in place; one on the tile's edge from it
//   are stored in each tile:          and the tiles beside it (corner samples), or from a cache that holds
//   one always read in place              widened tile for each depth
//                                       corner samples (type 7)      any other offset type
//      0 1 2 3|4                        0 1 2 3|4                  -1|0 1 2 3|4
//
// Store wide where the field is sampled more often than it changes, for one D+1 tile in place of a D one; use
// the core channel where it changes often or memory is short, and walk through space in order.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/detail/BlockCursor.h"
#include "GeometryVolume/sampling/VoxelSampler.h"
#include "GeometryVolume/sampling/detail/CellCorners.h"
#include "GeometryVolume/sampling/detail/SampleRegion.h"
#include "GeometryVolume/tiletree/Voxel.h"

#include <cstdint>
#include <utility>
#include <vector>

namespace VLN::TileTree3D {

/// Entries of a sampler's cache that are searched for one depth: depth d has those from number d on.
extern VLN_API int const kCacheSizeCoarserLevels;

/// Refers to the volume, which must outlive it. A change of the tree or of the channel's values leaves what
/// the caches hold behind: make a new sampler then.
/// @error std::bad_alloc where a cache is to be filled; the sampler works on afterwards.
/// @pre The channel has followed the container.
template <class TraitsT, class Value, int Components, class Real, class Position, int, int>
class VLN_API VoxelSamplerLinear : public VoxelSampler<TraitsT, Real, Position> {
  static_assert(std::is_same_v<Value, float> && Components == 1, "instantiated for float");
  using Base = VoxelSampler<TraitsT, Real, Position>;
  using typename Base::SampleCell;

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
  float sample(Position const& position, int depth, SamplerSpace space) const;
  /// Many positions: values[n] = sample(positions[n], depth, space).
  /// @shape `count` positions and values.
  /// @cost At random places about half of as many single calls: what the next ones need is fetched
  /// ahead. In order about the same.
  void sample(Position const* positions, float* values, std::int64_t count, int depth = TraitsT::kMaxDepth,
              SamplerSpace space = kSamplerWorldSpace) const;
  /// The interpolation proper, of a cell as prepareToSample() gives it. A tile deeper than the channel stands
  /// for the same place at the channel's deepest depth.
  float sample(TreeIndex const& tile, int3 const& ijk, Position const& weights) const;

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
  float sampleGradient(Position const& position, int depth, SamplerSpace space, Position* gradient) const;

  /// Many positions, as sample() takes them.
  /// @shape `count` positions, values and gradients.
  void sampleGradient(Position const* positions, float* values, Position* gradients, std::int64_t count,
                      int depth = TraitsT::kMaxDepth, SamplerSpace space = kSamplerWorldSpace) const;

  // Samples of voxels are not read: these are placeholders.
  float sample(Voxel<TraitsT> const&, int3 const&) const { return 0.0f; }
  float sample(Voxel<TraitsT> const&, int, int, int) const { return 0.0f; }
  ConstIterator begin(Voxel<TraitsT> const&, int3 const&) const { return {}; }
  ConstIterator begin(Voxel<TraitsT> const&, int, int, int) const { return {}; }
  ConstIterator end(Voxel<TraitsT> const&, int3 const&) const { return {}; }
  ConstIterator end(Voxel<TraitsT> const&, int, int, int) const { return {}; }

protected:
  using CoreTile = ConstTileData<float, D, 0>;
  /// The core channel's tile at exactly `depth` that holds a point of tile space; an empty handle without
  /// one.
  CoreTile findTile(int i, int j, int k, int depth) const;
  /// The entry that holds the tile, filled if it does not yet.
  CacheEntry<OneSidedTile>& updateCache(std::int64_t tile, int depth,
                                        std::vector<CacheEntry<OneSidedTile>>& cache) const;
  CacheEntry<TwoSidedTile>& updateCache(std::int64_t tile, int depth,
                                        std::vector<CacheEntry<TwoSidedTile>>& cache) const;

  using CellCorners = Internal::CellCorners;

  std::uint64_t accessCount() const { return m_accessCount; }

private:
  using HighSides = Internal::HighSides;
  template <class Tile> using Cache = std::vector<CacheEntry<Tile>>;
  // The cell that was last put together from several tiles.
  struct EdgeCell {
    float const* tile = nullptr;
    Internal::IntLanes ijk{};
    float const* low = nullptr;
    int width = 0;
    bool is(float const* samples, Internal::IntLanes cell) const {
      return samples == tile && cell[0] == ijk[0] && cell[1] == ijk[1] && cell[2] == ijk[2];
    }
  };

  bool covers(TreeIndex const& tile) const {
    return tile.index >= 0 && tile.depth >= (m_minDepth > 0 ? m_minDepth : 0);
  }
  template <class F> float withCorners(Internal::FloatLanes p, int depth, bool isAbove, F const& f) const;
  template <class F>
  float withCornersIn(Internal::TileSamples const& samples, Internal::FloatLanes p, int depth,
                      F const& f) const;
  template <class F> float withCornersFound(Internal::FloatLanes p, int depth, F const& f) const;
  bool findCorners(Internal::FloatLanes p, int depth, SampleCell& cell, CellCorners& corners) const;
  CellCorners cornersOf(SampleCell const& cell) const;
  bool findFinest(Internal::FloatLanes p, Internal::TileSamples& samples) const;
  void countTile(std::int64_t index) const {
    m_tileBefore = index;
    if (++m_tileChanges == kTileChangesTold) openTables(std::exchange(m_tileChanges, 0));
  }
  TileArrays<float> const* tileArrays() const {
    return m_channelWide ? m_channelWide->tileArrays() : m_channelCore->tileArrays();
  }
  // Whether the cell of a core channel can be read in place.
  bool isInside(SampleCell const& cell) const {
    int const low = this->m_offsetType == kVoxelOffsetCorner ? 0 : 1;
    auto const inside = [low](int i) { return i >= low && i + 1 < D; };
    return inside(cell.ijk[0]) && inside(cell.ijk[1]) && inside(cell.ijk[2]);
  }
  static CellCorners insideCorners(float const* data, SampleCell const& cell) {
    return {data + cell.ijk[0] + D * (cell.ijk[1] + D * cell.ijk[2]), D, cell.weights};
  }
  CellCorners wideCorners(float const* data, SampleCell const& cell) const {
    constexpr int w = D + 1;
    // Below the first sample: extrapolate from the first cell, as the last one does at the top.
    auto const below = cell.ijk < 0;
    auto const at = cell.ijk & ~below;
    auto const weights = cell.weights + __builtin_convertvector(below, Internal::FloatLanes);
    return {data + at[0] + w * (at[1] + w * at[2]), w, weights};
  }
  float const* dataOf(TreeIndex const& tile) const { return (*tileArrays())[tile.depth][tile.index].data(); }
  float sampleAbove(TreeIndex const& tile, int3 const& ijk, Position const& weights) const;
  CellCorners cachedCorners(TreeIndex const& tile, int3 const& ijk, Position const& weights) const;
  bool finestEdge(Internal::TileSamples const& samples, SampleCell const& cell) const;
  void openTables(std::int64_t tileChanges) const;
  template <class F>
  void forBatches(Position const* positions, std::int64_t count, int depth, SamplerSpace space,
                  F const& f) const;
  static void readEdge(int3 const& low, unsigned edge, std::array<float const*, 8> const& tiles,
                       float* corners);
  bool edgeCorners(TreeIndex const& tile, int3 const& low, float* corners, int& budget) const;
  void findHighSide(TreeIndex const& tile, HighSides& sides, unsigned direction) const;

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

  Accessor m_tileAccessor;
  VoxelOffsetType m_offsetTypeLinear = kVoxelOffsetCorner;
  mutable Cache<OneSidedTile> m_cacheOneSided;
  mutable Cache<TwoSidedTile> m_cacheTwoSided;
  mutable std::uint64_t m_accessCount = 0;
  mutable PerDepth<std::int64_t, TraitsT::kDepths> m_lastTile;
  mutable PerDepth<std::int32_t, TraitsT::kDepths> m_lastSlot;
  mutable PerDepth<HighSides, TraitsT::kDepths> m_highSides;
  mutable std::array<float, 8> m_corners;
  mutable Internal::SampleRegion m_region;
  mutable EdgeCell m_edge; ///< in the region
  // What leads from positions straight to samples of the deepest depth: made by the first copy of the sampler
  // for which it pays.
  static constexpr int kTileChangesTold = 64;
  Ostil::Ptr<Internal::SharedReadTables<TraitsT>> m_shared;
  mutable Internal::BlockCursor<TraitsT> m_blocks, m_blocksBeside;
  TileArrays<float> const* m_arrays = nullptr; ///< of the channel, when the sampler was made
  mutable float const* m_finestBefore = nullptr;
  mutable std::int64_t m_tileBefore = -1;
  mutable int m_tileChanges = 0;
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
