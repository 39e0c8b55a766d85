#include "GeometryVolume/tiletree/TileAccessor.h"

#include "GeometryVolume/tiletree/ContainerAppendImpl.h"
#include "GeometryVolume/tiletree/NeighborSearchImpl.h"

#include <algorithm>
#include <bit>

namespace VLN::TileTree3D {

template <class TraitsT> auto ConstTileAccessorOf<TraitsT>::invalidTile() const -> TileType const& {
  static TileType const none;
  return m_container ? m_container->invalidTile() : none;
}

template <class TraitsT>
TreeIndex ConstTileAccessorOf<TraitsT>::findNear(int i, int j, int k, int depth) const {
  if (m_depth < 0) return {};
  if (auto const* table = m_container->neighborData()) {
    auto const w = static_cast<std::uint32_t>(TraitsT::width(m_depth));
    auto const side = [w](int c, int corner) { return c < corner ? 0 : distance(c, corner) < w ? 1 : 2; };
    auto const entry =
        static_cast<std::size_t>(9 * side(i, m_corner.x) + 3 * side(j, m_corner.y) + side(k, m_corner.z));
    TreeIndex const next = (*table)[m_depth][m_index][entry];
    if (next.depth >= 0 && next.depth <= depth && m_container->tile(next).contains(i, j, k)) {
      setCursor(m_container->tile(next));
      return next;
    }
  }
  // The deepest depth at which the cursor's corner and the point lie in one tile.
  int common = std::min(m_depth, depth);
  if constexpr (TraitsT::kTW == 2) {
    common = std::min(common, commonDepth({i, j, k}, m_corner));
  } else {
    auto const shares = [&](int d) {
      return TraitsT::quotient(TraitsT::offset(i), d) == TraitsT::quotient(TraitsT::offset(m_corner.x), d) &&
             TraitsT::quotient(TraitsT::offset(j), d) == TraitsT::quotient(TraitsT::offset(m_corner.y), d) &&
             TraitsT::quotient(TraitsT::offset(k), d) == TraitsT::quotient(TraitsT::offset(m_corner.z), d);
    };
    while (common > 0 && !shares(common)) --common;
  }
  if (common < m_pathTop) {
    // Above the known path: the acceleration grid is the shorter way in; else complete the path upwards.
    if (int const grid = m_container->gridDepth(); grid >= 0 && depth >= grid) return {};
    while (m_pathTop > common) {
      std::int64_t const parent = m_container->tile(m_path[m_pathTop], m_pathTop).parentIndex();
      if (parent < 0) return {};
      m_path[--m_pathTop] = parent;
    }
  }
  return {m_path[common], common};
}

template <class TraitsT>
TreeIndex ConstTileAccessorOf<TraitsT>::descend(TreeIndex at, int i, int j, int k, int depth) const {
  if (at.depth < m_pathTop || m_depth < 0) m_pathTop = at.depth;
  m_path[at.depth] = at.index;
  at = m_container->descend(at, i, j, k, depth, m_path.data());
  m_depth = at.depth, m_index = at.index;
  m_corner = TraitsT::align(int3{i, j, k}, at.depth);
  return at;
}

template <class TraitsT>
TreeIndex ConstTileAccessorOf<TraitsT>::find(int i, int j, int k, int depth, bool exact) const {
  if (!m_container || depth < 0 || !TraitsT::inDomain(i, j, k)) return {};
  TreeIndex at;
  if (auto const* table = m_container->lookupTable()) {
    at = table->find(i, j, k);
    if (at.depth == table->kNoTile) return {};
    // Few levels up are a shorter way than one down from above. A root on the way is no answer.
    constexpr int kFewLevels = 3;
    if (at.depth > depth && at.depth - depth <= kFewLevels) {
      while (at.depth > depth && at.index >= 0) at = {m_container->tile(at).parentIndex(), at.depth - 1};
      if (at.index < 0) at = {};
    }
    // A tile of the last depth may have deeper ones below it; other answers are complete.
    if (at.depth == depth || (at.depth >= 0 && at.depth < depth && at.depth < table->lastDepth)) {
      setCursor(at, i, j, k);
      return exact && at.depth != depth ? TreeIndex{} : at;
    }
    if (at.depth > depth) at = {};
  }
  if (at.valid())
    m_pathTop = at.depth;
  else
    at = findNear(i, j, k, std::min(depth, TraitsT::kMaxDepth));
  bool far = !at.valid();
  if (far) at = m_container->entry(i, j, k, depth);
  if (at.valid()) {
    int const start = at.depth;
    if (far) m_pathTop = start;
    at = descend(at, i, j, k, depth);
    far |= at.depth - start >= kLongSearch;
  }
  if (m_countsSearches && (m_searches += far ? kShortInLong : 1) >= kShortInLong * kSearchesTold)
    m_searches = 0, m_container->countLongSearches(kSearchesTold);
  return exact && at.depth != depth ? TreeIndex{} : at;
}

template <class TraitsT>
auto ConstTileAccessorOf<TraitsT>::tileNeighbor(TileType const& t, NeighborDirection n) const
    -> TileType const& {
  if (t.depth() < 0 || t.index() < 0) return invalidTile();
  if (auto const* table = m_container->neighborData()) {
    TreeIndex const at = (*table)[t.depth()][t.index()][n];
    return at.valid() ? m_container->tile(at) : m_container->invalidTile();
  }
  return tileNeighbor(t, neighborOffset(n), t.depth(), false);
}

template <class TraitsT>
auto ConstTileAccessorOf<TraitsT>::tileNeighbor(TileType const& t, int di, int dj, int dk, int depth,
                                                bool exact) const -> TileType const& {
  std::int64_t const w = TraitsT::isDepth(depth) ? TraitsT::width(depth) : 0;
  std::int64_t const p[3] = {t.ti() + w * di, t.tj() + w * dj, t.tk() + w * dk};
  for (std::int64_t const c : p) {
    if (c < TraitsT::kMinTileCoord || c > TraitsT::kMaxTileCoord) return m_container->invalidTile();
  }
  return tile(static_cast<int>(p[0]), static_cast<int>(p[1]), static_cast<int>(p[2]), depth, exact);
}

template <class TraitsT>
void ConstTileAccessorOf<TraitsT>::tileNeighbors(TileType const& t, std::vector<TreeIndex>& list, int depth,
                                                 bool recursive) const {
  if (!t.valid()) return;
  NeighborSearch<TraitsT> search(*this, list);
  if (recursive)
    search.aroundLeafVoxels(t);
  else
    search.aroundTile(t, depth);
}

template <class TraitsT>
void ConstTileAccessorOf<TraitsT>::tiles(std::vector<TreeIndex>& list, int minDepth, int maxDepth) const {
  for (int d = std::max(minDepth, 0); d <= std::min(maxDepth, TraitsT::kMaxDepth); ++d) {
    for (std::int64_t n = 0; n < m_container->tileCount(d); ++n) {
      if (m_container->tile(n, d).valid()) list.push_back({n, d});
    }
  }
}

template <class TraitsT>
[[gnu::always_inline]] inline bool TileAccessorOf<TraitsT>::addNextTo(int i, int j, int k) {
  if constexpr (TraitsT::kTW == 2) {
    if (this->m_depth != kDeepest || this->m_pathTop == kDeepest) return false;
    constexpr std::uint32_t w = TraitsT::width(kDeepest);
    int3 const& last = this->m_corner;
    auto const bits = static_cast<std::uint32_t>((i ^ last.x) | (j ^ last.y) | (k ^ last.z));
    if (bits >= 2 * w) return false;
    constexpr auto kMask = static_cast<int>(~(w - 1));
    int3 const corner{i & kMask, j & kMask, k & kMask};
    int const slot = int((i & w) != 0) | int((j & w) != 0) << 1 | int((k & w) != 0) << 2;
    std::int64_t const parent = this->m_path[kDeepest - 1];
    std::int64_t index = this->m_container->tile(parent, kDeepest - 1).childIndex(slot);
    if (index < 0)
      index = ContainerBuilder<TraitsT>(*m_mutableContainer).addDeepestTile(parent, slot, corner).index;
    this->m_index = this->m_path[kDeepest] = index;
    this->m_corner = corner;
    return true;
  }
  return false;
}

template <class TraitsT>
auto TileAccessorOf<TraitsT>::addTile(int i, int j, int k, int depth) -> TileType const& {
  if (depth == kDeepest && addNextTo(i, j, k)) return this->m_container->tile(this->m_index, kDeepest);
  return addFar(i, j, k, depth);
}

template <class TraitsT>
auto TileAccessorOf<TraitsT>::addFar(int i, int j, int k, int depth) -> TileType const& {
  ContainerT& tree = *m_mutableContainer;
  if (!TraitsT::isDepth(depth) || !TraitsT::inDomain(i, j, k)) return tree.invalidTile();
  if (depth == this->m_depth && this->holds(i, j, k, depth)) return this->current();
  TreeIndex at = this->findNear(i, j, k, depth);
  if (!at.valid()) return this->setCursor(tree.tile(tree.addTile(i, j, k, depth)));
  if constexpr (TraitsT::kTW == 2) {
    auto& way = m_wayDown;
    auto& path = this->m_path;
    if (depth == at.depth && depth < this->m_depth) {
      way.point = this->m_corner, way.from = depth, way.to = this->m_depth;
      std::copy(path.begin() + way.from + 1, path.begin() + way.to + 1, way.path.begin() + way.from + 1);
    } else if (at.depth == this->m_depth && at.depth >= way.from && at.depth < way.to) {
      int const common = std::min({way.to, depth, this->commonDepth({i, j, k}, way.point)});
      if (common > at.depth) {
        std::copy(way.path.begin() + at.depth + 1, way.path.begin() + common + 1,
                  path.begin() + at.depth + 1);
        at = {path[common], common};
      }
    }
  }
  at = this->descend(at, i, j, k, depth);
  if (at.depth != depth) growBelow(at, i, j, k, depth);
  return this->current();
}

template <class TraitsT>
void TileAccessorOf<TraitsT>::growBelow(TreeIndex at, int i, int j, int k, int depth) {
  ContainerT& tree = *m_mutableContainer;
  this->m_index = ContainerBuilder<TraitsT>(tree).addTileBelow(at, i, j, k, depth).index;
  for (int d = at.depth + 1; d <= depth; ++d) this->m_path[d] = tree.tileCount(d) - 1;
  this->m_depth = depth;
  this->m_corner = TraitsT::align(int3{i, j, k}, depth);
}

template <class TraitsT>
auto TileAccessorOf<TraitsT>::addTile(int3 const& min, int3 const& max) -> TileType const& {
  if (!TraitsT::inDomain(min) || !TraitsT::inDomain(max)) return m_mutableContainer->invalidTile();
  auto const share = [&](int d) {
    for (int a = 0; a < 3; ++a) {
      if (TraitsT::align(min[a], d) != TraitsT::align(max[a], d)) return false;
    }
    return true;
  };
  int depth = 0;
  while (depth < TraitsT::kMaxDepth && share(depth + 1)) ++depth;
  return addTile(min, depth);
}

template <class TraitsT> void TileAccessorOf<TraitsT>::addTiles(int3 const& min, int3 const& max, int depth) {
  if (!TraitsT::isDepth(depth)) return;
  std::int64_t const w = TraitsT::width(depth);
  // Positions below the domain hold nothing, so that the walk starts inside it.
  std::int64_t first[3], last[3];
  for (int a = 0; a < 3; ++a) {
    std::int64_t const low = std::max(min[a], TraitsT::kMinTileCoord);
    if (low > TraitsT::kMaxTileCoord) return;
    first[a] = TraitsT::align(static_cast<int>(low), depth);
    last[a] = std::min<std::int64_t>(max[a], std::int64_t(TraitsT::kMaxTileCoord) + 1);
    if (min[a] >= max[a]) return;
  }
  for (std::int64_t i = first[0]; i < last[0]; i += w) {
    for (std::int64_t j = first[1]; j < last[1]; j += w) {
      for (std::int64_t k = first[2]; k < last[2]; k += w)
        addTile(static_cast<int>(i), static_cast<int>(j), static_cast<int>(k), depth);
    }
  }
}

template <class TraitsT> void TileAccessorOf<TraitsT>::rereadCursor() {
  ContainerT const& tree = *m_mutableContainer;
  m_wayDown.to = -1;
  if (this->m_depth >= 0 && this->m_index < tree.tileCount(this->m_depth) &&
      tree.tile(this->m_index, this->m_depth).valid())
    this->setCursor(tree.tile(this->m_index, this->m_depth));
  else
    this->resetCursor();
}

template <class TraitsT>
void TileAccessorOf<TraitsT>::removeTile(TreeIndex const& at, bool withBranch, TileMoves* moves) {
  m_mutableContainer->removeTile(at, withBranch, moves);
  rereadCursor();
}

template <class TraitsT>
void TileAccessorOf<TraitsT>::removeTiles(TileIndexLists const& lists, bool withBranch, TileMoves* moves) {
  TileIndexLists copy = lists;
  m_mutableContainer->removeTiles(copy, withBranch, moves);
  rereadCursor();
}

template <class TraitsT>
void TileAccessorOf<TraitsT>::removeTiles(std::vector<std::int64_t> const& indices, int depth,
                                          bool withBranch, TileMoves* moves) {
  TileIndexLists lists(TraitsT::kDepths);
  if (TraitsT::isDepth(depth)) lists[depth] = indices;
  removeTiles(lists, withBranch, moves);
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template class VLN_API ConstTileAccessorOf<TraitsT>;                                                       \
  template class VLN_API TileAccessorOf<TraitsT>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
