#include "GeometryVolume/tiletree/TileAccessor.h"

#include "GeometryVolume/tiletree/NeighborSearch.h"

namespace VLN::TileTree3D {

template <class TraitsT>
TreeIndex ConstTileAccessorOf<TraitsT>::findAncestor(int i, int j, int k, int depth) const {
  auto const* table = m_container->neighborData();
  TreeIndex at{m_index, m_depth};
  while (at.depth >= 0) {
    TileType const& t = m_container->tile(at);
    auto const serves = [&](TreeIndex const& candidate) {
      return candidate.depth >= 0 && candidate.depth <= depth &&
             m_container->tile(candidate).contains(i, j, k);
    };
    if (serves(at)) return at;
    if (table && t.valid()) {
      int const w = t.tileVoxelWidth();
      auto const side = [w](int c, int corner) {
        return c < corner ? 0 : distance(c, corner) < std::uint32_t(w) ? 1 : 2;
      };
      auto const entry =
          static_cast<std::size_t>(9 * side(i, t.ti()) + 3 * side(j, t.tj()) + side(k, t.tk()));
      TreeIndex const next =
          (*table)[static_cast<std::size_t>(at.depth)][static_cast<std::size_t>(at.index)][entry];
      if (serves(next)) return next;
    }
    if (t.isRoot()) break;
    at = t.parentTreeIndex();
  }
  return {};
}

template <class TraitsT> auto ConstTileAccessorOf<TraitsT>::noTile() const -> TileType const& {
  static TileType const none;
  return m_container ? m_container->invalidTile() : none;
}

template <class TraitsT>
template <bool Exact>
auto ConstTileAccessorOf<TraitsT>::tileImpl(int i, int j, int k, int depth) const -> TileType const& {
  if (!m_container || depth < 0 || !TraitsT::inDomain(i, j, k)) return noTile();
  TreeIndex at = findAncestor(i, j, k, depth);
  at = at.valid() ? m_container->descend(at, i, j, k, depth) : m_container->tileIndex(i, j, k, depth);
  if (!at.valid()) return m_container->invalidTile();
  TileType const& found = moveTo(m_container->tile(at));
  return Exact && at.depth != depth ? m_container->invalidTile() : found;
}

template <class TraitsT>
auto ConstTileAccessorOf<TraitsT>::tileNeighbor(TileType const& t, NeighborDirection n) const
    -> TileType const& {
  if (t.depth() < 0 || t.index() < 0) return noTile();
  if (auto const* table = m_container->neighborData()) {
    TreeIndex const at = (*table)[static_cast<std::size_t>(t.depth())][static_cast<std::size_t>(t.index())]
                                 [static_cast<std::size_t>(n)];
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
auto TileAccessorOf<TraitsT>::addTile(int i, int j, int k, int depth) -> TileType const& {
  ContainerT& tree = *m_mutableContainer;
  if (!TraitsT::isDepth(depth) || !TraitsT::inDomain(i, j, k)) return tree.invalidTile();
  if (depth == this->m_depth && this->holds(i, j, k)) return this->current();
  TreeIndex at = this->findAncestor(i, j, k, depth);
  if (!at.valid()) return this->moveTo(tree.tile(tree.addTile(i, j, k, depth)));
  at = tree.descend(at, i, j, k, depth);
  if (at.depth != depth) {
    TreeIndex const made = tree.makeTile(i, j, k, depth);
    tree.insertChild(at, made);
    at = made;
  }
  return this->moveTo(tree.tile(at));
}

template <class TraitsT>
auto TileAccessorOf<TraitsT>::addTile(int3 const& min, int3 const& max) -> TileType const& {
  if (!TraitsT::inDomain(min.x, min.y, min.z) || !TraitsT::inDomain(max.x, max.y, max.z))
    return m_mutableContainer->invalidTile();
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

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template class VLN_API ConstTileAccessorOf<TraitsT>;                                                       \
  template class VLN_API TileAccessorOf<TraitsT>;                                                            \
  template VLN_API Tile<TraitsT, TraitsT::kTileSize> const& ConstTileAccessorOf<TraitsT>::tileImpl<true>(    \
      int, int, int, int) const;                                                                             \
  template VLN_API Tile<TraitsT, TraitsT::kTileSize> const& ConstTileAccessorOf<TraitsT>::tileImpl<false>(   \
      int, int, int, int) const;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
