// The blocks of a grid that need tiles of their own: those in which a blend gives more than one value.
#pragma once

#include "GeometryVolume/core/Parallel.h"
#include "Interop/VdbBlocksImpl.h"
#include "Interop/VdbStoredGridImpl.h"
#include "Interop/VdbTilesRoundImpl.h"
#include "Interop/VdbTreeImpl.h"

#include <algorithm>
#include <array>
#include <optional>
#include <vector>

namespace VLN::Interop {

template <class TreeT> class UnevenBlocks {
public:
  explicit UnevenBlocks(StoredGrid<TreeT> const& grid)
      : m_grid(grid) {}

  /// Appends the blocks in leaves, which are in order, and those before them, which are not.
  /// @param leavesHaveTile Whether a wider tile lies over every leaf; else even blocks are left out only
  ///   where they hold the background.
  void collectInLeaves(bool leavesHaveTile, BlockList& inLeaves, BlockList& before) const {
    collectInParallel(
        std::int64_t(m_grid.leaves.size()), 256,
        [&](std::int64_t n, Search& search, BlockList& own, BlockList& places) {
          Leaf const& leaf = *m_grid.leaves[n];
          auto const& digest = m_grid.digestOf(leaf);
          Places round = placesRound(search, leaf.origin());
          unsigned blocks = activeBlocks(leaf);
          for (int b = 0; b < 8; ++b) {
            if (blocks >> b & 1) continue;
            int const x = b >> 2, y = b >> 1 & 1, z = b & 1;
            bool const spare = (digest.uniform >> 8 * b & 1) && round.isUniform(x, y, z) &&
                               (leavesHaveTile || sameBits(round.valueAt(x, y, z), m_grid.background));
            if (!spare) blocks |= 1u << b;
          }
          if (blocks != 0 || leavesHaveTile) own.push_back({toInt3(leaf.origin()), blocks});
          collectBefore(
              round, leaf.origin(), [](auto const& place) { return !place.digest; }, places);
        },
        inLeaves, before);
  }

  /// The blocks at the surfaces of wide tiles: those inside at the high sides, and those before the low ones.
  /// Inside such a block a value goes over to another one within one voxel.
  /// @param planned Tiles that there are already. Grows by those that are looked at.
  void collectShells(std::uint64_t mostTiles, std::uint64_t& planned, BlockList& out) const {
    for (int const width : kNodeWidths) {
      std::vector<Wide const*> exposed = exposedTiles(width);
      // A shell grows with the square of the width: where memory ends, the widest tiles stay coarse.
      int const across = width / kBlockWidth;
      planned += std::uint64_t(exposed.size()) * 6 * std::uint64_t(across) * std::uint64_t(across);
      if (planned > mostTiles) return;
      if (width == kLeafWidth) {
        collectInParallel(
            std::int64_t(exposed.size()), 96,
            [&](std::int64_t n, Search& search, BlockList& part) {
              collectRound(search, exposed[n]->corner, part);
            },
            out);
        continue;
      }
      auto const rows = std::int64_t(across) + 1;
      collectInParallel(
          std::int64_t(exposed.size()) * rows, 1,
          [&](std::int64_t n, Search& search, BlockList& part) {
            collectSlice(search, exposed[n / rows]->corner, across, static_cast<int>(n % rows) - 1, part);
          },
          out);
    }
  }

private:
  using Leaf = typename TreeT::LeafNodeType;
  using Value = typename TreeT::ValueType;
  using Wide = WideTile<Value>;
  using Search = PlaceSearch<TreeT>;
  using Places = LeafPlaces<TreeT>;

  Places placesRound(Search& search, Coord const& corner) const {
    return Places(search, m_grid.digests.data(), corner);
  }

  /// Appends what `collect(n, accessor, part...)` finds for each n to each of the lists, in order.
  template <class Collect, class... Lists>
  void collectInParallel(std::int64_t count, std::int64_t grain, Collect const& collect,
                         Lists&... lists) const {
    using Part = std::array<BlockList, sizeof...(Lists)>;
    std::vector<Part> parts(static_cast<std::size_t>(chunkCount(0, count, grain)));
    parallelChunks(0, count, grain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
      Search search(m_grid.tree);
      Part& part = parts[chunk];
      for (std::int64_t n = begin; n < end; ++n)
        std::apply([&](auto&... list) { collect(n, search, list...); }, part);
    });
    std::size_t n = 0;
    auto const append = [&](BlockList& list) {
      std::size_t size = list.size();
      for (Part const& part : parts) size += part[n].size();
      list.reserve(size);
      for (Part const& part : parts) list.insert(list.end(), part[n].begin(), part[n].end());
      ++n;
    };
    (append(lists), ...);
  }
  /// A block of the place that lies x, y, z blocks from another one's first.
  static int3 blockOf(int3 const& place, int x, int y, int z) {
    return {place.x + kBlockWidth * x, place.y + kBlockWidth * y, place.z + kBlockWidth * z};
  }
  /// The first of all blocks of a place.
  static int3 placeOf(Coord const& leaf, int x, int y, int z) {
    return {leaf.x() + kLeafWidth * x, leaf.y() + kLeafWidth * y, leaf.z() + kLeafWidth * z};
  }

