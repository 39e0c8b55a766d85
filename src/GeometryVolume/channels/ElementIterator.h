// ElementIteratorBase: a walk over all elements of a channel, depth by depth and tile by tile.
#pragma once

#include "GeometryVolume/tiletree/Traits.h"
#include "GeometryVolume/tiletree/TreeIndex.h"

#include <cstddef>
#include <cstdint>
#include <iterator>
#include <type_traits>

namespace VLN::TileTree3D {

/// Tiles without elements and depths without tiles are not seen.
/// @pre The channel's tiles keep their sizes during the walk.
template <class TD, class VecIterator, class Reference, class Pointer, class ChannelPointer>
class ElementIteratorBase {
public:
  using iterator_category = std::forward_iterator_tag;
  using value_type = std::remove_cv_t<std::remove_reference_t<Reference>>;
  using difference_type = std::ptrdiff_t;
  using reference = Reference;
  using pointer = Pointer;

  ElementIteratorBase() = default;
  ElementIteratorBase(ElementIteratorBase const&) = default;
  ElementIteratorBase& operator=(ElementIteratorBase const&) = default;
  virtual ~ElementIteratorBase() = default;

  Reference operator*() const { return *m_element; }
  Pointer operator->() const { return &*m_element; }
  ElementIteratorBase& operator++() {
    ++m_element, ++m_position;
    if (m_element == m_end) {
      ++m_at.index;
      increment(true);
    }
    return *this;
  }
  ElementIteratorBase operator++(int) {
    ElementIteratorBase const old = *this;
    ++*this;
    return old;
  }
  /// Moves over whole tiles of kSize elements: for channels that hold kSize in every tile. Past the last
  /// element lies the end, before the first the first.
  ElementIteratorBase& operator+=(std::int64_t n) {
    std::int64_t const tiles = m_channel->tileCount(-1);
    std::int64_t flat =
        n + (m_at.valid() ? m_channel->treeIndexToIndex(m_at) * TD::kSize + m_position : tiles * TD::kSize);
    if (flat >= tiles * TD::kSize) {
      becomeEnd();
      return *this;
    }
    flat = flat < 0 ? 0 : flat;
    m_at = m_channel->indexToTreeIndex(flat / TD::kSize);
    enterTile();
    m_position = flat % TD::kSize;
    m_element += m_position;
    return *this;
  }
  bool operator==(ElementIteratorBase const& b) const {
    return m_at == b.m_at && (!m_at.valid() || m_element == b.m_element);
  }

  /// The tile of the current element; invalid at the end.
  TreeIndex const& treeIndex() const { return m_at; }
  /// The current element's position in its tile.
  std::int64_t position() const { return m_position; }
  ElementTreeIndex elementTreeIndex() const { return {m_at, static_cast<std::int32_t>(m_position)}; }

private:
  template <class, class, int, int> friend class Channel;

  ElementIteratorBase(ChannelPointer channel, bool atBegin)
      : m_channel(channel) {
    if (!atBegin) return;
    m_at = {0, 0};
    increment(false);
  }

  /// Goes to the next tile that has elements: from the current tile on, or from the current depth's first.
  void increment(bool keepTile) {
    for (;; keepTile = false, ++m_at.depth) {
      if (!keepTile) {
        while (m_at.depth < kChannelDepths && m_channel->tileCount(m_at.depth) == 0) ++m_at.depth;
        m_at.index = 0;
      }
      if (m_at.depth >= kChannelDepths) return becomeEnd();
      std::int64_t const tiles = m_channel->tileCount(m_at.depth);
      while (m_at.index < tiles && m_channel->elementCount(m_at) == 0) ++m_at.index;
      if (m_at.index < tiles) return enterTile();
    }
  }
  void enterTile() {
    auto& vector = m_channel->tileVector(m_at);
    m_element = vector.begin();
    m_end = vector.end();
    m_position = 0;
    m_tileCount = m_channel->tileCount(m_at.depth);
  }
  void becomeEnd() {
    m_at = {};
    m_element = m_end = VecIterator();
    m_position = m_tileCount = 0;
  }

  ChannelPointer m_channel = nullptr;
  TreeIndex m_at;
  VecIterator m_element{}, m_end{};
  std::int64_t m_position = 0;
  std::int64_t m_tileCount = 0;
};

} // namespace VLN::TileTree3D
