#include "GeometryVolume/volume/detail/VolumeData.h"

#include "GeometryVolume/channels/UpdateDispatch.h"
#include "GeometryVolume/channels/UpdateTopologies.h"
#include "GeometryVolume/tiletree/Morton.h"

#include <algorithm>
#include <stdexcept>
#include <string>
#include <utility>

namespace VLN::TileTree3D::Internal {

namespace {

/// Roots of a volume that begins empty are 4096 samples wide: few enough for the map of roots, and not so
/// wide that a small volume needs many tiles above it.
constexpr int kRootDepth = VolumeShape::kMaxDepth - 10;
static_assert(VolumeShape::width(kRootDepth) == 4096);

constexpr int kFinest = VolumeShape::kMaxDepth;
/// Nor are tiles added in bulk where the tree holds this many times as many: that looks at every one.
constexpr std::int64_t kBulkShare = 64;

} // namespace

FieldSlot::~FieldSlot() = default;

void throwOutside(int3 const& p) {
  throw std::out_of_range("(" + std::to_string(p.x) + ", " + std::to_string(p.y) + ", " +
                          std::to_string(p.z) + ") lies outside the domain of a volume");
}

void VolumeData::beginSharing() {
  std::lock_guard const lock(mutex);
  for (auto& slot : slots) slot->exclusive.store(false, std::memory_order_relaxed);
  epoch.fetch_add(1, std::memory_order_release);
}

std::unique_ptr<VolumeData> VolumeData::share() {
  sync();
  beginSharing();
  auto copy = std::make_unique<VolumeData>();
  copy->tree = tree;
  copy->topology = topology;
  copy->rest = rest;
  for (auto const& slot : slots) {
    copy->slots.push_back(slot->share());
    copy->slots.back()->name = slot->name;
  }
  copy->topologyVersion = copy->restVersion = copy->version;
  return copy;
}

FieldSlot* VolumeData::find(std::string const& name) const {
  for (auto const& slot : slots)
    if (slot->name == name) return slot.get();
  return nullptr;
}

void VolumeData::updateTopology() {
  if (topologyVersion == version) return;
  makeUnique(topology);
  topology->update(*tree);
  topologyVersion = version;
}

void VolumeData::updateRest(TileRemovalList const* removed) {
  if (restVersion == version) return;
  if (!rest.empty()) {
    if (removed)
      updateTilesRemoved(*removed, *topology, rest);
    else
      updateTilesAdded(*topology, rest);
    updateTopologies(*tree, rest, removed);
  }
  restVersion = version;
}

void VolumeData::sync() {
  if (!hasPending() && syncedVersion.load(std::memory_order_acquire) == version) return;
  std::lock_guard const lock(mutex);
  flushLocked();
  updateTopology();
  for (auto& slot : slots)
    if (slot->version.load(std::memory_order_relaxed) != version) slot->follow(*this);
  updateRest(nullptr);
  syncedVersion.store(version, std::memory_order_release);
}

void VolumeData::follow(FieldSlot& slot) {
  std::lock_guard const lock(mutex);
  flushLocked();
  if (slot.version.load(std::memory_order_relaxed) != version) slot.follow(*this);
}

void VolumeData::flush() {
  std::lock_guard const lock(mutex);
  flushLocked();
}

void VolumeData::flushLocked() {
  if (!hasPending()) return;
  VolumeTree::TileLists lists;
  auto& finest = lists[kFinest];
  for (auto const& slot : slots) slot->listPending(finest);
  VolumeTree& edited = editTree();
  epoch.fetch_add(1, std::memory_order_relaxed);
  ++version;
  auto const count = static_cast<std::int64_t>(finest.size());
  if (count <= kFewTiles || count * kBulkShare <= edited.tileCount(-1)) {
    // Which of them bulk writes made first depends on the number of threads.
    std::sort(finest.begin(), finest.end(), MortonOrder());
    for (int3 const& p : finest) {
      if (m_accessor.addTileBelow(p.x, p.y, p.z, kFinest) >= 0) continue;
      m_accessor.addTile(p, rootDepth());
      m_accessor.addTile(p, kFinest);
    }
  } else {
    addTiles(edited, lists);
  }
  for (auto& slot : slots)
    if (slot->hasPending()) slot->follow(*this);
  pending.store(false, std::memory_order_release);
}

void VolumeData::separate(FieldSlot& slot) {
  if (slot.version.load(std::memory_order_acquire) != version) follow(slot);
  if (!slot.exclusive.load(std::memory_order_relaxed)) {
    slot.detach(*this);
    if (slot.version.load(std::memory_order_relaxed) != version) follow(slot);
  }
}

VolumeTree& VolumeData::editTree() {
  makeUnique(tree);
  if (m_accessorTree != tree.get()) {
    m_accessor = tree->tileAccessor();
    m_accessorTree = tree.get();
  }
  return *tree;
}

int VolumeData::rootDepth() const {
  for (int d = 0; d < VolumeShape::kMaxDepth; ++d)
    if (tree->rootCount(d) > 0) return d;
  return kRootDepth;
}

VolumeTree::ConstTileAccessor const& VolumeData::reader() {
  if (m_readerTree != tree.get()) {
    m_reader = std::as_const(*tree).tileAccessor();
    m_readerTree = tree.get();
  }
  return m_reader;
}

void VolumeData::growTree(FunctionRef<void(VolumeTree&)> change) {
  sync();
  VolumeTree& edited = editTree();
  epoch.fetch_add(1, std::memory_order_relaxed);
  ++version;
  change(edited);
  m_accessorTree = m_readerTree = nullptr;
}

void VolumeData::makeTiles(VolumeTree::TileLists& lists) {
  growTree([&](VolumeTree& edited) { addTiles(edited, lists); });
}

void VolumeData::addTiles(VolumeTree& edited, VolumeTree::TileLists& lists) {
  int const root = rootDepth();
  auto& roots = lists[root];
  int3 last{0, 0, 0};
  bool any = false;
  for (int d = root + 1; d <= kFinest; ++d)
    for (int3 const& p : lists[d]) {
      int3 const corner{VolumeShape::align(p.x, root), VolumeShape::align(p.y, root),
                        VolumeShape::align(p.z, root)};
      if (!any || corner != last) roots.append(corner);
      any = true, last = corner;
    }
  edited.tileAccessor().addTiles(lists);
}

void VolumeData::removeTiles(TileIndexLists const& lists) {
  sync();
  editTree();
  TileMoves moves;
  m_accessor.removeTiles(lists, true, &moves);
  m_accessorTree = m_readerTree = nullptr;
  ++version;
  epoch.fetch_add(1, std::memory_order_relaxed);
  updateTopology();
  for (auto& slot : slots) slot->tilesRemoved(*this, moves);
  updateRest(&moves);
}

} // namespace VLN::TileTree3D::Internal
