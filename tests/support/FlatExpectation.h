// What the conversion must find in a tree: root depth, numbers, halos, blocks. A slow model, tile by tile
// from the description; the tree is asked for nothing but its records and for tiles at positions.
#pragma once

#include "support/FlatVolume.h"

#include <cstdint>
#include <map>
#include <optional>
#include <tuple>
#include <vector>

namespace Support {

struct FlatExpectation {
  struct Entry {
    std::int64_t index = -1;
    int depth = -1;
    int3 corner{0, 0, 0};
    /// Coalescing: complete levels below, height of the branch, and whether a block above swallows the tile.
    int full = 0, height = 0;
    bool marked = false;
    bool head = false;
    bool halo = false;
    std::uint32_t number = 0xFFFFFFFFu;
    int blockLevels() const { return head ? full : 0; }
  };
  using Place = std::tuple<int, int, int, int>; // depth, corner

  FlatExpectation(FlatTree const& tree, FlatOptions const& options, std::optional<int> contentDepth = {});

  /// A root lies deeper than the root depth: the answer is an empty handle.
  bool refused = false;
  int rootDepth = 0, maxDepth = 28;
  int3 llc{0, 0, 0};
  std::array<std::uint32_t, 30> accum{};
  /// Every tile of the depths that are converted.
  std::map<Place, Entry> entries;
  /// Those with numbers, in their order.
  std::vector<Entry const*> tiles;
  std::uint64_t haloTiles = 0, nonHaloTiles = 0;

  Entry const* find(int3 const& corner, int depth) const {
    auto const it = entries.find({depth, corner.x, corner.y, corner.z});
    return it == entries.end() ? nullptr : &it->second;
  }
  Entry const* child(Entry const& e, int slot) const {
    int const half = FlatTraits::width(e.depth) / 2;
    return e.depth == 28 ? nullptr
                         : find({e.corner.x + (slot & 1) * half, e.corner.y + (slot >> 1 & 1) * half,
                                 e.corner.z + (slot >> 2) * half},
                                e.depth + 1);
  }
  Entry const* parent(Entry const& e) const {
    return e.depth == 0
               ? nullptr
               : find({FlatTraits::align(e.corner.x, e.depth - 1), FlatTraits::align(e.corner.y, e.depth - 1),
                       FlatTraits::align(e.corner.z, e.depth - 1)},
                      e.depth - 1);
  }
  /// The nearest ancestor with a number.
  Entry const* numberedParent(Entry const& e) const {
    Entry const* p = parent(e);
    while (p && p->marked) p = parent(*p);
    return p;
  }

private:
  void chooseRootDepth(FlatTree const& tree, FlatOptions const& options, std::optional<int> contentDepth);
  void findBlocks();
  void number(FlatOptions const& options);
  void placeHalos(FlatTree const& tree, FlatOptions const& options);
};

} // namespace Support
