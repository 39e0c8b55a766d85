// A slow tree: the set of its tiles' coordinates, and what each change of a tree must make of it.
#pragma once

#include "GeometryVolume/tiletree/Container.h"
#include "support/Print.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <random>
#include <set>
#include <vector>

namespace Support {

using Velorn::Math::int3;
using VLN::TileTree3D::Container;
using VLN::TileTree3D::TreeIndex;
using VLN::TileTree3D::VoxelCoord;

template <class TraitsT> class TreeModel {
public:
  struct Less {
    bool operator()(VoxelCoord const& a, VoxelCoord const& b) const {
      return std::tie(a.depth, a.i, a.j, a.k) < std::tie(b.depth, b.i, b.j, b.k);
    }
  };
  using Set = std::set<VoxelCoord, Less>;

  Set const& tiles() const { return m_tiles; }
  bool has(VoxelCoord const& at) const { return m_tiles.count(at) > 0; }

  static std::int64_t width(int d) {
    std::int64_t w = TraitsT::kDomainWidth;
    for (int n = 0; n < d; ++n) w /= TraitsT::kTW;
    return w;
  }
  /// The tile of depth `d` that would hold the point.
  static VoxelCoord holder(int3 const& p, int d) {
    auto const align = [&](std::int64_t c) {
      std::int64_t const low = TraitsT::kMinTileCoord, w = width(d);
      return static_cast<int>((c - low) / w * w + low);
    };
    return {align(p.x), align(p.y), align(p.z), d};
  }
  static VoxelCoord above(VoxelCoord const& at, int d) { return holder(at.ijk(), d); }

  bool isRoot(VoxelCoord const& at) const { return at.depth == 0 || !has(above(at, at.depth - 1)); }
  /// The deepest tile at or above `depth` that holds the point; depth -1 when there is none.
  VoxelCoord find(int3 const& p, int depth) const {
    for (int d = depth; d >= 0; --d) {
      if (VoxelCoord const at = holder(p, d); has(at)) return at;
    }
    return {};
  }
  Set branch(VoxelCoord const& top) const {
    Set result;
    for (VoxelCoord const& at : m_tiles) {
      if (at.depth >= top.depth && above(at, top.depth) == top) result.insert(at);
    }
    return result;
  }

  /// Adds tiles and those between them and coarser or finer ones of the same branch.
  void add(Set const& added) {
    m_tiles.insert(added.begin(), added.end());
    Set between;
    for (VoxelCoord const& at : m_tiles) {
      VoxelCoord const near = at.depth > 0 ? find(at.ijk(), at.depth - 1) : VoxelCoord{};
      for (int d = at.depth - 1; near.depth >= 0 && d > near.depth; --d) between.insert(above(at, d));
    }
    m_tiles.insert(between.begin(), between.end());
  }
  void add(VoxelCoord const& at) { add(Set{at}); }

  /// False when the removal is refused.
  bool remove(VoxelCoord const& at, bool withBranch) {
    if (!has(at)) return false;
    if (isRoot(at) && !withBranch) {
      std::vector<VoxelCoord> children;
      for (VoxelCoord const& c : branch(at)) {
        if (c.depth == at.depth + 1) children.push_back(c);
      }
      std::int64_t const w = width(at.depth + 1);
      auto const near = [w](std::int64_t a, std::int64_t b) { return std::abs(a - b) <= w; };
      for (std::size_t a = 0; a < children.size(); ++a) {
        for (std::size_t b = 0; b < a; ++b) {
          if (near(children[a].i, children[b].i) && near(children[a].j, children[b].j) &&
              near(children[a].k, children[b].k))
            return false;
        }
      }
      m_tiles.erase(at);
      return true;
    }
    for (VoxelCoord const& gone : branch(at)) m_tiles.erase(gone);
    return true;
  }

  /// Compares a tree's live tiles, links, roots, counts and lookups with this set.
  void compare(Container<TraitsT> const& tree, bool mayHoldDead) const {
    Set found;
    std::int64_t roots = 0;
    for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
      std::int64_t rootsHere = 0;
      for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
        auto const& t = tree.tile(n, d);
        if (!t.valid()) {
          ASSERT_TRUE(mayHoldDead) << "dead tile " << d << ' ' << n;
          continue;
        }
        ASSERT_EQ(t.treeIndex(), (TreeIndex{n, d}));
        ASSERT_TRUE(found.insert(t.voxelCoord()).second) << "twice: " << t.voxelCoord();
        if (t.isRoot()) {
          ++rootsHere;
          ASSERT_TRUE(isRoot(t.voxelCoord())) << t.voxelCoord();
          continue;
        }
        auto const& parent = tree.tile(t.parentTreeIndex());
        ASSERT_TRUE(parent.valid());
        ASSERT_EQ(parent.voxelCoord(), above(t.voxelCoord(), d - 1));
        ASSERT_EQ(parent.childIndex(t), n);
      }
      ASSERT_EQ(tree.rootCount(d), rootsHere);
      roots += rootsHere;
    }
    ASSERT_EQ(found.size(), m_tiles.size());
    ASSERT_TRUE(std::equal(found.begin(), found.end(), m_tiles.begin()));
    ASSERT_EQ(tree.tileCount(-1), static_cast<std::int64_t>(m_tiles.size()));
    ASSERT_EQ(tree.rootCount(), roots);
    for (auto root = tree.cbeginRoots(); root != tree.cendRoots(); ++root)
      ASSERT_EQ(tree.tile(root->second).voxelCoord(), root->first);
    ASSERT_EQ(tree.checkConsistency(false), [&] {
      std::int64_t stored = 0;
      for (int d = 0; d <= TraitsT::kMaxDepth; ++d) stored += tree.tileCount(d);
      return stored == tree.tileCount(-1);
    }());
  }
  void compareLookups(Container<TraitsT> const& tree, std::vector<VoxelCoord> const& places) const {
    auto accessor = tree.tileAccessor();
    for (VoxelCoord const& place : places) {
      auto const& t = accessor.tile(place, false);
      VoxelCoord const expected = find(place.ijk(), place.depth);
      ASSERT_EQ(t.valid(), expected.depth >= 0) << place;
      if (t.valid()) { ASSERT_EQ(t.voxelCoord(), expected) << place; }
    }
  }

