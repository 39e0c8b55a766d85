// Tiles of a channel that tells which voxels of a grid are active.
#pragma once

#include "Interop/VdbGridSourceImpl.h"
#include "Interop/VdbLeafPlacesImpl.h"
#include "Interop/VdbZeroTilesImpl.h"

#include <optional>

namespace VLN::Interop {

/// @threads Each with one of its own.
template <class TreeT> class StateMaker {
public:
  StateMaker(TreeT const& tree, StateChannel const& channel, ZeroTiles<unsigned char>& zeros)
      : m_search(tree)
      , m_channel(channel)
      , m_zeros(zeros) {}

  /// @param made Empty.
  void operator()(int3 const& corner, int depth, TileVector<unsigned char>& made) {
    Coord const origin = toCoord(corner);
    if (depth == VdbTraits::kMaxDepth) {
      auto const* const leaf = leafAt(toCoord(leafPlaceOf(corner)));
      if (!leaf) return m_zeros.make(m_run, made);
      made = m_channel.unwrittenTile();
      return writeBlockStates(*leaf, static_cast<int>(Leaf::coordToOffset(origin)), made.data());
    }
    // Depth of the file's tree whose tiles are as wide as a sample: 2, 1 or 0 for 8, 128 or 4096 voxels.
    int const step = VdbTraits::width(depth) / VdbTraits::kTDW;
    int const level = step == kNodeWidths[0]   ? 2
                      : step == kNodeWidths[1] ? 1
                      : step == kNodeWidths[2] ? 0
                                               : -2;
    if (level == -2) return m_zeros.make(m_run, made);
    made = m_channel.newTile();
    unsigned char* states = made.data();
    for (int k = 0; k < 4; ++k)
      for (int j = 0; j < 4; ++j)
        for (int i = 0; i < 4; ++i, ++states) {
          auto const place = m_search.at(origin.offsetBy(i * step, j * step, k * step));
          if (place.level == level && place.active) *states = kVdbStateActive;
        }
  }

private:
  using Leaf = typename TreeT::LeafNodeType;

  /// Tiles that are made one after another share a leaf.
  Leaf const* leafAt(Coord const& corner) {
    if (m_corner != corner) {
      m_leaf = m_search.at(corner).leaf;
      m_corner = corner;
    }
    return m_leaf;
  }

  PlaceSearch<TreeT> m_search;
  StateChannel const& m_channel;
  ZeroTiles<unsigned char>& m_zeros;
  ZeroTiles<unsigned char>::Run m_run;
  std::optional<Coord> m_corner;
  Leaf const* m_leaf = nullptr;
};

} // namespace VLN::Interop
