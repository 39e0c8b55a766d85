// IteratorBase: walks all elements of a channel, depth by depth and tile by tile. Tiles and depths without
// elements are passed over.
#pragma once

#include "GeometryVolume/tiletree/Traits.h"
#include "GeometryVolume/tiletree/TreeIndex.h"

#include <cstddef>
#include <cstdint>
#include <string> // what brings iterator tags, at no cost beside the strings of every component

namespace VLN::TileTree3D {

/// Made by a channel's begin() and end().
template <class TD, class VecIterator, class Reference, class Pointer, class ChannelPointer>
class IteratorBase {
public:
  using iterator_category = std::forward_iterator_tag;
  using value_type = typename TD::value_type;
  using difference_type = std::ptrdiff_t;
  using reference = Reference;
  using pointer = Pointer;

  /// The end.
  IteratorBase() = default;
  IteratorBase(ChannelPointer channel, TreeIndex const& start)
      : m_channel(channel)
      , m_tile(start) {
    if (start.valid()) increment(false);
  }
  IteratorBase(IteratorBase const&) = default;
  IteratorBase& operator=(IteratorBase const&) = default;
  virtual ~IteratorBase() = default;

  Reference operator*() const { return *m_current; }
  Pointer operator->() const { return &*m_current; }

  IteratorBase& operator++() {
    ++m_current;
    ++m_position;
    if (m_current == m_end) {
      ++m_tile.index;
      increment(true);
    }
    return *this;
  }
  IteratorBase operator++(int) {
    IteratorBase const before = *this;
    ++*this;
    return before;
  }
  /// Moves by `n` elements, forward or back. Beyond either end it becomes the end.
  /// @pre Every tile holds kSize elements.
  IteratorBase& operator+=(std::int64_t n) {
    std::int64_t const size = TD::kSize;
    std::int64_t const total = m_channel->tileCount(-1) * size;
    std::int64_t const from =
        m_tile.valid() ? m_channel->treeIndexToIndex(m_tile) * size + m_position : total;
    std::int64_t const to = from + n;
    if (to < 0 || to >= total) {
      becomeEnd();
      return *this;
    }
    m_tile = m_channel->indexToTreeIndex(to / size);
    m_tileCount = m_channel->tileCount(m_tile.depth);
    enterTile();
    m_position = to % size;
    m_current += m_position;
    return *this;
  }

  bool operator==(IteratorBase const& b) const {
    return m_tile == b.m_tile && (!m_tile.valid() || m_current == b.m_current);
  }

  TreeIndex const& tile() const { return m_tile; }
  /// Position in the tile.
  std::int64_t position() const { return m_position; }

private:
  /// From the present tile, or from the first of the present depth, to the next one that holds elements.
  void increment(bool keepTile) {
    for (;; keepTile = false, ++m_tile.depth) {
      if (!keepTile) {
        while (m_tile.depth < kChannelDepths && m_channel->tileCount(m_tile.depth) == 0) ++m_tile.depth;
        m_tile.index = 0;
      }
      if (m_tile.depth >= kChannelDepths) return becomeEnd();
      m_tileCount = m_channel->tileCount(m_tile.depth);
      while (m_tile.index < m_tileCount && m_channel->elementCount(m_tile) == 0) ++m_tile.index;
      if (m_tile.index < m_tileCount) return enterTile();
    }
  }
  void enterTile() {
    auto data = m_channel->tileData(m_tile);
    m_current = data.begin();
    m_end = data.end();
    m_position = 0;
  }
  void becomeEnd() {
    m_tile = TreeIndex();
    m_current = m_end = VecIterator();
    m_position = 0;
  }

  ChannelPointer m_channel = nullptr;
  TreeIndex m_tile;
  VecIterator m_current{}, m_end{};
  std::int64_t m_position = 0;
  std::int64_t m_tileCount = 0;
};

} // namespace VLN::TileTree3D
