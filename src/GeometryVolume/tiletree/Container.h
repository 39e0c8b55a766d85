// Container: the tree itself, a named component that owns all tiles of one volume.
//
// Tiles lie by depth in dense arrays and refer to each other by index; a TreeIndex stays valid when the tree
// grows, a reference to a tile does not. The tree is a forest: a root is any tile without a parent, at any
// depth.
//
//   depth d   | tile | tile | tile | ...          parent index up, child indices down
//   depth d+1 | tile | tile | tile | tile | ...
//
// A container holds no field values: channels hang off it and are told of changes by the update protocol.
#pragma once

#include "GeometryVolume/core/FixedArray.h"
#include "GeometryVolume/tiletree/RootIterator.h"
#include "GeometryVolume/tiletree/TreeComponent.h"
#include "GeometryVolume/tiletree/Visitor.h"
#include "GeometryVolume/tiletree/detail/ContainerTiles.h"
#include "Ostil/Array.h"
#include "Ostil/Ptr.h"

#include <cstdint>
#include <utility>
#include <vector>

namespace VLN {
class AffinityPartitioner;
} // namespace VLN

namespace VLN::TileTree3D {

template <class TraitsT> class ConstTileAccessorOf;
template <class TraitsT> class TileAccessorOf;
template <class Reference, class Pointer, class ContainerT> class TileIteratorBase;
template <class TraitsT> class ConstVoxelIterator;
template <class TraitsT> class TileHaloVisitor;
template <class TraitsT> struct ContainerData;
template <class TraitsT> class ContainerBuilder;
template <class TraitsT> struct TileHalo;

/// For each depth, indices of tiles.
using TileIndexLists = std::vector<std::vector<std::int64_t>>;
/// For each depth, the (destination, source) pairs of a compaction.
using TileMoves = std::vector<std::vector<std::pair<std::int64_t, std::int64_t>>>;

/// @threads Structural change belongs to one thread; reads may run concurrently while nothing changes.
template <class TraitsT> class VLN_API Container : public Component {
public:
  using TraitsType = TraitsT;
  using TileType = Tile<TraitsT, TraitsT::kTileSize>;
  using Data = ContainerData<TraitsT>;
  using ConstTileAccessor = ConstTileAccessorOf<TraitsT>;
  using TileAccessor = TileAccessorOf<TraitsT>;
  using VisitorType = Visitor<Container>;
  using TileIterator = TileIteratorBase<TileType&, TileType*, Container>;
  using ConstTileIterator = TileIteratorBase<TileType const&, TileType const*, Container const>;
  using VoxelIterator = ConstVoxelIterator<TraitsT>;
  using Counts = typename ContainerTiles<TraitsT>::Counts;
  /// Corners of tiles by depth.
  using TileLists = PerDepth<Ostil::Array<int3>, TraitsT::kDepths>;
  /// For each depth and tile, the tiles around it.
  using NeighborTable =
      PerDepth<std::vector<Dense1D::FixedArray<TreeIndex, kNeighborCount>>, TraitsT::kDepths>;

  static constexpr int kTW = TraitsT::kTW;
  static constexpr int kTileWidth = TraitsT::kTW;
  static constexpr int kTDW = TraitsT::kTDW;
  static constexpr int kTileSize = TraitsT::kTileSize;
  static constexpr int kMaxDepth = TraitsT::kMaxDepth;
  static constexpr int kMaxParallelDepth = TraitsT::kMaxParallelDepth;
  static constexpr int kDepthFirstMaxParallelDepth = TraitsT::kDepthFirstMaxParallelDepth;
  static constexpr int kMinTileCoord = TraitsT::kMinTileCoord;
  static constexpr int kMaxTileCoord = TraitsT::kMaxTileCoord;

  /// An empty name becomes Const::TileTreeContainerName.
  Container();
  Container(Ostil::String const& name, float voxelSize);
  /// The copy has its own data and shares the tile arrays until either is changed.
  Container(Container const& other);
  Container& operator=(Container const& other);
  ~Container() override;

  // Component
  void dump(std::ostream& os) const override;
  void memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const override;
  void copyTo(Ostil::Ptr<VLN::Component>& target) const override;
  /// Number of voxels: tiles x kTileSize.
  std::uint64_t size() const override;
  bool empty() const override;
  /// Nothing: a tree follows no other component.
  void update(VLN::Component const& source) override;
  std::int64_t elementCount(int depth) const override;
  int elementCount(TreeIndex const& tile) const override;
  std::int64_t tileCount(int depth) const override {
    if (depth == -1) return m_data->m_tileCountTotal;
    return TraitsT::isDepth(depth) ? m_data->m_tileCounts[depth] : 0;
  }
  /// A quick estimate of the memory of the tile records. @cost Constant.
  std::uint64_t memUsage() const;

  // Tiles
  /// Array access, unchecked.
  TileType const& tile(TreeIndex const& at) const { return m_data->tiles(at.depth)[at.index]; }
  TileType const& tile(std::int64_t index, int depth) const { return m_data->tiles(depth)[index]; }
  /// The n-th tile counted across depths from depth 0 upward; the invalid tile beyond the last.
  TileType const& tile(std::int64_t n) const;
  /// Position of a tile across depths.
  std::int64_t tileIndex(TreeIndex const& at) const;
  /// What every failed lookup returns: not valid, depth -1.
  TileType const& invalidTile() const { return m_data->m_invalidTile; }
  ConstTileAccessor tileAccessor() const;
  TileAccessor tileAccessor();

  std::int64_t rootCount() const;
  std::int64_t rootCount(int depth) const { return m_data->m_rootCounts[depth]; }
  RootIterator cbeginRoots() const;
  RootIterator cendRoots() const;

  // Shape
  static constexpr int depth() { return kMaxDepth; }
  static constexpr int maxDepth() { return kMaxDepth; }
  static int tileWidth(int) { return kTW; }
  static int tileSize(int) { return kTileSize; }
  static int tileDataWidth(int) { return kTDW; }
  static int tileDataSize(int) { return TraitsT::kTileDataSize; }
  static int tileVoxelWidth(int d) { return TileType::tileVoxelWidth(d); }
  static int voxelWidth(int d) { return TileType::voxelWidth(d); }
  static int voxelDataWidth(int d) { return TileType::voxelDataWidth(d); }
  std::int64_t voxelCount(int d) const { return tileCount(d) * kTileSize; }
  std::int64_t voxelDataCount(int d) const { return tileCount(d) * TraitsT::kTileDataSize; }

  // World
  /// World length of one tile-space unit.
  float voxelSize() const { return m_data->m_voxelSize; }
  /// @edges A size that is not above 0 stores an inverse of 1.
  void setVoxelSize(float size);
  float3 toTileSpace(float3 const& world) const { return world * m_data->m_voxelSizeInv; }
  float3 toWorldSpace(float3 const& tile) const { return tile * m_data->m_voxelSize; }
  float worldSpaceTileVoxelDiagonal(int d) const;
  /// Box of the roots, or of all tiles of a depth. @edges An empty tree gives the empty box.
  void tileSpaceBounds(bbox<int3, int>& box) const;
  void tileSpaceBounds(int d, bbox<int3, int>& box) const;
  void worldSpaceBounds(bbox<float3>& box) const;
  void worldSpaceBounds(int d, bbox<float3>& box) const;
  void worldSpaceBounds(bbox<double3>& box) const;
  void worldSpaceBounds(int d, bbox<double3>& box) const;

  // Iteration: all tiles, or all voxels, depth by depth in index order; `n` items are skipped
  TileIterator beginTiles(std::int64_t n = 0);
  TileIterator endTiles();
  ConstTileIterator beginTiles(std::int64_t n = 0) const { return cbeginTiles(n); }
  ConstTileIterator endTiles() const { return cendTiles(); }
  ConstTileIterator cbeginTiles(std::int64_t n = 0) const;
  ConstTileIterator cendTiles() const;
  VoxelIterator begin(std::int64_t n = 0) const { return cbegin(n); }
  VoxelIterator end() const { return cend(); }
  VoxelIterator cbegin(std::int64_t n = 0) const;
  VoxelIterator cend() const;

  // Traversal
  /// Drives `visitor` over the tree. See TraversalMode for orders.
  /// @error Parallel modes throw std::runtime_error(VLN::exceptionMessage) when the host cancels the job.
  void traverse(VisitorType& visitor, TraversalMode mode, TraversalRange const& range = {}) const;
  void traverse(VisitorType& visitor, TraversalMode mode, TraversalRange const& range = {});
  /// As traverse(), and joins the workers' results into `visitor`, in an order that does not depend on the
  /// threads.
  void reduce(VisitorType& visitor, TraversalMode mode, TraversalRange const& range = {}) const;
  void reduce(VisitorType& visitor, TraversalMode mode, TraversalRange const& range = {});
  /// Whether each stored branch size is that of its branch. The verbose form reports on standard error.
  bool checkBranchSizes(bool verbose) const;
  /// Whether the records of the tree agree with each other. The verbose form reports on standard error.
  bool checkConsistency(bool verbose) const;

  // Derived caches: built on demand, dropped by every change of the tree. Where one finds no memory it is not
  // built: the grid is off, the tables are those of before. Beside them, accessors that look for tiles far
  // from each other, thousands of times, make the lookup table that goes with the grid, which takes about as
  // long as those searches and a small part of the tree's memory.
  /// Dense grid of tile indices for fast entry: at the deepest depth up to `maxDepth` whose tiles span at
  /// most 64 cells on each axis. @cost Linear in the tiles of the depths tried.
  void buildAccessorAccelerationStructure(int maxDepth);
  void clearAccessorAccelerationStructure();
  /// 27 neighbours of each tile. @cost 432 bytes and 27 lookups a tile.
  void precomputeTileNeighbors();
  void clearPrecomputedTileNeighbors();
  /// Null without the table.
  NeighborTable const* neighborData() const;
  void precomputeTileHalos();
  void clearTileHalos();
  TileHalo<TraitsT> const* tileHalo(TreeIndex const& at) const;
  void precomputeCompressedTileHalos();
  void clearCompressedTileHalos();
  /// Reads a compressed halo; an ended visitor without the table.
  TileHaloVisitor<TraitsT> tileHaloVisitor(TreeIndex const& at) const;
  /// Largest number of tiles across the bounds of any depth; 0 for an empty tree.
  int tileSpaceMaxTileDistance() const;

  // Bulk change. Channels are not told: run the update protocol afterwards.
  /// Makes this tree a superset of each source. Tiles between are made only where a former root comes to lie
  /// below a new tile, or a root of a source below a coarser tile of this tree: roots never overlap.
  /// @param newTiles If given, the corner of every tile made is appended to the list of its depth.
  /// @param setBranchSizesAtEnd Else branch sizes are stale afterwards.
  /// @error std::runtime_error(VLN::exceptionMessage) when the host cancels the job; the depths finished so
  /// far stay. So they do with std::bad_alloc, and branch sizes are right then where `setBranchSizesAtEnd`
  /// asks.
  /// @cost Linear in the sources' tiles, each with a lookup near the previous one.
  void refine(std::vector<Container const*> const& sources, TileLists* newTiles, bool setBranchSizesAtEnd);
  // What throws std::bad_alloc in these four leaves the tree as it was.
  /// Fills the holes of dead tiles. `moves` tells what went where.
  void compact(TileMoves* moves = nullptr);
  /// Reorders the tiles: the tile at index i of depth d goes to perms[d][i]. An empty permutation leaves its
  /// depth.
  /// @pre kMaxDepth + 1 lists, each empty or a permutation of the depth's tiles.
  void permute(std::vector<std::int64_t> const* perms);
  /// Permutations, old index to new, that put each depth's tiles into Morton order.
  void computeMortonPermutations(std::vector<std::vector<std::int64_t>>& perms) const;
  void sortIntoMortonOrder(std::vector<std::vector<std::int64_t>>* permutations = nullptr);

  /// Writes the tiles of a depth as boxes of a Wavefront OBJ file, in three colours that tell neighbours
  /// apart, and the materials as "tile_tree.mtl" in the current directory.
  /// @space World space.
  /// @error None: a file that cannot be written is left out silently.
  void dumpObj(Ostil::String const& filename, int depth) const;

  // Scratch containers for parallel builders
  /// Hands out a private container; it begins with one tile at depth 0 unless `keepEmpty` is not 0.
  Container* threadLocalContainer(int keepEmpty);
  /// Takes a scratch container back, without the tiles that it gained.
  void freeThreadLocalContainer(Container* scratch);
  /// Takes all handed-out containers back, truncated from the first depth that `lists` names, or from the
  /// first depth at which they gained tiles when it names none.
  void clearThreadLocalData(TileLists const* lists);

  /// Value that the container carries for its callers; a negative one is stored as 0.
  float maxRelativeRefinementError() const { return m_data->m_maxRelativeRefinementError; }
  void setMaxRelativeRefinementError(float error);
  bool compactOnRemoval() const { return m_data->m_compactOnRemoval; }
  void setCompactOnRemoval(bool on) { m_data->m_compactOnRemoval = on; }

  // Sharing
  std::int64_t dataUseCount() const { return m_data.useCount(); }
  /// Makes the data exclusive to this container.
  void cloneData();
  bool sharesTiles(Container const& other) const;

protected:
  friend class ConstTileAccessorOf<TraitsT>;
  friend class TileAccessorOf<TraitsT>;
  friend class ContainerBuilder<TraitsT>;
  friend struct ContainerTestAccess;

  Data const* getData() const;
  /// What leads from positions to tiles, or null.
  TileLookupTable<TraitsT> const* lookupTable() const { return m_data->m_lookup.loadAcquire(); }
  /// Adds to the number of searches that led over many levels. Where the table would have paid for itself
  /// since the tree changed, it is built. @threads Any, while nothing changes.
  void countLongSearches(std::int64_t n) const;
  /// For lookups while the tree grows: they never build the table.
  ConstTileAccessor growthAccessor() const;

  // Lookup
  /// The deepest tile at or above `depth` that holds the point; invalid when there is none.
  TreeIndex tileIndex(int i, int j, int k, int depth) const;
  TileType const& tile(int i, int j, int k, int depth) const;
  /// Follows child slots from a tile towards a point of the domain until `depth` or an empty slot.
  /// With `path`, the index of each tile below the first is kept under its depth.
  TreeIndex descend(TreeIndex at, int i, int j, int k, int depth, std::int64_t* path = nullptr) const;
  /// Where a search begins: the tile of the acceleration grid, or the root, that holds the point at or above
  /// `depth`; invalid when there is none.
  TreeIndex entry(int i, int j, int k, int depth) const;
  /// Depth of the acceleration grid; -1 without one.
  int gridDepth() const;

  // Change. Tiles are named by index, since growth moves the records.
  TileType& editTile(TreeIndex const& at) { return m_data->editTiles(at.depth)[at.index]; }
  TreeIndex addTile(VoxelCoord const& at) { return addTile(at.i, at.j, at.k, at.depth); }
  TreeIndex addTile(int i, int j, int k, int depth);
  /// A tile below an existing one, with those between.
  TreeIndex addTileBelow(TreeIndex above, int i, int j, int k, int depth);
  std::int64_t allocateTile(int depth, TileType*& out);
  void allocateTiles(int depth, std::int64_t n);
  /// Before others get tiles to write: makes the arrays this container's alone.
  void handTilesOut();
  /// Sets the count of the depth. The caller restores the total.
  void resize(std::int64_t n, int depth);
  std::int64_t tileCapacity(int depth) const { return m_data->tiles(depth).capacity(); }
  void reallocateTile(std::int64_t dst, std::int64_t src, int depth);
  void addRoot(TileType const& tile);
  /// @cost For many, about that of sorting them.
  void addRoots(std::vector<std::int64_t> const& tiles, int depth);
  void removeRoot(TileType const& tile);
  /// Drops the derived caches after the tree grew.
  void tilesAdded();
  /// Drops them after tiles went; `moves` names, for each depth, what compaction did.
  void tilesRemoved(TileMoves const* moves);
  void setBranchSizes();
  void refineInternal(Container const& source, bool last, TileLists* newTiles);
  /// Removes one tile or its branch. A root without its branch goes only when no two of its children are
  /// adjacent; another tile always goes with its branch. Dead and unknown tiles are left alone.
  void removeTile(TreeIndex const& at, bool withBranch, TileMoves* moves = nullptr);
  /// Removes many; `lists` becomes what went, sorted.
  void removeTiles(TileIndexLists& lists, bool withBranch, TileMoves* moves = nullptr);
  /// Adds the tiles of many corners and those between, and sets all branch sizes.
  void addTilesInBulk(TileLists const& corners, TileLists* newTiles);

  AffinityPartitioner& affinityPartitioner(int d) const;
  int incrementAffinityPartitionerUseCount() const;
  int decrementAffinityPartitionerUseCount() const;

private:
  template <bool, class> friend class TraversalEngine;

  Data& data();
  Data const& data() const;

  /// The tiles of a Data.
  Ostil::Ptr<ContainerTiles<TraitsT>> m_data;
};

} // namespace VLN::TileTree3D

#include "GeometryVolume/tiletree/TileAccessor.h"
#include "GeometryVolume/tiletree/TileIterator.h"
