// Iterators over all tiles and over all voxels of a container, depth by depth in index order.
#pragma once

#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/tiletree/Voxel.h"

#include <cstddef>
#include <cstdint>
#include <type_traits>

namespace VLN::TileTree3D {

/// Walks the arrays of all depths from 0 to kMaxDepth, dead tiles included.
template <class Reference, class Pointer, class ContainerT> class TileIteratorBase {
public:
  using iterator_category = std::bidirectional_iterator_tag;
  using value_type = std::remove_cvref_t<Reference>;
  using difference_type = std::int64_t;
  using reference = Reference;
  using pointer = Pointer;

  TileIteratorBase() = default;
  explicit TileIteratorBase(ContainerT& container)
      : m_container(&container) {}
  virtual ~TileIteratorBase() = default;
  TileIteratorBase(TileIteratorBase const&) = default;
  TileIteratorBase& operator=(TileIteratorBase const&) = default;

  /// Goes to the first tile, or behind the last one.
  void init(bool atBegin) {
    m_position = 0;
    if (atBegin) {
      for (m_depth = 0; m_depth < ContainerT::kMaxDepth && count(m_depth) == 0;) ++m_depth;
      m_count = count(m_depth);
    } else {
      m_depth = ContainerT::kMaxDepth;
      m_position = m_count = count(m_depth);
    }
    settle();
  }
  /// Moves `n` tiles forward or backward across empty depths; returns whether it moved all the way.
  bool increment(std::int64_t n) {
    std::int64_t position = m_position + n;
    bool whole = true;
    while (position >= m_count && m_depth < ContainerT::kMaxDepth) {
      position -= m_count;
      m_count = count(++m_depth);
    }
    if (position > m_count) whole = false, position = m_count;
    while (position < 0) {
      if (firstDepth()) {
        whole = false, position = 0;
        break;
      }
      m_count = count(--m_depth);
      position += m_count;
    }
    m_position = position;
    settle();
    return whole;
  }

  TileIteratorBase& operator++() {
    increment(1);
    return *this;
  }
  TileIteratorBase& operator--() {
    increment(-1);
    return *this;
  }
  TileIteratorBase& operator+=(std::int64_t n) {
    increment(n);
    return *this;
  }
  Reference operator*() const { return *m_tile; }
  Pointer operator->() const { return m_tile; }
  bool operator==(TileIteratorBase const& b) const {
    return m_depth == b.m_depth && m_position == b.m_position;
  }

  int depth() const { return m_depth; }
  std::int64_t tileIndex() const { return m_position; }
  TreeIndex treeIndex() const { return {m_position, m_depth}; }
  bool valid() const { return m_tile != nullptr; }

private:
  std::int64_t count(int d) const { return m_container->tileCount(d); }
  bool firstDepth() const {
    for (int d = 0; d < m_depth; ++d) {
      if (count(d) > 0) return false;
    }
    return true;
  }
  void settle() {
    m_tile = m_position < m_count ? const_cast<Pointer>(&m_container->tile(m_position, m_depth)) : nullptr;
  }

  std::int64_t m_position = 0;
  std::int64_t m_count = 0;
  std::int32_t m_depth = -1;
  Pointer m_tile = nullptr;
  ContainerT* m_container = nullptr;
};

/// Yields each voxel of each tile, slots in order.
template <class TraitsT> class ConstVoxelIterator {
  using ContainerT = Container<TraitsT>;

public:
  using iterator_category = std::forward_iterator_tag;
  using value_type = Voxel<TraitsT>;
  using difference_type = std::int64_t;
  using reference = Voxel<TraitsT> const&;
  using pointer = Voxel<TraitsT> const*;

  ConstVoxelIterator() = default;
  ConstVoxelIterator(typename ContainerT::ConstTileIterator tile, int slot)
      : m_tile(tile)
      , m_slot(slot) {
    settle();
  }

  ConstVoxelIterator& operator++() { return *this += 1; }
  ConstVoxelIterator& operator+=(std::int64_t n) {
    std::int64_t const slot = m_slot + n;
    m_tile.increment(slot / TraitsT::kTileSize);
    m_slot = static_cast<int>(slot % TraitsT::kTileSize);
    settle();
    return *this;
  }
  Voxel<TraitsT> const& operator*() const { return m_voxel; }
  Voxel<TraitsT> const* operator->() const { return &m_voxel; }
  bool operator==(ConstVoxelIterator const& b) const { return m_tile == b.m_tile && m_slot == b.m_slot; }

private:
  void settle() {
    if (m_tile.valid())
      m_voxel = Voxel<TraitsT>(*m_tile, m_slot);
    else
      m_voxel = {}, m_slot = 0;
  }

  typename ContainerT::ConstTileIterator m_tile;
  int m_slot = 0;
  Voxel<TraitsT> m_voxel;
};

template <class TraitsT>
typename Container<TraitsT>::ConstTileIterator Container<TraitsT>::cbeginTiles(std::int64_t n) const {
  ConstTileIterator it(*this);
  it.init(true);
  if (n > 0) it.increment(n);
  return it;
}
template <class TraitsT>
typename Container<TraitsT>::ConstTileIterator Container<TraitsT>::cendTiles() const {
  ConstTileIterator it(*this);
  it.init(false);
  return it;
}
template <class TraitsT>
typename Container<TraitsT>::TileIterator Container<TraitsT>::beginTiles(std::int64_t n) {
  handTilesOut();
  TileIterator it(*this);
  it.init(true);
  if (n > 0) it.increment(n);
  return it;
}
template <class TraitsT> typename Container<TraitsT>::TileIterator Container<TraitsT>::endTiles() {
  TileIterator it(*this);
  it.init(false);
  return it;
}
template <class TraitsT> ConstVoxelIterator<TraitsT> Container<TraitsT>::cbegin(std::int64_t n) const {
  VoxelIterator it(cbeginTiles(), 0);
  if (n > 0) it += n;
  return it;
}
template <class TraitsT> ConstVoxelIterator<TraitsT> Container<TraitsT>::cend() const {
  return {cendTiles(), 0};
}

} // namespace VLN::TileTree3D
