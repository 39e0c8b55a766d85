// RootIterator: walks the roots of a container.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/tiletree/TreeIndex.h"

#include <cstddef>
#include <string> // what brings iterator tags, at no cost beside the strings of every component
#include <utility>

namespace VLN::TileTree3D {

/// In the order of corners and depths. A root is a pair of its corner with its depth, and its index.
/// @pre The container and its roots stay as they are.
class VLN_API RootIterator {
public:
  using iterator_category = std::forward_iterator_tag;
  using value_type = std::pair<VoxelCoord const, TreeIndex>;
  using difference_type = std::ptrdiff_t;
  using reference = value_type const&;
  using pointer = value_type const*;

  RootIterator() = default;

  reference operator*() const;
  pointer operator->() const { return &**this; }
  RootIterator& operator++();
  RootIterator operator++(int) {
    RootIterator const before = *this;
    ++*this;
    return before;
  }
  bool operator==(RootIterator const&) const = default;

private:
  template <class> friend class Container;
  explicit RootIterator(void const* place)
      : m_place(place) {}

  void const* m_place = nullptr; ///< in the container's own table
};

} // namespace VLN::TileTree3D
