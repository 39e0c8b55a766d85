// Definitions of the halo functions. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/channels/HaloDriverImpl.h"
#include "GeometryVolume/channels/UntypedTilesImpl.h"

namespace VLN::TileTree3D {

template <class TraitsT, class T, int SourceExtended, int SourceHalo, int TargetExtended, int TargetHalo>
requires PlainHaloLayouts<SourceExtended, SourceHalo, TargetExtended, TargetHalo>
void computeHalo(Internal::HaloChannel<TraitsT, T, SourceExtended, SourceHalo> const& src,
                 Container<TraitsT> const& tree,
                 Internal::HaloChannel<TraitsT, T, TargetExtended, TargetHalo>& dst, int firstDepth,
                 int lastDepth) {
  auto const target = Internal::untypedTarget<T>(dst);
  Internal::runHaloPass<TraitsT>(
      {Internal::untypedTiles<T>(src), target,
       &Internal::kHaloTable<TraitsT, SourceExtended, SourceHalo, TargetExtended, TargetHalo>, firstDepth,
       lastDepth},
      tree);
}

template <class TraitsT, class T, int E, int SourceHalo, int TargetHalo>
requires(E == TraitsT::kTDW && ModeHaloLayouts<SourceHalo, TargetHalo>) void computeHalo(
    HaloMode mode, HaloType type, int firstDepth, int lastDepth,
    Channel<TraitsT, T, E, SourceHalo> const& src, Container<TraitsT> const& tree,
    Channel<TraitsT, T, E, TargetHalo>& dst, float scale, VoxelOffsetType offsetType, float constant) {
  auto const target = Internal::untypedTarget<T>(dst);
  Internal::runHaloPass<TraitsT>({Internal::untypedTiles<T>(src), target,
                                  &Internal::kHaloTable<TraitsT, 0, SourceHalo, 0, TargetHalo>, firstDepth,
                                  lastDepth},
                                 {mode, type, constant, scale, offsetType}, tree);
}

template <class TraitsT, class T, int SourceExtended, int SourceHalo, int TargetExtended, int TargetHalo>
requires TileHaloLayouts<SourceExtended, SourceHalo, TargetExtended, TargetHalo>
void setHaloTile(typename Container<TraitsT>::TileType const& tile,
                 typename Container<TraitsT>::TileType const* parent,
                 Internal::HaloChannel<TraitsT, T, SourceExtended, SourceHalo> const& src,
                 Internal::HaloTile<TraitsT, T, TargetExtended, TargetHalo>& dst, HaloMode mode,
                 typename Container<TraitsT>::ConstTileAccessor& accessor,
                 Internal::HaloTile<TraitsT, T, TargetExtended, TargetHalo>& parentData) {
  auto const source = Internal::untypedTiles<T>(src);
  Internal::HaloDriver<TraitsT> driver(
      source, Internal::kHaloTable<TraitsT, SourceExtended, SourceHalo, TargetExtended, TargetHalo>,
      accessor);
  driver.fill({tile, dst.data()->data(), parent, parent && parentData ? parentData.data()->data() : nullptr},
              mode);
}

template <class TraitsT, class T, int SourceHalo, int TargetHalo, int SourceExtended, int TargetExtended>
requires IndexHaloLayouts<SourceHalo, TargetHalo, SourceExtended, TargetExtended>
void setHaloTile(TreeIndex const& index,
                 Internal::HaloChannel<TraitsT, T, SourceExtended, SourceHalo> const& src, HaloMode mode,
                 HaloType type, typename Container<TraitsT>::ConstTileAccessor& accessor,
                 Internal::HaloTile<TraitsT, T, TargetExtended, TargetHalo>& dst, float constant, float scale,
                 VoxelOffsetType offsetType) {
  auto const source = Internal::untypedTiles<T>(src);
  auto const& table = Internal::kHaloTable<TraitsT, SourceExtended, SourceHalo, TargetExtended, TargetHalo>;
  Internal::HaloDriver<TraitsT> driver(source, table, accessor);
  Internal::HaloSampler<TraitsT> sampler(source, table.sourceWidth, table.sourceOrigin, offsetType, accessor);
  driver.fill(accessor.tile(index), dst.data()->data(), {mode, type, constant, scale, offsetType}, sampler);
}

} // namespace VLN::TileTree3D
