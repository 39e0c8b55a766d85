// Addition of many tiles at once. Included by Container.cpp alone.
//
// Everything goes by groups of siblings: what is wanted below one tile of the depth above is one corner and a
// bit for each slot. Groups are sorted, so that neighbours in space are neighbours in memory; then the tiles
// between are added from the bottom up, and all are made from the top down.
#pragma once

#include "GeometryVolume/tiletree/ContainerBuilderImpl.h"
#include "GeometryVolume/tiletree/Morton.h"

#include <algorithm>
#include <bitset>
#include <new>
#include <utility>

namespace VLN::TileTree3D {

namespace Internal {

/// Groups that one task takes.
inline constexpr std::int64_t kGroupGrain = 128;
/// Listed tiles that one task takes.
inline constexpr std::int64_t kPointGrain = 4096;

/// Tiles of one depth with a common parent, which need not exist.
template <class TraitsT> struct Siblings {
  SortRecord key; ///< of the parent's corner; the value means nothing
  int3 parent;
  std::bitset<TraitsT::kTileSize> slots;

  /// Calls `f(slot)` for each slot, rising.
  template <class F> void forEachSlot(F const& f) const { Internal::forEachSlot(slots, f); }
  /// How many slots lie before one.
  std::int64_t countBefore(std::size_t slot) const {
    return static_cast<std::int64_t>((slots << (slots.size() - slot)).count());
  }
};
template <class TraitsT> bool comesBefore(Siblings<TraitsT> const& a, Siblings<TraitsT> const& b) {
  return a.key.high != b.key.high ? a.key.high < b.key.high : a.key.low < b.key.low;
}

/// The slot of the child of a tile of depth - 1 in which a point lies, if it lies in the tile; else beyond
/// all slots.
template <class TraitsT>
[[gnu::always_inline]] inline std::size_t slotIn(int3 const& corner, int3 const& p, int depth) {
  constexpr std::uint32_t kTW = TraitsT::kTW;
  auto const w = static_cast<std::uint32_t>(TraitsT::width(depth));
  auto const x = static_cast<std::uint32_t>(p.x) - static_cast<std::uint32_t>(corner.x),
             y = static_cast<std::uint32_t>(p.y) - static_cast<std::uint32_t>(corner.y),
             z = static_cast<std::uint32_t>(p.z) - static_cast<std::uint32_t>(corner.z);
  if constexpr (kTW == 2) {
    if ((x | y | z) >= 2 * w) return TraitsT::kTileSize;
    return std::size_t(x >= w) | std::size_t(y >= w) << 1 | std::size_t(z >= w) << 2;
  } else {
    if (x >= kTW * w || y >= kTW * w || z >= kTW * w) return TraitsT::kTileSize;
    return x / w + kTW * (y / w + kTW * (z / w));
  }
}

/// The depth above while a depth is made: its groups, without those that were there, and the index of the
/// first tile made for each.
template <class TraitsT> struct MadeAbove {
  std::vector<Siblings<TraitsT>> const* groups = nullptr;
  std::vector<std::int64_t> firsts;
  bool childless = true; ///< no tile was there that hangs below one of them now
};

template <class TraitsT> class WantedTiles {
  using Group = Siblings<TraitsT>;
  using Groups = std::vector<Group>;

public:
  static constexpr int kMaxDepth = TraitsT::kMaxDepth;

  explicit WantedTiles(typename Container<TraitsT>::TileLists const& points) {
    for (int3 const& p : points[0]) m_domain = m_domain || TraitsT::inDomain(p);
    for (int d = 1; d <= kMaxDepth; ++d) {
      auto const* const list = points[d].data();
      join(d, listed(static_cast<std::int64_t>(points[d].size()), kPointGrain,
                     [&](std::int64_t begin, std::int64_t end, Groups& to) {
                       to.reserve(static_cast<std::size_t>(end - begin) / TraitsT::kTileSize + 1);
                       for (std::int64_t n = begin; n < end; ++n)
                         add(list[n], d, to,
                             [](int3 const& parent) { return mortonRecord<TraitsT>(parent, 0); });
                     }));
    }
  }

  /// Whether the tile of depth 0 is wanted.
  bool domain() const { return m_domain; }
  /// By the Morton order of the parents.
  Groups& groups(int depth) { return m_groups[depth]; }
  Groups const& groups(int depth) const { return m_groups[depth]; }

  /// Adds the tiles between a wanted one and the next coarser one above, wanted or there.
  /// @param firstDepth The lowest at which there are tiles. @param makeAccessor One for each thread.
  template <class MakeAccessor> void addBetween(int firstDepth, MakeAccessor const& makeAccessor) {
    for (int d = kMaxDepth; d > 1; --d) {
      Groups const& here = groups(d);
      if (here.empty()) continue;
      std::vector<CoverageQuery> const above = coverageAbove(d - 1);
      join(d - 1, listed(static_cast<std::int64_t>(here.size()), kGroupGrain,
                         [&](std::int64_t begin, std::int64_t end, Groups& to) {
                           auto const accessor = makeAccessor();
                           std::vector<CoverageQuery> queries = above;
                           for (auto n = begin; n < end; ++n) {
                             int3 const& p = here[n].parent;
                             TreeIndex there;
                             if (firstDepth < d) there = accessor.treeIndex(p.x, p.y, p.z, d - 1, false);
                             if (there.depth == d - 1) continue;
                             if (there.valid() || m_domain ||
                                 std::any_of(queries.begin(), queries.end(),
                                             [&](CoverageQuery& c) { return c.holds(p); }))
                               add(p, d - 1, to, [&](int3 const& parent) {
                                 return keyAbove<TraitsT>(here[n].key, parent, d - 2);
                               });
                           }
                         }));
    }
  }

private:
  /// @param keyOf Of the corner of a tile of the depth above.
  template <class KeyOf> static void add(int3 const& p, int depth, Groups& to, KeyOf const& keyOf) {
    if (!to.empty()) {
      Group& last = to.back();
      std::size_t const slot = slotIn<TraitsT>(last.parent, p, depth);
      if (slot < last.slots.size()) {
        last.slots[slot] = true;
        return;
      }
    }
    if (!TraitsT::inDomain(p)) return;
    int3 const parent = TraitsT::align(p, depth - 1);
    to.push_back({keyOf(parent), parent, {}});
    to.back().slots[slotIn<TraitsT>(parent, p, depth)] = true;
  }
  /// Groups that chunks of a range make, in the range's order.
  template <class Make>
  static std::vector<Groups> listed(std::int64_t count, std::int64_t grain, Make const& make) {
    std::vector<Groups> parts(chunkCount(0, count, grain));
    parallelChunks(0, count, grain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
      make(begin, end, parts[chunk]);
    });
    return parts;
  }
  /// Sorts a depth's groups and others, and makes one group of those with the same parent.
  void join(int depth, std::vector<Groups> parts) {
    if (std::all_of(parts.begin(), parts.end(), [](Groups const& part) { return part.empty(); })) return;
    parts.push_back(std::move(groups(depth)));
    std::vector<std::size_t> starts{0};
    for (Groups const& part : parts) starts.push_back(starts.back() + part.size());
    std::vector<SortRecord> order(starts.back());
    parallelFor(0, static_cast<std::int64_t>(parts.size()), [&](std::int64_t first, std::int64_t last) {
      for (std::int64_t part = first; part < last; ++part) {
        std::size_t next = starts[part];
        std::int64_t value = part << kPartShift;
        for (Group const& group : parts[part]) order[next++] = {group.key.high, group.key.low, value++};
      }
    });
    if (!rises(order)) parallelSort(order.data(), static_cast<std::int64_t>(order.size()));
    groups(depth) = united(parts, order);
  }
  /// Where a sorted group lies: its part, and its place there.
  static constexpr int kPartShift = 32;
  static Group const& groupOf(std::vector<Groups> const& parts, SortRecord const& record) {
    return parts[record.value >> kPartShift]
                [static_cast<std::size_t>(record.value & ((std::int64_t(1) << kPartShift) - 1))];
  }
  static bool sameParent(SortRecord const& a, SortRecord const& b) {
    return a.high == b.high && a.low == b.low;
  }
  static bool rises(std::vector<SortRecord> const& order) {
    return parallelReduce(
        1, std::max<std::int64_t>(1, static_cast<std::int64_t>(order.size())), kPointGrain, true,
        [&](std::int64_t begin, std::int64_t end) {
          for (auto n = begin; n < end; ++n) {
            SortRecord const &a = order[n - 1], &b = order[n];
            if (a.high != b.high ? a.high > b.high : a.low > b.low) return false;
          }
          return true;
        },
        [](bool a, bool b) { return a && b; });
  }
  /// The groups in their order, those with the same parent as one.
  static Groups united(std::vector<Groups> const& parts, std::vector<SortRecord> const& order) {
    auto const isFirst = [&](std::size_t n) { return n == 0 || !sameParent(order[n - 1], order[n]); };
    auto const count = static_cast<std::int64_t>(order.size());
    std::vector<std::size_t> starts(chunkCount(0, count, kPointGrain));
    parallelChunks(0, count, kPointGrain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
      std::size_t firsts = 0;
      for (auto n = begin; n < end; ++n) firsts += isFirst(n);
      starts[chunk] = firsts;
    });
    std::size_t total = 0;
    for (std::size_t& start : starts) total += std::exchange(start, total);
    Groups sorted(total);
    parallelChunks(0, count, kPointGrain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
      std::size_t next = starts[chunk];
      for (auto n = begin; n < end; ++n) {
        if (!isFirst(n)) continue;
        Group& group = sorted[next++] = groupOf(parts, order[n]);
        for (std::size_t same = n + 1; same < order.size() && !isFirst(same); ++same)
          group.slots |= groupOf(parts, order[same]).slots;
      }
    });
    return sorted;
  }

  /// Whether a depth's wanted tiles hold a point. Remembers the last answer.
  class CoverageQuery {
  public:
    CoverageQuery(Groups const& list, int depth)
        : m_list(&list)
        , m_depth(depth) {}
    bool holds(int3 const& p) {
      if (slotIn<TraitsT>(m_above, p, m_depth) == m_slot) return m_answer;
      m_above = TraitsT::align(p, m_depth - 1);
      m_slot = slotIn<TraitsT>(m_above, p, m_depth);
      Group const wanted{mortonRecord<TraitsT>(m_above, 0), m_above, {}};
      auto const at = std::lower_bound(m_list->begin(), m_list->end(), wanted, comesBefore<TraitsT>);
      m_answer = at != m_list->end() && at->parent == m_above && at->slots[m_slot];
      return m_answer;
    }

  private:
    Groups const* m_list;
    int m_depth;
    bool m_answer = false;
    int3 m_above{0, 0, 0};
    std::size_t m_slot = TraitsT::kTileSize + 1; // no point's
  };
  std::vector<CoverageQuery> coverageAbove(int depth) const {
    std::vector<CoverageQuery> queries;
    for (int d = 1; d < depth; ++d) {
      if (!groups(d).empty()) queries.emplace_back(groups(d), d);
    }
    return queries;
  }

  bool m_domain = false;
  PerDepth<Groups, TraitsT::kDepths> m_groups;
};

} // namespace Internal

