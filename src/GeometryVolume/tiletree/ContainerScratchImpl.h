// Scratch containers: private trees that parallel builders fill without locks. Included by Container.cpp
// alone.
#pragma once

#include "GeometryVolume/tiletree/ContainerBuilderImpl.h"

#include <utility>

namespace VLN::TileTree3D {

/// First tile of a new scratch container.
inline constexpr VoxelCoord kScratchStart{0, 0, 0, 0};

template <class TraitsT> Container<TraitsT>* Container<TraitsT>::threadLocalContainer(int keepEmpty) {
  Container* scratch = nullptr;
  {
    std::lock_guard const lock(data().m_threadLocalFreeMutex);
    auto& idle = data().m_freeThreadLocal;
    if (!idle.empty()) scratch = idle.front(), idle.erase(idle.begin());
  }
  if (!scratch) {
    auto made = Ostil::makePtr<Container>("voxel_tile_tree_thread_local", voxelSize());
    scratch = made.get();
    if (keepEmpty == 0) scratch->addTile(kScratchStart);
    std::lock_guard const lock(data().m_threadLocalFreeMutex);
    // Those that come back find room.
    data().m_freeThreadLocal.reserve(data().m_allThreadLocal.size() + 1);
    data().m_allThreadLocal.push_back(std::move(made));
  }
  Counts counts{};
  for (int d = 0; d <= kMaxDepth; ++d) counts[d] = scratch->tileCount(d);
  try {
    std::lock_guard const lock(data().m_threadLocalMapMutex);
    data().m_threadLocalCounts[scratch] = counts;
  } catch (...) {
    std::lock_guard const lock(data().m_threadLocalFreeMutex);
    data().m_freeThreadLocal.push_back(scratch);
    throw;
  }
  return scratch;
}

namespace Internal {

/// First depth at which a scratch container differs from what it was when it was handed out; -1 when at none.
template <class ContainerT>
int firstChangedDepth(ContainerT const& scratch, typename ContainerT::Counts const& counts) {
  for (int d = 0; d <= ContainerT::kMaxDepth; ++d) {
    if (scratch.tileCount(d) != counts[d]) return d;
  }
  return -1;
}

} // namespace Internal

template <class TraitsT> void Container<TraitsT>::freeThreadLocalContainer(Container* scratch) {
  Counts counts{};
  {
    std::lock_guard const lock(data().m_threadLocalMapMutex);
    auto const entry = data().m_threadLocalCounts.find(scratch);
    if (entry == data().m_threadLocalCounts.end()) return;
    counts = entry->second;
    data().m_threadLocalCounts.erase(entry);
  }
  int const changed = Internal::firstChangedDepth(*scratch, counts);
  if (changed >= 0) ContainerBuilder<TraitsT>(*scratch).truncate(changed);
  std::lock_guard const lock(data().m_threadLocalFreeMutex);
  data().m_freeThreadLocal.push_back(scratch);
}

template <class TraitsT> void Container<TraitsT>::clearThreadLocalData(TileLists const* lists) {
  int from = -1;
  for (int d = 0; lists && from < 0 && d <= kMaxDepth; ++d) {
    if (!(*lists)[d].empty()) from = d;
  }
  ContainerBuilder<TraitsT>(*this).returnThreadLocal(from);
}

template <class TraitsT> void ContainerBuilder<TraitsT>::returnThreadLocal(int fromDepth) {
  std::map<Tree*, Counts> handedOut;
  {
    std::lock_guard const lock(data().m_threadLocalMapMutex);
    handedOut.swap(data().m_threadLocalCounts);
  }
  for (auto const& [scratch, counts] : handedOut) {
    int const from = fromDepth >= 0 ? fromDepth : Internal::firstChangedDepth(*scratch, counts);
    if (from >= 0) ContainerBuilder(*scratch).truncate(from);
    std::lock_guard const lock(data().m_threadLocalFreeMutex);
    data().m_freeThreadLocal.push_back(scratch);
  }
}

template <class TraitsT> void ContainerBuilder<TraitsT>::truncate(int depth) {
  data().detachTiles();
  m_tree.tilesAdded();
  if (depth > 0) {
    auto& parents = data().editTiles(depth - 1);
    parallelFor(0, parents.size(),
                [&](std::int64_t begin, std::int64_t end) {
                  for (std::int64_t n = begin; n < end; ++n) {
                    if (parents[n].children()) parents[n].initData();
                  }
                },
                {.grain = 4096});
  }
  for (int d = depth; d <= kMaxDepth; ++d) {
    data().m_tileCountTotal -= data().m_tileCounts[d];
    data().m_tileCounts[d] = 0;
    data().editTiles(d).clear();
    if (data().m_rootCounts[d] > 0) {
      data().m_rootCounts[d] = 0;
      std::erase_if(data().m_roots, [&](auto const& root) { return root.first.depth == d; });
    }
  }
}

} // namespace VLN::TileTree3D
