// TypedChannel<T>: all of a channel that needs its element type but neither tree shape nor layout. The sizes
// are run-time values here, so that one instantiation serves the eight channel classes of an element type.
#pragma once

#include "GeometryVolume/channels/ChannelBase.h"
#include "GeometryVolume/channels/ChannelData.h"

#include <cassert>
#include <typeindex>

namespace VLN::TileTree3D {

/// A copied channel has a Data of its own that shares the tile storage until one of the two is written; an
/// assigned channel shares the Data itself. The operations that change tiles separate by themselves. Writing
/// through an accessor does not: call cloneData() first on a channel that may be shared.
/// @threads Concurrent readers are safe, and so is copying; a writer needs the channel for itself.
template <class T> class VLN_API TypedChannel : public ChannelBase {
public:
  ~TypedChannel() override;

  void dump(std::ostream& os) const override;
  /// Charges shared data evenly to the channels that share it, or whole with `notShared`.
  void memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const override;
  /// Elements of all depths. Walks the tiles.
  std::uint64_t size() const override;
  using ChannelBase::update;
  /// As updateTilesAdded(); a component that counts no tiles is ignored.
  void update(VLN::Component const& source) override;
  /// Walks the tiles of the depth, or of all depths for -1.
  std::int64_t elementCount(int depth) const override;
  int elementCount(TreeIndex const& tile) const override;
  std::int64_t tileCount(int depth) const override;

  int minDepth() const override;
  int depth() const override;
  void setMinDepth(int minDepth, Component const& source) override;
  void setDepth(int depth, Component const& source) override;
  bool hasElementType(Ostil::Any const& type) const override;
  Ostil::Ptr<void> channelData(unsigned int kind, Ostil::Any const& type) override;
  void setChannelData(unsigned int kind, Ostil::Any const& type, Ostil::Ptr<void> const& data) override;
  /// Gives every tile that the tree has and the channel lacks its elements, and drops tiles at the end that
  /// the tree lacks.
  /// @error A static block that cannot be allocated leaves the channel as it was, and so does what is thrown,
  /// by this and the other updates.
  void updateTilesAdded(Component const& tree) override;
  void updateTilesRemoved(TileRemovalList const& removed, Component const& tree) override;
  void updateTilesPermuted(TilePermutation const& newToOld) override;
  void updateElements(ElementMoves const& moves, ElementOrder const& order, DestinationTiles const& tiles,
                      ArrivalMap const& arrivals) override;
  std::type_index elementType() const override { return typeid(T); }
  ChannelLayout layout() const override { return m_data->layout(); }
  void fillTiles(int depth, std::vector<std::int64_t> const& tiles) override;

  // Settings
  T const& defaultValue() const { return m_data->defaultValue(); }
  /// For new tiles; existing ones keep their values. Null stands for zero.
  void setDefaultValue(T const* value);
  DataElementInitializerType dataElementInitializerType() const { return m_data->initializer(); }
  /// Returns the old value.
  DataElementInitializerType setDataElementInitializerType(DataElementInitializerType v);
  /// Whether the elements of new tiles take the default value. Else they stay unwritten.
  bool callElementConstructor() const { return m_data->callElementConstructor(); }
  void setCallElementConstructor(bool b);
  /// While enabled, new tiles stay without elements.
  void enableAllocateEmptyTileData();
  void disableAllocateEmptyTileData();

  // Sharing
  /// Handles on this channel's Data.
  std::int64_t dataUseCount() const { return m_data.useCount(); }
  bool hasSameData(TypedChannel const& other) const { return m_data == other.m_data; }
  /// Makes this channel the only holder of its Data and of its storage, and returns the storage.
  /// @cost A deep copy when the storage is shared, else nothing.
  Ostil::Ptr<TileStorage<T>> const& cloneData();
  /// The tiles by depth, for passes that read many.
  TileArrays<T> const* tileArrays() const { return dataPtr(); }
  /// Called on the copy that stands in for a channel which others still hold.
  void separateClone() { cloneData(); }
  /// Always 0; memUse() reports.
  std::uint64_t memUsage() const { return 0; }
  /// Brings the capacities down to the sizes.
  void compactStorage();

  // Tiles and elements
  bool resize(int depth, std::int64_t tileCount, int elementCount);
  /// @shape `tileCounts` has 29 entries.
  bool resize(std::int64_t const* tileCounts, int elementCount);
  /// Appends tiles to one depth, their elements at the default value: for who follows a tree tile by tile.
  /// Never in a static block.
  /// @cost Amortised constant for each tile, where updateTilesAdded() looks at all depths.
  void appendTiles(int depth, std::int64_t count);
  /// A tile as appendTiles() makes it, of no channel yet.
  TileVector<T> newTile() const;
  /// The same with elements as the memory held them.
  TileVector<T> unwrittenTile() const;
  /// Appends such tiles, moving them out of `arriving`.
  /// @error std::bad_alloc; nothing has changed then.
  void appendTiles(int depth, std::vector<TileVector<T>>& arriving);
  /// false without storage.
  bool removeAll();
  /// Puts tiles in a new order: new tile i of depth d is old tile newToOld[d][i]. Returns true.
  bool permute(TilePermutation const* newToOld);

protected:
  TypedChannel(Ostil::String const& name, Ostil::Ptr<ChannelData<T>> data);
  /// A Data of its own on the same storage.
  TypedChannel(TypedChannel const& other);
  /// Shares the Data.
  TypedChannel& operator=(TypedChannel const& other);

  bool updateResize() { return true; }
  void updateTileResizeNoDispatch(Component const& tree);
  void updateTilesNoDispatch(TileRemovalList const* removed);
  void updateTilePermuteNoDispatch(TilePermutation const* newToOld);
  void updateElementResizeNoDispatch(Component const& source);
  void allocateElementStorage(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                              std::size_t moveCount, int depth) override;
  void copyElements(std::vector<ElementToFrom> const& moves, std::vector<std::uint64_t> const& order,
                    std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                    int depth) override;
  void removeElements(std::vector<ElementInTile> const& elements, int depth) override;
  bool holdsAll(std::vector<ElementToFrom> const& moves, int depth) const override;
  void reserveElementStorage(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                             std::size_t moveCount, int depth) override;
  void remove(int firstDepth, int lastDepth);

  std::int64_t treeIndexToIndex(TreeIndex const& tile) const { return m_data->treeIndexToIndex(tile); }
  TreeIndex indexToTreeIndex(std::int64_t flat) const { return m_data->indexToTreeIndex(flat); }
  TileArrays<T>* dataPtr() const { return m_data ? m_data->dataPtr() : nullptr; }

  TileVector<T> const& tileVector(TreeIndex const& tile) const { return m_data->vector(tile); }
  TileVector<T>& tileVector(TreeIndex const& tile) {
    assert(m_data.unique() && !m_data->storageIsShared() && "cloneData() before writing a shared channel");
    return m_data->vector(tile);
  }
  /// Deep copy into a new channel of the same class.
  void deepCopyTo(TypedChannel& copy) const;

  Ostil::Ptr<ChannelData<T>> m_data;

private:
  /// Runs `change` on a Data that no other channel sees, and tells the accounting when the storage changes.
  void write(FunctionRef<void(ChannelData<T>&)> change);
  /// Makes this channel the only holder of its Data.
  void ownData();
  void replaceEmptyName();
};

} // namespace VLN::TileTree3D
