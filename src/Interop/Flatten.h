// flattenVolume(): a volume as a flat buffer, with what a user would set and no template arguments.
#pragma once

#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/nanovtt/AlignedHostBuffer.h"

#include <cstdint>
#include <string>
#include <vector>

namespace VLN::Interop {

enum class Quantisation { kNone, kFp4, kFp8, kFp16, kFpN };

struct FlattenOptions {
  std::string channels = "*"; ///< a filter, as ChannelParser takes it
  Quantisation quantisation = Quantisation::kNone;
  float tolerance = -1; ///< for kFpN; below 0: as the grid's class says
  bool dither = false;
  float haloFraction = 0; ///< 0 to 1: share of tiles that may be stored with a halo
  bool morton = false;
  bool coalesce = false;
  bool textures = false;      ///< needs halos everywhere, no quantisation and no coalescing
  int checksum = 1;           ///< 0 none, 1 of the headers, 2 of all bytes
  int finestLevel = 0;        ///< levels above the deepest at which the buffer ends
  bool coarserLevels = false; ///< coarse samples take the values of their children
  float coarserTolerance = 0;
  bool traversal = false;
  bool neighbors = false;
  bool cubic = false;
  int elementBytes = 1;
  bool log = false; ///< the conversion's own report on standard output
};

struct FlatVolume {
  nanovtt::AlignedHostBuffer buffer, traversal, neighbors;
  double seconds = 0; ///< of the conversion
};

/// The volume with the tree "voxel_tile_tree" and the topology "voxel_component".
/// @error std::runtime_error with one line: for a filter that is none or lets no channel through, options
/// that exclude each other, and trees that no root table holds.
VLN_API FlatVolume flattenVolume(Object const& object, FlattenOptions const& options);

/// Names of the channels that a filter lets through and a flat buffer can hold.
/// @error std::runtime_error for a filter that is none.
VLN_API std::vector<std::string> flatChannels(Object const& object, std::string const& filter);

/// How far the samples of a buffer lie from those of its volume.
struct FlatError {
  std::string channel;
  double largest = 0;
  double mean = 0;
};
/// One entry for each float channel.
/// @cost Reads all samples, in parallel.
VLN_API std::vector<FlatError> flatErrors(Object const& object, FlatVolume const& flat);

} // namespace VLN::Interop