private:
  Set m_tiles;
};

/// Everything that a tree's arrays hold, as numbers.
template <class TraitsT> std::vector<std::int64_t> treeContents(Container<TraitsT> const& tree) {
  std::vector<std::int64_t> out;
  for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
    out.push_back(tree.tileCount(d));
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
      auto const& t = tree.tile(n, d);
      out.insert(out.end(), {t.ti(), t.tj(), t.tk(), t.depth(), t.index(), t.parentIndex(), t.branchSize(),
                             std::int64_t(t.valid())});
      if (t.children()) out.insert(out.end(), t.children(), t.children() + TraitsT::kTileSize);
    }
  }
  for (auto root = tree.cbeginRoots(); root != tree.cendRoots(); ++root)
    out.insert(out.end(), {root->first.i, root->first.j, root->first.k, root->first.depth, root->second.index,
                           root->second.depth});
  out.push_back(tree.tileCount(-1));
  return out;
}

/// Random tiles in a few clusters, some of them at the ends of the domain, at mixed depths.
template <class TraitsT> class TilePlaces {
public:
  explicit TilePlaces(std::uint32_t seed)
      : m_random(seed) {
    constexpr int low = TraitsT::kMinTileCoord, high = TraitsT::kMaxTileCoord;
    m_centers = {{low, low, low}, {high, high, high}, {0, 0, 0}, {low, high, 0}};
    for (int n = 0; n < 2; ++n) m_centers.push_back({coordinate(), coordinate(), coordinate()});
  }
  std::mt19937& random() { return m_random; }
  int below(int n) { return static_cast<int>(m_random() % static_cast<std::uint32_t>(n)); }
  bool coin() { return below(2) == 0; }

  VoxelCoord next() {
    int const lowest = std::max(0, TraitsT::kMaxDepth - 8);
    int const depth =
        below(12) == 0 ? below(TraitsT::kMaxDepth + 1) : lowest + below(TraitsT::kDepths - lowest);
    int3 const& c = m_centers[static_cast<std::size_t>(below(static_cast<int>(m_centers.size())))];
    std::int64_t const w = TraitsT::width(depth);
    int3 p;
    for (int a = 0; a < 3; ++a) {
      std::int64_t const at = c[a] + w * (below(7) - 3);
      p[a] = static_cast<int>(std::clamp<std::int64_t>(at, TraitsT::kMinTileCoord, TraitsT::kMaxTileCoord));
    }
    return TreeModel<TraitsT>::holder(p, depth);
  }
  std::vector<VoxelCoord> some(int n) {
    std::vector<VoxelCoord> result;
    while (n-- > 0) result.push_back(next());
    return result;
  }

private:
  int coordinate() {
    return static_cast<int>(std::uniform_int_distribution<std::int64_t>(TraitsT::kMinTileCoord,
                                                                        TraitsT::kMaxTileCoord)(m_random));
  }
  std::mt19937 m_random;
  std::vector<int3> m_centers;
};

} // namespace Support
