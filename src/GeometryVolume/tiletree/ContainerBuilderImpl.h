// ContainerBuilder: the steps by which a container's tiles come and go.
#pragma once

#include "GeometryVolume/tiletree/ContainerGrowthImpl.h"

#include <array>
#include <bit>
#include <bitset>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace VLN::TileTree3D {

namespace Internal {
template <class TraitsT> struct Siblings;
template <class TraitsT> struct MadeAbove;

/// Slot of the child of `above` whose corner is p.
/// @pre p is such a corner. Then no division is needed where a tile has two voxels along an axis.
template <class TileType> int slotOfCorner(TileType const& above, int3 const& p) {
  if constexpr (TileType::kTileWidth == 2)
    return int(p.x > above.ti()) | int(p.y > above.tj()) << 1 | int(p.z > above.tk()) << 2;
  else {
    int3 const at = above.childIJK(p);
    return TileType::slotOf(at.x, at.y, at.z);
  }
}

/// From the corner of a tile of depth - 1 to those of its children.
template <class TraitsT> class ChildCorners {
public:
  explicit ChildCorners(int depth) {
    for (int slot = 0; slot < TraitsT::kTileSize; ++slot) {
      int3 const at = Tile<TraitsT, TraitsT::kTileSize>::childIJK(slot);
      auto const w = static_cast<std::uint32_t>(TraitsT::width(depth));
      auto& offset = m_offsets[slot];
      for (int a = 0; a < 3; ++a) offset[a] = w * static_cast<std::uint32_t>(at[a]);
    }
  }
  int3 operator()(int3 const& above, std::size_t slot) const {
    auto const& offset = m_offsets[slot];
    return {sum(above.x, offset[0]), sum(above.y, offset[1]), sum(above.z, offset[2])};
  }

private:
  static int sum(int corner, std::uint32_t offset) {
    return static_cast<int>(static_cast<std::uint32_t>(corner) + offset);
  }
  std::array<std::array<std::uint32_t, 3>, TraitsT::kTileSize> m_offsets;
};

/// Calls `f(slot)` for each slot of a set, rising.
template <std::size_t N, class F> void forEachSlot(std::bitset<N> const& slots, F const& f) {
  if constexpr (N <= 8) {
    for (auto bits = slots.to_ulong(); bits != 0; bits &= bits - 1)
      f(static_cast<std::size_t>(std::countr_zero(bits)));
  } else {
    for (std::size_t slot = 0; slot < N; ++slot)
      if (slots[slot]) f(slot);
  }
}

} // namespace Internal