  /// Appends those of a place's blocks whose blends give more than one value.
  /// @param blocks Bits, numbered as in PlaceBlocks.
  /// @param x, y, z The place, counted from that which `places` lie round.
  static void collectUnlessUniform(Places& places, Coord const& origin, int x, int y, int z, unsigned blocks,
                                   BlockList& out) {
    int3 const place = placeOf(origin, x, y, z);
    unsigned found = 0;
    for (int n = 0; n < 8; ++n) {
      if (!(blocks >> n & 1)) continue;
      int const bx = n >> 2, by = n >> 1 & 1, bz = n & 1;
      if (VdbTraits::inDomain(blockOf(place, bx, by, bz)) &&
          !places.isUniform(2 * x + bx, 2 * y + by, 2 * z + bz))
        found |= 1u << n;
    }
    if (found == 0) return;
    if (!out.empty() && out.back().place == place)
      out.back().blocks |= found;
    else
      out.push_back({place, found});
  }

  /// The blocks before the low sides of a leaf or its place, at the places that are `asked` for.
  template <class Asked>
  static void collectBefore(Places& places, Coord const& origin, Asked const& asked, BlockList& out) {
    // Of a place before on some axes those that touch: on these axes the second ones.
    constexpr unsigned kSecond[3] = {0xF0, 0xCC, 0xAA};
    for (int n = 1; n < 8; ++n) {
      int const x = n & 1, y = n >> 1 & 1, z = n >> 2;
      if (!asked(places.at(-x, -y, -z))) continue;
      unsigned const touching =
          (x ? kSecond[0] : 0xFFu) & (y ? kSecond[1] : 0xFFu) & (z ? kSecond[2] : 0xFFu);
      collectUnlessUniform(places, origin, -x, -y, -z, touching, out);
    }
  }

