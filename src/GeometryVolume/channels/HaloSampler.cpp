#include "GeometryVolume/channels/HaloSamplerImpl.h"

#include <algorithm>
#include <cmath>
#include <cstring>

namespace VLN::TileTree3D::Internal {

template <class TraitsT> void HaloSampler<TraitsT>::sample(int3 const& p, float scale, void* out) {
  read(p, out);
  if (scale != 1.0f) m_source.ops->scale(out, scale);
}

template <class TraitsT> auto HaloSampler<TraitsT>::cacheOf(TileType const& tile) -> NeighborCache& {
  NeighborCache& cache = m_recent[static_cast<std::size_t>(tile.index()) % kRecent];
  if (cache.tile != &tile) {
    cache.tile = &tile, cache.known = 0;
    cache.elements = tile.valid() ? m_source.elements(tile.treeIndex()) : nullptr;
  }
  return cache;
}

template <class TraitsT> void HaloSampler<TraitsT>::setTile(int3 const& p, int depth) {
  auto const& found = m_accessor.tile(p, depth, false);
  m_at = &cacheOf(found);
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
auto HaloSampler<TraitsT>::neighbor(NeighborCache& cache, NeighborDirection direction, int3 const& at) const
    -> NeighborTile const& {
  auto& found = cache.neighbors[direction];
  if (cache.known >> direction & 1) return found;
  cache.known |= 1u << direction;
  found = {};
  // The whole tile beside lies in the domain, or nothing of it.
  auto const place = placeOf(*cache.tile, at);
  for (std::int64_t const c : place)
    if (c < TraitsT::kMinTileCoord || c > TraitsT::kMaxTileCoord) return found;
  auto const& there = m_accessor.tile(
      int3{static_cast<int>(place[0]), static_cast<int>(place[1]), static_cast<int>(place[2])},
      cache.tile->depth(), false);
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
  auto const& there = neighbor(*m_at, direction, at);
  if (there.elements) {
    auto const place = placeOf(*m_at->tile, at);
    return flat(there.elements,
                there.tile->childDataIJK(static_cast<int>(place[0]), static_cast<int>(place[1]),
                                         static_cast<int>(place[2])));
  }
  auto const nearest = [](int c) { return std::clamp(c, 0, TraitsT::kTDW - 1); };
  return flat(m_at->elements, {nearest(at.x), nearest(at.y), nearest(at.z)});
}

template <class TraitsT> void HaloSampler<TraitsT>::Axis::set(AxisPlaces const& to, std::ptrdiff_t stride) {
  places = to;
  // As samplePlace(), without its division where a product gives the same.
  auto const samplesTo = [&](int p) {
    double const distance = double(p) - double(to.corner);
    if constexpr (TraitsT::kTW == 2) return distance * (1.0 / to.width);
    return distance / to.width;
  };
  int p = to.first;
  for (int n = 0; n < to.count; ++n, p += to.step) {
    double const l = samplesTo(p) - double(to.offset);
    int const low = static_cast<int>(l) - (l < static_cast<int>(l)); // the place lies in the tile
    if (n == 0) first = low;
    at[n] = low - first, fraction[n] = l - low;
  }
  constexpr int w = TraitsT::kTDW;
  count = at[to.count - 1] + 2;
  zoneCount = 0;
  int const ends[3] = {std::clamp(-first, 0, count), std::clamp(w - first, 0, count), count};
  for (int side = 0, begin = 0; side < 3; begin = ends[side++])
    if (ends[side] > begin) zones[zoneCount++] = {side - 1, begin, ends[side]};
  for (int n = 0; n < count; ++n) {
    int const c = first + n;
    wrapped[n] = (c < 0 ? c + w : c >= w ? c - w : c) * stride;
    nearest[n] = std::clamp(c, 0, w - 1) * stride;
  }
}

template <class TraitsT>
bool HaloSampler<TraitsT>::sampleBox(TileType const& from, Places const& places, float scale) {
  m_at = &cacheOf(from);
  m_extent = 0; // the next sample() looks for its tile
  if (!m_at->elements) return false;

  auto const size = static_cast<std::ptrdiff_t>(m_source.ops->size);
  auto const axisOf = [&](std::size_t a, std::ptrdiff_t stride) -> Axis const& {
    int const n = static_cast<int>(a);
    AxisPlaces const wanted{places.count[a], places.first[n],       places.step,
                            from.tijk()[n],  from.voxelDataWidth(), m_offset[n]};
    Axis& axis = m_axes[a][places.side[a] + 1];
    if (axis.places != wanted) axis.set(wanted, stride * size);
    return axis;
  };
  Axis const &x = axisOf(0, 1), &y = axisOf(1, m_width), &z = axisOf(2, m_width * m_width);

  // Samples in the tile or in one of the same depth beside it lie alike; those of one tile are taken
  // together.
  void const* samples[kReads * kReads * kReads];
  int const acrossI = x.count, acrossJ = y.count;
  auto const forZone = [&](Zone const& zi, Zone const& zj, Zone const& zk, auto const& sampleAt) {
    for (int k = zk.begin; k < zk.end; ++k)
      for (int j = zj.begin; j < zj.end; ++j) {
        void const** const row = samples + (k * acrossJ + j) * acrossI;
        auto const at = sampleAt(j, k);
        for (int i = zi.begin; i < zi.end; ++i) row[i] = at(i);
      }
  };
  auto const alike = [&](Zone const& zi, Zone const& zj, Zone const& zk, void const* elements,
                         std::ptrdiff_t const* i, std::ptrdiff_t const* j, std::ptrdiff_t const* k) {
    auto const* const first = static_cast<std::byte const*>(elements) + m_origin * size;
    forZone(zi, zj, zk,
            [=](int nj, int nk) { return [i, row = first + j[nj] + k[nk]](int ni) { return row + i[ni]; }; });
  };
  for (int nk = 0; nk < z.zoneCount; ++nk)
    for (int nj = 0; nj < y.zoneCount; ++nj)
      for (int ni = 0; ni < x.zoneCount; ++ni) {
        Zone const &zi = x.zones[ni], &zj = y.zones[nj], &zk = z.zones[nk];
        auto const direction = neighborDirection(zi.side, zj.side, zk.side);
        if (direction == kNeighborSelf) {
          alike(zi, zj, zk, m_at->elements, x.wrapped, y.wrapped, z.wrapped);
          continue;
        }
        NeighborTile const& there =
            neighbor(*m_at, direction, {x.first + zi.begin, y.first + zj.begin, z.first + zk.begin});
        if (!there.elements)
          alike(zi, zj, zk, m_at->elements, x.nearest, y.nearest, z.nearest);
        else if (there.tile->depth() == from.depth())
          alike(zi, zj, zk, there.elements, x.wrapped, y.wrapped, z.wrapped);
        else
          forZone(zi, zj, zk, [&](int j, int k) {
            return [&, j, k](int i) { return corner({x.first + i, y.first + j, z.first + k}); };
          });
      }
  m_source.ops->blendBox({places.target,
                          places.targetWidth,
                          places.count,
                          samples,
                          {x.count, y.count, z.count},
                          {x.at, y.at, z.at},
                          {x.fraction, y.fraction, z.fraction},
                          scale});
  return true;
}

#define VLN_INSTANTIATE(TraitsT) template class HaloSampler<TraitsT>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D::Internal
