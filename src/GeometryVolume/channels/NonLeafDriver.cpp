#include "GeometryVolume/channels/NonLeafDriverImpl.h"

#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <atomic>
#include <cstring>
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

// The samples of a tile: where each lies, the slot of its voxel, and which child sample belongs to it.
struct Sample {
  int element, slot, childElement;
};

template <class TraitsT> std::vector<Sample> samplesOf(NonLeafPass const& pass) {
  constexpr int w = TraitsT::kTDW, perVoxel = TraitsT::kTDW / TraitsT::kTW;
  std::vector<Sample> samples;
  for (int k = 0; k < w; ++k)
    for (int j = 0; j < w; ++j)
      for (int i = 0; i < w; ++i)
        samples.push_back(
            {pass.layout.element(i, j, k),
             Tile<TraitsT, TraitsT::kTileSize>::slotOf(i / perVoxel, j / perVoxel, k / perVoxel),
             nonLeafChildElement(pass.layout, pass.offsetType, {i, j, k})});
  return samples;
}

// Calls f(parent element, child element) for the refined samples of a tile whose data exist, until it says
// that it is done.
template <class TraitsT, class F>
void forPairs(NonLeafPass const& pass, std::vector<Sample> const& samples,
              Tile<TraitsT, TraitsT::kTileSize> const& tile, F const& f) {
  if (!tile.valid()) return;
  auto const* const own = static_cast<std::byte const*>(pass.tiles.elements(tile.treeIndex()));
  if (!own) return;
  auto const size = static_cast<std::ptrdiff_t>(pass.tiles.ops->size);
  for (Sample const& s : samples) {
    if (tile.isLeaf(s.slot)) continue;
    auto const* const child = static_cast<std::byte const*>(pass.tiles.elements(tile.childTreeIndex(s.slot)));
    if (child && f(own + s.element * size, child + s.childElement * size)) return;
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
  auto const samples = samplesOf<TraitsT>(pass);
  auto const [low, high] = depthsOf<TraitsT>(pass);
  for (int d = high; d >= low; --d)
    parallelFor(0, tree.tileCount(d), [&, depth = d](std::int64_t begin, std::int64_t end) {
      for (std::int64_t n = begin; n < end; ++n)
        forPairs<TraitsT>(pass, samples, tree.tile(n, depth),
                          [&](std::byte const* to, std::byte const* from) {
                            std::memcpy(const_cast<std::byte*>(to), from, pass.tiles.ops->size);
                            return false;
                          });
    });
}

template <class TraitsT>
bool findNonLeafDifference(NonLeafPass const& pass, double tolerance, Container<TraitsT> const& tree) {
  auto const samples = samplesOf<TraitsT>(pass);
  auto const [low, high] = depthsOf<TraitsT>(pass);
  std::atomic<bool> found = false;
  for (int d = high; d >= low && !found; --d)
    parallelFor(0, tree.tileCount(d), [&, depth = d](std::int64_t begin, std::int64_t end) {
      for (std::int64_t n = begin; n < end && !found.load(std::memory_order_relaxed); ++n)
        forPairs<TraitsT>(pass, samples, tree.tile(n, depth),
                          [&](std::byte const* own, std::byte const* child) {
                            bool const differs = pass.tiles.ops->distance(own, child) > tolerance;
                            if (differs) found.store(true, std::memory_order_relaxed);
                            return differs;
                          });
    });
  return found;
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template void setNonLeafValues<TraitsT>(NonLeafPass const&, Container<TraitsT> const&);                    \
  template bool findNonLeafDifference<TraitsT>(NonLeafPass const&, double, Container<TraitsT> const&);
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D::Internal
