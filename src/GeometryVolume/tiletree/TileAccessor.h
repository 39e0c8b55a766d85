// Accessors: cheap per-thread cursors over a container that remember the last tile and walk from it.
#pragma once

#include "GeometryVolume/tiletree/Container.h"

#include <bit>
#include <vector>

namespace VLN::TileTree3D {

/// Reads. The cursor is kept by value (corner, depth and index of a tile), so that it survives growth of the
/// tree, also growth through another accessor. Removal and reordering of tiles make every cursor but that of
/// the accessor that did it meaningless: take a new accessor then.
/// @threads One accessor for each thread.
template <class TraitsT> class VLN_API ConstTileAccessorOf {
public:
  using ContainerT = Container<TraitsT>;
  using TileType = typename ContainerT::TileType;

  ConstTileAccessorOf()
      : m_path{} {}
  ConstTileAccessorOf(ConstTileAccessorOf const&) = default;
  ConstTileAccessorOf& operator=(ConstTileAccessorOf const&) = default;
  virtual ~ConstTileAccessorOf() = default;

  ContainerT const* container() const { return m_container; }

  // Lookup by position in tile space
  /// The tile at `depth` that holds the point; with `exact` false the deepest tile at or above `depth`.
  /// @edges The invalid tile when there is none, and for points out of the domain. Depths deeper than the
  /// shape's last hold no tiles.
  /// @cost A hit on the cursor's tile costs one unsigned test an axis; other lookups begin at the deepest
  /// known ancestor that holds the point, without walking up to it.
  TileType const& tile(int i, int j, int k, int depth, bool exact) const {
    TreeIndex const at = treeIndex(i, j, k, depth, exact);
    return at.depth >= 0 ? m_container->tile(at) : invalidTile();
  }
  TileType const& tile(int3 const& p, int depth, bool exact) const {
    return tile(p.x, p.y, p.z, depth, exact);
  }
  TileType const& tile(VoxelCoord const& at, bool exact) const {
    return tile(at.i, at.j, at.k, at.depth, exact);
  }
  /// Index of the tile that tile() finds; invalid when there is none.
  /// @cost As tile(), without touching the tile's record.
  [[gnu::always_inline]] TreeIndex treeIndex(int i, int j, int k, int depth, bool exact) const {
    if (depth == m_depth && holds(i, j, k, depth)) return {m_index, depth};
    return look(i, j, k, depth, exact);
  }

  // Access by index; the cursor stays
  TileType const& tile(TreeIndex const& at) const { return m_container->tile(at); }
  TileType const& tile(std::int64_t n) const { return m_container->tile(n); }
  TileType const& tile(std::int64_t index, int depth) const { return m_container->tile(index, depth); }

  /// The tile found last; the invalid tile of a fresh accessor.
  TileType const& current() const {
    return m_depth >= 0 ? m_container->tile(m_index, m_depth) : invalidTile();
  }

  /// Corner of the tile found last, without touching its record. After a lookup that found no tile it is that
  /// of the tile where the search ended, or of an earlier one.
  int3 const& cursorCorner() const { return m_corner; }

  // Neighbours
  /// The tile next to `t` at its depth, or the deepest one above that holds the place; the invalid tile else.
  /// @edges The invalid tile has no neighbours.
  TileType const& tileNeighbor(TileType const& t, NeighborDirection n) const;
  /// The tile at `t`'s corner plus (di, dj, dk) tile widths of `depth`.
  TileType const& tileNeighbor(TileType const& t, int di, int dj, int dk, int depth, bool exact) const;
  TileType const& tileNeighbor(TileType const& t, int3 const& d, int depth, bool exact) const {
    return tileNeighbor(t, d.x, d.y, d.z, depth, exact);
  }
  TreeIndex treeIndexNeighbor(TileType const& t, NeighborDirection n) const {
    return tileNeighbor(t, n).treeIndex();
  }
  /// Appends the distinct tiles around `t` to `list`.
  ///
  /// Not recursive: for each of the 27 offsets the tile found at `t`'s depth. One that is shallower, or any
  /// when `depth` is `t`'s own, is added alone; otherwise it is added with those of its descendants down to
  /// `depth` that face `t`. Recursive: for each leaf voxel of `t` the tiles around that voxel, looked up one
  /// level deeper than `t`, and `t` itself when it has leaf voxels.
  void tileNeighbors(TileType const& t, std::vector<TreeIndex>& list, int depth, bool recursive) const;

  TileHalo<TraitsT> const* tileHalo(TreeIndex const& at) const { return m_container->tileHalo(at); }
  TileHaloVisitor<TraitsT> tileHaloVisitor(TreeIndex const& at) const;

  bool operator==(ConstTileAccessorOf const& b) const { return m_container == b.m_container; }

protected:
  friend class Container<TraitsT>;
  template <class> friend class NeighborSearch;

  explicit ConstTileAccessorOf(ContainerT const& container, bool countsSearches = true)
      : m_container(&container)
      , m_countsSearches(countsSearches) {}

  /// The way of a miss of the cursor: out of line, so that a hit is a few instructions where it is asked for.
  [[gnu::noinline]] TreeIndex look(int i, int j, int k, int depth, bool exact) const {
    if constexpr (TraitsT::kTW == 2) {
      auto const* const table = m_container ? m_container->lookupTable() : nullptr;
      if (table && depth == table->lastDepth) [[likely]] {
        if (std::int64_t const n = table->indexAtLast(i, j, k); n >= 0) [[likely]] {
          auto const mask = static_cast<int>(table->widthMask);
          m_corner.x = i & mask, m_corner.y = j & mask, m_corner.z = k & mask;
          m_depth = m_pathTop = depth, m_index = m_path[depth] = n;
          return {n, depth};
        }
      }
    }
    return find(i, j, k, depth, exact);
  }
  /// The search behind a miss of the cursor; moves the cursor to the deepest tile that it reaches.
  TreeIndex find(int i, int j, int k, int depth, bool exact) const;
  /// Appends the live tiles of a depth range.
  void tiles(std::vector<TreeIndex>& list, int minDepth, int maxDepth) const;

  /// @param depth That of the cursor's tile.
  bool holds(int i, int j, int k, int depth) const {
    auto const w = static_cast<std::uint32_t>(TraitsT::width(depth));
    std::uint32_t const x = distance(i, m_corner.x), y = distance(j, m_corner.y), z = distance(k, m_corner.z);
    if constexpr (TraitsT::kTW == 2) return (x | y | z) < w; // a power of two
    return x < w && y < w && z < w;
  }
  static std::uint32_t distance(int c, int corner) {
    return static_cast<std::uint32_t>(c) - static_cast<std::uint32_t>(corner);
  }
  TileType const& invalidTile() const;
  /// Puts the cursor on a tile whose ancestors are not known.
  TileType const& setCursor(TileType const& t) const {
    m_corner = t.tijk(), m_depth = m_pathTop = t.depth(), m_index = t.index();
    if (m_depth >= 0) m_path[m_depth] = m_index;
    return t;
  }
  /// The same for the tile that holds a point.
  void setCursor(TreeIndex const& at, int i, int j, int k) const {
    m_corner = TraitsT::align(int3{i, j, k}, at.depth);
    m_depth = m_pathTop = at.depth, m_index = at.index;
    m_path[at.depth] = at.index;
  }
  void resetCursor() const { m_corner = {0, 0, 0}, m_depth = m_pathTop = kNoDepth, m_index = -1; }
  /// A tile at or above `depth` that holds the point, from the cursor's neighbours or its path; invalid when
  /// the way leads over the tree's entry. What the path keeps is then still right for the tile returned.
  TreeIndex findNear(int i, int j, int k, int depth) const;
  /// The deepest depth at which two points of the domain lie in one tile; above kMaxDepth for points close
  /// by.
  static int commonDepth(int3 const& a, int3 const& b) requires(TraitsT::kTW == 2) {
    constexpr int kDomainBits = std::bit_width(static_cast<std::uint32_t>(TraitsT::kDomainWidth)) - 1;
    std::uint32_t const bits = (TraitsT::offset(a.x) ^ TraitsT::offset(b.x)) |
                               (TraitsT::offset(a.y) ^ TraitsT::offset(b.y)) |
                               (TraitsT::offset(a.z) ^ TraitsT::offset(b.z));
    return kDomainBits - static_cast<int>(std::bit_width(bits));
  }
  /// Follows child slots from a tile, keeps the path, and puts the cursor on the last tile.
  TreeIndex descend(TreeIndex at, int i, int j, int k, int depth) const;

  /// Depth of a cursor without a tile. Asked for, it "hits" and gives the invalid index, which is the answer.
  static constexpr std::int32_t kNoDepth = -1;
  /// Levels of a long search, how many are counted before the container is told, and how many short ones
  /// count as one: reading in order, again and again, gains by the table as well.
  static constexpr int kLongSearch = 3, kSearchesTold = 64, kShortInLong = 8;

  ContainerT const* m_container = nullptr;
  mutable int3 m_corner{0, 0, 0};
  mutable std::int32_t m_depth = kNoDepth;
  mutable std::int64_t m_index = -1;
  /// Indices of the cursor's tile and its ancestors, known from depth m_pathTop on.
  mutable std::int32_t m_pathTop = kNoDepth;
  mutable std::int32_t m_searches = 0; ///< in short ones
  bool m_countsSearches = true;
  mutable PerDepth<std::int64_t, TraitsT::kDepths> m_path;
};

/// Adds tiles as well.
template <class TraitsT> class VLN_API TileAccessorOf : public ConstTileAccessorOf<TraitsT> {
public:
  using ContainerT = Container<TraitsT>;
  using TileType = typename ContainerT::TileType;

  TileAccessorOf() = default;

  /// The tile of `depth` that holds the point, made with the tiles between it and the deepest existing one
  /// above.
  /// @edges The invalid tile for points and depths out of the domain.
  /// @error std::bad_alloc; the tree is as it was then, without derived caches.
  /// @cost Drops the container's derived caches when a tile is made.
  TileType const& addTile(int i, int j, int k, int depth);
  TileType const& addTile(int3 const& p, int depth) { return addTile(p.x, p.y, p.z, depth); }
  TileType const& addTile(VoxelCoord const& at) { return addTile(at.i, at.j, at.k, at.depth); }
  /// The same where a coarser tile holds the point already; else nothing is made.
  /// @return The depth of the deepest tile that held the point before: `depth` where that tile was there, -1
  /// where there is none.
  int addTileBelow(int i, int j, int k, int depth) {
    if (!TraitsT::isDepth(depth)) return -1;
    TreeIndex const at = this->treeIndex(i, j, k, depth, false);
    if (at.valid() && at.depth != depth) growBelow(at, i, j, k, depth);
    return at.valid() ? at.depth : -1;
  }
  /// Adds the smallest tile that holds the box.
  TileType const& addTile(int3 const& min, int3 const& max);
  /// Adds the tiles of a depth over a box, its max exclusive. Positions out of the domain are left out.
  /// @edges `min` is aligned to its tile first, `max` is taken as it stands: with `max` at or below `min` on
  /// an axis, the tile that holds `min` is still added where its corner lies below `max`.
  /// @error std::bad_alloc; the tiles added so far stay.
  void addTiles(int3 const& min, int3 const& max, int depth);
  /// Adds the tiles that hold the listed points, by depth, all at once: existing ones are left, those between
  /// a listed tile and the next coarser one above it, listed or there, are made as well, and branch sizes are
  /// right afterwards. New ones lie parent by parent in the parents' Morton order.
  /// @edges Points out of the domain are left out; a point may be listed more than once.
  /// @param newTiles If given, the corner of every tile made is appended to the list of its depth.
  /// @error std::bad_alloc; tree and `newTiles` are as they were then.
  /// @cost Linear, but for one sort of the parents where they do not come in Morton order; runs in parallel.
  void addTiles(typename ContainerT::TileLists const& points,
                typename ContainerT::TileLists* newTiles = nullptr) {
    m_mutableContainer->addTilesInBulk(points, newTiles);
  }

  // Removal. With the container's compaction on, indices of other tiles may change: `moves` tells how. What
  // throws std::bad_alloc leaves the tree as it was.
  /// Removes one tile or its branch. A root without its branch goes only when no two of its children are
  /// adjacent; another tile always goes with its branch. Refusal is silent: ask the tile's valid().
  void removeTile(TreeIndex const& at, bool withBranch, TileMoves* moves = nullptr);
  void removeTiles(TileIndexLists const& lists, bool withBranch, TileMoves* moves = nullptr);
  void removeTiles(std::vector<std::int64_t> const& indices, int depth, bool withBranch,
                   TileMoves* moves = nullptr);

private:
  static constexpr int kDeepest = TraitsT::kMaxDepth;
  /// What the cursor's path was below the tile to which it has gone up: the way back down, without a search.
  struct WayDown {
    int3 point{0, 0, 0};
    std::int32_t from = -1, to = -1; ///< depths; known are the indices below the first one
    PerDepth<std::int64_t, TraitsT::kDepths> path{};
  };

  /// The tile of the deepest depth at a point, made where it is not there, if the cursor's is a tile of the
  /// same parent. Moves the cursor.
  /// @return false, and nothing done, else.
  bool addNextTo(int i, int j, int k);
  /// addTile() of any other tile.
  TileType const& addFar(int i, int j, int k, int depth);
  /// Makes the tile of `depth` below the cursor's tile `at`, and moves the cursor there.
  void growBelow(TreeIndex at, int i, int j, int k, int depth);
  /// Reads the cursor's tile again at its index, or resets the cursor when there is none.
  void rereadCursor();

  friend class Container<TraitsT>;

  explicit TileAccessorOf(ContainerT& container)
      : ConstTileAccessorOf<TraitsT>(container)
      , m_mutableContainer(&container) {}

  ContainerT* m_mutableContainer = nullptr;
  WayDown m_wayDown;
};

template <class TraitsT> ConstTileAccessorOf<TraitsT> Container<TraitsT>::tileAccessor() const {
  return ConstTileAccessorOf<TraitsT>(*this);
}
template <class TraitsT> ConstTileAccessorOf<TraitsT> Container<TraitsT>::growthAccessor() const {
  return ConstTileAccessorOf<TraitsT>(*this, false);
}
template <class TraitsT> TileAccessorOf<TraitsT> Container<TraitsT>::tileAccessor() {
  return TileAccessorOf<TraitsT>(*this);
}

} // namespace VLN::TileTree3D
