// HaloDriver: fills the halo of tiles. Geometry and copying know no element type here; what blends lies
// behind ElementOps. One instantiation for each tree shape.
#pragma once

#include "GeometryVolume/channels/HaloSamplerImpl.h"

#include <bit>

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
  UntypedTiles const* tiles = nullptr; ///< in place of parentElements: the target's tiles

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

  HaloDriver(UntypedTiles const& source, HaloTable const& table, Accessor const& accessor)
      : m_source(source)
      , m_table(table)
      , m_accessor(accessor) {}

  /// The core, then each region: from the neighbour of the same depth; else blended from the parent; else,
  /// without a parent, replicated in mode kHaloModeReplicate and the default value in any other.
  void fill(HaloTarget<TraitsT> const& target, HaloMode mode);
  /// Finds what tiles read that are filled next, in the order of their indices, in the source and in the
  /// parents' tiles of the target.
  /// @pre The tree stays as it is until they are filled.
  void prepare(TileType const& first, UntypedTiles const& target);
  /// What `fill.type` names, as `fill.mode` says.
  void fill(TileType const& tile, void* target, HaloFill const& fill, HaloSampler<TraitsT>& sampler);

private:
  /// A tile or none, as TreeIndex, and its child table; one without children where it has none. Without
  /// initial values, so that a driver for one tile need not write a table of them.
  struct OwnerTile {
    std::int64_t index;
    std::int64_t const* children;
    std::int32_t depth;

    TreeIndex at() const { return {index, depth}; }
  };
  /// Indices of tiles that a block is filled with, and where each goes.
  struct BlockIndices {
    std::array<std::int64_t, 64> index;
    std::array<std::uint8_t, 64> place;
    int count = 0;
  };
  /// Makes `tile` the one whose neighbours are asked for.
  void setTile(TileType const& tile);
  /// The tile beside, at its depth or the deepest one above.
  /// @pre setTile(tile).
  TreeIndex neighbor(TileType const& tile, HaloRegion const& region) {
    return m_parentCache ? childAt(*m_parentCache, m_blockSlot + region.blockSlot, tile, region.direction)
                         : searchNeighbor(tile, region.direction);
  }
  /// The source's elements of a tile at the depth of `tile`.
  void const* neighborElements(TileType const& tile, TreeIndex const& at) const {
    return m_source.elements({at.depth == tile.depth() ? at.index : -1, tile.depth()});
  }
  /// What lies round one tile, as far as it was asked for.
  struct NeighborCache {
    TreeIndex tile;
    std::uint32_t known = 0; ///< directions that were looked up
    std::uint32_t open = 0;  ///< those of them whose child table was not
    std::array<OwnerTile, kNeighborCount> around;
  };
  NeighborCache& cacheOf(TreeIndex const& at) {
    NeighborCache& cache = m_caches[at.depth];
    if (cache.tile != at) cache.tile = at, cache.known = 0;
    return cache;
  }
  /// Finds tiles beside that of the cache, a bit for each direction, through its parent, and so through all
  /// its ancestors if need be.
  void findPlaces(NeighborCache& cache, std::uint32_t steps);
  /// And their child tables.
  void findChildren(NeighborCache& cache);
  /// The tile that owns a slot of the block: of the cached tile's children and those round them.
  OwnerTile const& ownerOf(NeighborCache& cache, NeighborSlot const& in) {
    if (!(cache.known >> in.direction & 1)) findPlaces(cache, 1u << in.direction), findChildren(cache);
    return cache.around[in.direction];
  }
  static NeighborSlot const& neighborSlot(int blockSlot) {
    return kNeighborSlots<TraitsT::kTW>[static_cast<std::size_t>(blockSlot)];
  }
  /// What lies at a slot of that block, one step from the child `tile`.
  TreeIndex childAt(NeighborCache& cache, int blockSlot, TileType const& tile, NeighborDirection step) {
    NeighborSlot const& in = neighborSlot(blockSlot);
    OwnerTile const& owner = ownerOf(cache, in);
    if (owner.depth < 0) return neighborBeyondParent(tile, step);
    std::int64_t const child = owner.children[in.slot];
    return child >= 0 ? TreeIndex{child, tile.depth()} : owner.at();
  }
  /// What lies beside a tile where no tile lies beside its parent: maybe a root of the tile's own depth.
  TreeIndex neighborBeyondParent(TileType const& tile, NeighborDirection step) const {
    return m_accessor.container()->rootCount(tile.depth()) > 0 ? searchNeighbor(tile, step) : TreeIndex{};
  }
  /// Index of the tile of the same depth beside, -1 without one.
  /// @pre setTile(tile).
  std::int64_t neighborIndex(TileType const& tile, HaloRegion const& region) {
    NeighborSlot const& in = neighborSlot(m_blockSlot + region.blockSlot);
    OwnerTile const* const owner = m_parentCache ? &ownerOf(*m_parentCache, in) : nullptr;
    if (owner && owner->depth >= 0) return owner->children[in.slot];
    TreeIndex const at =
        owner ? neighborBeyondParent(tile, region.direction) : searchNeighbor(tile, region.direction);
    return at.depth == tile.depth() ? at.index : -1;
  }
  /// neighborIndex() or neighbor() by a search from the accessor's last tile.
  TreeIndex searchNeighbor(TileType const& tile, NeighborDirection step) const;
  /// The source's elements of tiles of one depth, by place; kNoElements where there are none.
  using Block = PointerBlock<TraitsT::kTW>;
  struct Elements {
    std::array<void const*, Block::kSize> at;
    std::uint64_t present = 0; ///< a bit for each place that has some
  };
  /// A parent, what lies round it, and the block of its children and those round them, as far as was asked
  /// for.
  struct ParentBlock {
    NeighborCache cache;
    std::uint32_t wanted = 0; ///< owners whose slots are to be filled
    std::uint32_t filled = 0; ///< owners whose slots are filled
    std::uint32_t beyond = 0; ///< owners where no tile lies, so that roots may
    Elements elements;
  };
  /// What a tile reads: its own elements' place in a block, and bits of the regions' places without a source.
  struct Around {
    void const* const* elements;
    std::uint64_t missing;
    bool own; ///< whether the tile itself has elements

    void const* ownElements() const { return own ? *elements : nullptr; }
  };
  /// @pre setTile(tile).
  Around elementsAround(TileType const& tile);
  /// Owners of what a child of the tile at this slot of the block reads.
  std::uint32_t ownersRound(int slot) const {
    std::uint32_t const owners = kOwnersRound<TraitsT::kTW>[static_cast<std::size_t>(slot)];
    return m_table.halo == 0 ? owners & kOwnersAhead : owners;
  }
  /// The block of a tile's parent: the one before, one that is ready, or a new one.
  ParentBlock& blockOf(TileType const& tile);
  static ParentBlock& startBlock(ParentBlock& block, TreeIndex const& parent);
  /// Fills what is wanted of blocks. Each step is taken for all of them before the next one, so that what the
  /// next one reads is on its way.
  void completeBlocks(int depth, ParentBlock* blocks, std::size_t count);
  void listIndices(ParentBlock& block, BlockIndices& to) const;
  /// Fills a block for one tile alone, which lies at its first child's place.
  void findAlone(TileType const& tile);
  HaloRegion const& regionOf(std::uint64_t places) const { return m_table.regionOf(places); }
  /// Core and regions in one go. A region without a tile beside takes bytes without meaning.
  void copyWholeTile(void* target, Around const& around) const;
  /// The tile itself, or its deepest ancestor whose data the source holds.
  TileType const* ancestorWithData(TileType const* tile, void const*& elements) const;

  void* at(void* elements, int flat) const {
    return static_cast<std::byte*>(elements) + flat * static_cast<std::ptrdiff_t>(m_source.ops->size);
  }
  void const* at(void const* elements, int flat) const {
    return static_cast<std::byte const*>(elements) + flat * static_cast<std::ptrdiff_t>(m_source.ops->size);
  }
  void copy(HaloBox const& box, void* target, void const* source) const;
  void set(HaloBox const& box, void* target, void const* value) const;
  void replicate(HaloBox const& box, void* target) const;
  /// Regions without a source, from the parent's finished tile.
  void blend(std::uint64_t missing, void* target, void const* parent) const;
  void nearest(HaloBox const& box, TileType const& tile, void* target, TileType const& coarse,
               void const* source) const;
  /// @param there The deepest tile above `tile` where the box lies, if it is known.
  void sample(HaloBox const& box, TileType const& tile, TreeIndex const& there, void* target, float scale,
              HaloSampler<TraitsT>& sampler);
  /// The deepest tile that the source covers at `there` and at all places in it where no tile of the depth of
  /// `tile` lies; null where that is not known.
  TileType const* solelyCovered(TileType const& tile, TreeIndex const& there);
  void fillRegion(HaloRegion const& region, TileType const& tile, void* target, HaloFill const& fill,
                  HaloSampler<TraitsT>& sampler);

  UntypedTiles const& m_source;
  HaloTable const& m_table;
  Accessor const& m_accessor;

  static constexpr int kAcross = TraitsT::kTW + 2;
  static int blockSlot(int3 const& slot) {
    return (slot.x + 1) + kAcross * ((slot.y + 1) + kAcross * (slot.z + 1));
  }
  static int slotInParentBlock(TileType const& tile);

  NeighborCache* m_parentCache = nullptr; ///< of the tile's parent; null for a root
  static constexpr int kUnknownDepth = -2;
  int m_deepestRoot = kUnknownDepth;      ///< -1 without roots
  int m_blockSlot = blockSlot({0, 0, 0}); ///< of the tile among the parent's children and those round them
  // One for each depth. The coarser, the more seldom it changes.
  PerDepth<NeighborCache, TraitsT::kDepths> m_caches;

  // Parents in the order of their children: enough to have many reads under way, few enough to stay in the
  // nearest cache.
  static constexpr std::size_t kBlocks = Block::kOfParent ? 8 : 1;
  std::array<ParentBlock, kBlocks> m_blocks;
  std::size_t m_block = 0, m_blockCount = 0; ///< the last one that was asked for; those in use
  Elements m_alone;
};

/// A pass over the tiles of a range of depths, coarse to fine.
struct HaloPass {
  UntypedTiles source, target;
  HaloTable const* table;
  int firstDepth, lastDepth; ///< -1: as far as both channels reach
};

/// The plain form for each tile of the pass.
template <class TraitsT> void runHaloPass(HaloPass const& pass, Container<TraitsT> const& tree);
/// The form with modes.
template <class TraitsT>
void runHaloPass(HaloPass const& pass, HaloFill const& fill, Container<TraitsT> const& tree);

} // namespace VLN::TileTree3D::Internal
