// A picture of one channel on a plane across an axis.
#pragma once

#include "Interop/Image.h"
#include "Interop/VdbImport.h"

#include <optional>
#include <string>

namespace VLN::Interop {

struct SliceOptions {
  int axis = 2;             ///< 0, 1, 2 for x, y, z
  std::optional<double> at; ///< world position on the axis; the middle of the channel's active box otherwise
  int size = 512;           ///< pixels along the longer side of the plane, without scale and margin
  bool nearest = false;     ///< the nearest sample in place of a linear blend
  int depth = 1 << 20; ///< of the deepest tiles drawn; above roots, tiles are made of their children's values
  bool gradient = false; ///< the length of the gradient in world space, always of the linear blend
};

struct Slice {
  Image image;    ///< the plane with a scale beside it
  double at = 0;  ///< world position of the samples drawn
  double low = 0; ///< range of the numbers drawn
  double high = 0;
  double top = 0; ///< value of the last colour; below `high` where few pixels lie far above the others
  std::int64_t drawn = 0; ///< pixels that show a sample; the others lie where the tree has no tile
};

inline constexpr int kSmallestSlice = 16;
inline constexpr int kLargestSlice = 16384;

/// Draws the plane over the active box of the channel: each pixel shows the field at its middle, blended
/// linearly between samples, in the deepest tile down to a depth. A sample lies in the middle of its pixels,
/// as it does when the nearest is drawn. Across x the picture's axes are y and z, across y they are x and z,
/// across z they are x and y; the second one points up. Pixels without a tile are grey. Where values of both
/// signs occur zero is white; otherwise the colours end at the value that 99.5 % of the pixels stay below, so
/// that a few bright spots do not leave all else dark.
/// @error std::invalid_argument for a channel that is unknown or has no active voxel, and for a position that
/// misses the active box.
VLN_API Slice drawSlice(VdbVolume const& volume, std::string const& channel,
                        SliceOptions const& options = {});

} // namespace VLN::Interop
