// The narrow tiles that grids need, gathered by the places of leaves: eight blocks lie in one, and what a
// grid needs of them fits in a byte.
#pragma once

#include "Velorn/Math.h"

#include <cstdint>
#include <vector>

namespace VLN::Interop {

struct PlaceBlocks {
  Velorn::Math::int3 place; ///< corner of the place of a leaf
  unsigned blocks = 0; ///< bit 4 x + 2 y + z for the block (x, y, z) in it; none where the place alone counts
};

/// Places along the Z-shaped curve, each once.
using BlockList = std::vector<PlaceBlocks>;

/// Sorts places and joins what there is of each.
void sortPlaces(BlockList& list);
/// What either list has.
BlockList unionOf(BlockList const& a, BlockList const& b);
std::uint64_t countBlocks(BlockList const& list);
/// Corners of blocks, along the curve.
std::vector<Velorn::Math::int3> cornersOf(BlockList const& list);

} // namespace VLN::Interop
