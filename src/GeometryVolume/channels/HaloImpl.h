// Definitions of the halo functions. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/EraseTilesImpl.h"
#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/channels/HaloDriver.h"

namespace VLN::TileTree3D {

template <class TraitsT, class T, int SourceExtended, int SourceHalo, int TargetExtended, int TargetHalo>
requires(Internal::isPlainHalo(SourceExtended, SourceHalo, TargetExtended, TargetHalo)) void computeHalo(
    Internal::HaloChannel<TraitsT, T, SourceExtended, SourceHalo> const& src, Container<TraitsT> const& tree,
    Internal::HaloChannel<TraitsT, T, TargetExtended, TargetHalo>& dst, int firstDepth, int lastDepth) {
  auto const target = Internal::eraseTarget<T>(dst);
  Internal::runHaloPass<TraitsT>(
      {Internal::eraseTiles<T>(src), target,
       &Internal::kHaloTable<TraitsT, SourceExtended, SourceHalo, TargetExtended, TargetHalo>, firstDepth,
       lastDepth},
      tree);
}

template <class TraitsT, class T, int E, int SourceHalo, int TargetHalo>
requires(E == TraitsT::kTDW && TargetHalo >= 1 && SourceHalo + TargetHalo <= 2) void computeHalo(
    HaloMode mode, HaloType type, int firstDepth, int lastDepth,
    Channel<TraitsT, T, E, SourceHalo> const& src, Container<TraitsT> const& tree,
    Channel<TraitsT, T, E, TargetHalo>& dst, float scale, VoxelOffsetType offsetType, float constant) {
  auto const target = Internal::eraseTarget<T>(dst);
  Internal::runHaloPass<TraitsT>({Internal::eraseTiles<T>(src), target,
                                  &Internal::kHaloTable<TraitsT, 0, SourceHalo, 0, TargetHalo>, firstDepth,
                                  lastDepth},
                                 {mode, type, constant, scale, offsetType}, tree);
}

template <class TraitsT, class T, int SourceExtended, int SourceHalo, int TargetExtended, int TargetHalo>
requires(Internal::isTileHalo(SourceExtended, SourceHalo, TargetExtended, TargetHalo)) void setHaloTile(
    typename Container<TraitsT>::TileType const& tile, typename Container<TraitsT>::TileType const* parent,
    Internal::HaloChannel<TraitsT, T, SourceExtended, SourceHalo> const& src,
    Internal::HaloTile<TraitsT, T, TargetExtended, TargetHalo>& dst, HaloMode mode,
    typename Container<TraitsT>::ConstTileAccessor& accessor,
    Internal::HaloTile<TraitsT, T, TargetExtended, TargetHalo>& parentData) {
  auto const source = Internal::eraseTiles<T>(src);
  Internal::HaloDriver<TraitsT> driver(
      source, Internal::kHaloTable<TraitsT, SourceExtended, SourceHalo, TargetExtended, TargetHalo>,
      accessor);
  driver.fill({tile, dst.data()->data(), parent, parent && parentData ? parentData.data()->data() : nullptr},
              mode);
}

template <class TraitsT, class T, int SourceHalo, int TargetHalo, int SourceExtended, int TargetExtended>
requires(Internal::isIndexHalo(SourceHalo, TargetHalo, SourceExtended, TargetExtended)) void setHaloTile(
    TreeIndex const& index, Internal::HaloChannel<TraitsT, T, SourceExtended, SourceHalo> const& src,
    HaloMode mode, HaloType type, typename Container<TraitsT>::ConstTileAccessor& accessor,
    Internal::HaloTile<TraitsT, T, TargetExtended, TargetHalo>& dst, float constant, float scale,
    VoxelOffsetType offsetType) {
  auto const source = Internal::eraseTiles<T>(src);
  auto const& table = Internal::kHaloTable<TraitsT, SourceExtended, SourceHalo, TargetExtended, TargetHalo>;
  Internal::HaloDriver<TraitsT> driver(source, table, accessor);
  Internal::HaloSampler<TraitsT> sampler(source, table.sourceWidth, table.sourceOrigin, offsetType, accessor);
  driver.fill(accessor.tile(index), dst.data()->data(), {mode, type, constant, scale, offsetType}, sampler);
}

#define VLN_PLAIN_HALO(S, T, a, b, c, d)                                                                     \
  template VLN_API void computeHalo<S, T, a, b, c, d>(Internal::HaloChannel<S, T, a, b> const&,              \
                                                      Container<S> const&,                                   \
                                                      Internal::HaloChannel<S, T, c, d>&, int, int);         \
  VLN_TILE_HALO(S, T, a, b, c, d)
#define VLN_TILE_HALO(S, T, a, b, c, d)                                                                      \
  template VLN_API void setHaloTile<S, T, a, b, c, d>(                                                       \
      Container<S>::TileType const&, Container<S>::TileType const*,                                          \
      Internal::HaloChannel<S, T, a, b> const&, Internal::HaloTile<S, T, c, d>&, HaloMode,                   \
      Container<S>::ConstTileAccessor&, Internal::HaloTile<S, T, c, d>&);
#define VLN_MODE_HALO(S, T, h1, h2)                                                                          \
  template VLN_API void computeHalo<S, T, S::kTDW, h1, h2>(                                                  \
      HaloMode, HaloType, int, int, Channel<S, T, S::kTDW, h1> const&, Container<S> const&,                  \
      Channel<S, T, S::kTDW, h2>&, float, VoxelOffsetType, float);
#define VLN_INDEX_HALO(S, T, h1, h2, e1, e2)                                                                 \
  template VLN_API void setHaloTile<S, T, h1, h2, e1, e2>(                                                   \
      TreeIndex const&, Internal::HaloChannel<S, T, e1, h1> const&, HaloMode, HaloType,                      \
      Container<S>::ConstTileAccessor&, Internal::HaloTile<S, T, e2, h2>&, float, float, VoxelOffsetType);

/// All instantiations for one shape and element type.
#define VLN_HALO_FUNCTIONS(S, T)                                                                             \
  VLN_PLAIN_HALO(S, T, 0, 0, 0, 0)                                                                           \
  VLN_PLAIN_HALO(S, T, 0, 0, 0, 1)                                                                           \
  VLN_PLAIN_HALO(S, T, 0, 0, 1, 0)                                                                           \
  VLN_PLAIN_HALO(S, T, 0, 1, 1, 0)                                                                           \
  VLN_PLAIN_HALO(S, T, 1, 0, 1, 0)                                                                           \
  VLN_TILE_HALO(S, T, 0, 1, 1, 1)                                                                            \
  VLN_MODE_HALO(S, T, 0, 1)                                                                                  \
  VLN_MODE_HALO(S, T, 0, 2)                                                                                  \
  VLN_MODE_HALO(S, T, 1, 1)                                                                                  \
  VLN_INDEX_HALO(S, T, 0, 0, 0, 1)                                                                           \
  VLN_INDEX_HALO(S, T, 0, 0, 1, 1)                                                                           \
  VLN_INDEX_HALO(S, T, 0, 1, 0, 0)                                                                           \
  VLN_INDEX_HALO(S, T, 0, 1, 0, 1)                                                                           \
  VLN_INDEX_HALO(S, T, 0, 1, 1, 0)                                                                           \
  VLN_INDEX_HALO(S, T, 0, 1, 1, 1)                                                                           \
  VLN_INDEX_HALO(S, T, 0, 2, 0, 0)                                                                           \
  VLN_INDEX_HALO(S, T, 1, 1, 0, 0)

} // namespace VLN::TileTree3D
