// HaloDriver: fills the halo of tiles. Geometry and copying know no element type here; what blends lies
// behind ElementOps. One instantiation for each tree shape.
#pragma once

#include "GeometryVolume/channels/HaloSampler.h"

namespace VLN::TileTree3D::Internal {

/// What the form with modes is asked for.
struct HaloFill {
  HaloMode mode = kHaloModeDefault;
  HaloType type = kHaloAll;
  float constant = 0;
  float scale = 1;
  VoxelOffsetType offsetType = kVoxelOffsetCorner;
};

/// A target tile of the plain form, and the finished target tile of its parent.
template <class TraitsT> struct HaloTarget {
  using TileType = Tile<TraitsT, TraitsT::kTileSize>;

  TileType const& tile;
  void* elements;
  TileType const* parent = nullptr;
  void const* parentElements = nullptr;
};

/// @threads One for each thread.
template <class TraitsT> class HaloDriver {
public:
  using Accessor = ConstTileAccessorOf<TraitsT>;
  using TileType = typename Accessor::TileType;

  HaloDriver(ErasedTiles const& source, HaloTable const& table, Accessor const& accessor)
      : m_source(source)
      , m_table(table)
      , m_accessor(accessor) {}

  /// The core, then each region: from the neighbour of the same depth; else blended from the parent; else,
  /// without a parent, replicated in mode kHaloModeReplicate and the default value in any other.
  void fill(HaloTarget<TraitsT> const& target, HaloMode mode);
  /// What `fill.type` names, as `fill.mode` says.
  void fill(TileType const& tile, void* target, HaloFill const& fill, HaloSampler<TraitsT>& sampler);

private:
  /// The neighbour at the tile's depth, or the deepest one above.
  /// @cost Tiles of one parent after the other share the searches round the parent.
  TreeIndex neighbor(TileType const& tile, NeighborDirection d);
  /// The same by a search from the accessor's last tile.
  TreeIndex searchNeighbor(TileType const& tile, NeighborDirection d) const;
  /// The tile itself, or its deepest ancestor whose data the source holds.
  TileType const* withData(TileType const* tile, void const*& elements) const;

  void* at(void* elements, int flat) const {
    return static_cast<std::byte*>(elements) + flat * static_cast<std::ptrdiff_t>(m_source.ops->size);
  }
  void const* at(void const* elements, int flat) const {
    return static_cast<std::byte const*>(elements) + flat * static_cast<std::ptrdiff_t>(m_source.ops->size);
  }
  void copy(HaloBox const& box, void* target, void const* source) const;
  void set(HaloBox const& box, void* target, void const* value) const;
  void replicate(HaloBox const& box, void* target) const;
  void blend(HaloBox const& box, HaloTarget<TraitsT> const& target, int3 const& child) const;
  void nearest(HaloBox const& box, TileType const& tile, void* target, TileType const& coarse,
               void const* source) const;
  void sample(HaloBox const& box, TileType const& tile, void* target, float scale,
              HaloSampler<TraitsT>& sampler) const;
  void fillRegion(HaloRegion const& region, TileType const& tile, void* target, HaloFill const& fill,
                  HaloSampler<TraitsT>& sampler);

  ErasedTiles const& m_source;
  HaloTable const& m_table;
  Accessor const& m_accessor;

  // The last tile's parent, and what lies round it as far as it was asked for.
  TreeIndex m_parent;
  std::array<TreeIndex, kNeighborCount> m_around;
  std::uint32_t m_known = 0;
};

/// A pass over the tiles of a range of depths, coarse to fine.
struct HaloPass {
  ErasedTiles source, target;
  HaloTable const* table;
  int firstDepth, lastDepth; ///< -1: as far as both channels reach
};

/// The plain form for each tile of the pass.
template <class TraitsT> void runHaloPass(HaloPass const& pass, Container<TraitsT> const& tree);
/// The form with modes.
template <class TraitsT>
void runHaloPass(HaloPass const& pass, HaloFill const& fill, Container<TraitsT> const& tree);

} // namespace VLN::TileTree3D::Internal
