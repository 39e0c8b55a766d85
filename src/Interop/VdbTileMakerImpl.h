// Makes the tiles of a channel from what a grid stores.
#pragma once

#include "Interop/VdbStoredGridImpl.h"
#include "Interop/VdbTreeImpl.h"
#include "Interop/VdbZeroTilesImpl.h"

#include <algorithm>

namespace VLN::Interop {

/// @threads Each with one of its own.
template <class TreeT, class ChannelT> class TileMaker {
public:
  using Element = typename ChannelT::value_type;

  TileMaker(StoredGrid<TreeT> const& grid, ChannelT const& channel, ZeroTiles<Element>& zeros)
      : m_grid(grid)
      , m_channel(channel)
      , m_zeros(zeros)
      , m_search(grid.tree) {}

  /// @param made Empty.
  void operator()(int3 const& corner, int depth, TileVector<Element>& made) {
    if (VdbTraits::width(depth) <= kLeafWidth) {
      lookUp(leafPlaceOf(corner));
      auto const& place = m_last.place;
      bool const deepest = depth == VdbTraits::kMaxDepth;
      if (place.leaf ? deepest && isZeroBlock(*place.leaf, corner) : m_last.isZero)
        return m_zeros.make(m_run, made);
      if (deepest || !place.leaf) {
        made = m_channel.unwrittenTile();
        if (place.leaf)
          fill(corner, depth, made.data());
        else
          TileTree3D::Internal::fillRun(made.data(), ChannelT::kSize, toElement(place.value));
        return;
      }
    }
    Element samples[ChannelT::kSize];
    fill(corner, depth, samples);
    if (areZeros(samples, ChannelT::kSize)) return m_zeros.make(m_run, made);
    made = m_channel.unwrittenTile();
    std::copy(std::begin(samples), std::end(samples), made.data());
  }

private:
  using Leaf = typename TreeT::LeafNodeType;
  using Value = typename TreeT::ValueType;

  /// The place of a leaf that was looked up last: tiles that are filled one after another share it.
  struct LastPlace {
    int3 corner{1, 1, 1}; ///< at first none that a place has
    LeafPlace<TreeT> place;
    bool isZero = false;           ///< where there is no leaf
    Value const* values = nullptr; ///< of the leaf, unless they are bits
  };

  /// Whether all bits of the voxels in a block are zero.
  bool isZeroBlock(Leaf const& leaf, int3 const& corner) const {
    auto const& digest = m_grid.digestOf(leaf);
    int const block = blockNumber(corner);
    return (digest.uniform >> 8 * block & 1) && areZeros(&digest.first[block], 1);
  }
  void lookUp(int3 const& corner) {
    if (m_last.corner != corner) lookUpAnew(corner);
  }
  [[gnu::noinline]] void lookUpAnew(int3 const& corner) {
    m_last.place = m_search.at(toCoord(corner));
    m_last.corner = corner;
    if (m_last.place.leaf) {
      m_last.values = m_grid.valuesOf(*m_last.place.leaf);
      m_grid.fetchBehind(*m_last.place.leaf); // mostly the next to be looked up
    } else
      m_last.isZero = areZeros(&m_last.place.value, 1);
  }

  void fill(int3 const& corner, int depth, Element* samples) {
    int const step = VdbTraits::width(depth) / VdbTraits::kTDW;
    if (step >= kLeafWidth) {
      for (int k = 0; k < 4; ++k)
        for (int j = 0; j < 4; ++j)
          for (int i = 0; i < 4; ++i)
            *samples++ =
                toElement(m_grid.valueAt(m_search, toCoord(corner).offsetBy(i * step, j * step, k * step)));
      return;
    }
    // Leaf by leaf, or what stands in its place: each holds `count` samples along an axis.
    int const count = std::min(4, kLeafWidth / step);
    for (int k = 0; k < 4; k += count)
      for (int j = 0; j < 4; j += count)
        for (int i = 0; i < 4; i += count)
          fillFromPlace(toCoord(corner).offsetBy(i * step, j * step, k * step), step, count,
                        samples + i + 4 * (j + 4 * k));
  }
  void fillFromPlace(Coord const& at, int step, int count, Element* samples) {
    lookUp(leafPlaceOf(toInt3(at)));
    Leaf const* const leaf = m_last.place.leaf;
    auto const fill = [&](auto const& valueAt) {
      for (int k = 0; k < count; ++k)
        for (int j = 0; j < count; ++j)
          for (int i = 0; i < count; ++i)
            samples[i + 4 * (j + 4 * k)] = toElement(Value(valueAt((64 * i + 8 * j + k) * step)));
    };
    if (!leaf) return fill([&](int) { return m_last.place.value; });
    auto const first = static_cast<int>(Leaf::coordToOffset(at));
    if constexpr (std::is_same_v<Value, bool>) { // kept as bits
      fill([&](int n) { return leaf->getValue(static_cast<openvdb::Index>(first + n)); });
    } else {
      Value const* const values = m_last.values + first;
      if (step == 1) return copyBlock(values, samples);
      fill([&](int n) { return values[n]; });
    }
  }

  StoredGrid<TreeT> const& m_grid;
  ChannelT const& m_channel;
  ZeroTiles<Element>& m_zeros;
  typename ZeroTiles<Element>::Run m_run;
  PlaceSearch<TreeT> m_search;
  LastPlace m_last;
};

} // namespace VLN::Interop
