// A picture of one channel on a plane across an axis.
#pragma once

#include "Interop/Image.h"
#include "Interop/VdbImport.h"

#include <optional>
#include <string>
#include <utility>

namespace VLN::Interop {

enum class SliceColors { kAuto, kSequential, kDiverging, kGray };

struct SliceOptions {
  int axis = 2;             ///< 0, 1, 2 for x, y, z
  std::optional<double> at; ///< world position on the axis; the middle of the channel's active box otherwise
  int size = 512;           ///< pixels along the longer side of the plane, without scale and margin
  bool nearest = false;     ///< the nearest sample in place of a linear blend
  int depth = 1 << 20; ///< of the deepest tiles drawn; above roots, tiles are made of their children's values
  bool gradient = false;   ///< the length of the gradient in world space, always of the linear blend
  int component = -1;      ///< of vectors; -1 for their length
  bool indexSpace = false; ///< along the grid's own axes, every voxel a square; `at` is an index then
  std::optional<std::pair<double, double>> range = {}; ///< of the colours
  double percentile = 99.5; ///< without a range: share of the pixels that colours tell apart
  SliceColors colors = SliceColors::kAuto;
  std::string title = {}; ///< a line above the picture, to which the plane is added; cut to its width
};

struct Slice {
  Image image;    ///< the plane with a scale beside it
  double at = 0;  ///< world position of the samples drawn
  double low = 0; ///< range of the numbers drawn
  double high = 0;
  double top = 0; ///< value of the last colour; below `high` where few pixels lie far above the others
  std::int64_t drawn = 0; ///< pixels that show a sample; the others lie where the tree has no tile
  double bottom = 0;      ///< value of the first colour
};

inline constexpr int kSmallestSlice = 16;
inline constexpr int kLargestSlice = 16384;

/// Draws the plane over the active box of the channel: each pixel shows the field at its middle, blended
/// linearly between samples, in the deepest tile down to a depth; integers and, above the deepest depth,
/// other types than float show their nearest samples. A sample lies in the middle of its pixels, as it does
/// when the nearest is drawn. Across x the picture's axes are y and z, across y they are x and z, across z
/// they are x and y; the second one points up.
///
/// The plane is one of world space: a turned grid is cut where it stands, and a voxel that is no cube is
/// drawn as long as it is. Pixels without a tile, and those beyond the active box of a turned grid, are grey.
///
/// Where both signs matter zero is white. Otherwise colours end at the value that `percentile` of the pixels
/// stay below, and begin at the lowest, or at the one that as few pixels stay below if it lies far off: a few
/// bright or dark spots do not leave all else alike.
/// @error std::invalid_argument for a channel that is unknown or has no active voxel, for a position that
/// misses the active box, and for a component that the channel lacks.
VLN_API Slice drawSlice(VdbVolume const& volume, std::string const& channel,
                        SliceOptions const& options = {});

} // namespace VLN::Interop
