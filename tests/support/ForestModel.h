// A slow, independent model of the tree: a plain list of tiles, every question answered by a scan of it.
#pragma once

#include "GeometryVolume/tiletree/Traits.h"
#include "GeometryVolume/tiletree/TreeIndex.h"

#include <algorithm>
#include <cstdint>
#include <optional>
#include <set>
#include <vector>

namespace Support {

using Velorn::Math::int3;
using VLN::TileTree3D::VoxelCoord;

template <class TraitsT> class ForestModel {
public:
  using Wide = std::int64_t;

  static Wide width(int depth) {
    Wide w = 1;
    for (int d = depth; d <= TraitsT::kMaxDepth; ++d) w *= TraitsT::kTW;
    return TraitsT::kTW == 2 ? 2 * w : w;
  }
  static bool inDomain(Wide c) {
    Wide const half = width(0) / 2;
    return c >= -half && c < width(0) - half;
  }
  static bool inDomain(int3 const& p) { return inDomain(p.x) && inDomain(p.y) && inDomain(p.z); }
  static Wide align(Wide c, int depth) {
    Wide const low = -(width(0) / 2);
    return (c - low) / width(depth) * width(depth) + low;
  }
  /// The place of depth `depth` that holds a point of the domain.
  static VoxelCoord place(int3 const& p, int depth) {
    return {static_cast<int>(align(p.x, depth)), static_cast<int>(align(p.y, depth)),
            static_cast<int>(align(p.z, depth)), depth};
  }
  static bool holds(VoxelCoord const& tile, int3 const& p) {
    Wide const w = width(tile.depth);
    auto const axis = [w](Wide low, Wide c) { return low <= c && c < low + w; };
    return axis(tile.i, p.x) && axis(tile.j, p.y) && axis(tile.k, p.z);
  }

  std::set<VoxelCoord> const& tiles() const { return m_tiles; }
  bool has(VoxelCoord const& tile) const { return m_tiles.count(tile) > 0; }
  Wide count(int depth) const {
    return std::count_if(m_tiles.begin(), m_tiles.end(), [&](auto const& t) { return t.depth == depth; });
  }

  /// The deepest tile at or above `depth` that holds the point.
  std::optional<VoxelCoord> find(int3 const& p, int depth) const {
    std::optional<VoxelCoord> best;
    if (!inDomain(p)) return best;
    for (VoxelCoord const& t : m_tiles) {
      if (t.depth <= depth && holds(t, p) && (!best || t.depth > best->depth)) best = t;
    }
    return best;
  }
  std::optional<VoxelCoord> parent(VoxelCoord const& tile) const {
    if (tile.depth == 0) return {};
    VoxelCoord const above = place(tile.ijk(), tile.depth - 1);
    return has(above) ? std::optional(above) : std::nullopt;
  }
  std::vector<VoxelCoord> roots() const {
    std::vector<VoxelCoord> list;
    for (VoxelCoord const& t : m_tiles) {
      if (!parent(t)) list.push_back(t);
    }
    return list;
  }
  /// What lies `steps` tile widths beside a tile.
  std::optional<VoxelCoord> beside(VoxelCoord const& tile, int3 const& steps) const {
    Wide const w = width(tile.depth);
    Wide const p[3] = {tile.i + w * steps.x, tile.j + w * steps.y, tile.k + w * steps.z};
    for (Wide const c : p) {
      if (!inDomain(c)) return {};
    }
    return find({static_cast<int>(p[0]), static_cast<int>(p[1]), static_cast<int>(p[2])}, tile.depth);
  }
  /// Tiles in the branch of a tile, itself included.
  Wide branch(VoxelCoord const& tile) const {
    return std::count_if(m_tiles.begin(), m_tiles.end(),
                         [&](auto const& t) { return t.depth >= tile.depth && holds(tile, t.ijk()); });
  }

  /// The tile of `depth` that holds a point, with all tiles between it and what stands above and below it.
  void add(int3 const& p, int depth) {
    if (depth < 0 || depth > TraitsT::kMaxDepth || !inDomain(p)) return;
    VoxelCoord const tile = place(p, depth);
    if (has(tile)) return;
    if (auto const above = find(p, depth)) {
      for (int d = above->depth + 1; d < depth; ++d) m_tiles.insert(place(p, d));
    }
    std::vector<VoxelCoord> below;
    for (VoxelCoord const& root : roots()) {
      if (root.depth > depth && holds(tile, root.ijk())) below.push_back(root);
    }
    m_tiles.insert(tile);
    for (VoxelCoord const& root : below) {
      for (int d = depth + 1; d < root.depth; ++d) m_tiles.insert(place(root.ijk(), d));
    }
  }
  /// The smallest tile that holds two points.
  void addAround(int3 const& min, int3 const& max) {
    if (!inDomain(min) || !inDomain(max)) return;
    int depth = 0;
    while (depth < TraitsT::kMaxDepth && holds(place(min, depth + 1), max)) ++depth;
    add(min, depth);
  }
  /// The tiles of a depth that a box reaches into, its max exclusive.
  void addBox(int3 const& min, int3 const& max, int depth) {
    if (depth < 0 || depth > TraitsT::kMaxDepth) return;
    if (min.x >= max.x || min.y >= max.y || min.z >= max.z) return;
    Wide const w = width(depth), low = -(width(0) / 2);
    auto const first = [&](Wide c) { return c < low ? low : align(std::min(c, low + width(0) - 1), depth); };
    auto const beyond = [&](int a) { return Wide(min[a]) >= low + width(0); };
    if (beyond(0) || beyond(1) || beyond(2)) return;
    auto const last = [&](Wide c) { return std::min(c, low + width(0)); };
    for (Wide i = first(min.x); i < last(max.x); i += w) {
      for (Wide j = first(min.y); j < last(max.y); j += w) {
        for (Wide k = first(min.z); k < last(max.z); k += w)
          add({static_cast<int>(i), static_cast<int>(j), static_cast<int>(k)}, depth);
      }
    }
  }
  /// Takes a tile without children out.
  void remove(VoxelCoord const& tile) { m_tiles.erase(tile); }

private:
  std::set<VoxelCoord> m_tiles;
};

} // namespace Support