  /// The tiles of a width with another value than the background, beside which lies something else.
  std::vector<Wide const*> exposedTiles(int width) const {
    std::vector<Wide const*> list;
    for (Wide const& tile : m_grid.wide)
      if (tile.width == width && !sameBits(tile.value, m_grid.background)) list.push_back(&tile);
    std::vector<char> exposed(list.size());
    std::vector<std::size_t> const runs = runsInNodes(list);
    // The narrow tiles of most grids all have one value: where a node has many, it is looked at whole.
    bool const alike = width == kLeafWidth && list.size() > 8 * runs.size() &&
                       std::all_of(list.begin(), list.end(),
                                   [&](Wide const* tile) { return sameBits(tile->value, list[0]->value); });
    std::optional<TilesRound<TreeT>> round;
    if (alike) round.emplace(m_grid.tree, list[0]->value);
    parallelFor(0, std::int64_t(runs.size()),
                [&](std::int64_t begin, std::int64_t end) {
                  Search search(m_grid.tree);
                  for (auto run = static_cast<std::size_t>(begin); run < static_cast<std::size_t>(end);
                       ++run) {
                    std::size_t const last = run + 1 < runs.size() ? runs[run + 1] : list.size();
                    if (!alike) {
                      for (std::size_t n = runs[run]; n < last; ++n) exposed[n] = isExposed(search, *list[n]);
                      continue;
                    }
                    auto const inside = round->inside(search, *search.lower(list[runs[run]]->corner));
                    for (std::size_t n = runs[run]; n < last; ++n) {
                      auto const slot = Search::Lower::coordToOffset(list[n]->corner);
                      exposed[n] = !(inside[slot / 64] >> slot % 64 & 1);
                    }
                  }
                },
                {});
    std::size_t kept = 0;
    for (std::size_t n = 0; n < list.size(); ++n)
      if (exposed[n]) list[kept++] = list[n];
    list.resize(kept);
    return list;
  }
  /// Where the tiles of another node begin: those of one lie side by side.
  static std::vector<std::size_t> runsInNodes(std::vector<Wide const*> const& tiles) {
    std::vector<std::size_t> runs;
    for (std::size_t n = 0; n < tiles.size(); ++n) {
      auto const nodeOf = [](Wide const* tile) { return tile->corner & -kNodeWidths[1]; };
      if (n == 0 || nodeOf(tiles[n]) != nodeOf(tiles[n - 1])) runs.push_back(n);
    }
    return runs;
  }
  /// Whether one of a tile's 26 neighbours of the same width is finer, or has another value.
  bool isExposed(Search& search, Wide const& tile) const {
    if (auto const* const lower = search.lower(tile.corner); lower && Search::isInside(*lower, tile.corner))
      return isExposed(*lower, Search::Lower::coordToOffset(tile.corner), tile.value);
    int const level = tile.width == kNodeWidths[0] ? 2 : tile.width == kNodeWidths[1] ? 1 : 0;
    for (int n = 0; n < 27; ++n) {
      Coord const c = tile.corner.offsetBy((n / 9 - 1) * tile.width, (n / 3 % 3 - 1) * tile.width,
                                           (n % 3 - 1) * tile.width);
      auto const place = search.at(c);
      if (place.level > level || !sameBits(place.value, tile.value)) return true;
    }
    return false;
  }

  /// The same of a tile whose neighbours are all in one node.
  static bool isExposed(typename Search::Lower const& lower, openvdb::Index slot, Value const& value) {
    auto const* const table = lower.getTable();
    for (int x = -1; x < 2; ++x)
      for (int y = -1; y < 2; ++y)
        for (int z = -1; z < 2; ++z) {
          openvdb::Index const beside = slot + static_cast<openvdb::Index>(256 * x + 16 * y + z);
          if (lower.isChildMaskOn(beside) || !sameBits(Value(table[beside].getValue()), value)) return true;
        }
    return false;
  }

  /// The blocks in and before a tile that is as wide as a leaf. Those in leaves have been looked at, and
  /// those in tiles like this one come with them.
  void collectRound(Search& search, Coord const& corner, BlockList& out) const {
    Places places = placesRound(search, corner);
    // The first block of the tile blends with nothing else.
    collectUnlessUniform(places, corner, 0, 0, 0, 0xFE, out);
    collectBefore(
        places, corner,
        [&](auto const& place) {
          return !place.digest && !(place.isNarrow && !sameBits(place.value, m_grid.background));
        },
        out);
  }
  /// The blocks of the shell of a wider tile with one z, of -1 to across - 1.
  void collectSlice(Search& search, Coord const& corner, int across, int z, BlockList& out) const {
    auto const outer = [&](int c) { return c == -1 || c == across - 1; };
    for (int y = -1; y < across; ++y) {
      int const step = outer(z) || outer(y) ? 1 : across;
      for (int x = -1; x < across; x += step) {
        int3 const place = leafPlaceOf(blockOf(toInt3(corner), x, y, z));
        Places places = placesRound(search, toCoord(place));
        collectUnlessUniform(places, toCoord(place), 0, 0, 0, 1u << (4 * (x & 1) + 2 * (y & 1) + (z & 1)),
                             out);
      }
    }
  }

  StoredGrid<TreeT> const& m_grid;
};

} // namespace VLN::Interop
