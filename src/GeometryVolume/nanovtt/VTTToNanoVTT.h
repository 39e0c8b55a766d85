// vttToNanoVTT: a volume as one relocatable buffer that a GPU reads without pointers.
//
//   VLN::Object { "voxel_tile_tree", "voxel_component", channels... }
//        │
//        ▼
//   │ container: root table, parents, child tables │ grid of a channel │ grid │ ... │
//
// docs/flat_buffer.md has the format byte by byte; src/Reader reads it.
#pragma once

#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/nanovtt/AlignedHostBuffer.h"
#include "GeometryVolume/nanovtt/CopyableCudaDeviceBuffer.h"
#include "GeometryVolume/nanovtt/GridHandle.h"
#include "Velorn/Math.h"

#include <cstdint>

namespace nanovdb {
class Fp4;
class Fp8;
class Fp16;
class FpN;
class AbsDiff;
enum class StatsMode : std::uint32_t;
enum class ChecksumMode : std::uint32_t;
} // namespace nanovdb

namespace nanovtt {

/// Converts the tree "voxel_tile_tree" of 2 x 2 x 2 tiles, with the samples of the VoxelTopology
/// "voxel_component", and those channels without halo that pass the filter, of the element types float,
/// double, int16, int32, int64, float3, double3, uint32 and float4.
///
/// @tparam BufferT AlignedHostBuffer or CopyableCudaDeviceBuffer.
/// @tparam BuildT How float channels are stored: void as they are; nanovdb::Fp4, Fp8, Fp16 with codes of 4, 8
/// and 16 bits; nanovdb::FpN with as few bits for each tile as the tolerance allows.
/// @tparam OracleT nanovdb::AbsDiff.
/// @tparam kEnableCoalescedTilesSupportT Whether coalescing is compiled in; without, the option asks in vain.
///
/// @param channelFilter Names with wildcards, as ChannelParser takes them.
/// @param statsMode Not used.
/// @param checksumMode 0 none, 1 of the headers, 2 of all bytes.
/// @param verbosity Above 0: what is done and how long it takes, on standard output.
/// @param tolerance For FpN, in units of the values. Below 0: 0.1 voxel sizes in a level set, 0.01 in a fog
/// volume, 0 otherwise, as the first float channel says.
/// @param enableDithering Of quantised values.
/// @param haloOptFraction 0 to 1: the share of tiles that may be stored with one layer of the values beyond
/// their high sides, for blended reads without a look at the neighbours.
/// @param rootLevelLimit Levels above the deepest at which the search for the depth of the roots begins.
/// @param finestLevel Levels above the deepest at which the conversion ends.
/// @param sortTilesInMortonOrder Numbers the tiles of each depth along a Morton curve.
/// @param coalesceTileData Merges complete subtrees of up to three levels into dense blocks.
/// @param cubicBufferSize Sizes buffers as cubes of whole elements.
/// @param bufferElementBytes Bytes of such an element.
/// @param storeTileDataAs3DTextures Lays tiles out as bricks of a 3D texture.
/// @param fogThresholdFix In "voxel_fog_density", raises samples that border on fog to just above the
/// threshold.
/// @param coarserTolerance That threshold, and how much coarse samples may differ from those of their
/// children.
/// @param setCoarserLevels Stores coarse samples that differ as those of their children.
/// @param enableNanoVTTTraversal Fills `out_traversalStructure`: corner and depth of each tile.
/// @param out_neighborStructure If given: the 27 neighbours of each tile.
/// @param out_bbox If given, takes the box of what lies above the fog's threshold.
/// @space Boxes: tile space in the tree header; world space in the grid header and `out_bbox`.
/// @param pool What buffers are drawn from; one that belongs to no pool makes each of its own.
/// @return An empty handle for an object without these components, and for a tree with roots deeper than the
/// depth of the root table, which standard error then tells. Options that exclude each other are turned off,
/// which standard error tells as well.
/// @error std::runtime_error when a buffer cannot be had, and VLN::exceptionMessage for a cancelled job;
/// std::bad_alloc. What was drawn from a pool stays drawn.
/// @numeric The same bytes for any number of threads.
/// @cost Linear in tiles and samples; parallel. Beside the buffers, 8 bytes for each tile that may have
/// children, 4 for each tile where some have halos, and for FpN 20 for each tile.
/// @threads Nothing may change the object meanwhile.
template <class BufferT, class BuildT, class OracleT, bool kEnableCoalescedTilesSupportT>
VLN_API GridHandle<BufferT>
vttToNanoVTT(VLN::Object const& object, Ostil::String const& channelFilter, nanovdb::StatsMode statsMode,
             nanovdb::ChecksumMode checksumMode, int verbosity, float tolerance, bool enableDithering,
             float haloOptFraction, int rootLevelLimit, int finestLevel, bool sortTilesInMortonOrder,
             bool coalesceTileData, bool cubicBufferSize, int bufferElementBytes,
             bool storeTileDataAs3DTextures, bool fogThresholdFix, float coarserTolerance,
             bool setCoarserLevels, bool enableNanoVTTTraversal, BufferT* out_traversalStructure,
             BufferT* out_neighborStructure, Velorn::Math::bbox<Velorn::Math::float3, float>* out_bbox,
             BufferT const& pool);

} // namespace nanovtt
