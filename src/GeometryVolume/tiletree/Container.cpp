#include "GeometryVolume/tiletree/Container.h"

#include "GeometryVolume/core/Canceller.h"
#include "GeometryVolume/core/Const.h"
#include "GeometryVolume/core/LoggerHooks.h"
#include "GeometryVolume/core/Streaming.h"
#include "GeometryVolume/tiletree/ConsistencyImpl.h"
#include "GeometryVolume/tiletree/ContainerAddImpl.h"
#include "GeometryVolume/tiletree/ContainerBulkImpl.h"
#include "GeometryVolume/tiletree/ContainerRefineImpl.h"
#include "GeometryVolume/tiletree/ContainerRemoveImpl.h"
#include "GeometryVolume/tiletree/ContainerScratchImpl.h"
#include "GeometryVolume/tiletree/ContainerTilesImpl.h"
#include "GeometryVolume/tiletree/DerivedCachesImpl.h"
#include "GeometryVolume/tiletree/TileHalo.h"
#include "GeometryVolume/tiletree/TraversalEngineImpl.h"

#include <algorithm>
#include <bit>
#include <limits>
#include <ostream>

namespace VLN::TileTree3D {

namespace {

Ostil::String nameOrDefault(Ostil::String const& name) {
  return name.empty() ? Const::TileTreeContainerName : name;
}

template <class V> void toWorld(bbox<int3, int> const& box, double voxelSize, bbox<V>& out) {
  using S = typename V::Scalar;
  out = {};
  if (box.empty()) return;
  auto const scale = [&](int c) { return static_cast<S>(static_cast<S>(c) * static_cast<S>(voxelSize)); };
  out.min = {scale(box.min.x), scale(box.min.y), scale(box.min.z)};
  out.max = {scale(box.max.x), scale(box.max.y), scale(box.max.z)};
}

} // namespace

template <class TraitsT>
Container<TraitsT>::Container()
    : Container(Ostil::String(), 1.0f) {}

template <class TraitsT>
Container<TraitsT>::Container(Ostil::String const& name, float voxelSize)
    : Component(nameOrDefault(name), Incomplete())
    , m_data(Ostil::makePtr<Data>()) {
  setVoxelSize(voxelSize);
  objectComplete(this);
}

template <class TraitsT>
Container<TraitsT>::Container(Container const& other)
    : Component(other, Incomplete())
    , m_data(other.m_data) {
  cloneData();
  objectComplete(this);
}

template <class TraitsT> Container<TraitsT>& Container<TraitsT>::operator=(Container const& other) {
  if (this == &other) return *this;
  auto data = Ostil::makePtr<Data>(other.data());
  ObjectChange const change(this);
  Component::operator=(other);
  m_data = std::move(data);
  return *this;
}

template <class TraitsT> Container<TraitsT>::~Container() { objectIncomplete(this); }

template <class TraitsT> void Container<TraitsT>::cloneData() {
  if (!m_data.unique()) m_data = Ostil::makePtr<Data>(data());
}

template <class TraitsT> void Container<TraitsT>::copyTo(Ostil::Ptr<VLN::Component>& target) const {
  if (target.get() == this) return;
  auto copy = Ostil::makePtr<Container>(name(), voxelSize());
  ObjectChange const change(copy.get());
  copy->m_data = Ostil::makePtr<Data>(data());
  target = copy;
  Component::copyTo(target);
}

template <class TraitsT> std::uint64_t Container<TraitsT>::size() const {
  return static_cast<std::uint64_t>(tileCount(-1)) * kTileSize;
}
template <class TraitsT> bool Container<TraitsT>::empty() const { return size() == 0; }
template <class TraitsT> void Container<TraitsT>::update(VLN::Component const&) {}
template <class TraitsT> std::int64_t Container<TraitsT>::elementCount(int depth) const {
  return tileCount(depth) * TraitsT::kTileDataSize;
}
template <class TraitsT> int Container<TraitsT>::elementCount(TreeIndex const&) const {
  return TraitsT::kTileDataSize;
}

template <class TraitsT>
void Container<TraitsT>::memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const {
  Component::memUse(used, allocated, notShared);
  used += sizeof(m_data), allocated += sizeof(m_data);
  std::uint64_t dataUsed = 0, dataAllocated = 0;
  data().memUse(dataUsed, dataAllocated);
  auto const sharers =
      static_cast<std::uint64_t>(notShared ? 1 : std::max<std::int64_t>(1, m_data.useCount()));
  used += dataUsed / sharers, allocated += dataAllocated / sharers;
}

template <class TraitsT> std::uint64_t Container<TraitsT>::memUsage() const {
  std::int64_t records = rootCount() + 1 + tileCount(-1);
  for (int d = 0; d <= kMaxDepth; ++d) records += data().tiles(d).capacity() - data().tiles(d).size();
  return static_cast<std::uint64_t>(records) * sizeof(TileType);
}

template <class TraitsT> void Container<TraitsT>::dump(std::ostream& os) const {
  Component::dump(os);
  auto const pad = Streaming::pad(os);
  os << pad << "tileCount {\n";
  for (int d = 0; d <= kMaxDepth; ++d) os << pad << d << ": " << tileCount(d) << '\n';
  os << pad << "}\n" << pad << "roots size {" << rootCount() << "}\n";

  auto const writeTile = [&](char const* kind, TreeIndex const& at) {
    TileType const& t = tile(at);
    os << pad << kind << at.depth << ", " << at.index << "] = {tijk = " << t.ti() << ' ' << t.tj() << ' '
       << t.tk() << ", width = " << t.tileVoxelWidth() << ", parent = " << t.parentIndex();
    if (t.children()) {
      os << ", children = { ";
      for (int slot = 0; slot < kTileSize; ++slot) os << t.childIndex(slot) << ' ';
      os << '}';
    } else {
      os << ", children = nullptr";
    }
    os << "}\n";
  };
  for (auto const& root : data().m_roots) writeTile("root[", root.second);
  for (int d = 0; d <= kMaxDepth; ++d) {
    for (std::int64_t n = 0; n < tileCount(d); ++n) {
      if (tile(n, d).valid()) writeTile("tile[", {n, d});
    }
  }
}

template <class TraitsT> void Container<TraitsT>::setVoxelSize(float size) {
  if (data().m_voxelSize == size) return;
  data().m_voxelSize = size;
  data().m_voxelSizeInv = size > 0 ? 1.0f / size : 1.0f;
}

template <class TraitsT> void Container<TraitsT>::setMaxRelativeRefinementError(float error) {
  data().m_maxRelativeRefinementError = error < 0 ? 0.0f : error;
}

template <class TraitsT> float Container<TraitsT>::worldSpaceTileVoxelDiagonal(int d) const {
  return static_cast<float>(tileVoxelWidth(d)) * voxelSize() * 1.732051f;
}

template <class TraitsT> void Container<TraitsT>::tileSpaceBounds(bbox<int3, int>& box) const {
  box = {};
  for (auto const& root : data().m_roots) tile(root.second).tileSpaceBounds(box);
}

template <class TraitsT> void Container<TraitsT>::tileSpaceBounds(int d, bbox<int3, int>& box) const {
  using Box = bbox<int3, int>;
  auto const& tiles = data().tiles(d);
  box = parallelReduce(
      0, tiles.size(), 16384, Box{},
      [&](std::int64_t begin, std::int64_t end) {
        Box part;
        for (std::int64_t n = begin; n < end; ++n)
          if (tiles[n].valid()) part.grow(tiles[n].tijk());
        // All tiles of a depth are as wide; the far corner of the domain's last one fits into int32.
        int const w = tileVoxelWidth(d);
        if (!part.empty()) part.grow({part.max.x + w, part.max.y + w, part.max.z + w});
        return part;
      },
      [](Box a, Box const& b) {
        if (!b.empty()) a.grow(b.min), a.grow(b.max);
        return a;
      });
}

template <class TraitsT> void Container<TraitsT>::worldSpaceBounds(bbox<float3>& box) const {
  bbox<int3, int> bounds;
  tileSpaceBounds(bounds);
  toWorld(bounds, voxelSize(), box);
}
template <class TraitsT> void Container<TraitsT>::worldSpaceBounds(int d, bbox<float3>& box) const {
  bbox<int3, int> bounds;
  tileSpaceBounds(d, bounds);
  toWorld(bounds, voxelSize(), box);
}
template <class TraitsT> void Container<TraitsT>::worldSpaceBounds(bbox<double3>& box) const {
  bbox<int3, int> bounds;
  tileSpaceBounds(bounds);
  toWorld(bounds, voxelSize(), box);
}
template <class TraitsT> void Container<TraitsT>::worldSpaceBounds(int d, bbox<double3>& box) const {
  bbox<int3, int> bounds;
  tileSpaceBounds(d, bounds);
  toWorld(bounds, voxelSize(), box);
}

// --- Roots and sharing ---

template <class TraitsT> std::int64_t Container<TraitsT>::rootCount() const {
  return static_cast<std::int64_t>(data().m_roots.size());
}
template <class TraitsT> RootIterator Container<TraitsT>::cbeginRoots() const {
  return RootIterator(std::bit_cast<void const*>(data().m_roots.cbegin()));
}
template <class TraitsT> RootIterator Container<TraitsT>::cendRoots() const {
  return RootIterator(std::bit_cast<void const*>(data().m_roots.cend()));
}
template <class TraitsT> bool Container<TraitsT>::sharesTiles(Container const& other) const {
  return data().m_tiles == other.data().m_tiles;
}
template <class TraitsT> auto Container<TraitsT>::getData() const -> Data const* {
  return m_data ? &data() : nullptr;
}
template <class TraitsT> void Container<TraitsT>::handTilesOut() {
  data().detachTiles();
  data().m_tilesHandedOut = true;
}
template <class TraitsT> AffinityPartitioner& Container<TraitsT>::affinityPartitioner(int d) const {
  return *data().m_affinityPartitioners[d];
}
template <class TraitsT> int Container<TraitsT>::incrementAffinityPartitionerUseCount() const {
  return const_cast<Data&>(data()).m_affinityUseCount.fetch_add(1);
}
template <class TraitsT> int Container<TraitsT>::decrementAffinityPartitionerUseCount() const {
  return const_cast<Data&>(data()).m_affinityUseCount.fetch_sub(1);
}

// --- Addition of tiles ---

template <class TraitsT> TreeIndex Container<TraitsT>::addTile(int i, int j, int k, int depth) {
  return ContainerBuilder<TraitsT>(*this).addTile(i, j, k, depth);
}
template <class TraitsT>
TreeIndex Container<TraitsT>::addTileBelow(TreeIndex above, int i, int j, int k, int depth) {
  return ContainerBuilder<TraitsT>(*this).addTileBelow(above, i, j, k, depth);
}
template <class TraitsT>
void Container<TraitsT>::addTilesInBulk(TileLists const& corners, TileLists* newTiles) {
  ContainerBuilder<TraitsT>(*this).addTilesInBulk(corners, newTiles);
}

// --- Traversal ---

template <class TraitsT>
void Container<TraitsT>::traverse(VisitorType& visitor, TraversalMode mode,
                                  TraversalRange const& range) const {
  TraversalEngine<true, TraitsT>::run(*this, visitor, mode, range, VisitorResults::kKeepCopies);
}
template <class TraitsT>
void Container<TraitsT>::traverse(VisitorType& visitor, TraversalMode mode, TraversalRange const& range) {
  TraversalEngine<false, TraitsT>::run(*this, visitor, mode, range, VisitorResults::kKeepCopies);
}
template <class TraitsT>
void Container<TraitsT>::reduce(VisitorType& visitor, TraversalMode mode, TraversalRange const& range) const {
  TraversalEngine<true, TraitsT>::run(*this, visitor, mode, range, VisitorResults::kJoin);
}
template <class TraitsT>
void Container<TraitsT>::reduce(VisitorType& visitor, TraversalMode mode, TraversalRange const& range) {
  TraversalEngine<false, TraitsT>::run(*this, visitor, mode, range, VisitorResults::kJoin);
}
template <class TraitsT> void Container<TraitsT>::setBranchSizes() {
  ContainerBuilder<TraitsT>(*this).setBranchSizes(Cancellation::kPoll);
}
template <class TraitsT> bool Container<TraitsT>::checkBranchSizes(bool verbose) const {
  return TileTree3D::checkBranchSizes(*this, verbose);
}
template <class TraitsT> bool Container<TraitsT>::checkConsistency(bool verbose) const {
  return TileTree3D::checkConsistency(*this, verbose);
}

// --- Derived caches ---

template <class TraitsT> void Container<TraitsT>::buildAccessorAccelerationStructure(int maxDepth) {
  // First: where no depth qualifies, an older grid must not stay.
  clearAccessorAccelerationStructure();
  data().m_lookupBusy.test_and_set();
  try {
    buildAccelerationGrid(*this, data(), maxDepth);
  } catch (...) {
    clearAccessorAccelerationStructure();
    data().m_lookupBusy.clear();
    throw;
  }
  data().m_lookupBusy.clear();
}
template <class TraitsT> void Container<TraitsT>::countLongSearches(std::int64_t n) const {
  // A search takes 0.1 to 0.4 us; the table 1 to 2 ms, and 30 ns for each tile.
  constexpr std::int64_t kFewSearches = 16384, kTilesPerSearch = 8;
  auto& data = const_cast<Data&>(this->data()); // what follows changes no tile
  if (data.m_lookup.loadRelaxed()) return;
  std::int64_t const searches = data.m_longSearches.fetch_add(n) + n;
  if (searches < kFewSearches + data.m_tileCountTotal / kTilesPerSearch) return;
  if (data.m_lookupBusy.test_and_set()) return; // another thread builds, or this one, which searches for it
  std::shared_ptr<TileLookupTable<TraitsT> const> table;
  try {
    if (!data.m_lookup.loadAcquire()) table = buildLookupTable(*this);
  } catch (std::bad_alloc const&) {}
  if (table)
    data.setLookupTable(std::move(table));
  else
    data.m_longSearches = std::numeric_limits<std::int64_t>::min() / 2;
  data.m_lookupBusy.clear();
}
template <class TraitsT> auto Container<TraitsT>::neighborData() const -> NeighborTable const* {
  return data().m_neighbors.get();
}
template <class TraitsT> int Container<TraitsT>::gridDepth() const { return data().m_gridDepth; }
template <class TraitsT> void Container<TraitsT>::precomputeTileNeighbors() {
  data().m_neighbors = computeTileNeighbors(*this);
}
template <class TraitsT> void Container<TraitsT>::precomputeTileHalos() {
  data().m_halos = computeTileHalos(*this);
}
template <class TraitsT> void Container<TraitsT>::precomputeCompressedTileHalos() {
  data().m_compressedHalos = computeCompressedTileHalos(*this);
}
template <class TraitsT> TileHalo<TraitsT> const* Container<TraitsT>::tileHalo(TreeIndex const& at) const {
  if (!data().m_halos) return nullptr;
  return &(*data().m_halos)[at.depth][at.index];
}
template <class TraitsT>
TileHaloVisitor<TraitsT> Container<TraitsT>::tileHaloVisitor(TreeIndex const& at) const {
  if (!data().m_compressedHalos) return {};
  auto const& records = data().m_compressedHalos->records[at.depth];
  return {records[at.index], data().m_haloCompression};
}
template <class TraitsT> int Container<TraitsT>::tileSpaceMaxTileDistance() const {
  return maxTileDistance(*this);
}

#define VLN_INSTANTIATE(TraitsT) template class VLN_API Container<TraitsT>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
