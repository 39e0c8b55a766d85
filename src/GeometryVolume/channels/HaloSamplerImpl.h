// HaloSampler: linear samples of a channel at places of the tree, through neighbours and coarser tiles.
#pragma once

#include "GeometryVolume/channels/ElementOpsTableImpl.h"
#include "GeometryVolume/channels/HaloTypes.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelOffsetType.h"

#include <array>

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

  /// Places in a row along each axis, and where their values go.
  struct Places {
    int3 first; ///< place of the first one
    int step;   ///< from place to place
    std::array<int, 3> count;
    std::array<int, 3> side; ///< -1, 0, 1: on which side of what they are for, or none
    void* target;            ///< element of the first one
    int targetWidth;
  };
  /// sample() at all of some places.
  /// @pre `from` is the deepest tile there that the channel covers, with samples wider than a step, and at
  /// most kMost places lie along an axis.
  /// @return False if the channel has no data there; then nothing is written.
  bool sampleBox(TileType const& from, Places const& places, float scale);
  static constexpr int kMost = kLargestBlend;

private:
  /// What lies beside the tile in a direction, at its depth or above: the same tile for every sample there.
  struct NeighborTile {
    TileType const* tile;
    void const* elements;
  };

  /// Places in a row along one axis, and the tile that they lie in.
  struct AxisPlaces {
    int count = 0; // first: without places the rest is not compared
    int first, step;
    int corner, width;
    float offset;

    bool operator==(AxisPlaces const&) const = default;
  };
  /// Samples before a tile, in it, or behind it: side -1, 0, 1.
  struct Zone {
    int side, begin, end;
  };
  /// The samples that such places blend.
  static constexpr int kReads = kMost + 1;
  struct Axis {
    AxisPlaces places;
    int at[kMost]; ///< a place's low sample
    double fraction[kMost];
    int first, count; ///< samples that are read
    int zoneCount;
    Zone zones[3];
    std::ptrdiff_t wrapped[kReads], nearest[kReads]; ///< bytes into the tile there, and into this one

    void set(AxisPlaces const& to, std::ptrdiff_t stride);
  };

  /// A tile, its elements, and what lies beside it as far as it was asked for.
  struct NeighborCache {
    TileType const* tile = nullptr;
    void const* elements = nullptr;
    std::uint32_t known = 0; ///< bits of the directions that were looked up
    std::array<NeighborTile, kNeighborCount> neighbors;
  };

  void read(int3 const& p, void* out);
  void setTile(int3 const& p, int depth);
  /// Tiles that were used last keep what lies beside them: those round a tile come again for the tiles near
  /// it.
  NeighborCache& cacheOf(TileType const& tile);
  /// Whether the tile of the last sample is that of the point too.
  bool holds(int3 const& p) const {
    for (int a = 0; a < 3; ++a)
      if (static_cast<std::uint32_t>(p[a]) - static_cast<std::uint32_t>(m_corner[a]) >= m_extent)
        return false;
    return true;
  }
  NeighborTile const& neighbor(NeighborCache& cache, NeighborDirection direction, int3 const& at) const;
  void const* corner(int3 const& at);
  void const* flat(void const* tile, int3 const& at) const {
    auto const index = m_origin + at.x + (at.y + at.z * m_width) * m_width;
    return static_cast<std::byte const*>(tile) + index * static_cast<std::ptrdiff_t>(m_source.ops->size);
  }
  /// Place of the sample at `at` of a tile, which may lie beside it.
  static std::array<std::int64_t, 3> placeOf(TileType const& tile, int3 const& at) {
    std::int64_t const s = tile.voxelDataWidth();
    return {tile.ti() + at.x * s, tile.tj() + at.y * s, tile.tk() + at.z * s};
  }

  UntypedTiles const& m_source;
  int m_width, m_origin;
  float3 m_offset;
  Accessor const& m_accessor;
  NeighborCache* m_at = nullptr; ///< of the last sample's tile
  /// Where that is the tile: all of it at the deepest depth that is asked for, else a voxel without a child.
  int3 m_corner{0, 0, 0};
  std::uint32_t m_extent = 0;
  static constexpr std::size_t kRecent = 32;
  std::array<NeighborCache, kRecent> m_recent;
  /// By axis and side: regions of a tile on the same side have the same places there.
  std::array<std::array<Axis, 3>, 3> m_axes;
};

} // namespace VLN::TileTree3D::Internal
