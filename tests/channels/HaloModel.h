// A slow, independent model of halos: each element on its own, every tile found by a scan of the whole tree.
#pragma once

#include "GeometryVolume/channels/ElementTraits.h"
#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "channels/TestValues.h"
#include "support/RandomForest.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstring>
#include <optional>
#include <random>
#include <vector>

namespace VLN::Test {

using namespace TileTree3D;

using Place = std::array<std::int64_t, 3>;

template <class T> std::string bytesOf(TileVector<T> const& v) {
  return std::string(reinterpret_cast<char const*>(v.data()), v.size() * sizeof(T));
}
template <class T> bool sameBytes(T const& a, T const& b) { return std::memcmp(&a, &b, sizeof(T)) == 0; }

/// A channel of a layout that has followed the tree, over a range of depths.
template <class ChannelT, class TraitsT>
ChannelT channelOn(Container<TraitsT> const& tree, typename ChannelT::value_type const& defaultValue,
                   int minDepth = 0, int maxDepth = TraitsT::kMaxDepth) {
  VoxelTopology<TraitsT> topology("", kVoxelOffsetCorner);
  topology.update(tree);
  ChannelT channel("", &defaultValue, kInitializeDefaultValue, false, true, minDepth, maxDepth);
  channel.update(topology);
  return channel;
}

/// Calls f(tile) for each tile of a range of depths.
template <class TraitsT, class F>
void forTiles(Container<TraitsT> const& tree, int minDepth, int maxDepth, F const& f) {
  for (int d = std::max(0, minDepth); d <= std::min(maxDepth, TraitsT::kMaxDepth); ++d)
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n)
      if (tree.tile(n, d).valid()) f(tree.tile(n, d));
}
/// Calls f(i, j, k) for all coordinates in low..high.
template <class F> void forBox(int low, int high, F const& f) {
  for (int k = low; k <= high; ++k)
    for (int j = low; j <= high; ++j)
      for (int i = low; i <= high; ++i) f(i, j, k);
}

/// Fills every element of a channel, cores and all else, with numbers that depend on the seed.
template <class ChannelT, class TraitsT>
void fillRandom(ChannelT& channel, Container<TraitsT> const& tree, std::uint32_t seed) {
  using T = typename ChannelT::value_type;
  using Traits = ElementTraits<T>;
  std::mt19937 random(seed);
  forTiles(tree, channel.minDepth(), channel.depth(), [&](auto const& tile) {
    for (T& v : channel.tileData(tile.treeIndex()))
      for (int c = 0; c < Traits::kComponents; ++c)
        Traits::component(v, c) = static_cast<typename Traits::Scalar>(random() % 251);
  });
}