template <class TraitsT>
void ContainerBuilder<TraitsT>::addTilesInBulk(TileLists const& corners, TileLists* newTiles) {
  m_tree.tilesAdded();
  Internal::WantedTiles<TraitsT> wanted(corners);
  int firstDepth = 0;
  while (firstDepth <= kMaxDepth && tileCount(firstDepth) == 0) ++firstDepth;
  wanted.addBetween(firstDepth, [&] { return m_tree.growthAccessor(); });
  Growth growth(data(), newTiles);
  constexpr int kLow = TraitsT::kMinTileCoord;
  if (wanted.domain() && !m_tree.tileIndex(kLow, kLow, kLow, 0).valid()) {
    addRootTile(kLow, kLow, kLow, 0, growth);
    listNewTiles(growth.before(), newTiles);
  }
  Internal::MadeAbove<TraitsT> above;
  for (int d = 1; d <= kMaxDepth; ++d) {
    auto& groups = wanted.groups(d);
    std::vector<std::int64_t> parents;
    std::vector<std::int64_t> starts = dropExisting(groups, d, above, parents);
    above.groups = &groups;
    above.firsts.clear();
    Counts const before = data().m_tileCounts;
    std::int64_t next = tileCount(d);
    for (std::int64_t& start : starts) next += std::exchange(start, next);
    if (next == tileCount(d)) continue;
    above.firsts.resize(groups.size());
    allocateUninitialised(d, next - tileCount(d));
    TileIndexLists const parts = makeSiblings(groups, d, parents, starts, above.firsts);
    std::vector<std::int64_t> roots;
    for (auto const& part : parts) roots.insert(roots.end(), part.begin(), part.end());
    m_tree.addRoots(roots, d);
    if (!roots.empty() && adoptDeeperRoots(d, growth)) above.childless = false;
    listNewTiles(before, newTiles);
  }
  growth.keep();
  setBranchSizes(Cancellation::kPoll);
}

