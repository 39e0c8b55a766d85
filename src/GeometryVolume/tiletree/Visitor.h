// Visitor: what runs at the tiles and voxels of a traversal, and the orders in which a tree can be walked.
#pragma once

#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/tiletree/Tile.h"
#include "Ostil/Ptr.h"

namespace VLN::TileTree3D {

/// Order of a traversal. Depth scans go over the arrays of each depth and ignore parents; the other orders
/// follow children from a start list: the start tile, or all roots from minDepth on and all tiles at
/// minDepth.
enum TraversalMode : int {
  kBreadthFirst = 0,           ///< top-down, serial: a depth scan, or a queue from the start tile
  kBottomUp = 1,               ///< bottom-up depth scan, serial; nothing with a start tile
  kDepthFirst = 2,             ///< pre-order, serial; visitInteriorVoxel() may prune a child
  kLeafVoxels = 3,             ///< top-down depth scan, serial, leaf voxels only; the start is ignored
  kParallelTopDown = 4,        ///< depth scan, or by levels from the start tile; a barrier after each depth
  kParallelBottomUp = 5,       ///< bottom-up depth scan with a barrier; nothing with a start tile
  kParallelDepthFirst = 6,     ///< branches in parallel, each in pre-order with pruning
  kParallelFlat = 7,           ///< one range over all depths, no order; nothing with a start tile
  kParallelTopDownGuarded = 8, ///< as kParallelTopDown; nothing with a start tile
};

/// Which tiles show their voxels to visitInteriorVoxel().
enum VisitInteriorVoxelMode : int {
  kVisitAllDepths = 0, ///< all; parallel ranges count voxels
  kSkipMaxDepth = 1,   ///< not those of the deepest depth; parallel ranges count tiles
};

/// What a traversal covers. The defaults are the whole tree and whole tiles.
struct TraversalRange {
  TreeIndex start{}; ///< start tile; invalid: the whole forest
  int minDepth = 0;
  int maxDepth = 1 << 20;  ///< limited to the shape's deepest depth
  std::uint64_t grain = 1; ///< items of a parallel range that stay together
  bool useAffinity = true; ///< repeated passes find their tiles on the same cores
  int voxelBegin = 0;      ///< bounds of i, j and k of the visited voxels
  int voxelEnd = 1 << 20;  ///< limited to the tile's width
  VisitInteriorVoxelMode interior = kSkipMaxDepth;
  int maxParallelDepth = 1 << 20; ///< depth-first branches deeper than this stay on their thread
};

template <class ContainerT> struct TileOf;
template <template <class> class ContainerT, class TraitsT> struct TileOf<ContainerT<TraitsT>> {
  using type = Tile<TraitsT, TraitsT::kTileSize>;
};

/// Base of all visitors. A visit of a tile is beginTile(), its voxels with i fastest, endTile().
/// The order of the virtual operations is fixed.
/// @threads In a parallel pass each worker has its own clone; a visitor writes only to the tile that it is
/// given.
template <class ContainerT> class Visitor {
public:
  using TileType = typename TileOf<ContainerT>::type;

  virtual void beginTraverse() {}
  virtual void endTraverse() {}
  virtual void beginTile(TileType const&) {}
  virtual void beginTile(TileType&) {}
  virtual void endTile(TileType const&) {}
  virtual void endTile(TileType&) {}
  /// A false result prunes the voxel's child in depth-first orders.
  virtual bool visitInteriorVoxel(TileType const&, int3 const&) { return true; }
  virtual bool visitInteriorVoxel(TileType&, int3 const&) { return true; }
  /// Takes the results of another copy in.
  virtual void join(Visitor const&) {}
  /// A new copy for another worker, as it would be at the start of a traversal.
  virtual Visitor* clone() const = 0;
  virtual ~Visitor() = default;

  bool isBeginTileOverridden() const { return m_beginTileOverridden; }
  bool isEndTileOverridden() const { return m_endTileOverridden; }

  bool hasVisitorCopies() const { return m_copies != nullptr; }
  /// Creates the store of per-thread copies when there is none.
  VLN_API void initVisitorCopies();
  /// The calling thread's copy, made at the thread's first use; null without a store.
  VLN_API Visitor* visitorCopy();
  /// Calls `f` for each copy, in no fixed order.
  VLN_API void forEachCopy(FunctionRef<void(Visitor&)> f);

  // Hook for per-branch data that derived visitors may shadow.
  void* getData() { return nullptr; }
  void setParentData(int const*) {}
  void clearData() {}

protected:
  Visitor() = default;
  /// Copies no per-thread copies.
  Visitor(Visitor const& other)
      : m_beginTileOverridden(other.m_beginTileOverridden)
      , m_endTileOverridden(other.m_endTileOverridden) {}
  Visitor& operator=(Visitor const&) = delete;

  /// A visitor that does not override beginTile() or endTile() clears the flag, to spare the calls.
  void setBeginTileOverridden(bool on) { m_beginTileOverridden = on; }
  void setEndTileOverridden(bool on) { m_endTileOverridden = on; }

private:
  struct Copies;

  Ostil::Ptr<Copies> m_copies;
  bool m_beginTileOverridden = true;
  bool m_endTileOverridden = true;
};

} // namespace VLN::TileTree3D