/// What computeHalo() and setHaloTile() must give for a source channel.
template <class TraitsT, class ChannelT> class HaloModel {
public:
  using T = typename ChannelT::value_type;
  using Elements = ElementTraits<T>;
  using Blend = typename Elements::Blend;
  using TileType = typename Container<TraitsT>::TileType;
  static constexpr int W = TraitsT::kTDW;

  HaloModel(Container<TraitsT> const& tree, ChannelT const& source)
      : m_tree(tree)
      , m_source(source) {}

  /// The deepest tile at or above `depth` that holds a place.
  TileType const* deepest(Place const& p, int depth) const {
    TileType const* best = nullptr;
    forTiles(m_tree, 0, depth, [&](TileType const& t) {
      if (holds(t, p) && (!best || t.depth() > best->depth())) best = &t;
    });
    return best;
  }
  bool hasData(TileType const* t) const {
    return t && t->depth() >= m_source.minDepth() && t->depth() <= m_source.depth() &&
           t->index() < m_source.tileCount(t->depth());
  }
  T sourceAt(TileType const& t, int i, int j, int k) const {
    return m_source.tileData(t.treeIndex())(i, j, k);
  }
  static Place placeOf(TileType const& t, int i, int j, int k) {
    std::int64_t const s = t.voxelDataWidth();
    return {t.ti() + s * i, t.tj() + s * j, t.tk() + s * k};
  }
  static int step(int c) { return c < 0 ? -1 : c >= W ? 1 : 0; }
  static T blend(T const (&corner)[8], Blend fi, Blend fj, Blend fk) {
    T result;
    for (int c = 0; c < Elements::kComponents; ++c) {
      Blend v[8];
      for (int n = 0; n < 8; ++n) v[n] = Elements::toBlend(Elements::component(corner[n], c));
      for (int n = 0; n < 4; ++n) v[n] = (v[2 * n + 1] - v[2 * n]) * fi + v[2 * n];
      for (int n = 0; n < 2; ++n) v[n] = (v[2 * n + 1] - v[2 * n]) * fj + v[2 * n];
      Elements::component(result, c) = Elements::fromBlend((v[1] - v[0]) * fk + v[0]);
    }
    return result;
  }

  /// An element of the plain form, given what the parent's target tile holds.
  template <class TargetTile>
  T plain(TileType const& tile, int i, int j, int k, HaloMode mode, TileType const* parent,
          TargetTile const* parentData) const {
    int const si = step(i), sj = step(j), sk = step(k);
    if (si == 0 && sj == 0 && sk == 0)
      return hasData(&tile) ? sourceAt(tile, i, j, k) : m_source.defaultValue();
    TileType const* const beside = deepest(placeOf(tile, i, j, k), tile.depth());
    if (beside && beside->depth() == tile.depth() && hasData(beside))
      return sourceAt(*beside, i - W * si, j - W * sj, k - W * sk);
    if (parent) {
      int const at[3] = {i, j, k};
      int low[3];
      float fraction[3];
      for (int a = 0; a < 3; ++a) {
        // In units of the tile's samples, of which the parent's are kTW wide.
        std::int64_t const corner =
            (std::int64_t(tile.tijk()[a]) - parent->tijk()[a]) / tile.voxelDataWidth() + at[a];
        float const x = static_cast<float>(corner) / static_cast<float>(TraitsT::kTW);
        low[a] =
            std::min({static_cast<int>(std::floor(x)), TargetTile::kCore - 1, TargetTile::kMaxCoord - 1});
        fraction[a] = x - static_cast<float>(low[a]);
      }
      T corners[8];
      for (int n = 0; n < 8; ++n)
        corners[n] = (*parentData)(low[0] + n % 2, low[1] + n / 2 % 2, low[2] + n / 4);
      return blend(corners, fraction[0], fraction[1], fraction[2]);
    }
    if (mode == kHaloModeReplicate && hasData(&tile))
      return sourceAt(tile, std::clamp(i, 0, W - 1), std::clamp(j, 0, W - 1), std::clamp(k, 0, W - 1));
    return m_source.defaultValue();
  }

  /// A linear sample at a place.
  T linear(Place const& p, VoxelOffsetType offsetType) const {
    TileType const* const t = deepest(p, m_source.depth());
    if (!hasData(t)) return m_source.defaultValue();
    float const offset[3] = {voxelOffset(offsetType).x, voxelOffset(offsetType).y, voxelOffset(offsetType).z};
    int low[3];
    double fraction[3];
    for (int a = 0; a < 3; ++a) {
      double const l = double(p[std::size_t(a)] - t->tijk()[a]) / t->voxelDataWidth() - double(offset[a]);
      low[a] = static_cast<int>(std::floor(l));
      fraction[a] = l - low[a];
    }
    T corners[8];
    for (int n = 0; n < 8; ++n) {
      int const i = low[0] + n % 2, j = low[1] + n / 2 % 2, k = low[2] + n / 4;
      Place const q = placeOf(*t, i, j, k);
      TileType const* const there = deepest(q, t->depth());
      if (hasData(there)) {
        std::int64_t const s = there->voxelDataWidth();
        corners[n] = sourceAt(*there, int((q[0] - there->ti()) / s), int((q[1] - there->tj()) / s),
                              int((q[2] - there->tk()) / s));
      } else {
        corners[n] = sourceAt(*t, std::clamp(i, 0, W - 1), std::clamp(j, 0, W - 1), std::clamp(k, 0, W - 1));
      }
    }
    return blend(corners, Blend(fraction[0]), Blend(fraction[1]), Blend(fraction[2]));
  }

  struct Request {
    HaloMode mode;
    HaloType type;
    float constant, scale;
    VoxelOffsetType offsetType;
  };
  /// An element of the form with modes; nothing where it stays as it was. `own` reads the target's core.
  template <class Own>
  std::optional<T> moded(TileType const& tile, int i, int j, int k, Request const& r, Own const& own) const {
    if (r.mode < 0 || r.mode >= VLN::TileTree3D::kHaloModeCount) return {};
    auto const scaled = [&](T const& v) { return r.scale == 1.0f ? v : Elements::scaled(v, Blend(r.scale)); };
    int const si = step(i), sj = step(j), sk = step(k);
    int const moved = std::abs(si) + std::abs(sj) + std::abs(sk);
    Place const p = placeOf(tile, i, j, k);
    if (moved == 0) {
      if (!(r.type & 4)) return {};
      if (hasData(&tile)) return sourceAt(tile, i, j, k);
      return tile.depth() > m_source.depth() ? scaled(linear(p, r.offsetType)) : m_source.defaultValue();
    }
    if (!(r.type & (moved == 1 ? 1 : 2))) return {};
    if (r.type & (1 << (3 + (si + 1) * 9 + (sj + 1) * 3 + (sk + 1)))) return {};
    TileType const* const beside = deepest(p, tile.depth());
    if (beside && beside->depth() == tile.depth() && hasData(beside))
      return sourceAt(*beside, i - W * si, j - W * sj, k - W * sk);
    if (!beside || beside->depth() < m_source.minDepth()) return m_source.defaultValue();
    switch (r.mode) {
    case kHaloModeDeepOnly:
      if (beside->depth() > m_source.depth()) return scaled(linear(p, r.offsetType));
      return {};
    case kHaloModeReplicate:
      return own(std::clamp(i, 0, W - 1), std::clamp(j, 0, W - 1), std::clamp(k, 0, W - 1));
    case kHaloModeNearestCoarse: {
      // The deepest tile there that has data.
      for (int d = tile.depth(); d >= m_source.minDepth(); --d) {
        TileType const* const t = deepest(p, d);
        if (!hasData(t)) continue;
        std::int64_t const s = t->voxelDataWidth();
        return sourceAt(*t, int((p[0] - t->ti()) / s), int((p[1] - t->tj()) / s), int((p[2] - t->tk()) / s));
      }
      return m_source.defaultValue();
    }
    case kHaloModeLinearCoarse:
      return scaled(linear(p, r.offsetType));
    case kHaloModeConstant: {
      T v;
      for (int c = 0; c < Elements::kComponents; ++c)
        Elements::component(v, c) = Elements::fromBlend(Blend(r.constant));
      return v;
    }
    default:
      return m_source.defaultValue();
    }
  }

private:
  static bool holds(TileType const& t, Place const& p) {
    std::int64_t const w = t.tileVoxelWidth();
    for (int a = 0; a < 3; ++a) {
      std::int64_t const c = p[std::size_t(a)] - t.tijk()[a];
      if (c < 0 || c >= w) return false;
    }
    return true;
  }

  Container<TraitsT> const& m_tree;
  ChannelT const& m_source;
};

/// A tree with tiles of several depths side by side, some at the ends of the domain.
template <class TraitsT> struct HaloForest {
  Support::RandomForest<TraitsT> forest;

  explicit HaloForest(std::uint32_t seed, int additions = 12)
      : forest(seed) {
    for (int n = 0; n < additions; ++n) forest.grow();
  }
  Container<TraitsT> const& tree() { return forest.tree(); }
};

} // namespace VLN::Test
