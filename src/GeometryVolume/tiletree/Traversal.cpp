#include "GeometryVolume/tiletree/TraversalEngineImpl.h"

#include "GeometryVolume/core/Canceller.h"
#include "GeometryVolume/core/Parallel.h"

#include <deque>
#include <stdexcept>
#include <tbb/enumerable_thread_specific.h>

namespace VLN::TileTree3D {

// --- Visitor copies ---

template <class ContainerT> struct Visitor<ContainerT>::Copies {
  tbb::enumerable_thread_specific<Visitor*> perThread{static_cast<Visitor*>(nullptr)};
  ~Copies() {
    for (Visitor* copy : perThread) delete copy;
  }
};

template <class ContainerT> void Visitor<ContainerT>::initVisitorCopies() {
  if (!m_copies) m_copies = Ostil::makePtr<Copies>();
}

template <class ContainerT> Visitor<ContainerT>* Visitor<ContainerT>::visitorCopy() {
  if (!m_copies) return nullptr;
  Visitor*& own = m_copies->perThread.local();
  if (!own) own = clone();
  return own;
}

template <class ContainerT> void Visitor<ContainerT>::forEachCopy(FunctionRef<void(Visitor&)> f) {
  if (!m_copies) return;
  for (Visitor* copy : m_copies->perThread) {
    if (copy) f(*copy);
  }
}

// --- Engine ---

namespace {

/// A parallel branch splits when it holds more voxels than this.
template <class TraitsT> constexpr std::int64_t kSplitThreshold = 2 * TraitsT::kTileSize + 1;

/// Branches to make before the rest runs in parallel: enough to balance, few enough to keep copies cheap.
constexpr std::size_t kBranches = 512;

/// More items than any range has, and few enough to count with.
constexpr std::uint64_t kMaxGrain = std::uint64_t(1) << 48;

/// Chunks of one depth whose results are joined in order.
constexpr std::int64_t kJoinedChunks = 256;

void append(std::vector<TreeIndex>& list, TreeIndex const& at) {
  if (list.size() == list.max_size()) throw std::length_error("list too long");
  list.push_back(at);
}

} // namespace

template <bool IsConst, class TraitsT>
TraversalEngine<IsConst, TraitsT>::TraversalEngine(ContainerRef container, VisitorType& visitor,
                                                   TraversalRange const& range, VisitorResults results)
    : m_container(container)
    , m_visitor(visitor)
    , m_range(range)
    , m_results(results) {
  m_range.minDepth = std::max(range.minDepth, 0);
  m_range.maxDepth = std::min(range.maxDepth, TraitsT::kMaxDepth);
  m_range.voxelBegin = std::clamp(range.voxelBegin, 0, TraitsT::kTW);
  m_range.voxelEnd = std::clamp(range.voxelEnd, m_range.voxelBegin, TraitsT::kTW);
  m_range.grain = std::clamp<std::uint64_t>(range.grain, 1, kMaxGrain);
  m_wholeTiles = m_range.voxelBegin == 0 && m_range.voxelEnd == TraitsT::kTW;
}

template <bool IsConst, class TraitsT>
void TraversalEngine<IsConst, TraitsT>::run(ContainerRef container, VisitorType& visitor, TraversalMode mode,
                                            TraversalRange const& range, VisitorResults results) {
  Canceller::cancelID(Canceller::kTraverse);
  if constexpr (!IsConst) container.handTilesOut();
  if (static_cast<int>(mode) == 9) mode = kBreadthFirst;
  visitor.beginTraverse();
  TraversalEngine(container, visitor, range, results).dispatch(mode);
  visitor.endTraverse();
}

template <bool IsConst, class TraitsT> void TraversalEngine<IsConst, TraitsT>::dispatch(TraversalMode mode) {
  bool const wholeForest = !m_range.start.valid();
  switch (mode) {
  case kLeafVoxels:
    depthScan(true, true);
    return;
  case kBottomUp:
    if (wholeForest) depthScan(false, false);
    return;
  case kBreadthFirst:
    if (wholeForest)
      depthScan(true, false);
    else if (buildStartList())
      breadthQueue();
    return;
  case kParallelTopDown:
    if (wholeForest)
      parallelDepthScan(mode);
    else if (buildStartList())
      parallelBreadth();
    return;
  case kParallelBottomUp:
  case kParallelFlat:
  case kParallelTopDownGuarded:
    if (wholeForest) parallelDepthScan(mode);
    return;
  case kDepthFirst:
    buildStartList();
    for (; !m_starts.empty(); m_starts.pop_back()) depthFirst(m_visitor, m_starts.back());
    return;
  case kParallelDepthFirst:
    if (buildStartList()) parallelDepthFirst();
    return;
  }
}

template <bool IsConst, class TraitsT> bool TraversalEngine<IsConst, TraitsT>::buildStartList() {
  ContainerT const& container = m_container;
  if (m_range.start.valid()) {
    if (m_range.start.depth <= m_range.maxDepth && live(m_range.start)) append(m_starts, m_range.start);
    return !m_starts.empty();
  }
  for (auto root = container.cbeginRoots(); root != container.cendRoots(); ++root) {
    int const d = root->second.depth;
    if (d >= m_range.minDepth && d <= m_range.maxDepth && live(root->second)) append(m_starts, root->second);
  }
  if (m_range.minDepth > 0 && m_range.minDepth <= m_range.maxDepth) {
    for (std::int64_t n = 0; n < container.tileCount(m_range.minDepth); ++n) {
      TreeIndex const at{n, m_range.minDepth};
      if (live(at) && !tile(at).isRoot()) append(m_starts, at);
    }
  }
  return !m_starts.empty();
}

template <bool IsConst, class TraitsT>
void TraversalEngine<IsConst, TraitsT>::visit(VisitorType& v, TileRef t, bool leavesOnly) const {
  if (v.isBeginTileOverridden()) v.beginTile(t);
  if (t.depth() != TraitsT::kMaxDepth || m_range.interior == kVisitAllDepths) visitVoxels(v, t, leavesOnly);
  if (v.isEndTileOverridden()) v.endTile(t);
}

template <bool IsConst, class TraitsT>
void TraversalEngine<IsConst, TraitsT>::visitVoxels(VisitorType& v, TileRef t, bool leavesOnly) const {
  for (int k = m_range.voxelBegin; k < m_range.voxelEnd; ++k) {
    for (int j = m_range.voxelBegin; j < m_range.voxelEnd; ++j) {
      for (int i = m_range.voxelBegin; i < m_range.voxelEnd; ++i) {
        if (!leavesOnly || !m_wholeTiles || t.isLeaf(i, j, k)) v.visitInteriorVoxel(t, int3{i, j, k});
      }
    }
  }
}

template <bool IsConst, class TraitsT>
void TraversalEngine<IsConst, TraitsT>::depthScan(bool upward, bool leavesOnly) {
  int const first = upward ? m_range.minDepth : m_range.maxDepth;
  int const step = upward ? 1 : -1;
  for (int d = first; d >= m_range.minDepth && d <= m_range.maxDepth; d += step) {
    for (std::int64_t n = 0; n < m_container.tileCount(d); ++n) {
      if (live({n, d})) visit(m_visitor, tile({n, d}), leavesOnly);
    }
  }
}

template <bool IsConst, class TraitsT>
void TraversalEngine<IsConst, TraitsT>::parallelRange(std::int64_t count, AffinityPartitioner* affinity,
                                                      FunctionRef<TreeIndex(std::int64_t)> tileAt) {
  if (count == 0) return;
  // A range that counts voxels keeps `grain` voxels together; a tile belongs to the chunk of its first voxel.
  std::int64_t unit = 1;
  if (m_range.interior == kVisitAllDepths) {
    std::int64_t const edge = std::max(1, m_range.voxelEnd - m_range.voxelBegin);
    unit = edge * edge * edge;
  }
  std::int64_t const grain = (static_cast<std::int64_t>(m_range.grain) + unit - 1) / unit;
  auto const pass = [&](VisitorType& v, std::int64_t begin, std::int64_t end) {
    for (std::int64_t n = begin; n < end; ++n) {
      TreeIndex const at = tileAt(n);
      if (live(at)) visit(v, tile(at));
    }
  };
  if (m_results == VisitorResults::kKeepCopies) {
    m_visitor.initVisitorCopies();
    parallelFor(0, count,
                [&](std::int64_t begin, std::int64_t end) { pass(*m_visitor.visitorCopy(), begin, end); },
                {.grain = grain, .cancellation = Cancellation::kPoll, .affinity = affinity});
  } else {
    std::int64_t const chunk = std::max(grain, (count + kJoinedChunks - 1) / kJoinedChunks);
    std::vector<std::unique_ptr<VisitorType>> parts(chunkCount(0, count, chunk));
    parallelChunks(
        0, count, chunk,
        [&](std::int64_t c, std::int64_t begin, std::int64_t end) {
          auto& part = parts[c];
          part.reset(m_visitor.clone());
          pass(*part, begin, end);
        },
        Cancellation::kPoll);
    for (auto const& part : parts) m_visitor.join(*part);
  }
  Canceller::cancelID(Canceller::kTraverse);
}

namespace {

/// Whether this traversal may use the depths' partitioners: only the sole one does.
template <class ContainerT> class AffinityUse {
public:
  AffinityUse(ContainerT const& container, bool wanted, int (ContainerT::*acquire)() const,
              int (ContainerT::*release)() const)
      : m_container(container)
      , m_release(release) {
    if (!wanted) return;
    m_held = true;
    m_sole = (container.*acquire)() == 0;
    if (!m_sole) drop();
  }
  ~AffinityUse() { drop(); }
  AffinityUse(AffinityUse const&) = delete;
  AffinityUse& operator=(AffinityUse const&) = delete;
  bool sole() const { return m_sole; }

private:
  void drop() {
    if (m_held) (m_container.*m_release)();
    m_held = false;
  }

  ContainerT const& m_container;
  int (ContainerT::*m_release)() const;
  bool m_held = false;
  bool m_sole = false;
};

} // namespace

template <bool IsConst, class TraitsT>
void TraversalEngine<IsConst, TraitsT>::parallelDepthScan(TraversalMode mode) {
  int const minDepth = m_range.minDepth, maxDepth = m_range.maxDepth;
  if (minDepth > maxDepth) return;
  AffinityUse<ContainerT> const use(m_container, m_range.useAffinity,
                                    &ContainerT::incrementAffinityPartitionerUseCount,
                                    &ContainerT::decrementAffinityPartitionerUseCount);
  auto const partitioner = [&](int d) { return use.sole() ? &m_container.affinityPartitioner(d) : nullptr; };
  if (mode == kParallelFlat) {
    std::vector<std::int64_t> prefix{0};
    for (int d = minDepth; d <= maxDepth; ++d) prefix.push_back(prefix.back() + m_container.tileCount(d));
    parallelRange(prefix.back(), partitioner(maxDepth), [&](std::int64_t n) {
      auto const above = std::upper_bound(prefix.begin(), prefix.end(), n) - 1;
      return TreeIndex{n - *above, minDepth + static_cast<int>(above - prefix.begin())};
    });
    return;
  }
  bool const upward = mode != kParallelBottomUp;
  for (int d = upward ? minDepth : maxDepth; d >= minDepth && d <= maxDepth; d += upward ? 1 : -1)
    parallelRange(m_container.tileCount(d), partitioner(d), [d](std::int64_t n) { return TreeIndex{n, d}; });
}

template <bool IsConst, class TraitsT> void TraversalEngine<IsConst, TraitsT>::breadthQueue() {
  std::deque<TreeIndex> queue(m_starts.begin(), m_starts.end());
  for (; !queue.empty(); queue.pop_front()) {
    TileRef t = tile(queue.front());
    visit(m_visitor, t);
    if (t.atMaxDepth() || t.depth() >= m_range.maxDepth) continue;
    for (int slot = 0; slot < TraitsT::kTileSize; ++slot) {
      if (!t.isLeaf(slot)) queue.push_back(t.childTreeIndex(slot));
    }
  }
}

template <bool IsConst, class TraitsT> void TraversalEngine<IsConst, TraitsT>::parallelBreadth() {
  std::vector<TreeIndex> level = std::move(m_starts);
  while (!level.empty()) {
    parallelRange(static_cast<std::int64_t>(level.size()), nullptr, [&](std::int64_t n) { return level[n]; });
    std::vector<TreeIndex> next;
    for (TreeIndex const& at : level) {
      TileType const& t = tile(at);
      if (t.atMaxDepth() || t.depth() >= m_range.maxDepth) continue;
      for (auto child = t.begin(); child != t.end(); ++child) append(next, child.treeIndex());
    }
    level = std::move(next);
  }
}

namespace {

/// Visits the voxels of a tile in a depth-first walk and collects the children that were not pruned.
template <class TraitsT, class VisitorT, class TileRef>
void openTile(VisitorT& v, TileRef t, TraversalRange const& range, std::vector<TreeIndex>& children) {
  if (v.isBeginTileOverridden()) v.beginTile(t);
  if (t.atMaxDepth() && range.interior != kVisitAllDepths) return;
  auto const within = [&](int c) { return c >= range.voxelBegin && c < range.voxelEnd; };
  bool const goesDeeper = !t.atMaxDepth() && t.depth() < range.maxDepth;
  for (int slot = 0; slot < TraitsT::kTileSize; ++slot) {
    int3 const ijk = t.childIJK(slot);
    bool const visited = within(ijk.x) && within(ijk.y) && within(ijk.z);
    bool const keep = !visited || v.visitInteriorVoxel(t, ijk);
    if (keep && goesDeeper && !t.isLeaf(slot)) append(children, t.childTreeIndex(slot));
  }
}

} // namespace

template <bool IsConst, class TraitsT>
void TraversalEngine<IsConst, TraitsT>::depthFirst(VisitorType& v, TreeIndex at) const {
  TileRef t = tile(at);
  std::vector<TreeIndex> children;
  openTile<TraitsT, VisitorType, TileRef>(v, t, m_range, children);
  for (TreeIndex const& child : children) depthFirst(v, child);
  if (v.isEndTileOverridden()) v.endTile(t);
}

template <bool IsConst, class TraitsT>
bool TraversalEngine<IsConst, TraitsT>::splits(TreeIndex const& at) const {
  TileType const& t = tile(at);
  return t.depth() < std::min(m_range.maxParallelDepth, TraitsT::kDepthFirstMaxParallelDepth) &&
         t.branchSize() > kSplitThreshold<TraitsT> && !t.isLeaf();
}

template <bool IsConst, class TraitsT> void TraversalEngine<IsConst, TraitsT>::parallelDepthFirst() {
  // The upper tiles are opened one level after the other on this thread until there are enough branches,
  // which then run in parallel. The upper tiles are closed last, deepest first, so that each closes after all
  // its children.
  bool const joins = m_results == VisitorResults::kJoin;
  std::unique_ptr<VisitorType> const ownUpper(joins ? m_visitor.clone() : nullptr);
  if (!joins) m_visitor.initVisitorCopies();
  VisitorType& upper = joins ? *ownUpper : *m_visitor.visitorCopy();
  std::vector<TreeIndex> branches = std::move(m_starts);
  std::vector<TreeIndex> opened;
  bool split = true;
  while (split && branches.size() < kBranches) {
    split = false;
    std::vector<TreeIndex> next;
    for (TreeIndex const& at : branches) {
      if (splits(at)) {
        openTile<TraitsT, VisitorType, TileRef>(upper, tile(at), m_range, next);
        opened.push_back(at);
        split = true;
      } else {
        append(next, at);
      }
    }
    branches = std::move(next);
  }
  auto const count = static_cast<std::int64_t>(branches.size());
  if (!joins) {
    parallelFor(0, count,
                [&](std::int64_t begin, std::int64_t end) {
                  VisitorType& v = *m_visitor.visitorCopy();
                  for (std::int64_t n = begin; n < end; ++n) depthFirst(v, branches[n]);
                },
                {.cancellation = Cancellation::kPoll});
  } else {
    std::int64_t const chunk = std::max<std::int64_t>(1, (count + kJoinedChunks - 1) / kJoinedChunks);
    std::vector<std::unique_ptr<VisitorType>> parts(chunkCount(0, count, chunk));
    parallelChunks(
        0, count, chunk,
        [&](std::int64_t c, std::int64_t begin, std::int64_t end) {
          auto& part = parts[c];
          part.reset(m_visitor.clone());
          for (std::int64_t n = begin; n < end; ++n) depthFirst(*part, branches[n]);
        },
        Cancellation::kPoll);
    for (auto const& part : parts) m_visitor.join(*part);
  }
  if (upper.isEndTileOverridden()) {
    for (auto at = opened.rbegin(); at != opened.rend(); ++at) upper.endTile(tile(*at));
  }
  if (joins) m_visitor.join(upper);
  Canceller::cancelID(Canceller::kTraverse);
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template class TraversalEngine<true, TraitsT>;                                                             \
  template class TraversalEngine<false, TraitsT>;                                                            \
  template void Visitor<Container<TraitsT>>::initVisitorCopies();                                            \
  template Visitor<Container<TraitsT>>* Visitor<Container<TraitsT>>::visitorCopy();                          \
  template void Visitor<Container<TraitsT>>::forEachCopy(FunctionRef<void(Visitor<Container<TraitsT>>&)>);
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
