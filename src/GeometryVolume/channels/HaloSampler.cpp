#include "GeometryVolume/channels/HaloSamplerImpl.h"

#include <algorithm>
#include <cmath>
#include <cstring>

namespace VLN::TileTree3D::Internal {

template <class TraitsT> void HaloSampler<TraitsT>::sample(int3 const& p, float scale, void* out) {
  read(p, out);
  if (scale != 1.0f) m_source.ops->scale(out, scale);
}

template <class TraitsT> void HaloSampler<TraitsT>::setTile(int3 const& p, int depth) {
  auto const& found = m_accessor.tile(p, depth, false);
  m_extent = 0;
  if (&found != m_tile) m_known = 0;
  m_tile = &found;
  m_elements = nullptr;
  if (!found.valid()) return;
  m_elements = m_source.elements(found.treeIndex());
  int const covered = found.depth() == depth ? depth : found.depth() + 1;
  m_corner = TraitsT::align(p, covered);
  m_extent = static_cast<std::uint32_t>(TraitsT::width(covered));
}

template <class TraitsT> void HaloSampler<TraitsT>::read(int3 const& p, void* out) {
  if (!holds(p)) setTile(p, std::min(m_source.maxDepth, TraitsT::kMaxDepth));
  if (!m_elements) {
    std::memcpy(out, m_source.defaultValue, m_source.ops->size);
    return;
  }
  // In double: every difference of coordinates is exact there, and so is every whole quotient.
  CornerBlend blend;
  int low[3];
  for (int a = 0; a < 3; ++a) {
    double const l =
        (double(p[a]) - double(m_tile->tijk()[a])) / m_tile->voxelDataWidth() - double(m_offset[a]);
    double const floor = std::floor(l);
    low[a] = static_cast<int>(floor);
    blend.fraction[a] = l - floor;
  }
  auto const fits = [](int c) { return c >= 0 && c + 1 < TraitsT::kTDW; };
  if (fits(low[0]) && fits(low[1]) && fits(low[2])) {
    auto const* const first = static_cast<std::byte const*>(flat(m_elements, {low[0], low[1], low[2]}));
    auto const size = static_cast<std::ptrdiff_t>(m_source.ops->size);
    for (int n = 0; n < 8; ++n)
      blend.corners[n] = first + size * ((n & 1) + m_width * ((n >> 1 & 1) + m_width * (n >> 2)));
  } else {
    for (int n = 0; n < 8; ++n)
      blend.corners[n] = corner({low[0] + (n & 1), low[1] + (n >> 1 & 1), low[2] + (n >> 2)});
  }
  m_source.ops->blendCorners(blend, out);
}

template <class TraitsT>
auto HaloSampler<TraitsT>::beside(NeighborDirection direction, int3 const& place) -> Beside const& {
  auto& found = m_beside[static_cast<std::size_t>(direction)];
  if (m_known >> direction & 1) return found;
  auto const& there = m_accessor.tile(place, m_tile->depth(), false);
  found = {&there, there.valid() ? m_source.elements(there.treeIndex()) : nullptr};
  m_known |= 1u << direction;
  return found;
}

template <class TraitsT> void const* HaloSampler<TraitsT>::corner(int3 const& at) {
  constexpr int w = TraitsT::kTDW;
  auto const inside = [](int c) { return c >= 0 && c < w; };
  if (inside(at.x) && inside(at.y) && inside(at.z)) return flat(m_elements, at);
  int3 place{};
  bool inDomain = true;
  for (int a = 0; a < 3; ++a) {
    std::int64_t const c = m_tile->tijk()[a] + std::int64_t(at[a]) * m_tile->voxelDataWidth();
    inDomain = inDomain && c >= TraitsT::kMinTileCoord && c <= TraitsT::kMaxTileCoord;
    if (inDomain) place[a] = static_cast<int>(c);
  }
  if (inDomain) {
    auto const side = [](int c) { return c < 0 ? -1 : c >= w ? 1 : 0; };
    auto const& there = beside(neighborDirection(side(at.x), side(at.y), side(at.z)), place);
    if (there.elements) return flat(there.elements, there.tile->childDataIJK(place));
  }
  auto const nearest = [](int c) { return std::clamp(c, 0, w - 1); };
  return flat(m_elements, {nearest(at.x), nearest(at.y), nearest(at.z)});
}

#define VLN_INSTANTIATE(TraitsT) template class HaloSampler<TraitsT>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D::Internal
