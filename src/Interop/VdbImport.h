// From a .vdb file to volumes: one object for each transform, one channel for each grid.
//
//   object { "voxel_component" : VoxelTopology, "voxel_tile_tree" : Container, "<grid>" : Channel, ... }
//
// One VDB voxel is one sample at the deepest depth, and lies at its integer index, the sample's low corner.
//
//   in the file                      in the tree
//   leaf, 8 voxels wide              tiles of 4 samples at depth 28, below one of 2-wide samples at depth 27
//   active tile,   8 wide            a sample of a tile at depth 25
//   active tile,  128 wide           a sample of a tile at depth 21
//   active tile, 4096 wide           a sample of a tile at depth 16
//
// Blends are those of the file as well: a block of 4 x 4 x 4 voxels has a tile of its own wherever a blend
// that begins in it meets two different values, in leaves, at the surfaces of the file's tiles, and around
// both. What has no finer tile is of one value, which the coarser samples there hold. So reading or blending
// in the deepest tile at a position, or taking the channel's default value where there is no tile, gives
// exactly what the grid gives. (Blocks that hold an active voxel have tiles in any case.)
//
// Above them stands the chain of ancestors up to one depth of roots, the deepest at which the whole box is at
// most 64 tiles wide on each axis and no tile that the file needs lies higher, or a shallower one where that
// takes fewer tiles. Grids of one object share the union of their trees. Every sample of every tile holds the
// grid's value at the sample's corner.
//
// What else the file holds is kept as plain properties of the object, see VdbRecord.h. Where values do not
// tell which samples are active, a channel of bytes beside the grid's own does.
#pragma once

#include "GeometryVolume/core/Object.h"
#include "Interop/IndexToWorld.h"
#include "Interop/PointVolume.h"
#include "Interop/Progress.h"
#include "Interop/VdbFile.h"
#include "Velorn/Math.h"

#include <cstdint>
#include <string>
#include <vector>

namespace VLN::Interop {

inline constexpr char const* kVdbContainerName = "voxel_tile_tree";
inline constexpr char const* kVdbTopologyName = "voxel_component";

/// @space Tile space; half open.
using IndexBox = Velorn::Math::bbox<Velorn::Math::int3, int>;

struct VdbChannel {
  std::string name;     ///< of the channel in its object; unlike the grid's only where that is taken
  std::string gridName; ///< as in the file
  std::string type;     ///< of the grid's values: "float", "double", "int32", "int64", "bool", "mask",
                        ///< "vec3s", "vec3d", "vec3i"
  int core = 0;
  int halo = 0;
  std::int64_t activeVoxels = 0; ///< of the grid, those of active tiles included
  double minimum = 0;            ///< of the active values that are numbers; of the lengths of vectors
  double maximum = 0;
  bool hasRange = false; ///< whether there are such values
  IndexBox activeBox;    ///< empty() without an active voxel
};

struct VdbVolume {
  Ostil::Ptr<Object> object;
  double voxelSize = 1; ///< as in the file; the container holds it as a float
  /// The transform of all grids, whole. World positions of reports go through it; the container knows the
  /// voxel size alone.
  IndexToWorld indexToWorld;
  /// Empty when the transform is one uniform scale, else what it is.
  std::string transform;
  IndexBox activeBox;
  std::vector<VdbChannel> channels;

  VdbChannel const* channel(std::string const& name) const;
};

struct VdbImport {
  std::string file;
  std::vector<VdbVolume> volumes;  ///< in the order in which their first grids come
  std::vector<PointVolume> points; ///< one for each points grid
  std::vector<SkippedGrid> skipped;
  std::string metadata; ///< OpenVDB's own bytes of the file's metadata
};

/// Reads a file and builds its volumes: each grid of a supported type becomes a Channel<Traits<2,4,0,1>, T,
/// 4, 0> of its type (bool and masks as unsigned char) whose default value is the grid's background.
/// @numeric The same trees and values for any number of threads.
/// @error FileError; see probeVdbFile().
VLN_API VdbImport importVdb(std::string const& path, VdbReadLimits const& limits = {},
                            Progress const& progress = {});

} // namespace VLN::Interop
