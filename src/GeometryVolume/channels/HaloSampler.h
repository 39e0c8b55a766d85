// HaloSampler: linear samples of a channel at places of the tree, through neighbours and coarser tiles.
#pragma once

#include "GeometryVolume/channels/ElementOps.h"
#include "GeometryVolume/channels/HaloTypes.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelOffsetType.h"

namespace VLN::TileTree3D::Internal {

/// @threads One for each thread: it moves the accessor, and remembers its last tile.
template <class TraitsT> class HaloSampler {
public:
  using Accessor = ConstTileAccessorOf<TraitsT>;
  using TileType = typename Accessor::TileType;

  /// @param width, origin Full width and flat index of coordinate (0,0,0) of the source's tiles.
  HaloSampler(UntypedTiles const& source, int width, int origin, VoxelOffsetType offsetType,
              Accessor const& accessor)
      : m_source(source)
      , m_width(width)
      , m_origin(origin)
      , m_offset(voxelOffset(offsetType))
      , m_accessor(accessor) {}

  /// Writes the value at `p` times the scale, read from the deepest tile there that the channel covers.
  ///
  /// @formula l = (p - corner) / sample width - offset; the eight samples at floor(l) and one further. Those
  /// outside the tile's core come from the tile at their place: at the same depth its sample, coarser the
  /// sample that contains the place, without a tile this tile's nearest sample.
  /// @edges Without a tile or its data: the channel's default value.
  void sample(int3 const& p, float scale, void* out);

private:
  void read(int3 const& p, void* out);
  void const* corner(int3 const& at) const;
  void const* flat(void const* tile, int3 const& at) const {
    auto const index = m_origin + at.x + (at.y + at.z * m_width) * m_width;
    return static_cast<std::byte const*>(tile) + index * static_cast<std::ptrdiff_t>(m_source.ops->size);
  }

  UntypedTiles const& m_source;
  int m_width, m_origin;
  float3 m_offset;
  Accessor const& m_accessor;
  TileType const* m_tile = nullptr;
  void const* m_elements = nullptr;
};

} // namespace VLN::TileTree3D::Internal
