// Halos: copies of the neighbours' values round the core of a tile, so that a stencil or a trilinear read
// near a tile's edge stays in one block of memory.
//
//   +---+-------+---+      computeHalo() fills a target channel from a source channel, tile by tile;
//   | e | face  | e |      setHaloTile() does one tile.
//   +---+-------+---+
//   | f | core  | f |      core    the tile's own samples, W along an edge
//   | a |       | a |      face    6 regions, edge 12, corner 8; each as thick as the target's halo; an
//   | c |       | c |              extended target's high ones hold one plane more, and without halo only the
//   +---+-------+---+              seven regions on the high sides exist
//   | e | face  | e |
//   +---+-------+---+
//
// A layout is written (extended, halo): (0,0) is the channel with E = W, (1,0) that with E = W + 1.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/HaloLayouts.h"
#include "GeometryVolume/channels/HaloTypes.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelOffsetType.h"

namespace VLN::TileTree3D {

namespace Internal {
template <class TraitsT, class T, int Extended, int Halo>
using HaloChannel = Channel<TraitsT, T, TraitsT::kTDW + Extended, Halo>;
template <class TraitsT, class T, int Extended, int Halo>
using HaloTile = TileData<T, TraitsT::kTDW + Extended, Halo>;
} // namespace Internal

/// Fills the tiles of `dst`: the core from the same tile of `src`; each region from the neighbour of the same
/// depth, else blended from the tile's parent in `dst`, else, without a parent in the range of depths, with
/// the nearest element of the core.
/// @param firstDepth, lastDepth -1: as far as both channels reach; others are limited to that.
/// @space Samples are taken to lie on the low corners of their voxels.
/// @pre Two channels that have followed `tree`; the layouts (0,0)->(0,0), (0,0)->(0,1), (0,0)->(1,0),
/// (0,1)->(1,0) and (1,0)->(1,0) exist.
/// @numeric The same bytes for any number of threads.
/// @error std::runtime_error(VLN::exceptionMessage) when the host cancels the job; std::bad_alloc. Some of
/// the target's tiles may be filled then; the call can be repeated.
/// @cost Parallel over the tiles of one depth at a time, coarse to fine.
template <class TraitsT, class T, int SourceExtended, int SourceHalo, int TargetExtended, int TargetHalo>
requires PlainHaloLayouts<SourceExtended, SourceHalo, TargetExtended, TargetHalo>
void computeHalo(Internal::HaloChannel<TraitsT, T, SourceExtended, SourceHalo> const& src,
                 Container<TraitsT> const& tree,
                 Internal::HaloChannel<TraitsT, T, TargetExtended, TargetHalo>& dst, int firstDepth,
                 int lastDepth);

/// Fills what `type` names of each tile of `dst`, and leaves all other bytes alone. A region without a
/// neighbour of the same depth takes what `mode` says; without any tile there, or with one above the source's
/// depths, the source's default value.
/// @pre E = W with (SourceHalo, TargetHalo) one of (0,1), (0,2), (1,1).
/// @edges A number that is no mode fills nothing. A scale of exactly 1 multiplies nothing.
/// @error As the form above.
template <class TraitsT, class T, int E, int SourceHalo, int TargetHalo>
requires(E == TraitsT::kTDW && ModeHaloLayouts<SourceHalo, TargetHalo>) void computeHalo(
    HaloMode mode, HaloType type, int firstDepth, int lastDepth,
    Channel<TraitsT, T, E, SourceHalo> const& src, Container<TraitsT> const& tree,
    Channel<TraitsT, T, E, TargetHalo>& dst, float scale, VoxelOffsetType offsetType, float constant);

/// One tile of the plain form. `mode` matters only without a parent: kHaloModeReplicate copies the core's
/// edge outwards, any other mode sets the source's default value.
/// @param parent The tile's parent, or null; `parentData` is its finished tile in the target's layout.
/// @pre `dst` holds a whole tile. (0,1)->(1,1) exists beside the layouts of computeHalo().
template <class TraitsT, class T, int SourceExtended, int SourceHalo, int TargetExtended, int TargetHalo>
requires TileHaloLayouts<SourceExtended, SourceHalo, TargetExtended, TargetHalo>
void setHaloTile(typename Container<TraitsT>::TileType const& tile,
                 typename Container<TraitsT>::TileType const* parent,
                 Internal::HaloChannel<TraitsT, T, SourceExtended, SourceHalo> const& src,
                 Internal::HaloTile<TraitsT, T, TargetExtended, TargetHalo>& dst, HaloMode mode,
                 typename Container<TraitsT>::ConstTileAccessor& accessor,
                 Internal::HaloTile<TraitsT, T, TargetExtended, TargetHalo>& parentData);

/// One tile of the form with modes. Tiles deeper than the source are sampled linearly, their core too. Note
/// the order of the last arguments, which is not that of computeHalo().
template <class TraitsT, class T, int SourceHalo, int TargetHalo, int SourceExtended, int TargetExtended>
requires IndexHaloLayouts<SourceHalo, TargetHalo, SourceExtended, TargetExtended>
void setHaloTile(TreeIndex const& index,
                 Internal::HaloChannel<TraitsT, T, SourceExtended, SourceHalo> const& src, HaloMode mode,
                 HaloType type, typename Container<TraitsT>::ConstTileAccessor& accessor,
                 Internal::HaloTile<TraitsT, T, TargetExtended, TargetHalo>& dst, float constant, float scale,
                 VoxelOffsetType offsetType);

} // namespace VLN::TileTree3D
