// TraversalEngine: drives a visitor over the tiles of a container. Compiled once for each shape and
// constness.
#pragma once

#include "GeometryVolume/tiletree/Container.h"

namespace VLN::TileTree3D {

/// How a parallel pass treats the workers' copies of the visitor.
enum class VisitorResults : bool {
  kKeepCopies, ///< one copy for each thread, merged by the caller
  kJoin,       ///< one copy for each chunk, joined in order into the visitor
};

template <bool IsConst, class TraitsT> class TraversalEngine {
public:
  using ContainerT = Container<TraitsT>;
  using TileType = typename ContainerT::TileType;
  using ContainerRef = std::conditional_t<IsConst, ContainerT const&, ContainerT&>;
  using TileRef = std::conditional_t<IsConst, TileType const&, TileType&>;
  using VisitorType = Visitor<ContainerT>;

  static void run(ContainerRef container, VisitorType& visitor, TraversalMode mode,
                  TraversalRange const& range, VisitorResults results);

private:
  TraversalEngine(ContainerRef container, VisitorType& visitor, TraversalRange const& range,
                  VisitorResults results);

  void dispatch(TraversalMode mode);
  void visit(VisitorType& v, TileRef tile, bool leavesOnly = false) const;
  void visitVoxels(VisitorType& v, TileRef tile, bool leavesOnly) const;

  void depthScan(bool upward, bool leavesOnly);
  void parallelDepthScan(TraversalMode mode);
  void parallelRange(std::int64_t count, AffinityPartitioner* affinity,
                     FunctionRef<TreeIndex(std::int64_t)> tileAt);
  bool buildStartList();
  void breadthQueue();
  void parallelBreadth();
  void depthFirst(VisitorType& v, TreeIndex at) const;
  void parallelDepthFirst();
  bool splits(TreeIndex const& at) const;

  TileRef tile(TreeIndex const& at) const {
    return const_cast<TileType&>(static_cast<ContainerT const&>(m_container).tile(at));
  }
  bool live(TreeIndex const& at) const { return tile(at).valid(); }

  ContainerRef m_container;
  VisitorType& m_visitor;
  TraversalRange m_range;
  VisitorResults m_results;
  bool m_wholeTiles;
  std::vector<TreeIndex> m_starts;
};

} // namespace VLN::TileTree3D
