// The voxels of all leaves of a grid in one block of memory, in place of a buffer for each.
#pragma once

#include <cstddef>

namespace VLN::Interop {

/// Leaf n of a tree, counted in the order of the tiles made of it, has its voxels behind those of the leaves
/// before it, and n for its transient data. Pages of large blocks come huge where the system has such, and
/// may go before the block does.
class PackedLeaves {
public:
  /// @error std::bad_alloc.
  explicit PackedLeaves(std::size_t bytes);
  ~PackedLeaves();
  PackedLeaves(PackedLeaves const&) = delete;
  PackedLeaves& operator=(PackedLeaves const&) = delete;

  void* begin() const { return m_begin; }
  /// Gives the memory of the first `bytes` back: what was there must not be read again.
  void drop(std::size_t bytes);

private:
  void dropAll();

  char* m_begin = nullptr;
  std::size_t m_size;
  std::size_t m_dropped = 0;
};

} // namespace VLN::Interop
