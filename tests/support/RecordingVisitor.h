// A visitor that writes down what the engine calls, and the same written down by a plain reading of the
// rules.
#pragma once

#include "support/ContainerAccess.h"

#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <ostream>
#include <thread>
#include <vector>

namespace Support {

using Velorn::Math::int3;
using VLN::TileTree3D::TreeIndex;

struct Event {
  char kind; ///< b and e: begin and end of a tile, v: voxel, B and E: of the traversal
  TreeIndex at{};
  int3 ijk{0, 0, 0};

  bool operator==(Event const&) const = default;
  friend std::ostream& operator<<(std::ostream& os, Event const& e) {
    return os << e.kind << ' ' << e.at.index << '@' << e.at.depth << " (" << e.ijk.x << ' ' << e.ijk.y << ' '
              << e.ijk.z << ')';
  }
};

/// Shared by a visitor and its clones; in the order in which the calls came.
struct EventLog {
  std::mutex mutex;
  std::vector<Event> events;
  std::vector<std::thread::id> threads;
  std::vector<bool> writable; ///< whether the form for mutable tiles was called
  int clones = 0;
};

template <class T> class RecordingVisitor : public VLN::TileTree3D::Visitor<VLN::TileTree3D::Container<T>> {
public:
  using Base = VLN::TileTree3D::Visitor<VLN::TileTree3D::Container<T>>;
  using TileT = typename Base::TileType;
  using Prune = std::function<bool(TreeIndex const&, int3 const&)>;

  RecordingVisitor()
      : m_log(std::make_shared<EventLog>()) {}
  explicit RecordingVisitor(Prune keep)
      : RecordingVisitor() {
    m_keep = std::move(keep);
  }

  EventLog const& log() const { return *m_log; }
  std::vector<Event> const& events() const { return m_log->events; }
  using Base::setBeginTileOverridden;
  using Base::setEndTileOverridden;

  void beginTraverse() override { write({'B'}, false); }
  void endTraverse() override { write({'E'}, false); }
  void beginTile(TileT const& t) override { write({'b', t.treeIndex()}, false); }
  void beginTile(TileT& t) override { write({'b', t.treeIndex()}, true); }
  void endTile(TileT const& t) override { write({'e', t.treeIndex()}, false); }
  void endTile(TileT& t) override { write({'e', t.treeIndex()}, true); }
  bool visitInteriorVoxel(TileT const& t, int3 const& ijk) override {
    write({'v', t.treeIndex(), ijk}, false);
    return !m_keep || m_keep(t.treeIndex(), ijk);
  }
  bool visitInteriorVoxel(TileT& t, int3 const& ijk) override {
    write({'v', t.treeIndex(), ijk}, true);
    return !m_keep || m_keep(t.treeIndex(), ijk);
  }
  RecordingVisitor* clone() const override {
    std::lock_guard const lock(m_log->mutex);
    ++m_log->clones;
    return new RecordingVisitor(*this);
  }

private:
  void write(Event const& event, bool writable) {
    std::lock_guard const lock(m_log->mutex);
    m_log->events.push_back(event);
    m_log->threads.push_back(std::this_thread::get_id());
    m_log->writable.push_back(writable);
  }

  std::shared_ptr<EventLog> m_log;
  Prune m_keep;
};

/// What a traversal must call, in serial order; parallel modes call the same in an order of their own.
template <class T> class ExpectedTraversal {
public:
  using ContainerT = VLN::TileTree3D::Container<T>;
  using Range = VLN::TileTree3D::TraversalRange;
  using Prune = typename RecordingVisitor<T>::Prune;

  ExpectedTraversal(ContainerT const& tree, int mode, Range const& range, Prune keep = {})
      : m_tree(tree)
      , m_range(range)
      , m_keep(std::move(keep)) {
    m_range.minDepth = std::max(0, range.minDepth);
    m_range.maxDepth = std::min(T::kMaxDepth, range.maxDepth);
    m_range.voxelEnd = std::min(T::kTW, range.voxelEnd);
    m_whole = m_range.voxelBegin == 0 && m_range.voxelEnd == T::kTW;
    bool const forest = !range.start.valid();
    switch (mode) {
    case 0:
    case 9:
    case 4:
      if (forest)
        scan(true, false);
      else
        queue();
      break;
    case 1:
    case 5:
      if (forest) scan(false, false);
      break;
    case 2:
    case 6: {
      auto list = starts();
      for (auto at = list.rbegin(); at != list.rend(); ++at) recurse(*at);
      break;
    }
    case 3:
      scan(true, true);
      break;
    default:
      if (forest) scan(true, false);
      break;
    }
  }
  std::vector<Event> const& events() const { return m_events; }

private:
  bool live(TreeIndex const& at) const { return m_tree.tile(at).valid(); }
  bool inRange(int c) const { return c >= m_range.voxelBegin && c < m_range.voxelEnd; }
  bool showsVoxels(TreeIndex const& at) const {
    return at.depth != T::kMaxDepth || m_range.interior == VLN::TileTree3D::kVisitAllDepths;
  }
  void visit(TreeIndex const& at, bool leavesOnly) {
    m_events.push_back({'b', at});
    for (int k = 0; k < T::kTW && showsVoxels(at); ++k) {
      for (int j = 0; j < T::kTW; ++j) {
        for (int i = 0; i < T::kTW; ++i) {
          if (!inRange(i) || !inRange(j) || !inRange(k)) continue;
          if (leavesOnly && m_whole && !m_tree.tile(at).isLeaf(i, j, k)) continue;
          m_events.push_back({'v', at, {i, j, k}});
        }
      }
    }
    m_events.push_back({'e', at});
  }
  void scan(bool upward, bool leavesOnly) {
    for (int n = 0; n <= T::kMaxDepth; ++n) {
      int const d = upward ? n : T::kMaxDepth - n;
      if (d < m_range.minDepth || d > m_range.maxDepth) continue;
      for (std::int64_t i = 0; i < m_tree.tileCount(d); ++i) {
        if (live({i, d})) visit({i, d}, leavesOnly);
      }
    }
  }
  std::vector<TreeIndex> starts() const {
    std::vector<TreeIndex> list;
    auto const add = [&](TreeIndex const& at) {
      if (at.depth <= m_range.maxDepth && live(at)) list.push_back(at);
    };
    if (m_range.start.valid()) {
      add(m_range.start);
      return list;
    }
    for (auto root = m_tree.cbeginRoots(); root != m_tree.cendRoots(); ++root) {
      if (root->second.depth >= m_range.minDepth) add(root->second);
    }
    for (std::int64_t i = 0; m_range.minDepth > 0 && i < m_tree.tileCount(m_range.minDepth); ++i) {
      if (!m_tree.tile(i, m_range.minDepth).isRoot()) add({i, m_range.minDepth});
    }
    return list;
  }
  std::vector<TreeIndex> children(TreeIndex const& at) const {
    std::vector<TreeIndex> list;
    if (at.depth == T::kMaxDepth || at.depth >= m_range.maxDepth) return list;
    for (int slot = 0; slot < T::kTileSize; ++slot) {
      int3 const ijk = m_tree.tile(at).childIJK(slot);
      bool const pruned =
          m_pruning && inRange(ijk.x) && inRange(ijk.y) && inRange(ijk.z) && m_keep && !m_keep(at, ijk);
      if (!m_tree.tile(at).isLeaf(slot) && !pruned) list.push_back(m_tree.tile(at).childTreeIndex(slot));
    }
    return list;
  }
  void queue() {
    auto const list = starts();
    std::deque<TreeIndex> open(list.begin(), list.end());
    for (; !open.empty(); open.pop_front()) {
      visit(open.front(), false);
      for (TreeIndex const& child : children(open.front())) open.push_back(child);
    }
  }
  void recurse(TreeIndex const& at) {
    m_pruning = true;
    visit(at, false);
    m_events.pop_back(); // its end comes after the children
    for (TreeIndex const& child : children(at)) recurse(child);
    m_events.push_back({'e', at});
  }

  ContainerT const& m_tree;
  Range m_range;
  Prune m_keep;
  bool m_whole = true;
  bool m_pruning = false;
  std::vector<Event> m_events;
};

} // namespace Support
