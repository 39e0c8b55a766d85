// Moves of boxes of elements whose type takes no part: one set of kernels for each element size.
#pragma once

#include <array>
#include <cstddef>

namespace VLN::TileTree3D::Internal {

/// A box inside two flat arrays. Pointers lie on the first element; widths are those of the tiles.
struct BoxMove {
  void* target;
  int targetWidth;
  void const* source;
  int sourceWidth;
  std::array<int, 3> count;
};

/// A box whose elements come from anywhere in a source tile, axis by axis: element (i,j,k) takes the one at
/// i[i] + j[j] + k[k]. The source may be the target's own tile, read where the box does not write.
struct BoxGather {
  void* target;
  int targetWidth;
  void const* source;
  int const* i;
  int const* j;
  int const* k;
  std::array<int, 3> count;
};

/// A whole target tile from its own source tile and those round it. Directions that the layout lacks are not
/// read.
struct TileMove {
  void* target;
  int sourceWidth;
  int const* offsets;        ///< by direction: flat index of the first element that is read there
  void const* const* around; ///< the tile's place in a PointerBlock, all of whose pointers can be read
};

/// Layouts of a target that TileMove has kernels for.
enum HaloTileKind { kHaloTileExtended, kHaloTileHalo1, kHaloTileKinds, kHaloTileOther = kHaloTileKinds };

struct HaloKernels {
  void (*copy)(BoxMove const&);
  void (*fill)(BoxMove const&); ///< every element takes the one at `source`
  void (*gather)(BoxGather const&);
  void (*tile4[kHaloTileKinds])(TileMove const&); ///< for W = 4
  void (*tile5[kHaloTileKinds])(TileMove const&); ///< for W = 5
};

/// Sizes of elements that there are kernels for, rising. A type of a new size does not compile before its
/// size is here.
inline constexpr std::array<std::size_t, 10> kHaloElementSizes{1, 2, 4, 8, 12, 16, 24, 32, 36, 64};
inline constexpr std::size_t kLargestElement = kHaloElementSizes.back();

/// @pre One of these sizes.
HaloKernels const& haloKernels(std::size_t elementSize);

} // namespace VLN::TileTree3D::Internal
