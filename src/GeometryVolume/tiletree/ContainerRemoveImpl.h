// Removal of tiles, filling of the holes that it leaves, and reordering. Included by Container.cpp alone.
//
//   | a | X | b | X | c | d |      tiles at removed indices 1 and 3
//   | a | d | b | c |              holes are filled from the end of the array; every referrer is told
#pragma once

#include "GeometryVolume/tiletree/ContainerBuilderImpl.h"
#include "GeometryVolume/tiletree/Morton.h"

#include <atomic>
#include <cstdlib>
#include <utility>
#include <vector>

namespace VLN::TileTree3D {

namespace Internal {

/// Removed tiles that one task takes.
inline constexpr std::int64_t kRemovalGrain = 1024;

/// Whether two occupied slots lie within one step of each other on each axis.
template <class TileType> bool hasAdjacentChildren(TileType const& tile) {
  for (auto a = tile.begin(); a != tile.end(); ++a) {
    for (auto b = tile.begin(); b != tile.end(); ++b) {
      int3 const d = TileType::childIJK(*a) - TileType::childIJK(*b);
      if (*a != *b && std::abs(d.x) <= 1 && std::abs(d.y) <= 1 && std::abs(d.z) <= 1) return true;
    }
  }
  return false;
}

} // namespace Internal

template <class TraitsT>
void ContainerBuilder<TraitsT>::countBranch(TreeIndex const& at, Counts& counts, std::int64_t& budget) const {
  if (--budget < 0) return;
  ++counts[at.depth];
  TileType const& t = tile(at);
  if (t.atMaxDepth()) return;
  for (auto child = t.begin(); child != t.end(); ++child) countBranch(child.treeIndex(), counts, budget);
}

template <class TraitsT>
std::int64_t ContainerBuilder<TraitsT>::invalidateBranch(TreeIndex const& at, TileIndexLists& removed) {
  std::int64_t count = 1;
  TileType& t = editTile(at);
  if (!t.atMaxDepth())
    for (auto child = t.begin(); child != t.end(); ++child)
      count += invalidateBranch(child.treeIndex(), removed);
  t.invalidate();
  removed[at.depth].push_back(at.index);
  return count;
}

template <class TraitsT>
std::int64_t ContainerBuilder<TraitsT>::unlinkTile(TreeIndex const& at, bool withBranch,
                                                   TileIndexLists& removed, RootTable& spareRoots) {
  if (!TraitsT::isDepth(at.depth) || at.index < 0 || at.index >= tileCount(at.depth) || !tile(at).valid())
    return 0;
  TileType& t = editTile(at);
  if (t.isRoot()) {
    if (!withBranch && Internal::hasAdjacentChildren(t)) return 0;
    m_tree.removeRoot(t);
    if (!withBranch) {
      for (auto child = t.begin(); child != t.end(); ++child) {
        TileType& c = editTile(child.treeIndex());
        c.setParentIndex(-1);
        auto node = spareRoots.extract(spareRoots.begin());
        node.key() = c.voxelCoord(), node.mapped() = c.treeIndex();
        data().m_roots.insert(std::move(node));
        ++data().m_rootCounts[c.depth()];
      }
      t.invalidate();
      removed[at.depth].push_back(at.index);
      return 1;
    }
  } else {
    std::int64_t const branch = t.branchSize();
    TreeIndex above = t.parentTreeIndex();
    editTile(above).childIndex(t) = -1;
    for (; above.index >= 0; above = tile(above).parentTreeIndex())
      editTile(above).setBranchSize(tile(above).branchSize() - branch);
  }
  return invalidateBranch(at, removed);
}

template <class TraitsT>
void ContainerBuilder<TraitsT>::reserveMoves(TileIndexLists const& lists, TileMoves& moves) {
  moves.assign(kMaxDepth + 1, {});
  for (std::size_t d = 0; d < lists.size(); ++d) moves[d].reserve(lists[d].capacity());
}

template <class TraitsT> bool ContainerBuilder<TraitsT>::areRisingLeaves(TileIndexLists const& lists) const {
  for (int d = 0; d <= kMaxDepth && d < static_cast<int>(lists.size()); ++d) {
    auto const& list = lists[d];
    bool const all = parallelReduce(
        0, static_cast<std::int64_t>(list.size()), Internal::kRemovalGrain, true,
        [&](std::int64_t begin, std::int64_t end) {
          for (auto n = begin; n < end; ++n) {
            TreeIndex const at{list[n], d};
            if (at.index < 0 || at.index >= tileCount(d) || (n > 0 && list[n - 1] >= at.index)) return false;
            TileType const& t = tile(at);
            if (!t.valid() || t.isRoot() || !t.isLeaf()) return false;
          }
          return true;
        },
        [](bool a, bool b) { return a && b; });
    if (!all) return false;
  }
  return true;
}

template <class TraitsT>
void ContainerBuilder<TraitsT>::unlinkLeaves(std::int64_t const* indices, std::int64_t count, int depth) {
  // The ancestors of the tile before, and what their branches have lost meanwhile: neighbours in the list
  // have most ancestors in common, which are written once for all of them.
  PerDepth<std::int64_t, TraitsT::kDepths> above, lost;
  for (int d = 0; d < depth; ++d) above[d] = -1, lost[d] = 0;
  auto const leave = [&](int d) {
    std::atomic_ref<std::int64_t> size(editTile({above[d], d}).m_branchSize);
    size.fetch_sub(lost[d], std::memory_order_relaxed);
    if (d > 0 && above[d - 1] >= 0) lost[d - 1] += lost[d];
    above[d] = -1, lost[d] = 0;
  };
  for (std::int64_t n = 0; n < count; ++n) {
    TileType& t = editTile({indices[n], depth});
    editTile(t.parentTreeIndex()).childIndex(t) = -1;
    int d = depth - 1;
    for (std::int64_t at = t.parentIndex(); d >= 0 && at != above[d]; --d) {
      if (above[d] >= 0) leave(d);
      above[d] = at;
      if (at >= 0) at = tile({at, d}).parentIndex();
    }
    lost[depth - 1] += t.branchSize();
    t.invalidate();
  }
  for (int d = depth - 1; d >= 0 && above[d] >= 0; --d) leave(d);
}

template <class TraitsT>
void ContainerBuilder<TraitsT>::removeLeaves(TileIndexLists& lists, TileMoves* moves) {
  lists.resize(kMaxDepth + 1);
  TileMoves ownMoves;
  TileMoves& made = moves ? *moves : ownMoves;
  reserveMoves(lists, made);
  data().detachTiles();
  std::int64_t count = 0;
  for (int d = 1; d <= kMaxDepth; ++d) {
    auto const& list = lists[d];
    auto const n = static_cast<std::int64_t>(list.size());
    parallelFor(
        0, n,
        [&](std::int64_t begin, std::int64_t end) { unlinkLeaves(list.data() + begin, end - begin, d); },
        {.grain = Internal::kRemovalGrain});
    count += n;
  }
  if (count == 0) return;
  data().m_tileCountTotal -= count;
  if (m_tree.compactOnRemoval()) fillHoles(lists, made);
  m_tree.tilesRemoved(&made);
}

template <class TraitsT>
void ContainerBuilder<TraitsT>::removeTiles(TileIndexLists& lists, bool withBranch, TileMoves* moves) {
  if (areRisingLeaves(lists)) return removeLeaves(lists, moves);
  // All memory that is needed comes first. Branches of listed tiles may hold listed ones: where more would be
  // counted than there are tiles, room is made for all.
  Counts counts{};
  RootTable spareRoots;
  std::int64_t budget = data().m_tileCountTotal;
  auto const live = [&](TreeIndex const& at) {
    return at.index >= 0 && at.index < tileCount(at.depth) && tile(at).valid();
  };
  for (int d = 0; d <= kMaxDepth && d < static_cast<int>(lists.size()); ++d) {
    for (std::int64_t const index : lists[d]) {
      TreeIndex const at{index, d};
      if (!live(at)) continue;
      countBranch(at, counts, budget);
      for (int n = withBranch ? 0 : tile(at).childCount(); n > 0; --n)
        spareRoots.try_emplace({static_cast<int>(spareRoots.size()), 0, 0, 0});
    }
  }
  TileIndexLists removed(kMaxDepth + 1);
  for (std::size_t d = 0; d < removed.size(); ++d)
    removed[d].reserve(budget < 0 ? data().m_tileCounts[d] : counts[d]);
  TileMoves ownMoves;
  TileMoves& made = moves ? *moves : ownMoves;
  reserveMoves(removed, made);
  data().detachTiles();

  std::int64_t count = 0;
  for (int d = 0; d <= kMaxDepth && d < static_cast<int>(lists.size()); ++d) {
    for (std::int64_t const index : lists[d])
      count += unlinkTile({index, d}, withBranch, removed, spareRoots);
  }
  // Refused and dead entries have left the lists; branches have joined them.
  lists = std::move(removed);
  if (count == 0) return;
  data().m_tileCountTotal -= count;
  if (m_tree.compactOnRemoval()) fillHoles(lists, made);
  m_tree.tilesRemoved(&made);
}

template <class TraitsT> void ContainerBuilder<TraitsT>::compact(TileMoves* moves) {
  TileIndexLists dead(kMaxDepth + 1);
  for (int d = 0; d <= kMaxDepth; ++d) {
    for (std::int64_t n = 0; n < tileCount(d); ++n) {
      if (!tile({n, d}).valid()) dead[d].push_back(n);
    }
  }
  TileMoves ownMoves;
  TileMoves& made = moves ? *moves : ownMoves;
  reserveMoves(dead, made);
  data().detachTiles();
  fillHoles(dead, made);
  m_tree.tilesRemoved(&made);
}

template <class TraitsT> void ContainerBuilder<TraitsT>::fillHoles(TileIndexLists& lists, TileMoves& moves) {
  for (int d = 0; d <= kMaxDepth; ++d) {
    auto& holes = lists[d];
    if (holes.empty()) continue;
    if (!std::is_sorted(holes.begin(), holes.end())) std::sort(holes.begin(), holes.end());
    holes.erase(std::unique(holes.begin(), holes.end()), holes.end());
    auto const& tiles = data().tiles(d);
    auto& made = moves[d];
    // Dead tiles at the very end go without a move, also those that an earlier removal left behind.
    std::int64_t last = tiles.size() - 1;
    std::int64_t filled = -1; // the highest hole that has a tile coming, which is not there yet
    auto const dropDead = [&] {
      while (last > filled && !tiles[last].valid()) --last;
    };
    dropDead();
    for (std::int64_t const hole : holes) {
      if (hole >= last) break;
      made.emplace_back(hole, last--);
      filled = hole;
      dropDead();
    }
    std::atomic<bool> anyRoot{false};
    parallelFor(0, static_cast<std::int64_t>(made.size()), [&](std::int64_t begin, std::int64_t end) {
      for (auto n = begin; n < end; ++n) {
        auto const [dst, src] = made[n];
        data().editTiles(d).relocate(dst, src);
        TileType& t = editTile({dst, d});
        t.setIndex(dst);
        if (t.isRoot())
          anyRoot.store(true, std::memory_order_relaxed);
        else
          editTile(t.parentTreeIndex()).childIndex(t) = dst;
        for (auto child = t.begin(); child != t.end(); ++child)
          editTile(child.treeIndex()).setParentIndex(dst);
      }
    });
    // What lies behind is dead, or was moved: it owns nothing.
    data().editTiles(d).shrinkRaw(last + 1);
    data().m_tileCounts[d] = last + 1;
    if (!anyRoot.load(std::memory_order_relaxed)) continue;
    for (auto const& [dst, src] : made) {
      TileType const& t = tile({dst, d});
      if (t.isRoot()) data().m_roots.find(t.voxelCoord())->second = {dst, d};
    }
  }
}

template <class TraitsT>
void Container<TraitsT>::removeTile(TreeIndex const& at, bool withBranch, TileMoves* moves) {
  TileIndexLists lists(kMaxDepth + 1);
  if (TraitsT::isDepth(at.depth)) lists[at.depth].push_back(at.index);
  removeTiles(lists, withBranch, moves);
}

template <class TraitsT>
void Container<TraitsT>::removeTiles(TileIndexLists& lists, bool withBranch, TileMoves* moves) {
  ContainerBuilder<TraitsT>(*this).removeTiles(lists, withBranch, moves);
}
template <class TraitsT> void Container<TraitsT>::compact(TileMoves* moves) {
  ContainerBuilder<TraitsT>(*this).compact(moves);
}

template <class TraitsT> void Container<TraitsT>::permute(std::vector<std::int64_t> const* perms) {
  tilesAdded();
  data().detachTiles();
  auto const mapped = [&](std::int64_t index, int d) {
    auto const& perm = perms[d];
    return index < 0 || perm.empty() ? index : perm[index];
  };
  auto const permuted = [&](int d) { return TraitsT::isDepth(d) && !perms[d].empty(); };
  PerDepth<typename Data::Array::Room, TraitsT::kDepths> rooms;
  for (int d = 0; d <= kMaxDepth; ++d)
    if (permuted(d)) rooms[d] = data().tiles(d).roomToPermute();
  // Each depth rewrites only its own records, from the permutations of the depths above and below.
  parallelFor(0, kMaxDepth + 1, [&](std::int64_t firstDepth, std::int64_t lastDepth) {
    for (int d = static_cast<int>(firstDepth); d < static_cast<int>(lastDepth); ++d) {
      if (!permuted(d - 1) && !permuted(d) && !permuted(d + 1)) continue;
      auto& tiles = data().editTiles(d);
      if (permuted(d)) tiles.permute(perms[d].data(), rooms[d]);
      parallelFor(0, tiles.size(),
                  [&](std::int64_t begin, std::int64_t end) {
                    for (std::int64_t n = begin; n < end; ++n) {
                      TileType& t = tiles[n];
                      t.setIndex(n);
                      if (!t.valid()) continue; // its links are old, and may lead nowhere
                      t.setParentIndex(d > 0 ? mapped(t.parentIndex(), d - 1) : t.parentIndex());
                      for (auto child = t.begin(); child != t.end(); ++child)
                        t.childIndex(*child) = mapped(t.childIndex(*child), d + 1);
                    }
                  },
                  {.grain = 1024});
    }
  });
  for (auto& [at, index] : data().m_roots) index.index = mapped(index.index, index.depth);
}

template <class TraitsT>
void Container<TraitsT>::computeMortonPermutations(std::vector<std::vector<std::int64_t>>& perms) const {
  perms.assign(kMaxDepth + 1, {});
  parallelFor(0, kMaxDepth + 1, [&](std::int64_t firstDepth, std::int64_t lastDepth) {
    for (int d = static_cast<int>(firstDepth); d < static_cast<int>(lastDepth); ++d) {
      auto const& tiles = data().tiles(d);
      std::vector<SortRecord> order(tiles.size());
      parallelFor(0, tiles.size(),
                  [&](std::int64_t begin, std::int64_t end) {
                    for (std::int64_t n = begin; n < end; ++n)
                      order[n] = mortonRecord<TraitsT>(tiles[n].tijk(), n);
                  },
                  {.grain = 1024});
      parallelSort(order.data(), tiles.size());
      auto& perm = perms[d];
      perm.resize(order.size());
      for (std::size_t n = 0; n < order.size(); ++n) perm[order[n].value] = static_cast<std::int64_t>(n);
    }
  });
}

template <class TraitsT>
void Container<TraitsT>::sortIntoMortonOrder(std::vector<std::vector<std::int64_t>>* permutations) {
  std::vector<std::vector<std::int64_t>> own;
  auto& perms = permutations ? *permutations : own;
  computeMortonPermutations(perms);
  permute(perms.data());
}

} // namespace VLN::TileTree3D
