// ChannelData<T>: storage of a channel, shared by the handles that were assigned to each other.
//
//   Channel ──Ptr──> ChannelData ──Ptr──> TileStorage ── depth 0: [tile][tile]...
//   Channel ──Ptr──────^   |                             ...
//                          └─ blocks behind static tiles depth 28: [tile]...
//
// A copied ChannelData shares the TileStorage of its source until one of the two is written. Blocks follow
// the storage that lives in them: whoever leaves a storage that others still hold leaves its blocks there.
#pragma once

#include "GeometryVolume/channels/ChannelTypes.h"
#include "GeometryVolume/channels/detail/ChannelPlan.h"
#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/core/FixedArray.h"
#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/pools/TileDataAllocator.h"
#include "Ostil/Array.h"
#include "Ostil/Ptr.h"

#include <cstdint>
#include <vector>

namespace VLN::TileTree3D {

/// Element vectors by depth and tile. Both tree shapes have 29 depths here.
template <class T> using TileArrays = PerDepth<std::vector<TileVector<T>>, kChannelDepths>;

template <class T> class TileStorage : public TileArrays<T> {
public:
  TileStorage() = default;
  TileStorage(TileStorage const&) = delete;
  TileStorage& operator=(TileStorage const&) = delete;
  /// Keeps blocks that static tiles of this storage lie in, for a holder that leaves.
  void adopt(Internal::BlockList& blocks) { Internal::handOverBlocks(m_blocks, blocks); }
  /// Takes over the blocks of a storage whose tiles move here.
  void adoptAll(TileStorage& from) { adopt(from.m_blocks); }

private:
  Internal::BlockList m_blocks;
};

/// Nested export: by depth, by tile, the tile's elements. Depths outside the channel's range are null.
template <class T> using NestedArrays = Ostil::Array<Ostil::Ptr<Ostil::Array<Ostil::Ptr<Ostil::Array<T>>>>>;

/// @threads As a channel: concurrent readers, or one writer.
template <class T> class VLN_API ChannelData {
public:
  using Vector = TileVector<T>;

  /// Without storage.
  explicit ChannelData(ChannelLayout const& layout);
  /// With storage for no tiles. A null default value stands for zero.
  ChannelData(ChannelLayout const& layout, T const* defaultValue, DataElementInitializerType initializer,
              bool useStaticAllocation, bool callElementConstructor, int minDepth, int depth);
  /// Shares the storage in constant time. Blocks stay with the source, and the flags take their defaults.
  ChannelData(ChannelData const& b);
  ChannelData& operator=(ChannelData const&) = delete;
  ~ChannelData();

  // Settings
  ChannelLayout const& layout() const { return m_layout; }
  T const& defaultValue() const { return m_defaultValue; }
  void setDefaultValue(T const* value) { m_defaultValue = value ? *value : T{}; }
  DataElementInitializerType initializer() const { return m_initializer; }
  void setInitializer(DataElementInitializerType v) { m_initializer = v; }
  bool useStaticAllocation() const { return m_useStaticAllocation; }
  bool callElementConstructor() const { return m_callElementConstructor; }
  /// Whether element construction has ever been off.
  bool rawCopy() const { return m_rawCopy; }
  void setCallElementConstructor(bool b) {
    m_callElementConstructor = b;
    if (!b) m_rawCopy = true;
  }
  bool allocateEmptyTileData() const { return m_allocateEmptyTileData; }
  void setAllocateEmptyTileData(bool b) { m_allocateEmptyTileData = b; }
  int minDepth() const { return m_minDepth; }
  int depth() const { return m_depth; }
  void setMinDepth(int d) { m_minDepth = d; }
  void setDepth(int d) { m_depth = d; }

  // Counts
  std::int64_t tileCount(int depth) const;
  std::int64_t elementCount(int depth) const;
  int elementCount(TreeIndex const& tile) const { return static_cast<int>(vector(tile).size()); }
  std::int64_t treeIndexToIndex(TreeIndex const& tile) const {
    std::int64_t flat = tile.index;
    for (int d = 0; d < tile.depth; ++d) flat += m_tileCounts[d];
    return flat;
  }
  TreeIndex indexToTreeIndex(std::int64_t flat) const {
    int d = 0;
    for (; d < kChannelDepths - 1 && flat >= m_tileCounts[d]; ++d) flat -= m_tileCounts[d];
    return {flat, d};
  }

  // Access
  TileArrays<T>* dataPtr() const { return m_data.get(); }
  Ostil::Ptr<TileStorage<T>> const& storage() const { return m_data; }
  Vector& vector(TreeIndex const& tile) const { return (*m_data)[tile.depth][tile.index]; }
  bool storageIsShared() const { return m_data && !m_data.unique(); }

  // Copying
  /// Makes this the only holder of its storage.
  void cloneData();
  /// Takes over range, counts and tiles of `source`, in storage of its own.
  void deepCopy(ChannelData const& source);
  /// Brings all capacities down to the sizes.
  void compactStorage();

  // Blocks
  Internal::BlockList const& allocations() const { return m_allocations; }
  void freeAndClearAllocations() { m_allocations.clear(); }

  // Updates; each separates the storage first when it changes anything.
  /// Grows and shrinks every depth of the range to the tile counts of `source`.
  /// @return false when a static block could not be allocated; nothing has changed then, nor when something
  /// is thrown.
  bool resizeTiles(Internal::TileCounts const& source);
  /// Applies a compaction of tiles, all of it or, when something is thrown, none. Sources that lie at or
  /// beyond `kept(depth)` are about to be dropped.
  void moveTiles(TileRemovalList const& removed, FunctionRef<std::int64_t(int depth)> kept);
  /// Puts the tiles in a new order, in new storage.
  /// @return false when there was nothing to do or no memory for a static block.
  /// What is thrown leaves the tiles as they were.
  bool permuteTiles(TilePermutation const& newToOld);
  void removeDepths(int first, int last);
  bool resizeDepth(int depth, std::int64_t tileCount, int elementCount);
  /// Appends tiles of `layout().size` elements to a depth of the range.
  /// @error What is thrown leaves the tiles that were appended before.
  void appendTiles(int depth, std::int64_t count);
  /// A tile as appendTiles() makes it, of nobody yet.
  Vector newTile() const { return m_allocateEmptyTileData ? Vector() : newTile(m_layout.size, nullptr); }
  Vector unwrittenTile() const {
    return m_allocateEmptyTileData ? Vector() : unwrittenTile(m_layout.size, nullptr);
  }
  /// Appends such tiles, moving them out of `arriving`: all, or none when something is thrown.
  void appendTiles(int depth, std::vector<Vector>& arriving);
  /// Grows tiles that hold fewer elements than `source` says.
  void growElements(Internal::TileCounts const& source);
  /// Whether the tiles and elements that the moves to one depth name exist. A negative destination is no
  /// tile.
  bool holdsAll(std::vector<ElementToFrom> const& moves, int depth) const;
  /// Capacity for what arrives in the tiles of one depth.
  void reserveElements(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                       std::size_t moveCount, int depth);
  /// Grows the destination tiles of one depth by what arrives there.
  void allocateElements(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                        std::size_t moveCount, int depth);
  /// Writes the arrivals of one depth behind the elements that its tiles had.
  /// @pre allocateElements() was called for the depth.
  void copyElements(std::vector<ElementToFrom> const& moves, std::vector<std::uint64_t> const& order,
                    std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals, int depth);
  /// Removes elements, filling the holes from each tile's tail.
  /// @pre Sorted by tile and element.
  void removeElements(std::vector<ElementInTile> const& elements, int depth);

  // Plain arrays
  Ostil::Ptr<Ostil::Array<T>> exportFlat() const;
  Ostil::Ptr<NestedArrays<T>> exportNested() const;
  void importFlat(Ostil::Array<T> const& values);
  void importNested(NestedArrays<T> const& values);

  void memUse(std::uint64_t& used, std::uint64_t& allocated) const;

private:
  using Spans = Internal::TileSpans;
  using Counts = Internal::DepthCounts;
  /// Gives the values for a tile of new storage.
  using TileValues = FunctionRef<T const*(int depth, std::int64_t tile)>;

  int firstDepth() const { return m_minDepth > 0 ? m_minDepth : 0; }
  int lastDepth() const { return m_depth < kChannelDepths ? m_depth : kChannelDepths - 1; }
  std::int64_t& count(int d) { return m_tileCounts[d]; }
  std::int64_t count(int d) const { return m_tileCounts[d]; }
  std::vector<Vector>& depthTiles(int d) const { return (*m_data)[d]; }
  std::int64_t slotElements(std::size_t size) const;
  std::size_t tileBytes() const { return static_cast<std::size_t>(m_layout.size) * sizeof(T); }
  void sumCounts();
  Spans allTiles() const;
  /// Makes the added tiles of a depth: in their slots of `block` where all are of one size, and not written
  /// then; else empty.
  void makeAdded(Internal::GrowthPlan const& plan, int depth, T* block);
  /// Gives the added tiles of a plan their elements, in `block` if there is one.
  /// @param zeros Whether that holds zeros for new elements.
  void fillAdded(Internal::GrowthPlan const& plan, Internal::TileCounts const& source, T* block, bool zeros);

  /// A vector of `n` unwritten elements, in `slot` when that is not null.
  Vector unwrittenTile(std::int64_t n, T* slot) const;
  /// A new tile as the flags ask for.
  Vector newTile(std::int64_t n, T* slot) const;
  /// Leaves the storage, and its blocks to whoever still holds it; then holds `fresh` and `blocks`.
  void replaceStorage(Ostil::Ptr<TileStorage<T>> fresh, Internal::BlockList& blocks) noexcept;
  /// New storage with the tiles of `source`, their values taken from `values`. Leaves out [skipFirst,
  /// skipLast]. Without memory for a static block the storage is empty afterwards; whatever is thrown leaves
  /// all as it was.
  void rebuild(TileArrays<T> const& source, Counts const& counts, TileValues values, int skipFirst,
               int skipLast);
  void separateWithout(int skipFirst, int skipLast);
  void importValues(TileValues values);
  Internal::TileSlots tileOffsets() const;

  T m_defaultValue{};
  DataElementInitializerType m_initializer = kInitializeDefaultValue;
  Ostil::Ptr<TileStorage<T>> m_data;
  Internal::BlockList m_allocations;
  bool m_useStaticAllocation = false;
  bool m_callElementConstructor = true;
  bool m_rawCopy = false;
  bool m_allocateEmptyTileData = false;
  std::int32_t m_minDepth = 0;
  std::int32_t m_depth = kChannelDepths - 1;
  Counts m_tileCounts{};
  std::int64_t m_tileCountTotal = 0;
  ChannelLayout m_layout;
};

} // namespace VLN::TileTree3D
