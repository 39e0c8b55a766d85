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
  ErasedTiles const* tiles = nullptr; ///< in place of parentElements: the target's tiles

  void const* parentData() const {
    if (!parent || !tiles) return parent ? parentElements : nullptr;
    return tiles->elements(parent->treeIndex());
  }
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
  /// A tile beside another, at its depth or the deepest one above; the source's elements of one at its depth.
  /// Without initial values, so that a driver for one tile need not write a table of them.
  struct Beside {
    std::int64_t index;
    void const* elements;
    std::int32_t depth;

    TreeIndex at() const { return {index, depth}; }
  };
  /// @pre moveTo(tile).
  /// @cost Tiles of one parent after the other share the searches round the parent.
  Beside const& beside(TileType const& tile, HaloRegion const& region) {
    int const n = m_place + region.place;
    auto const word = static_cast<std::size_t>(n) / 64;
    std::uint64_t const bit = std::uint64_t(1) << n % 64;
    Beside& entry = m_beside[static_cast<std::size_t>(n)];
    if (!(m_known[word] & bit)) {
      m_known[word] |= bit;
      TreeIndex const at = findBeside(tile, neighborOffset(region.direction));
      entry = {at.index, at.depth == tile.depth() ? m_source.elements(at) : nullptr, at.depth};
    }
    return entry;
  }
  /// Makes `tile` the one whose neighbours are asked for.
  void moveTo(TileType const& tile);
  TreeIndex findBeside(TileType const& tile, int3 const& step);
  /// The same by a search from the accessor's last tile.
  TreeIndex searchBeside(TileType const& tile, int3 const& step) const;
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
  void blend(HaloBox const& box, HaloTarget<TraitsT> const& target, void const* parent) const;
  void nearest(HaloBox const& box, TileType const& tile, void* target, TileType const& coarse,
               void const* source) const;
  void sample(HaloBox const& box, TileType const& tile, void* target, float scale,
              HaloSampler<TraitsT>& sampler) const;
  void fillRegion(HaloRegion const& region, TileType const& tile, void* target, HaloFill const& fill,
                  HaloSampler<TraitsT>& sampler);

  ErasedTiles const& m_source;
  HaloTable const& m_table;
  Accessor const& m_accessor;

  // Children of the last tile's parent with one layer round them, as far as they were asked for; and the
  // tiles round the parent.
  static constexpr int kAcross = TraitsT::kTW + 2;
  static constexpr std::size_t kPlaces = std::size_t(kAcross) * kAcross * kAcross;
  TreeIndex m_parent;
  int3 m_slot{0, 0, 0};                      ///< of the tile in its parent
  int m_place = 1 + kAcross * (1 + kAcross); ///< of the tile among them
  std::array<Beside, kPlaces> m_beside;
  std::array<std::uint64_t, (kPlaces + 63) / 64> m_known{};
  std::array<Beside, kNeighborCount> m_around;
  std::uint32_t m_aroundKnown = 0;
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
