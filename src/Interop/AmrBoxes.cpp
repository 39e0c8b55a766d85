#include "Interop/AmrBoxesImpl.h"

#include <algorithm>
#include <bitset>
#include <tuple>

namespace VLN::Interop {

namespace {

using Traits = TileTree3D::PowerOfTwoTraits;
using Tree = TileTree3D::Container<Traits>;

/// A tile by its place in the lattice of its depth, counted from the low end of the domain.
struct Place {
  std::int32_t x, y, z;
  bool operator==(Place const&) const = default;
};

constexpr int kBlock = 8; ///< tiles across the widest box
constexpr int kShift = 3;
using Block = std::bitset<kBlock * kBlock * kBlock>;

/// By block, and within a block by z, y, x.
bool before(Place const& a, Place const& b) {
  auto const key = [](Place const& p) {
    return std::tuple(p.z >> kShift, p.y >> kShift, p.x >> kShift, p.z, p.y, p.x);
  };
  return key(a) < key(b);
}

class LevelMaker {
public:
  LevelMaker(int depth, std::vector<Place>& above)
      : m_above(above)
      , m_tilesAcross(Traits::kDomainWidth / Traits::width(depth)) {
    m_level.depth = depth;
    m_level.width = Traits::width(depth) / Traits::kTDW;
    m_low = Traits::kMinTileCoord / m_level.width;
  }

  AmrLevel run(std::vector<Place>& tiles) {
    std::sort(tiles.begin(), tiles.end(), before);
    tiles.erase(std::unique(tiles.begin(), tiles.end()), tiles.end());
    for (std::size_t n = 0; n < tiles.size();) {
      Place const low{tiles[n].x & -kBlock, tiles[n].y & -kBlock, tiles[n].z & -kBlock};
      m_block.reset();
      for (; n < tiles.size() && (tiles[n].x & -kBlock) == low.x && (tiles[n].y & -kBlock) == low.y &&
             (tiles[n].z & -kBlock) == low.z;
           ++n)
        m_block.set(bit(tiles[n].x - low.x, tiles[n].y - low.y, tiles[n].z - low.z));
      divide(low, 0, 0, 0, kBlock);
    }
    return std::move(m_level);
  }

private:
  static std::size_t bit(int x, int y, int z) {
    return static_cast<std::size_t>(x + kBlock * (y + kBlock * z));
  }

  int count(int x, int y, int z, int across) const {
    int found = 0;
    for (int k = z; k < z + across; ++k)
      for (int j = y; j < y + across; ++j)
        for (int i = x; i < x + across; ++i) found += m_block.test(bit(i, j, k));
    return found;
  }

  void divide(Place const& low, int x, int y, int z, int across) {
    int const found = count(x, y, z, across);
    if (found == 0) return;
    // The shallowest depths have fewer tiles than the widest box.
    bool const fits = across <= m_tilesAcross;
    int const share = across == kBlock / 2 ? 4 : 2;
    if (fits && found * share >= across * across * across)
      return add({low.x + x, low.y + y, low.z + z}, across);
    int const half = across / 2;
    for (int n = 0; n < 8; ++n)
      divide(low, x + (n & 1) * half, y + (n >> 1 & 1) * half, z + (n >> 2) * half, half);
  }

  void add(Place const& tile, int across) {
    auto const sample = [&](int t) { return m_low + t * Traits::kTDW; };
    int const wide = across * Traits::kTDW;
    IndexBox box;
    box.min = {sample(tile.x), sample(tile.y), sample(tile.z)};
    box.max = {box.min.x + wide, box.min.y + wide, box.min.z + wide};
    m_level.boxes.push_back(box);
    if (m_level.depth == 0) return;
    for (int z = tile.z / 2; z <= (tile.z + across - 1) / 2; ++z)
      for (int y = tile.y / 2; y <= (tile.y + across - 1) / 2; ++y)
        for (int x = tile.x / 2; x <= (tile.x + across - 1) / 2; ++x) m_above.push_back({x, y, z});
  }

  std::vector<Place>& m_above;
  int m_tilesAcross;
  int m_low = 0; ///< of the domain, in samples
  AmrLevel m_level;
  Block m_block;
};

} // namespace

std::int64_t AmrLevel::samples() const {
  std::int64_t sum = 0;
  for (IndexBox const& box : boxes)
    sum += std::int64_t(box.max.x - box.min.x) * (box.max.y - box.min.y) * (box.max.z - box.min.z);
  return sum;
}

std::vector<AmrLevel> amrLevels(Tree const& tree) {
  std::vector<AmrLevel> levels;
  std::vector<Place> tiles, above;
  int first = 0;
  while (first < Traits::kMaxDepth && tree.tileCount(first) == 0) ++first;
  for (int depth = Traits::kMaxDepth; depth >= first; --depth) {
    tiles.swap(above);
    above.clear();
    int const width = Traits::width(depth);
    auto const place = [&](int corner) {
      return static_cast<std::int32_t>(Traits::offset(corner) / static_cast<std::uint32_t>(width));
    };
    for (std::int64_t n = 0; n < tree.tileCount(depth); ++n) {
      auto const& tile = tree.tile(n, depth);
      tiles.push_back({place(tile.ti()), place(tile.tj()), place(tile.tk())});
    }
    if (tiles.empty() && levels.empty()) continue; // deeper than any tile
    levels.push_back(LevelMaker(depth, above).run(tiles));
  }
  std::reverse(levels.begin(), levels.end());
  return levels;
}

} // namespace VLN::Interop
