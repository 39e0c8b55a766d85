// What a grid stores, by place: the leaves of its tree, digests of them, and tiles wider than a voxel.
#pragma once

#include "Interop/VdbLeafPlacesImpl.h"
#include "Interop/VdbPackedLeavesImpl.h"

#include <memory>
#include <type_traits>
#include <vector>

namespace VLN::Interop {

/// A tile of the file's tree that is active, or has another value than the background.
template <class Value> struct WideTile {
  Coord corner;
  int width;
  Value value;
  bool active;
};

/// Of a block in its leaf.
inline int blockNumber(int3 const& corner) {
  return (corner.x & 4) | (corner.y & 4) >> 1 | (corner.z & 4) >> 2;
}

/// @threads Readers may share one.
template <class TreeT> struct StoredGrid {
  using Leaf = typename TreeT::LeafNodeType;
  using Value = typename TreeT::ValueType;

  TreeT const& tree;                    ///< whose leaves have their numbers as transient data
  std::shared_ptr<PackedLeaves> packed; ///< null where leaves have buffers
  Value background;
  std::vector<Leaf const*> leaves;        ///< along the Z-shaped curve
  std::vector<LeafDigest<Value>> digests; ///< by the leaves' numbers
  std::vector<WideTile<Value>> wide;      ///< along the Z-shaped curve

  LeafDigest<Value> const& digestOf(Leaf const& leaf) const { return digests[leaf.transientData()]; }
  /// The voxels of a leaf, unless they are bits.
  Value const* valuesOf(Leaf const& leaf) const {
    if constexpr (std::is_same_v<Value, bool>)
      return nullptr;
    else if (packed)
      return static_cast<Value const*>(packed->begin()) + std::size_t(leaf.transientData()) * Leaf::SIZE;
    else
      return leaf.buffer().data();
  }
  /// Has the voxels of a leaf fetched: leaves are small, and mostly over before the processor sees a pattern.
  static void fetch(Value const* values) {
    if constexpr (!std::is_same_v<Value, bool>)
      for (std::size_t byte = 0; byte < Leaf::SIZE * sizeof(Value); byte += 64)
        __builtin_prefetch(reinterpret_cast<char const*>(values) + byte);
  }
  /// The same for the leaf behind one, if it is known where that lies.
  void fetchBehind(Leaf const& leaf) const {
    if (packed && leaf.transientData() + 1 < leaves.size()) fetch(valuesOf(leaf) + Leaf::SIZE);
  }
  Value valueAt(PlaceSearch<TreeT>& search, Coord const& c) const {
    auto const place = search.at(c);
    if (!place.leaf) return place.value;
    auto const n = Leaf::coordToOffset(c);
    if constexpr (std::is_same_v<Value, bool>)
      return place.leaf->getValue(n);
    else
      return valuesOf(*place.leaf)[n];
  }
};

} // namespace VLN::Interop
