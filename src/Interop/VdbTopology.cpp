#include "Interop/VdbTopologyImpl.h"

#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <cmath>
#include <cstring>

namespace VLN::Interop {

namespace {

using openvdb::Coord;
using openvdb::FloatGrid;
using openvdb::FloatTree;
using Leaf = FloatTree::LeafNodeType;
using Lower = FloatTree::RootNodeType::ChildNodeType::ChildNodeType;
using Upper = FloatTree::RootNodeType::ChildNodeType;
using Velorn::Math::int3;

constexpr int kMaxDepth = VdbTraits::kMaxDepth;
constexpr int kMostRootsAnAxis = 64;

// Depth of the tiles whose samples are `width` wide.
constexpr int depthOfSamples(int width) {
  int depth = kMaxDepth;
  for (; width > 1; width /= 2) --depth;
  return depth;
}
static_assert(depthOfSamples(Leaf::DIM) == 25 && depthOfSamples(Lower::DIM) == 21 &&
              depthOfSamples(Upper::DIM) == 16);

struct ActiveTile {
  Coord corner;
  int width;
  float value;
};

// Calls `take(ActiveTile)` for each active tile, in the tree's order.
template <class Take> void forEachActiveTile(FloatTree const& tree, Take const& take) {
  for (auto it = tree.root().cbeginValueOn(); it; ++it) take(ActiveTile{it.getCoord(), Upper::DIM, *it});
  std::vector<Upper const*> uppers;
  tree.getNodes(uppers);
  for (Upper const* node : uppers)
    for (auto it = node->cbeginValueOn(); it; ++it) take(ActiveTile{it.getCoord(), Lower::DIM, *it});
  std::vector<Lower const*> lowers;
  tree.getNodes(lowers);
  for (Lower const* node : lowers)
    for (auto it = node->cbeginValueOn(); it; ++it) take(ActiveTile{it.getCoord(), Leaf::DIM, *it});
}

std::vector<Leaf const*> leavesOf(FloatTree const& tree) {
  std::vector<Leaf const*> leaves;
  tree.getNodes(leaves);
  return leaves;
}

bool fits(Coord const& corner, int width) {
  for (int a = 0; a < 3; ++a) {
    // The domain's ends are multiples of every node's width, so a corner inside means that all is.
    if (!VdbTraits::inDomain(corner[a]) || (corner[a] & (width - 1)) != 0) return false;
  }
  return true;
}

int3 toInt3(Coord const& c) { return {c.x(), c.y(), c.z()}; }

void growBy(IndexBox& box, Coord const& corner, int width) {
  box.grow(toInt3(corner));
  box.grow(toInt3(corner.offsetBy(width)));
}

void grow(IndexBox& box, IndexBox const& other) {
  if (other.empty()) return;
  box.grow(other.min), box.grow(other.max);
}

void growRange(GridSummary& s, float value) {
  if (std::isnan(value)) return;
  double const v = value;
  s.minimum = s.hasRange ? std::min(s.minimum, v) : v;
  s.maximum = s.hasRange ? std::max(s.maximum, v) : v;
  s.hasRange = true;
}

GridSummary join(GridSummary a, GridSummary const& b) {
  grow(a.stored, b.stored), grow(a.active, b.active);
  a.shallowest = std::min(a.shallowest, b.shallowest);
  a.activeVoxels += b.activeVoxels;
  if (b.hasRange) {
    a.minimum = a.hasRange ? std::min(a.minimum, b.minimum) : b.minimum;
    a.maximum = a.hasRange ? std::max(a.maximum, b.maximum) : b.maximum;
    a.hasRange = true;
  }
  return a;
}

// Whether a quarter block of a leaf can go: see the rule in VdbImport.h. A coarser tile at the place holds
// the block's own values; without one a reader finds the background.
bool isSpare(Leaf const& leaf, Coord const& corner, bool underTile, float background) {
  float const first = underTile ? leaf.getValue(corner) : background;
  for (int i = 0; i < 4; ++i)
    for (int j = 0; j < 4; ++j)
      for (int k = 0; k < 4; ++k) {
        openvdb::Index const n = Leaf::coordToOffset(corner.offsetBy(i, j, k));
        float const value = leaf.getValue(n);
        // Bits, so that NaN and the sign of zero count.
        if (leaf.isValueOn(n) || std::memcmp(&value, &first, sizeof value) != 0) return false;
      }
  return true;
}

// Whether a comes before b along the Z-shaped curve: the axis whose coordinates differ in the highest bit
// decides.
bool mortonLess(int3 const& a, int3 const& b) {
  std::uint32_t highest = 0;
  int axis = 0;
  for (int n = 0; n < 3; ++n) {
    auto const differ = static_cast<std::uint32_t>(a[n]) ^ static_cast<std::uint32_t>(b[n]);
    if (highest < differ && highest < (highest ^ differ)) highest = differ, axis = n;
  }
  return a[axis] < b[axis];
}

void sortUnique(std::vector<int3>& corners) {
  std::sort(corners.begin(), corners.end(), mortonLess);
  corners.erase(std::unique(corners.begin(), corners.end()), corners.end());
}

int3 alignTo(int3 const& c, int depth) {
  return {VdbTraits::align(c.x, depth), VdbTraits::align(c.y, depth), VdbTraits::align(c.z, depth)};
}

} // namespace

std::optional<std::string> whyNotPlaced(FloatGrid const& grid) {
  bool ok = true;
  for (Leaf const* leaf : leavesOf(grid.tree())) ok = ok && fits(leaf->origin(), Leaf::DIM);
  forEachActiveTile(grid.tree(), [&](ActiveTile const& t) { ok = ok && fits(t.corner, t.width); });
  if (ok) return std::nullopt;
  return "its voxels lie outside " + std::to_string(VdbTraits::kMinTileCoord) + ".." +
         std::to_string(VdbTraits::kMaxTileCoord) + " or off the lattice of its nodes";
}

GridSummary summarize(FloatGrid const& grid) {
  auto const leaves = leavesOf(grid.tree());
  GridSummary summary = parallelReduce(
      0, std::int64_t(leaves.size()), 256, GridSummary{},
      [&](std::int64_t begin, std::int64_t end) {
        GridSummary s;
        for (std::int64_t n = begin; n < end; ++n) {
          Leaf const& leaf = *leaves[static_cast<std::size_t>(n)];
          growBy(s.stored, leaf.origin(), Leaf::DIM);
          s.activeVoxels += std::int64_t(leaf.onVoxelCount());
          for (auto it = leaf.cbeginValueOn(); it; ++it) {
            growRange(s, *it);
            growBy(s.active, it.getCoord(), 1);
          }
        }
        return s;
      },
      join);
  forEachActiveTile(grid.tree(), [&](ActiveTile const& t) {
    growBy(summary.stored, t.corner, t.width);
    growBy(summary.active, t.corner, t.width);
    summary.shallowest = std::min(summary.shallowest, depthOfSamples(t.width));
    summary.activeVoxels += std::int64_t(t.width) * t.width * t.width;
    growRange(summary, t.value);
  });
  return summary;
}

int rootDepth(std::vector<GridSummary> const& grids) {
  IndexBox box;
  int depth = kMaxDepth;
  for (auto const& s : grids) {
    grow(box, s.stored);
    depth = std::min(depth, s.shallowest);
  }
  if (box.empty()) return depth;
  auto tooWide = [&](int d) {
    for (int a = 0; a < 3; ++a) {
      std::int64_t const first = VdbTraits::align(box.min[a], d), last = VdbTraits::align(box.max[a] - 1, d);
      if ((last - first) / VdbTraits::width(d) + 1 > kMostRootsAnAxis) return true;
    }
    return false;
  };
  while (depth > 0 && tooWide(depth)) --depth;
  return depth;
}

TileCorners tileCorners(std::vector<FloatGrid::ConstPtr> const& grids, int rootDepth) {
  TileCorners corners;
  auto at = [&](int depth) -> std::vector<int3>& { return corners[static_cast<std::size_t>(depth)]; };
  constexpr int kLeafDepth = kMaxDepth - 1; // its tiles are as wide as a leaf
  bool const leavesHaveTile = rootDepth <= kLeafDepth;
  for (auto const& grid : grids) {
    auto const leaves = leavesOf(grid->tree());
    constexpr std::int64_t kGrain = 256;
    std::vector<std::vector<int3>> parts(
        static_cast<std::size_t>(chunkCount(0, std::int64_t(leaves.size()), kGrain)));
    parallelChunks(0, std::int64_t(leaves.size()), kGrain,
                   [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
                     auto& part = parts[static_cast<std::size_t>(chunk)];
                     for (std::int64_t n = begin; n < end; ++n) {
                       Leaf const& leaf = *leaves[static_cast<std::size_t>(n)];
                       for (int slot = 0; slot < 8; ++slot) {
                         Coord const c =
                             leaf.origin().offsetBy(4 * (slot & 1), 4 * (slot >> 1 & 1), 4 * (slot >> 2));
                         if (!isSpare(leaf, c, leavesHaveTile, grid->background())) part.push_back(toInt3(c));
                       }
                     }
                   });
    for (auto const& part : parts) at(kMaxDepth).insert(at(kMaxDepth).end(), part.begin(), part.end());
    if (leavesHaveTile)
      for (Leaf const* leaf : leaves) at(kLeafDepth).push_back(toInt3(leaf->origin()));
    forEachActiveTile(grid->tree(), [&](ActiveTile const& t) {
      int const depth = depthOfSamples(t.width);
      at(depth).push_back(alignTo(toInt3(t.corner), depth));
    });
  }
  // From the bottom up, each tile brings its parent.
  for (int depth = kMaxDepth; depth >= rootDepth; --depth) {
    sortUnique(at(depth));
    if (depth == rootDepth) break;
    for (int3 const& c : at(depth)) {
      int3 const parent = alignTo(c, depth - 1);
      if (at(depth - 1).empty() || at(depth - 1).back() != parent) at(depth - 1).push_back(parent);
    }
  }
  return corners;
}

} // namespace VLN::Interop
