#include "Interop/VdbGridSourceImpl.h"

#include "GeometryVolume/core/Parallel.h"
#include "Interop/VdbLeafImpl.h"

#include <algorithm>
#include <bit>
#include <iterator>

namespace VLN::Interop {

namespace {

using Velorn::Math::int3;

constexpr int kMaxDepth = VdbTraits::kMaxDepth;
constexpr int kMostRootsAnAxis = 64;

void grow(IndexBox& box, IndexBox const& other) {
  if (other.empty()) return;
  box.grow(other.min), box.grow(other.max);
}

void sortCorners(std::vector<int3>& corners) {
  if (!std::is_sorted(corners.begin(), corners.end(), TileTree3D::MortonOrder()))
    std::sort(corners.begin(), corners.end(), TileTree3D::MortonOrder());
}

struct PlaceOrder {
  bool operator()(PlaceBlocks const& a, PlaceBlocks const& b) const {
    return TileTree3D::mortonLess(a.place, b.place);
  }
};

} // namespace

RootPlaces::RootPlaces(std::vector<int3> const& corners, int depth)
    : m_corners(corners)
    , m_depth(depth)
    , m_shift(std::countr_zero(static_cast<unsigned>(VdbTraits::width(depth)))) {
  if (corners.empty()) return;
  for (std::size_t a = 0; a < 3; ++a) {
    auto const [low, high] =
        std::minmax_element(corners.begin(), corners.end(), [a](int3 const& b, int3 const& c) {
          return b[static_cast<int>(a)] < c[static_cast<int>(a)];
        });
    // With a margin: places beside the outermost ones are asked for too.
    m_first[a] = (std::int64_t((*low)[static_cast<int>(a)]) >> m_shift) - 1;
    m_count[a] = (std::int64_t((*high)[static_cast<int>(a)]) >> m_shift) + 2 - m_first[a];
  }
  m_held.resize(m_count[0] * m_count[1] * m_count[2]);
  for (int3 const& c : corners) m_held[numberOf(c)] = 1;
  for (std::size_t side = 1; side < 8; ++side)
    m_step[side] = ((side & 1 ? m_count[1] : 0) + (side & 2 ? 1 : 0)) * m_count[2] + (side & 4 ? 1 : 0);
}

GridSummary joinSummaries(GridSummary a, GridSummary const& b) {
  grow(a.stored, b.stored), grow(a.active, b.active);
  a.shallowest = std::min(a.shallowest, b.shallowest);
  a.activeVoxels += b.activeVoxels;
  a.activeTiles += b.activeTiles;
  return a;
}

std::unique_ptr<GridSource> makeGridSource(GridToRead const& from, std::string& type) {
  type = from.grid->type() == "Tree_ptdataidx32_5_4_3" ? "points" : from.grid->type();
  // A grid of another node configuration has the value type, but none of the nodes.
  auto source = makeScalarSource(from);
  return source ? std::move(source) : makeVectorSource(from);
}

int rootDepth(std::vector<GridSummary> const& grids) {
  IndexBox box;
  int depth = kMaxDepth;
  for (auto const& s : grids) {
    grow(box, s.stored);
    depth = std::min(depth, s.shallowest);
  }
  if (box.empty()) return depth;
  // What a blend that begins in the voxel before the box meets belongs to it, and so may one root behind it:
  // see collectBeyondRoots().
  auto tooWide = [&](int d) {
    for (int a = 0; a < 3; ++a) {
      std::int64_t const low = std::max(box.min[a] - 1, VdbTraits::kMinTileCoord), high = box.max[a] - 1;
      std::int64_t const first = VdbTraits::align(static_cast<int>(low), d),
                         last = VdbTraits::align(static_cast<int>(high), d);
      std::int64_t const beyond = last + VdbTraits::width(d) <= VdbTraits::kMaxTileCoord;
      if ((last - first) / VdbTraits::width(d) + 1 + beyond > kMostRootsAnAxis) return true;
    }
    return false;
  };
  while (depth > 0 && tooWide(depth)) --depth;
  return depth;
}

int cheapestRootDepth(std::vector<int3> leaves, std::vector<int3> tiles, int deepest) {
  // A few tiles more or less are not worth the search.
  if (tiles.size() < leaves.size() / 8) return deepest;
  sortCorners(leaves);
  sortCorners(tiles);
  auto const raise = [](std::vector<int3>& corners, int depth) { // stays sorted
    for (int3& c : corners)
      c = {VdbTraits::align(c.x, depth), VdbTraits::align(c.y, depth), VdbTraits::align(c.z, depth)};
    corners.erase(std::unique(corners.begin(), corners.end()), corners.end());
  };
  int best = deepest;
  std::size_t least = ~std::size_t(0), below = 0;
  std::vector<int3> roots;
  for (int depth = deepest; depth >= 0; --depth) {
    raise(leaves, depth);
    raise(tiles, depth);
    roots.clear();
    std::set_union(leaves.begin(), leaves.end(), tiles.begin(), tiles.end(), std::back_inserter(roots),
                   TileTree3D::MortonOrder());
    if (below + roots.size() < least) least = below + roots.size(), best = depth;
    below += leaves.size();
    if (below >= least) break;
  }
  return best;
}

void sortPlaces(BlockList& list) {
  std::sort(list.begin(), list.end(), PlaceOrder());
  std::size_t kept = 0;
  for (PlaceBlocks const& b : list)
    if (kept > 0 && list[kept - 1].place == b.place)
      list[kept - 1].blocks |= b.blocks;
    else
      list[kept++] = b;
  list.resize(kept);
}

BlockList unionOf(BlockList const& a, BlockList const& b) {
  BlockList both;
  both.reserve(std::max(a.size(), b.size()));
  auto i = a.begin(), j = b.begin();
  while (i != a.end() && j != b.end()) {
    if (i->place == j->place)
      both.push_back({i->place, i->blocks | j->blocks}), ++i, ++j;
    else
      both.push_back(PlaceOrder()(*i, *j) ? *i++ : *j++);
  }
  both.insert(both.end(), i, a.end());
  both.insert(both.end(), j, b.end());
  return both;
}

std::uint64_t countBlocks(BlockList const& list) {
  std::uint64_t count = 0;
  for (PlaceBlocks const& b : list) count += static_cast<std::uint64_t>(std::popcount(b.blocks));
  return count;
}

std::vector<int3> cornersOf(BlockList const& list) {
  std::vector<int3> corners;
  corners.reserve(countBlocks(list));
  for (auto const& [place, blocks] : list)
    for (unsigned rest = blocks; rest != 0; rest &= rest - 1) {
      int const n = std::countr_zero(rest);
      corners.push_back({place.x + (n & 4), place.y + 2 * (n & 2), place.z + 4 * (n & 1)});
    }
  return corners;
}

void addSorted(std::vector<int3>& corners, std::vector<int3> others) {
  sortCorners(others);
  std::vector<int3> all;
  all.reserve(corners.size() + others.size());
  std::set_union(corners.begin(), corners.end(), others.begin(), others.end(), std::back_inserter(all),
                 TileTree3D::MortonOrder());
  all.erase(std::unique(all.begin(), all.end()), all.end());
  corners.swap(all);
}

bool tilesFollowLeaves(VdbContainer const& container) {
  auto const follow = [&](int depth) {
    // Those of one leaf may come in any order.
    auto const place = [&](std::int64_t n) {
      int3 const corner = container.tile(n, depth).tijk();
      return depth == kMaxDepth ? leafPlaceOf(corner) : corner;
    };
    return parallelReduce(
        1, std::max<std::int64_t>(1, container.tileCount(depth)), 4096, true,
        [&](std::int64_t begin, std::int64_t end) {
          for (std::int64_t n = begin; n < end; ++n)
            if (comesBefore<LeadingAxis::kZ>(place(n), place(n - 1))) return false;
          return true;
        },
        [](bool a, bool b) { return a && b; });
  };
  for (int depth = 0; depth <= kMaxDepth; ++depth)
    if (!follow(depth)) return false;
  return true;
}

void completeCorners(TileCorners& corners, int rootDepth) {
  auto at = [&](int depth) -> std::vector<int3>& { return corners[depth]; };
  // From the bottom up, each tile brings its parent.
  std::vector<int3> parents, all;
  for (int depth = kMaxDepth; depth >= rootDepth; --depth) {
    sortCorners(at(depth));
    if (!parents.empty()) {
      all.clear();
      std::set_union(at(depth).begin(), at(depth).end(), parents.begin(), parents.end(),
                     std::back_inserter(all), TileTree3D::MortonOrder());
      at(depth).swap(all);
    }
    at(depth).erase(std::unique(at(depth).begin(), at(depth).end()), at(depth).end());
    if (depth == rootDepth) break;
    parents.clear();
    for (int3 const& c : at(depth)) {
      int3 const parent{VdbTraits::align(c.x, depth - 1), VdbTraits::align(c.y, depth - 1),
                        VdbTraits::align(c.z, depth - 1)};
      if (parents.empty() || parents.back() != parent) parents.push_back(parent);
    }
  }
}

} // namespace VLN::Interop
