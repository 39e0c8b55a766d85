#include "GeometryVolume/volume/detail/VolumeData.h"

#include "GeometryVolume/channels/UpdateDispatch.h"
#include "GeometryVolume/channels/UpdateTopologies.h"

#include <stdexcept>
#include <string>

namespace VLN::TileTree3D::Internal {

namespace {

/// Roots of a volume that begins empty are 4096 samples wide: few enough for the map of roots, and not so
/// wide that a small volume needs many tiles above it.
constexpr int kRootDepth = VolumeShape::kMaxDepth - 10;
static_assert(VolumeShape::width(kRootDepth) == 4096);

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
  if (syncedVersion.load(std::memory_order_acquire) == version) return;
  std::lock_guard const lock(mutex);
  updateTopology();
  for (auto& slot : slots)
    if (slot->version.load(std::memory_order_relaxed) != version) slot->follow(*this, 0);
  updateRest(nullptr);
  syncedVersion.store(version, std::memory_order_release);
}

void VolumeData::follow(FieldSlot& slot) {
  std::lock_guard const lock(mutex);
  if (slot.version.load(std::memory_order_relaxed) != version) slot.follow(*this, 0);
}

void VolumeData::prepareWrite(FieldSlot& slot) {
  sync(slot);
  if (!slot.exclusive.load(std::memory_order_relaxed)) {
    slot.detach(*this);
    sync(slot);
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

void VolumeData::makeTile(FieldSlot& slot, int i, int j, int k) {
  if (!VolumeShape::inDomain(i, j, k)) throwOutside({i, j, k});
  prepareWrite(slot);
  editTree();
  constexpr int kFinest = VolumeShape::kMaxDepth;
  TreeIndex const above = m_accessor.treeIndex(i, j, k, kFinest, false);
  if (above.depth == kFinest) return;
  // Fields that share elements with another volume will leave them when they follow.
  if (slots.size() > 1) epoch.fetch_add(1, std::memory_order_relaxed);
  ++version;
  int const first = above.valid() ? above.depth + 1 : rootDepth();
  if (!above.valid()) m_accessor.addTile(i, j, k, first);
  m_accessor.addTile(i, j, k, kFinest);
  slot.follow(*this, first);
}

void VolumeData::growTree(FunctionRef<void(VolumeTree&)> change) {
  sync();
  VolumeTree& edited = editTree();
  epoch.fetch_add(1, std::memory_order_relaxed);
  ++version;
  change(edited);
}

void VolumeData::makeTiles(VolumeTree::TileLists& lists) {
  growTree([&](VolumeTree& edited) {
    int const root = rootDepth();
    auto& roots = lists[static_cast<std::size_t>(root)];
    int3 last{0, 0, 0};
    bool any = false;
    for (int d = root + 1; d <= VolumeShape::kMaxDepth; ++d)
      for (int3 const& p : lists[static_cast<std::size_t>(d)]) {
        int3 const corner{VolumeShape::align(p.x, root), VolumeShape::align(p.y, root),
                          VolumeShape::align(p.z, root)};
        if (!any || corner != last) roots.append(corner);
        any = true, last = corner;
      }
    edited.tileAccessor().addTiles(lists);
  });
}

void VolumeData::removeTiles(TileIndexLists const& lists) {
  sync();
  editTree();
  TileMoves moves;
  m_accessor.removeTiles(lists, true, &moves);
  m_accessorTree = nullptr;
  ++version;
  epoch.fetch_add(1, std::memory_order_relaxed);
  updateTopology();
  for (auto& slot : slots) slot->tilesRemoved(*this, moves);
  updateRest(&moves);
}

} // namespace VLN::TileTree3D::Internal
