// ElementRows: how the elements of a tile lie in memory, without their type.
#pragma once

#include <cstddef>

namespace VLN::TileTree3D::Internal {

/// Rows of elements, rows of rows, and so on.
struct ElementRows {
  std::size_t elementSize;
  std::size_t width; ///< of elements along an axis, those of a halo too
  std::size_t first; ///< element of the tile's first sample

  /// Bytes from the first element to that of a sample.
  std::size_t offset(std::size_t i, std::size_t j, std::size_t k) const {
    return (first + i + width * (j + width * k)) * elementSize;
  }
};

} // namespace VLN::TileTree3D::Internal
