#include "GeometryVolume/channels/NonLeafDriverImpl.h"

#include "GeometryVolume/channels/ElementSizeImpl.h"

#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <atomic>
#include <cstring>
#include <span>
#include <type_traits>
#include <vector>

namespace VLN::TileTree3D::Internal {

int nonLeafChildElement(ChannelLayout const& layout, VoxelOffsetType offsetType, int3 const& sample) {
  auto const offset = voxelOffset(offsetType);
  // Samples of one child side by side in the parent: 2 where a child lies under 2 x 2 x 2, else 1.
  int const shared = layout.tileDataWidth == 4 ? 2 : 1;
  int at[3];
  for (int a = 0; a < 3; ++a) {
    int const c = std::min(static_cast<int>(offset[a] * static_cast<float>(layout.core)), layout.core - 1);
    at[a] = c + sample[a] % shared * 2;
  }
  int const exact = layout.element(at[0], at[1], at[2]);
  if (exact < layout.size) return exact;
  int const last = layout.core - 1;
  return layout.element(std::min(at[0], last), std::min(at[1], last), std::min(at[2], last));
}

namespace {

// A sample of a tile and the sample of a child that it takes: offsets in bytes from where their elements
// begin.
struct Pair {
  std::ptrdiff_t own, child;
};

// Those of each slot one after another, as many for each.
template <class TraitsT> std::vector<Pair> pairsOf(NonLeafPass const& pass) {
  constexpr int perVoxel = TraitsT::kTDW / TraitsT::kTW;
  auto const size = static_cast<std::ptrdiff_t>(pass.tiles.ops->size);
  std::vector<Pair> pairs;
  for (int slot = 0; slot < TraitsT::kTileSize; ++slot) {
    int3 const child = Tile<TraitsT, TraitsT::kTileSize>::childIJK(slot);
    for (int n = 0; n < perVoxel * perVoxel * perVoxel; ++n) {
      int3 const at{child.x * perVoxel + n % perVoxel, child.y * perVoxel + n / perVoxel % perVoxel,
                    child.z * perVoxel + n / (perVoxel * perVoxel)};
      pairs.push_back({pass.layout.element(at.x, at.y, at.z) * size,
                       nonLeafChildElement(pass.layout, pass.offsetType, at) * size});
    }
  }
  return pairs;
}

// Calls f(elements, elements of the child, pairs) for the refined slots of a tile whose data exist, until it
// says that it is done.
template <class TraitsT, class F>
void forChildren(NonLeafPass const& pass, std::vector<Pair> const& pairs,
                 Tile<TraitsT, TraitsT::kTileSize> const& tile, F const& f) {
  if (!tile.valid()) return;
  auto const* const own = static_cast<std::byte const*>(pass.tiles.elements(tile.treeIndex()));
  if (!own) return;
  std::size_t const each = pairs.size() / static_cast<std::size_t>(TraitsT::kTileSize);
  for (int slot = 0; slot < TraitsT::kTileSize; ++slot) {
    if (tile.isLeaf(slot)) continue;
    auto const* const child = static_cast<std::byte const*>(pass.tiles.elements(tile.childTreeIndex(slot)));
    if (child && f(own, child, std::span(pairs).subspan(static_cast<std::size_t>(slot) * each, each))) return;
  }
}

struct Depths {
  int low, high;
};
template <class TraitsT> Depths depthsOf(NonLeafPass const& pass) {
  return {std::max({pass.tiles.minDepth, pass.firstDepth, 0}),
          std::min({pass.lastDepth, pass.tiles.maxDepth - 1, TraitsT::kMaxDepth - 1})};
}

} // namespace

template <class TraitsT> void setNonLeafValues(NonLeafPass const& pass, Container<TraitsT> const& tree) {
  auto const pairs = pairsOf<TraitsT>(pass);
  auto const [low, high] = depthsOf<TraitsT>(pass);
  for (int d = high; d >= low; --d)
    parallelFor(0, tree.tileCount(d), [&, depth = d](std::int64_t begin, std::int64_t end) {
      withSize(pass.tiles.ops->size, [&](auto size) {
        for (std::int64_t n = begin; n < end; ++n)
          forChildren<TraitsT>(pass, pairs, tree.tile(n, depth),
                               [&](std::byte const* own, std::byte const* child, std::span<Pair const> of) {
                                 auto* const to = const_cast<std::byte*>(own);
                                 for (Pair const& p : of) std::memcpy(to + p.own, child + p.child, size);
                                 return false;
                               });
      });
    });
}

template <class TraitsT>
bool findNonLeafDifference(NonLeafPass const& pass, double tolerance, Container<TraitsT> const& tree) {
  auto const pairs = pairsOf<TraitsT>(pass);
  auto const [low, high] = depthsOf<TraitsT>(pass);
  auto const differs = [&](void const* a, void const* b) {
    return pass.tiles.ops->distance(a, b) > tolerance;
  };
  std::atomic<bool> found = false;
  for (int d = high; d >= low && !found; --d)
    parallelFor(0, tree.tileCount(d), [&, depth = d](std::int64_t begin, std::int64_t end) {
      withSize(pass.tiles.ops->size, [&](auto size) {
        for (std::int64_t n = begin; n < end && !found.load(std::memory_order_relaxed); ++n)
          forChildren<TraitsT>(pass, pairs, tree.tile(n, depth),
                               [&](std::byte const* own, std::byte const* child, std::span<Pair const> of) {
                                 for (Pair const& p : of) {
                                   // Most are the same to the bit, and then no number lies between them.
                                   if (tolerance >= 0 && !std::memcmp(own + p.own, child + p.child, size))
                                     continue;
                                   if (differs(own + p.own, child + p.child)) {
                                     found.store(true, std::memory_order_relaxed);
                                     return true;
                                   }
                                 }
                                 return false;
                               });
      });
    });
  return found;
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template void setNonLeafValues<TraitsT>(NonLeafPass const&, Container<TraitsT> const&);                    \
  template bool findNonLeafDifference<TraitsT>(NonLeafPass const&, double, Container<TraitsT> const&);
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D::Internal
