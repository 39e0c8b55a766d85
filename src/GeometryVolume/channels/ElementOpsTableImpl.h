// ElementOps: what a pass over tiles needs of an element type, behind function pointers. Everything that only
// moves bytes is shared by element size instead (HaloKernels).
#pragma once

#include "GeometryVolume/channels/HaloKernelsImpl.h"
#include "GeometryVolume/channels/HaloRegionsImpl.h"
#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/tiletree/TreeIndex.h"

#include <algorithm>
#include <cstddef>

namespace VLN::TileTree3D::Internal {

/// A target tile whose regions are filled by trilinear reads of its parent's tile of the same layout.
struct ParentBlend {
  void* target;
  void const* parent; ///< coordinate (0,0,0) of the parent's tile
  HaloTable const* table;
  HaloAxis const* i; ///< by coordinate, that of the halo before it
  HaloAxis const* j;
  HaloAxis const* k;
};

/// One trilinear read: the corners with i fastest, and the fractions.
struct CornerBlend {
  void const* corners[8];
  double fraction[3];
};

/// Trilinear reads for a box of a target tile, of samples that lie anywhere.
struct BoxBlend {
  void* target; ///< first element of the box
  int targetWidth;
  std::array<int, 3> count;
  void const* const* samples; ///< with i fastest
  std::array<int, 3> sampleCount;
  std::array<int const*, 3> at; ///< along an axis, which sample is the low one of an element
  std::array<double const*, 3> fraction;
  float scale;
};

/// Most elements of such a box along an axis.
inline constexpr int kLargestBlend = HaloTable::kLargestTileWidth;

struct ElementOps {
  std::size_t size;
  HaloKernels const* kernels;
  /// Elements of a tile; null for one that the arrays lack, or that holds fewer than `count`.
  void const* (*elements)(void const* tileArrays, TreeIndex const& at, int count);
  /// The same for several tiles of a depth; an index of -1 stands for no tile.
  /// @cost Without branches that depend on which there are.
  void (*elementsOf)(void const* tileArrays, int depth, std::int64_t const* indices, int n, int count,
                     void const** found);
  /// Begins to read what elementsOf() will.
  void (*fetchRecords)(void const* tileArrays, int depth, std::int64_t const* indices, int n);
  /// Regions by HaloTable::around.
  void (*blendParent)(ParentBlend const&, std::uint64_t regions);
  void (*blendCorners)(CornerBlend const&, void* out);
  /// blendCorners() for a box, and scale() where the scale is not 1.
  void (*blendBox)(BoxBlend const&);
  /// Every component of an element times a factor, in place.
  void (*scale)(void* element, float factor);
  /// The constant in every component.
  void (*broadcast)(float constant, void* out);
  double (*distance)(void const* a, void const* b);
};

/// A channel's tiles, with the element type erased.
struct UntypedTiles {
  ElementOps const* ops = nullptr;
  void const* arrays = nullptr; ///< TileArrays of the element type
  void const* defaultValue = nullptr;
  int minDepth = 0, maxDepth = 0;
  int tileSize = 0; ///< elements that a tile must hold to count as present

  bool inRange(int depth) const { return depth >= minDepth && depth <= maxDepth; }
  /// Null outside the range of depths and for tiles without data.
  void const* elements(TreeIndex const& at) const {
    return inRange(at.depth) ? ops->elements(arrays, at, tileSize) : nullptr;
  }
  void elements(int depth, std::int64_t const* indices, int n, void const** found) const {
    if (inRange(depth))
      ops->elementsOf(arrays, depth, indices, n, tileSize, found);
    else
      for (int i = 0; i < n; ++i) found[i] = nullptr;
  }
  /// Begins to read or write a tile's elements.
  void fetch(TreeIndex const& at) const {
    auto const* const first = static_cast<std::byte const*>(elements(at));
    if (!first) return;
    constexpr std::size_t kLine = 64, kMost = 16;
    std::size_t const lines = (static_cast<std::size_t>(tileSize) * ops->size + kLine - 1) / kLine;
    for (std::size_t n = 0; n < std::min(lines, kMost); ++n) __builtin_prefetch(first + n * kLine, 1);
  }
  void fetchRecords(int depth, std::int64_t const* indices, int n) const {
    if (inRange(depth)) ops->fetchRecords(arrays, depth, indices, n);
  }
};

} // namespace VLN::TileTree3D::Internal
