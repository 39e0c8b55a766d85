// Accessors: cheap per-thread cursors over a container that remember the last tile and walk from it.
#pragma once

#include "GeometryVolume/tiletree/Container.h"

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

  ConstTileAccessorOf() = default;
  ConstTileAccessorOf(ConstTileAccessorOf const&) = default;
  ConstTileAccessorOf& operator=(ConstTileAccessorOf const&) = default;
  virtual ~ConstTileAccessorOf() = default;

  ContainerT const* container() const { return m_container; }

  // Lookup by position in tile space
  /// The tile at `depth` that holds the point; with `exact` false the deepest tile at or above `depth`.
  /// @edges The invalid tile when there is none, and for points out of the domain. Depths deeper than the
  /// shape's last hold no tiles.
  /// @cost A hit on the cursor's tile costs one unsigned test an axis; other lookups walk up to a common
  /// ancestor.
  TileType const& tile(int i, int j, int k, int depth, bool exact) const {
    if (depth >= 0 && depth == m_depth && holds(i, j, k)) return current();
    return exact ? tileImpl<true>(i, j, k, depth) : tileImpl<false>(i, j, k, depth);
  }
  TileType const& tile(int3 const& p, int depth, bool exact) const {
    return tile(p.x, p.y, p.z, depth, exact);
  }
  TileType const& tile(VoxelCoord const& at, bool exact) const {
    return tile(at.i, at.j, at.k, at.depth, exact);
  }
  /// Index of the tile that tile() finds; invalid when there is none.
  TreeIndex treeIndex(int i, int j, int k, int depth, bool exact) const {
    return tile(i, j, k, depth, exact).treeIndex();
  }

  // Access by index; the cursor stays
  TileType const& tile(TreeIndex const& at) const { return m_container->tile(at); }
  TileType const& tile(std::int64_t n) const { return m_container->tile(n); }
  TileType const& tile(std::int64_t index, int depth) const { return m_container->tile(index, depth); }

  /// The tile found last; an invalid tile of a fresh accessor.
  TileType const& current() const { return m_depth >= 0 ? m_container->tile(m_index, m_depth) : noTile(); }

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
  friend class NeighborSearch<TraitsT>;

  explicit ConstTileAccessorOf(ContainerT const& container)
      : m_container(&container) {}

  /// The container's invalid tile, and one of the library's own without a container.
  TileType const& noTile() const;
  /// The search behind a miss of the cursor.
  template <bool Exact> TileType const& tileImpl(int i, int j, int k, int depth) const;
  /// Appends the live tiles of a depth range.
  void tiles(std::vector<TreeIndex>& list, int minDepth, int maxDepth) const;

  bool holds(int i, int j, int k) const {
    auto const w = static_cast<std::uint32_t>(TraitsT::width(m_depth));
    return distance(i, m_corner.x) < w && distance(j, m_corner.y) < w && distance(k, m_corner.z) < w;
  }
  static std::uint32_t distance(int c, int corner) {
    return static_cast<std::uint32_t>(c) - static_cast<std::uint32_t>(corner);
  }
  TileType const& moveTo(TileType const& t) const {
    m_corner = t.tijk(), m_depth = t.depth(), m_index = t.index();
    return t;
  }
  /// The start of the walk: from the cursor to a tile at or above `depth` that holds the point; invalid when
  /// the walk leaves the tree.
  TreeIndex findAncestor(int i, int j, int k, int depth) const;

  ContainerT const* m_container = nullptr;
  mutable int3 m_corner{0, 0, 0};
  mutable std::int32_t m_depth = -1; // none; negative depths never match
  mutable std::int64_t m_index = -1;
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
  /// @cost Drops the container's derived caches when a tile is made.
  TileType const& addTile(int i, int j, int k, int depth);
  TileType const& addTile(int3 const& p, int depth) { return addTile(p.x, p.y, p.z, depth); }
  TileType const& addTile(VoxelCoord const& at) { return addTile(at.i, at.j, at.k, at.depth); }
  /// Adds the smallest tile that holds the box.
  TileType const& addTile(int3 const& min, int3 const& max);
  /// Adds the tiles of a depth over a box, its max exclusive. Positions out of the domain are left out.
  void addTiles(int3 const& min, int3 const& max, int depth);

private:
  friend class Container<TraitsT>;

  explicit TileAccessorOf(ContainerT& container)
      : ConstTileAccessorOf<TraitsT>(container)
      , m_mutableContainer(&container) {}

  ContainerT* m_mutableContainer = nullptr;
};

template <class TraitsT> ConstTileAccessorOf<TraitsT> Container<TraitsT>::tileAccessor() const {
  return ConstTileAccessorOf<TraitsT>(*this);
}
template <class TraitsT> TileAccessorOf<TraitsT> Container<TraitsT>::tileAccessor() {
  return TileAccessorOf<TraitsT>(*this);
}

} // namespace VLN::TileTree3D
