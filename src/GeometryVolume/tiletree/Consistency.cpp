#include "GeometryVolume/tiletree/ConsistencyImpl.h"

#include <iostream>

namespace VLN::TileTree3D {

namespace {

/// Size of a branch as counted; `ok` turns false when a stored size differs. A branch goes on being checked
/// after a failure in one child.
template <class TraitsT>
std::int64_t countBranch(Container<TraitsT> const& tree, TreeIndex const& at, bool verbose, bool& ok) {
  auto const& tile = tree.tile(at);
  std::int64_t size = TraitsT::kTileSize;
  for (auto child = tile.begin(); child != tile.end(); ++child)
    size += countBranch(tree, child.treeIndex(), verbose, ok);
  if (size != tile.branchSize()) {
    ok = false;
    if (verbose)
      std::cerr << "Branch size mismatch at tile = " << at.index << ' ' << at.depth
                << ": branchSize=" << tile.branchSize() << ", computed = " << size << std::endl;
  }
  return size;
}

/// Counts tiles in depth-first order and checks that each child knows its parent.
template <class TraitsT> class CountingVisitor final : public Visitor<Container<TraitsT>> {
public:
  using TileType = typename Container<TraitsT>::TileType;

  explicit CountingVisitor(Container<TraitsT> const& tree)
      : m_tree(tree) {
    this->setEndTileOverridden(false);
  }
  using Visitor<Container<TraitsT>>::beginTile;
  void beginTile(TileType const&) override { ++m_numTiles; }
  using Visitor<Container<TraitsT>>::visitInteriorVoxel;
  /// A link that leads nowhere, or to another's child, is not followed.
  bool visitInteriorVoxel(TileType const& tile, int3 const& ijk) override {
    if (tile.isLeaf(ijk)) return true;
    TreeIndex const at = tile.childTreeIndex(ijk);
    if (at.index < m_tree.tileCount(at.depth) && m_tree.tile(at).parentIndex() == tile.index() &&
        tile.childIJK(m_tree.tile(at)) == ijk)
      return true;
    m_failed = true;
    return false;
  }
  CountingVisitor* clone() const override { return new CountingVisitor(m_tree); }

  std::int64_t m_numTiles = 0;
  bool m_failed = false;

private:
  Container<TraitsT> const& m_tree;
};

} // namespace

template <class TraitsT> bool checkBranchSizes(Container<TraitsT> const& tree, bool verbose) {
  bool ok = true;
  for (auto root = tree.cbeginRoots(); root != tree.cendRoots(); ++root)
    countBranch(tree, root->second, verbose, ok);
  if (verbose) {
    if (ok)
      std::cerr << "BranchSizes OK!" << std::endl;
    else
      std::cerr << "checkBranchSizes not ok: tileCount = " << tree.tileCount(-1) << std::endl;
  }
  return ok;
}

template <class TraitsT> bool checkConsistency(Container<TraitsT> const& tree, bool verbose) {
  std::ostream& err = std::cerr;
  if (verbose) tree.dump(err);
  std::int64_t const total = tree.tileCount(-1);
  std::int64_t const roots = tree.rootCount();
  if (roots == 0 && total != 0) {
    if (verbose) err << "rootCount()==0 and tileCount()==" << total << std::endl;
    return false;
  }
  std::int64_t sum = 0;
  for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
    sum += tree.tileCount(d);
    if (verbose) err << "tileCount[" << d << "] = " << tree.tileCount(d) << std::endl;
  }
  if (sum != total) {
    if (verbose) err << "tileCount != m_data->m_tileCountTotal: " << sum << ' ' << total << std::endl;
    return false;
  }
  std::int64_t children = 0;
  for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
      auto const& tile = tree.tile(n, d);
      if (!tile.valid()) {
        if (verbose) err << "tile " << d << ' ' << n << " not valid!" << std::endl;
        return false;
      }
      children += tile.childCount();
      if (!tile.isOK()) {
        if (verbose) {
          err << "tile not ok: ";
          tile.dump(err);
        }
        return false;
      }
    }
  }
  if (children != total - roots) {
    if (verbose)
      err << "numChildren != m_data->m_tileCountTotal-m_roots.size(): " << children << " != " << total - roots
          << std::endl;
    return false;
  }
  CountingVisitor<TraitsT> visitor(tree);
  tree.traverse(visitor, kDepthFirst);
  if (visitor.m_failed) return false;
  if (visitor.m_numTiles != total) {
    if (verbose)
      err << "visitor.m_numTiles != m_numTilesTotal: " << visitor.m_numTiles << ' ' << total << std::endl;
    return false;
  }
  if (verbose) err << "Consistency OK!" << std::endl;
  return true;
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template bool checkBranchSizes(Container<TraitsT> const&, bool);                                           \
  template bool checkConsistency(Container<TraitsT> const&, bool);
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