/// @threads As the container's own changes: one thread.
template <class TraitsT> class ContainerBuilder {
public:
  using Tree = Container<TraitsT>;
  using Data = ContainerData<TraitsT>;
  using Growth = ContainerGrowth<TraitsT>;
  using TileType = typename Tree::TileType;
  using TileLists = typename Tree::TileLists;
  using Counts = typename Tree::Counts;
  using ConstTileAccessor = typename Tree::ConstTileAccessor;

  static constexpr int kMaxDepth = TraitsT::kMaxDepth, kTileSize = TraitsT::kTileSize;

  explicit ContainerBuilder(Tree& tree)
      : m_tree(tree) {}

  TreeIndex addTile(int i, int j, int k, int depth);
  /// A tile below the deepest one that holds its place, with those between.
  TreeIndex addTileBelow(TreeIndex above, int i, int j, int k, int depth);
  /// The same for a tile of the deepest depth, in a free slot of its parent.
  TreeIndex addDeepestTile(std::int64_t above, int slot, int3 const& corner);
  void addTilesInBulk(TileLists const& corners, TileLists* newTiles);
  void refine(Tree const& source, TileLists* newTiles);
  /// @param lists Becomes what went, sorted.
  void removeTiles(TileIndexLists& lists, bool withBranch, TileMoves* moves);
  /// Fills the holes of all dead tiles.
  void compact(TileMoves* moves);
  /// Drops the tiles of a depth and of all below.
  void truncate(int depth);
  /// Takes all scratch containers back, truncated from a depth on; for -1, from where each gained tiles.
  void returnThreadLocal(int fromDepth);
  void setBranchSizes(Cancellation cancellation);

private:
  using Siblings = Internal::Siblings<TraitsT>;
  using MadeAbove = Internal::MadeAbove<TraitsT>;
  class MadeParents;
  /// In place of the index of a source tile's counterpart.
  static constexpr std::int64_t kDeadSource = -1, kNotThere = -2;

  /// A new tile without parent: a root, or one that hangs below a coarser tile with tiles between.
  struct DetachedTile {
    std::int64_t index;
    TreeIndex above;
  };
  /// A record more, not live, of which nothing but the array knows.
  TileType& appendRecord(int depth);
  /// A new live tile without parent at the aligned corner.
  TreeIndex makeTile(int i, int j, int k, int depth);
  /// Hangs `child` below `parent`, making the tiles between; returns the size of the branch that the parent
  /// gained, 0 when it went below an existing child.
  std::int64_t insertChild(TreeIndex parent, TreeIndex child);
  /// A tile where there is none above.
  TreeIndex addRootTile(int i, int j, int k, int depth, Growth& growth);
  /// Grows a depth by `n` tiles, of which the caller runs initLinkedTile() for each index.
  void allocateUninitialised(int depth, std::int64_t n);
  /// Makes the tile of a new index and links it to its parent, when that is known (not -1) or found.
  /// @return false when it has none; `detached` then tells where it belongs.
  /// @threads Tiles of one depth are made in parallel: each slot belongs to exactly one tile.
  bool initLinkedTile(std::int64_t index, int depth, int3 const& corner, std::int64_t parent,
                      ConstTileAccessor const& accessor, DetachedTile& detached);
  /// Links what initLinkedTile() could not, and lists what is new since the counts were `before`.
  void linkDetached(int depth, std::vector<std::vector<DetachedTile>> const& parts, Growth& growth,
                    TileLists* newTiles);
  /// Appends the corners of all tiles made since the counts were `before`.
  void listNewTiles(Counts const& before, TileLists* newTiles) const;
  /// Children of a source's tiles of one depth that are not here, by parent, and how many for each chunk.
  struct MissingChildren {
    std::vector<std::bitset<kTileSize>> slots;
    std::vector<std::int64_t> counts;
  };
  /// Finds the counterparts of a source's tiles of a depth through those of their parents, which `above` has.
  /// The tiles themselves are not looked at.
  /// @param here Gets them, if it is not null; roots and dead tiles stay kDeadSource.
  /// @return Whether there are neither, and the tiles lie in the order of their parents: so they do in trees
  /// that were made at once, or sorted. If not, `missing` means nothing.
  bool findChildren(Tree const& source, int depth, std::vector<std::int64_t> const& above,
                    std::vector<std::int64_t>* here, MissingChildren& missing) const;
  /// Finds the counterparts of those source tiles that are kDeadSource yet, each by itself.
  /// @return How many of all tiles are not there, for each chunk of a refining pass.
  std::vector<std::int64_t> findCounterparts(TileArray<TileType> const& wanted, int depth,
                                             std::vector<std::int64_t> const& above,
                                             std::vector<std::int64_t>& here) const;
  /// Makes and links what findChildren() missed, by parents; those of a chunk from its start on.
  void makeChildren(Tree const& source, int depth, std::vector<std::int64_t> const& above,
                    std::vector<std::int64_t>& here, MissingChildren const& missing,
                    std::vector<std::int64_t> const& starts);
  /// Makes those of a source's tiles that are not there by themselves, those of a chunk from its start on.
  /// @param count How many they are. @return Those that have no parent here, by chunk.
  std::vector<std::vector<DetachedTile>>
  makeTiles(TileArray<TileType> const& wanted, int depth, std::vector<std::int64_t> const& above,
            std::vector<std::int64_t>& here, std::vector<std::int64_t> const& starts, std::int64_t count);
  /// Takes the tiles that are there out of groups, and finds the groups' parents; -1 for none.
  /// @return How many tiles are left, for each chunk of groups.
  std::vector<std::int64_t> dropExisting(std::vector<Siblings>& groups, int depth, MadeAbove const& above,
                                         std::vector<std::int64_t>& parents) const;
  /// Makes the tiles of groups, those of a chunk from its start on; returns those without a parent, by chunk.
  /// @param firsts Gets the index of the first tile of each group.
  TileIndexLists makeSiblings(std::vector<Siblings> const& groups, int depth,
                              std::vector<std::int64_t> const& parents,
                              std::vector<std::int64_t> const& starts, std::vector<std::int64_t>& firsts);
  /// Hangs roots deeper than `depth` below roots of `depth` that hold them.
  /// @return Whether there were any.
  bool adoptDeeperRoots(int depth, Growth& growth);
  /// Whether all listed tiles are alive, not roots, without children, and listed once by rising index: then
  /// they can go in any order.
  bool areRisingLeaves(TileIndexLists const& lists) const;
  /// removeTiles() of such lists, in parallel.
  void removeLeaves(TileIndexLists& lists, TileMoves* moves);
  /// Takes tiles without children out of the tree.
  /// @threads Each tile by one thread; ancestors may be shared.
  void unlinkLeaves(std::int64_t const* indices, std::int64_t count, int depth);
  /// Adds the tiles of a branch to the counts of their depths, until `budget` of them are counted.
  void countBranch(TreeIndex const& at, Counts& counts, std::int64_t& budget) const;
  /// Takes a tile or its branch out of the tree; returns how many tiles died.
  /// @param removed With room for what dies. @param spareRoots With room for each child that becomes a root.
  std::int64_t unlinkTile(TreeIndex const& at, bool withBranch, TileIndexLists& removed,
                          RootTable& spareRoots);
  std::int64_t invalidateBranch(TreeIndex const& at, TileIndexLists& removed);
  /// Room in `moves` for each entry of `lists`, so that fillHoles() needs no memory.
  static void reserveMoves(TileIndexLists const& lists, TileMoves& moves);
  void fillHoles(TileIndexLists& lists, TileMoves& moves);

  // The tree, as the steps name its parts.
  Data& data() const { return m_tree.data(); }
  TileType const& tile(TreeIndex const& at) const { return m_tree.data().tiles(at.depth)[at.index]; }
  TileType& editTile(TreeIndex const& at) const { return m_tree.data().editTiles(at.depth)[at.index]; }
  std::int64_t tileCount(int depth) const { return m_tree.tileCount(depth); }

  Tree& m_tree;
};

} // namespace VLN::TileTree3D
