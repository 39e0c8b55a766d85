// amrLevels(): the tiles of a tree as levels of boxes, as formats with adaptive meshes want them.
//
//   a block of 8 x 8 x 8 tiles, 32 samples wide    one box where half of its tiles are there, else
//   its blocks of 4 x 4 x 4 tiles                  one box each where a quarter is there, else
//   its blocks of 2 x 2 x 2 tiles                  one box each where half is there, else
//   its tiles                                      one box each
//
// A box also holds places that have no tile at its depth. So that each box lies in boxes of the depth above,
// these count as tiles there.
#pragma once

#include "GeometryVolume/tiletree/Container.h"
#include "Interop/VdbImport.h"

#include <cstdint>
#include <vector>

namespace VLN::Interop {

struct VLN_API AmrLevel {
  int depth = 0;
  int width = 1;               ///< of a sample
  std::vector<IndexBox> boxes; ///< of samples of that depth, in order of z, y and x of their blocks
  std::int64_t samples() const;
};

/// One level for each depth from the first that has tiles to the last. Boxes of a level do not overlap, all
/// samples of all tiles lie in them, and what lies in a box lies in one of the level above.
VLN_API std::vector<AmrLevel> amrLevels(TileTree3D::Container<TileTree3D::PowerOfTwoTraits> const& tree);

} // namespace VLN::Interop
