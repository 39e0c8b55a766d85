// Definitions of TypedChannel. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/ChannelDataImpl.h"
#include "GeometryVolume/channels/ChannelExportImpl.h"
#include "GeometryVolume/channels/ChannelUpdateImpl.h"
#include "GeometryVolume/channels/ElementMovesImpl.h"
#include "GeometryVolume/channels/TypedChannel.h"
#include "GeometryVolume/core/Const.h"
#include "GeometryVolume/core/LoggerHooks.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/YieldPointImpl.h"

#include <algorithm>
#include <limits>
#include <utility>

namespace VLN::TileTree3D {

template <class T>
TypedChannel<T>::TypedChannel(Ostil::String const& name, Ostil::Ptr<ChannelData<T>> data)
    : ChannelBase(name, Incomplete())
    , m_data(std::move(data)) {
  replaceEmptyName();
  pointerAllocated(dataPtr(), this);
}

template <class T>
TypedChannel<T>::TypedChannel(TypedChannel const& other)
    : ChannelBase(other, Incomplete())
    , m_data(other.m_data) {
  pointerAllocated(dataPtr(), this);
  replaceEmptyName();
  write([](ChannelData<T>&) {});
}

template <class T> TypedChannel<T>& TypedChannel<T>::operator=(TypedChannel const& other) {
  if (this == &other) return *this;
  ChannelBase::Change const change(*this);
  ChannelBase::operator=(other);
  pointerDeAllocated(dataPtr(), this);
  m_data = other.m_data;
  pointerAllocated(dataPtr(), this);
  return *this;
}

template <class T> TypedChannel<T>::~TypedChannel() { pointerDeAllocated(dataPtr(), this); }

template <class T> void TypedChannel<T>::replaceEmptyName() {
  if (name().empty()) setName(Const::TileTreeChannelName);
}

template <class T> void TypedChannel<T>::write(FunctionRef<void(ChannelData<T>&)> change) {
  ChannelBase::Change const announced(*this);
  /// Tells of new storage, also when something is thrown.
  struct Accounted {
    TypedChannel const& channel;
    void const* const before = channel.dataPtr();
    ~Accounted() {
      void const* const after = channel.dataPtr();
      if (after == before) return;
      pointerDeAllocated(before, &channel);
      pointerAllocated(after, &channel);
    }
  } const accounted{*this};
  ownData();
  change(*m_data);
}

template <class T> void TypedChannel<T>::ownData() {
  if (!m_data || m_data.unique()) return;
  VLN_YIELD_POINT(); // the other holder may go, or write, meanwhile
  // The handle is given up when its copy exists, not before.
  Ostil::MutablePtr<ChannelData<T>> own{Ostil::Ptr<ChannelData<T>>(m_data)};
  m_data = std::move(own);
}

template <class T> Ostil::Ptr<TileStorage<T>> const& TypedChannel<T>::cloneData() {
  write([](ChannelData<T>& data) { data.cloneData(); });
  return m_data->storage();
}

template <class T> void TypedChannel<T>::deepCopyTo(TypedChannel& copy) const {
  announceCopy(copy);
  copy.write([&](ChannelData<T>& data) { data.deepCopy(*m_data); });
}

template <class T> void TypedChannel<T>::dump(std::ostream& os) const {
  ChannelBase::dump(os);
  dumpCounts(os);
}

template <class T>
void TypedChannel<T>::memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const {
  ChannelBase::memUse(used, allocated, notShared);
  used += sizeof(m_data);
  allocated += sizeof(m_data);
  if (!m_data) return;
  std::uint64_t dataUsed = 0, dataAllocated = 0;
  m_data->memUse(dataUsed, dataAllocated);
  addShared(used, allocated, dataUsed, dataAllocated, m_data.useCount(), notShared, dataPtr());
}

template <class T> std::uint64_t TypedChannel<T>::size() const {
  return static_cast<std::uint64_t>(elementCount(-1));
}
template <class T> std::int64_t TypedChannel<T>::elementCount(int depth) const {
  return m_data->elementCount(depth);
}
template <class T> int TypedChannel<T>::elementCount(TreeIndex const& tile) const {
  return m_data->elementCount(tile);
}
template <class T> std::int64_t TypedChannel<T>::tileCount(int depth) const {
  return m_data->tileCount(depth);
}
template <class T> int TypedChannel<T>::minDepth() const { return m_data->minDepth(); }
template <class T> int TypedChannel<T>::depth() const { return m_data->depth(); }

template <class T> void TypedChannel<T>::setMinDepth(int minDepth, Component const& source) {
  int const old = this->minDepth();
  if (minDepth == old) return;
  write([&](ChannelData<T>& data) { data.setMinDepth(minDepth); });
  VLN::Internal::Rollback range([&] { m_data->setMinDepth(old); });
  if (old <= minDepth)
    remove(old, minDepth - 1);
  else
    this->update(source);
  range.dismiss();
}

template <class T> void TypedChannel<T>::setDepth(int depth, Component const& source) {
  int const old = this->depth();
  if (depth == old) return;
  write([&](ChannelData<T>& data) { data.setDepth(depth); });
  VLN::Internal::Rollback range([&] { m_data->setDepth(old); });
  if (old >= depth)
    remove(depth + 1, old);
  else
    this->update(source);
  range.dismiss();
}

template <class T> bool TypedChannel<T>::hasElementType(Ostil::Any const& type) const {
  auto const* identity = type.get<std::type_index>();
  return identity ? *identity == typeid(T) : type.type() == typeid(T);
}

template <class T> Ostil::Ptr<void> TypedChannel<T>::channelData(unsigned int kind, Ostil::Any const& type) {
  if (hasElementType(type)) {
    if (kind == 0) return m_data->exportFlat();
    if (kind == 3) return m_data->exportNested();
  }
  return Ostil::makePtr<Ostil::Array<T>>();
}

template <class T>
void TypedChannel<T>::setChannelData(unsigned int kind, Ostil::Any const& type,
                                     Ostil::Ptr<void> const& data) {
  if (!hasElementType(type) || !data) return;
  if (kind == 0)
    write([&](ChannelData<T>& d) { d.importFlat(*static_cast<Ostil::Array<T> const*>(data.get())); });
  if (kind == 3)
    write([&](ChannelData<T>& d) { d.importNested(*static_cast<NestedArrays<T> const*>(data.get())); });
}

template <class T> void TypedChannel<T>::fillTiles(int depth, std::vector<std::int64_t> const& tiles) {
  if (tiles.empty() || depth < 0 || depth >= kChannelDepths) return;
  cloneData();
  auto& vectors = (*m_data->dataPtr())[depth];
  auto const count = static_cast<std::int64_t>(vectors.size());
  parallelFor(0, static_cast<std::int64_t>(tiles.size()),
              [&](std::int64_t begin, std::int64_t end) {
                for (std::int64_t n = begin; n < end; ++n) {
                  std::int64_t const tile = tiles[n];
                  if (tile < 0 || tile >= count) continue;
                  auto& values = vectors[tile];
                  std::fill(values.begin(), values.end(), m_data->defaultValue());
                }
              },
              {.grain = 64});
}

template <class T> void TypedChannel<T>::setDefaultValue(T const* value) {
  write([&](ChannelData<T>& data) { data.setDefaultValue(value); });
}
template <class T>
DataElementInitializerType TypedChannel<T>::setDataElementInitializerType(DataElementInitializerType v) {
  auto const old = dataElementInitializerType();
  write([&](ChannelData<T>& data) { data.setInitializer(v); });
  return old;
}
template <class T> void TypedChannel<T>::setCallElementConstructor(bool b) {
  write([&](ChannelData<T>& data) { data.setCallElementConstructor(b); });
}
template <class T> void TypedChannel<T>::enableAllocateEmptyTileData() {
  write([](ChannelData<T>& data) { data.setAllocateEmptyTileData(true); });
}
template <class T> void TypedChannel<T>::disableAllocateEmptyTileData() {
  write([](ChannelData<T>& data) { data.setAllocateEmptyTileData(false); });
}

template <class T> void TypedChannel<T>::compactStorage() {
  if (dataPtr()) write([](ChannelData<T>& data) { data.compactStorage(); });
}

// The update protocol

template <class T> void TypedChannel<T>::update(VLN::Component const& source) {
  if (auto const* tree = dynamic_cast<Component const*>(&source)) updateTileResizeNoDispatch(*tree);
}
template <class T> void TypedChannel<T>::updateTilesAdded(Component const& tree) {
  updateTileResizeNoDispatch(tree);
}
template <class T> void TypedChannel<T>::updateTileResizeNoDispatch(Component const& tree) {
  Internal::ComponentCounts const counts(tree);
  write([&](ChannelData<T>& data) { data.resizeTiles(counts); });
}

template <class T>
void TypedChannel<T>::updateTilesRemoved(TileRemovalList const& removed, Component const& tree) {
  /// The tree's tiles, and no fewer than there are.
  class Grown final : public Internal::TileCounts {
  public:
    Grown(Internal::TileCounts const& tiles, ChannelData<T> const& data)
        : m_tiles(tiles)
        , m_data(data) {}
    std::int64_t tileCount(int d) const override {
      return std::max(m_tiles.tileCount(d), m_data.tileCount(d));
    }
    std::int64_t elementCount(TreeIndex const& tile) const override { return m_tiles.elementCount(tile); }

  private:
    Internal::TileCounts const& m_tiles;
    ChannelData<T> const& m_data;
  };
  Internal::ComponentCounts const counts(tree);
  write([&](ChannelData<T>& data) {
    // What may fail comes first, and dropping the tiles at the ends last.
    data.resizeTiles(Grown(counts, data));
    data.moveTiles(removed, [&](int d) { return tree.tileCount(d); });
    data.resizeTiles(counts);
  });
}
template <class T> void TypedChannel<T>::updateTilesNoDispatch(TileRemovalList const* removed) {
  // Nothing is known about which tiles go: all keep their elements.
  write([&](ChannelData<T>& data) {
    data.moveTiles(*removed, [](int) { return std::numeric_limits<std::int64_t>::max(); });
  });
}

template <class T> void TypedChannel<T>::updateTilesPermuted(TilePermutation const& newToOld) {
  updateTilePermuteNoDispatch(&newToOld);
}
template <class T> bool TypedChannel<T>::permute(TilePermutation const* newToOld) {
  updateTilePermuteNoDispatch(newToOld);
  return true;
}
template <class T> void TypedChannel<T>::updateTilePermuteNoDispatch(TilePermutation const* newToOld) {
  ChannelBase::Change const change(*this);
  void const* const before = dataPtr();
  ownData();
  m_data->permuteTiles(*newToOld);
  if (dataPtr() != before) pointerReAllocated(before, dataPtr());
}

template <class T> void TypedChannel<T>::updateElementResizeNoDispatch(Component const& source) {
  Internal::ComponentCounts const counts(source);
  write([&](ChannelData<T>& data) { data.growElements(counts); });
}

template <class T> void TypedChannel<T>::remove(int firstDepth, int lastDepth) {
  write([&](ChannelData<T>& data) { data.removeDepths(firstDepth, lastDepth); });
}
template <class T> bool TypedChannel<T>::removeAll() {
  if (!dataPtr()) return false;
  remove(0, depth());
  return true;
}

template <class T> void TypedChannel<T>::appendTiles(int depth, std::int64_t count) {
  write([&](ChannelData<T>& data) { data.appendTiles(depth, count); });
}
template <class T> TileVector<T> TypedChannel<T>::newTile() const { return m_data->newTile(); }
template <class T> TileVector<T> TypedChannel<T>::unwrittenTile() const { return m_data->unwrittenTile(); }
template <class T> void TypedChannel<T>::appendTiles(int depth, std::vector<TileVector<T>>& arriving) {
  write([&](ChannelData<T>& data) { data.appendTiles(depth, arriving); });
}

template <class T> bool TypedChannel<T>::resize(int depth, std::int64_t tileCount, int elementCount) {
  bool resized = false;
  write([&](ChannelData<T>& data) { resized = data.resizeDepth(depth, tileCount, elementCount); });
  return resized;
}

template <class T> bool TypedChannel<T>::resize(std::int64_t const* tileCounts, int elementCount) {
  class Wanted final : public Internal::TileCounts {
  public:
    Wanted(std::int64_t const* counts, int elements)
        : m_counts(counts)
        , m_elements(elements) {}
    std::int64_t tileCount(int d) const override { return m_counts[d]; }
    std::int64_t elementCount(TreeIndex const&) const override { return m_elements; }

  private:
    std::int64_t const* m_counts;
    int m_elements;
  };
  Wanted const wanted(tileCounts, elementCount);
  write([&](ChannelData<T>& data) { data.resizeTiles(wanted); });
  return true;
}

// Element moves

template <class T>
void TypedChannel<T>::updateElements(ElementMoves const& moves, ElementOrder const& order,
                                     DestinationTiles const& tiles, ArrivalMap const& arrivals) {
  ElementPermutation p{ElementPermutation::kAllDepths};
  p.allMoves = &moves, p.allOrders = &order, p.allTiles = &tiles, p.allArrivals = &arrivals;
  this->updateElementsNoDispatch(p);
}
template <class T>
void TypedChannel<T>::allocateElementStorage(std::vector<std::uint64_t> const& tiles,
                                             TileArrivals const& arrivals, std::size_t moveCount, int depth) {
  write([&](ChannelData<T>& data) { data.allocateElements(tiles, arrivals, moveCount, depth); });
}
template <class T>
void TypedChannel<T>::reserveElementStorage(std::vector<std::uint64_t> const& tiles,
                                            TileArrivals const& arrivals, std::size_t moveCount, int depth) {
  write([&](ChannelData<T>& data) { data.reserveElements(tiles, arrivals, moveCount, depth); });
}
template <class T> bool TypedChannel<T>::holdsAll(std::vector<ElementToFrom> const& moves, int depth) const {
  return m_data->holdsAll(moves, depth);
}
template <class T>
void TypedChannel<T>::copyElements(std::vector<ElementToFrom> const& moves,
                                   std::vector<std::uint64_t> const& order,
                                   std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                                   int depth) {
  m_data->copyElements(moves, order, tiles, arrivals, depth);
}
template <class T>
void TypedChannel<T>::removeElements(std::vector<ElementInTile> const& elements, int depth) {
  write([&](ChannelData<T>& data) { data.removeElements(elements, depth); });
}

} // namespace VLN::TileTree3D