template <class TraitsT>
std::vector<std::int64_t> ContainerBuilder<TraitsT>::dropExisting(std::vector<Siblings>& groups, int depth,
                                                                  MadeAbove const& above,
                                                                  std::vector<std::int64_t>& parents) const {
  auto const count = static_cast<std::int64_t>(groups.size());
  parents.resize(groups.size());
  std::vector<std::int64_t> left(chunkCount(0, count, Internal::kGroupGrain));
  parallelChunks(
      0, count, Internal::kGroupGrain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
        auto const accessor = m_tree.growthAccessor();
        Internal::ChildCorners<TraitsT> const corners(depth);
        MadeParents made(above, groups[begin], depth);
        std::size_t missing = 0;
        for (auto n = begin; n < end; ++n) {
          Siblings& group = groups[n];
          int3 const& p = group.parent;
          parents[n] = made.index(group);
          if (parents[n] < 0 || !above.childless) {
            TreeIndex const found = accessor.treeIndex(p.x, p.y, p.z, depth - 1, false);
            bool const hasParent = found.depth == depth - 1;
            parents[n] = hasParent ? found.index : -1;
            group.forEachSlot([&](std::size_t slot) {
              bool there;
              if (hasParent) {
                there = !tile(found).isLeaf(static_cast<int>(slot));
              } else {
                int3 const corner = corners(group.parent, slot);
                there = accessor.treeIndex(corner.x, corner.y, corner.z, depth, false).depth == depth;
              }
              if (there) group.slots.reset(slot);
            });
          }
          missing += group.slots.count();
        }
        left[chunk] = static_cast<std::int64_t>(missing);
      });
  return left;
}

