#include "GeometryVolume/channels/HaloSampler.h"

#include <algorithm>
#include <cmath>
#include <cstring>

namespace VLN::TileTree3D::Internal {

template <class TraitsT> void HaloSampler<TraitsT>::sample(int3 const& p, float scale, void* out) {
  read(p, out);
  if (scale != 1.0f) m_source.ops->scale(out, scale);
}

template <class TraitsT> void HaloSampler<TraitsT>::read(int3 const& p, void* out) {
  // A tile at the deepest depth that is asked for is the deepest one everywhere inside it.
  int const depth = std::min(m_source.maxDepth, TraitsT::kMaxDepth);
  if (!m_tile || m_tile->depth() != depth || !m_tile->contains(p)) {
    m_tile = &m_accessor.tile(p, depth, false);
    m_elements = m_tile->valid() ? m_source.elements(m_tile->treeIndex()) : nullptr;
  }
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
  for (int n = 0; n < 8; ++n)
    blend.corners[n] = corner({low[0] + (n & 1), low[1] + (n >> 1 & 1), low[2] + (n >> 2)});
  m_source.ops->blendCorners(blend, out);
}

template <class TraitsT> void const* HaloSampler<TraitsT>::corner(int3 const& at) const {
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
    auto const& there = m_accessor.tile(place, m_tile->depth(), false);
    void const* const elements = there.valid() ? m_source.elements(there.treeIndex()) : nullptr;
    if (elements) return flat(elements, there.childDataIJK(place));
  }
  auto const nearest = [](int c) { return std::clamp(c, 0, w - 1); };
  return flat(m_elements, {nearest(at.x), nearest(at.y), nearest(at.z)});
}

#define VLN_INSTANTIATE(TraitsT) template class HaloSampler<TraitsT>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D::Internal
