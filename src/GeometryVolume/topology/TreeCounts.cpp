#include "GeometryVolume/topology/TreeCounts.h"

#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/Traits.h"

#include <algorithm>
#include <numeric>

namespace VLN::TileTree3D {

template <int Depths> void TreeCounts<Depths>::countTiles(Component const& tree, std::uint32_t newElements) {
  // Room first: either all depths follow or none.
  for (int d = 0; d < Depths; ++d) {
    auto& tiles = elementsPerTile[d];
    auto const n = static_cast<std::size_t>(tree.tileCount(d));
    if (n > tiles.capacity()) tiles.reserve(std::max(n, 2 * tiles.size()));
  }
  tileCountTotal = tree.tileCount(-1);
  for (int d = 0; d < Depths; ++d) {
    tileCounts[d] = tree.tileCount(d);
    elementsPerTile[d].resize(tileCounts[d], newElements);
  }
}

template <int Depths> void TreeCounts<Depths>::countElements(Component const& source, std::uint32_t atLeast) {
  // What is thrown half-way leaves depths that have followed and others that have not: the sums must say so.
  struct Sums {
    TreeCounts& counts;
    bool taken = false;
    ~Sums() {
      if (taken) return;
      counts.elementCountTotal = 0;
      for (std::size_t d = 0; d < counts.elementsPerTile.size(); ++d) {
        auto const& tiles = counts.elementsPerTile[d];
        counts.elementCounts[d] = std::accumulate(tiles.begin(), tiles.end(), std::int64_t(0));
        counts.elementCountTotal += counts.elementCounts[d];
      }
    }
  } sums{*this};
  elementCountTotal = 0;
  for (int d = 0; d < Depths; ++d) {
    auto& tiles = elementsPerTile[d];
    std::int64_t const known = source.tileCount(d); // the source may cover fewer depths
    elementCounts[d] = parallelReduce(
        0, tileCounts[d], 4096, std::int64_t(0),
        [&](std::int64_t begin, std::int64_t end) {
          std::int64_t sum = 0;
          for (std::int64_t n = begin; n < end; ++n) {
            int const elements = n < known ? source.elementCount(TreeIndex{n, d}) : 0;
            sum += tiles[n] = std::max(static_cast<std::uint32_t>(elements), atLeast);
          }
          return sum;
        },
        [](std::int64_t x, std::int64_t y) { return x + y; });
    elementCountTotal += elementCounts[d];
  }
  sums.taken = true;
}

template <int Depths>
void TreeCounts<Depths>::addMemory(std::uint64_t& used, std::uint64_t& allocated) const {
  used += sizeof(*this), allocated += sizeof(*this);
  for (auto const& tiles : elementsPerTile) {
    used += tiles.size() * sizeof(std::uint32_t);
    allocated += tiles.capacity() * sizeof(std::uint32_t);
  }
}

template struct TreeCounts<PowerOfTwoTraits::kDepths>;
template struct TreeCounts<OddTraits::kDepths>;

} // namespace VLN::TileTree3D
