#include "GeometryVolume/channels/HaloSamplerImpl.h"

#include <algorithm>
#include <cmath>
#include <cstring>

namespace VLN::TileTree3D::Internal {

template <class TraitsT> void HaloSampler<TraitsT>::sample(int3 const& p, float scale, void* out) {
  read(p, out);
  if (scale != 1.0f) m_source.ops->scale(out, scale);
}

template <class TraitsT> auto HaloSampler<TraitsT>::aroundOf(TileType const& tile) -> Around& {
  Around& around = m_recent[static_cast<std::size_t>(tile.index()) % kRecent];
  if (around.tile != &tile) {
    around.tile = &tile, around.known = 0;
    around.elements = tile.valid() ? m_source.elements(tile.treeIndex()) : nullptr;
  }
  return around;
}

template <class TraitsT> void HaloSampler<TraitsT>::setTile(int3 const& p, int depth) {
  auto const& found = m_accessor.tile(p, depth, false);
  m_at = &aroundOf(found);
  m_extent = 0;
  if (!found.valid()) return;
  int const covered = found.depth() == depth ? depth : found.depth() + 1;
  m_corner = TraitsT::align(p, covered);
  m_extent = static_cast<std::uint32_t>(TraitsT::width(covered));
}

namespace {

// Where a place lies along one axis of a tile: the low one of two samples, and the fraction of the high one.
// In double: every difference of coordinates is exact there, and so is every whole quotient.
struct SamplePlace {
  int low;
  double fraction;
};
SamplePlace samplePlace(int p, int corner, int width, float offset) {
  double const l = (double(p) - double(corner)) / width - double(offset);
  double const floor = std::floor(l);
  return {static_cast<int>(floor), l - floor};
}

} // namespace

template <class TraitsT> void HaloSampler<TraitsT>::read(int3 const& p, void* out) {
  if (!holds(p)) setTile(p, std::min(m_source.maxDepth, TraitsT::kMaxDepth));
  if (!m_at->elements) {
    std::memcpy(out, m_source.defaultValue, m_source.ops->size);
    return;
  }
  TileType const& tile = *m_at->tile;
  CornerBlend blend;
  int low[3];
  for (int a = 0; a < 3; ++a) {
    auto const at = samplePlace(p[a], tile.tijk()[a], tile.voxelDataWidth(), m_offset[a]);
    low[a] = at.low, blend.fraction[a] = at.fraction;
  }
  for (int n = 0; n < 8; ++n)
    blend.corners[n] = corner({low[0] + (n & 1), low[1] + (n >> 1 & 1), low[2] + (n >> 2)});
  m_source.ops->blendCorners(blend, out);
}

template <class TraitsT>
auto HaloSampler<TraitsT>::beside(Around& around, NeighborDirection direction, int3 const& at) const
    -> Beside const& {
  auto& found = around.beside[static_cast<std::size_t>(direction)];
  if (around.known >> direction & 1) return found;
  around.known |= 1u << direction;
  found = {};
  // The whole tile beside lies in the domain, or nothing of it.
  auto const place = placeOf(*around.tile, at);
  for (std::int64_t const c : place)
    if (c < TraitsT::kMinTileCoord || c > TraitsT::kMaxTileCoord) return found;
  auto const& there = m_accessor.tile(
      int3{static_cast<int>(place[0]), static_cast<int>(place[1]), static_cast<int>(place[2])},
      around.tile->depth(), false);
  return found = {&there, there.valid() ? m_source.elements(there.treeIndex()) : nullptr};
}

namespace {

// On which side of a tile a sample lies.
template <class TraitsT> int sideOf(int at) { return at < 0 ? -1 : at >= TraitsT::kTDW ? 1 : 0; }

} // namespace

template <class TraitsT> void const* HaloSampler<TraitsT>::corner(int3 const& at) {
  auto const direction =
      neighborDirection(sideOf<TraitsT>(at.x), sideOf<TraitsT>(at.y), sideOf<TraitsT>(at.z));
  if (direction == kNeighborSelf) return flat(m_at->elements, at);
  auto const& there = beside(*m_at, direction, at);
  if (there.elements) {
    auto const place = placeOf(*m_at->tile, at);
    return flat(there.elements,
                there.tile->childDataIJK(static_cast<int>(place[0]), static_cast<int>(place[1]),
                                         static_cast<int>(place[2])));
  }
  auto const nearest = [](int c) { return std::clamp(c, 0, TraitsT::kTDW - 1); };
  return flat(m_at->elements, {nearest(at.x), nearest(at.y), nearest(at.z)});
}

template <class TraitsT>
bool HaloSampler<TraitsT>::sampleBox(TileType const& from, Places const& places, float scale) {
  m_at = &aroundOf(from);
  m_extent = 0; // the next sample() looks for its tile
  if (!m_at->elements) return false;

  // Each sample that any place blends, once: where it lies, along each axis.
  constexpr int kReads = kMost + 1;
  struct Axis {
    int at[kMost]; // a place's low sample
    double fraction[kMost];
    int first, count;                                // samples that are read
    int side[kReads];                                // of the tile
    std::ptrdiff_t wrapped[kReads], nearest[kReads]; // bytes into the tile there, and into this one
  } axes[3];
  auto stride = static_cast<std::ptrdiff_t>(m_source.ops->size);
  for (int a = 0; a < 3; ++a, stride *= m_width) {
    Axis& axis = axes[a];
    int const count = places.count[static_cast<std::size_t>(a)];
    for (int n = 0; n < count; ++n) {
      auto const at =
          samplePlace(places.first[a] + places.step * n, from.tijk()[a], from.voxelDataWidth(), m_offset[a]);
      if (n == 0) axis.first = at.low;
      axis.at[n] = at.low - axis.first, axis.fraction[n] = at.fraction;
    }
    axis.count = axis.at[count - 1] + 2;
    for (int n = 0; n < axis.count; ++n) {
      int const at = axis.first + n;
      axis.side[n] = sideOf<TraitsT>(at);
      axis.wrapped[n] = (at - axis.side[n] * TraitsT::kTDW) * stride;
      axis.nearest[n] = std::clamp(at, 0, TraitsT::kTDW - 1) * stride;
    }
  }

  void const* corners[kReads * kReads * kReads];
  auto const origin = m_origin * static_cast<std::ptrdiff_t>(m_source.ops->size);
  auto const in = [&](void const* elements, std::ptrdiff_t bytes) {
    return static_cast<std::byte const*>(elements) + origin + bytes;
  };
  auto* next = corners;
  for (int k = 0; k < axes[2].count; ++k)
    for (int j = 0; j < axes[1].count; ++j)
      for (int i = 0; i < axes[0].count; ++i, ++next) {
        auto const direction = neighborDirection(axes[0].side[i], axes[1].side[j], axes[2].side[k]);
        if (direction == kNeighborSelf) {
          *next = in(m_at->elements, axes[0].wrapped[i] + axes[1].wrapped[j] + axes[2].wrapped[k]);
          continue;
        }
        int3 const at{axes[0].first + i, axes[1].first + j, axes[2].first + k};
        auto const& there = beside(*m_at, direction, at);
        if (!there.elements)
          *next = in(m_at->elements, axes[0].nearest[i] + axes[1].nearest[j] + axes[2].nearest[k]);
        else if (there.tile->depth() == from.depth())
          *next = in(there.elements, axes[0].wrapped[i] + axes[1].wrapped[j] + axes[2].wrapped[k]);
        else
          *next = corner(at);
      }
  m_source.ops->blendBox({places.target,
                          places.targetWidth,
                          places.count,
                          corners,
                          axes[0].count,
                          axes[1].count,
                          {axes[0].at, axes[1].at, axes[2].at},
                          {axes[0].fraction, axes[1].fraction, axes[2].fraction},
                          scale});
  return true;
}

#define VLN_INSTANTIATE(TraitsT) template class HaloSampler<TraitsT>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D::Internal