/// Finds parents among the tiles just made, for groups in their order, without a search.
template <class TraitsT> class ContainerBuilder<TraitsT>::MadeParents {
public:
  /// @param depth Of the groups.
  MadeParents(MadeAbove const& above, Siblings const& first, int depth)
      : m_above(above)
      , m_depth(depth) {
    // Only where widths are powers of two do parents lie in the order of their own parents.
    if (TraitsT::kTW != 2 || above.firsts.empty()) return;
    auto const& groups = *above.groups;
    m_end = groups.size();
    m_at = static_cast<std::size_t>(
        std::upper_bound(groups.begin(), groups.end(), first, Internal::comesBefore<TraitsT>) -
        groups.begin());
    if (m_at > 0) --m_at;
  }
  /// Index of a group's parent; -1 where that was not made.
  std::int64_t index(Siblings const& group) {
    if (m_end == 0) return -1;
    auto const* const groups = m_above.groups->data();
    while (m_at + 1 < m_end && !Internal::comesBefore(group, groups[m_at + 1])) ++m_at;
    Siblings const& found = groups[m_at];
    std::size_t const slot = Internal::slotIn<TraitsT>(found.parent, group.parent, m_depth - 1);
    if (slot >= found.slots.size() || !found.slots[slot]) return -1;
    return m_above.firsts[m_at] + found.countBefore(slot);
  }

private:
  MadeAbove const& m_above;
  int m_depth;
  std::size_t m_at = 0, m_end = 0;
};

template <class TraitsT>
TileIndexLists ContainerBuilder<TraitsT>::makeSiblings(std::vector<Siblings> const& groups, int depth,
                                                       std::vector<std::int64_t> const& parents,
                                                       std::vector<std::int64_t> const& starts,
                                                       std::vector<std::int64_t>& firsts) {
  auto& tiles = data().editTiles(depth);
  auto& above = data().editTiles(depth - 1);
  TileIndexLists roots(starts.size());
  Internal::ChildCorners<TraitsT> const corners(depth);
  parallelChunks(0, static_cast<std::int64_t>(groups.size()), Internal::kGroupGrain,
                 [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
                   std::int64_t index = starts[chunk];
                   TileType* tile = tiles.begin() + index;
                   int const d = depth;
                   for (auto n = begin; n < end; ++n) {
                     Siblings const& group = groups[n];
                     std::int64_t const parent = parents[n];
                     // Each group has its parent to itself.
                     auto* const children = parent >= 0 ? above[parent].children() : nullptr;
                     firsts[n] = index;
                     group.forEachSlot([&](std::size_t slot) {
                       int3 const corner = corners(group.parent, slot);
                       if (d == kMaxDepth) new (static_cast<void*>(tile)) TileType;
                       tile++->init(parent, corner.x, corner.y, corner.z, d, index);
                       if (children)
                         children[slot] = index;
                       else
                         roots[chunk].push_back(index);
                       ++index;
                     });
                   }
                 });
  return roots;
}

} // namespace VLN::TileTree3D
