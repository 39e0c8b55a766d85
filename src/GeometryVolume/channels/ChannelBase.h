// ChannelBase: a channel without its element type, as objects and the update protocol handle it.
#pragma once

#include "GeometryVolume/channels/ChannelTypes.h"
#include "GeometryVolume/channels/ElementMoves.h"
#include "GeometryVolume/channels/TileDataElementAccessor.h"
#include "GeometryVolume/channels/detail/ChangeGate.h"
#include "Ostil/Any.h"
#include "Ostil/Ptr.h"

#include <iosfwd>
#include <typeindex>
#include <utility>

namespace VLN::TileTree3D {

/// The order of the virtual operations is fixed; new ones go behind updateElements().
class VLN_API ChannelBase : public Component {
public:
  using Component::Component;
  ChannelBase() = default;
  ChannelBase(ChannelBase const&) = default;
  ChannelBase& operator=(ChannelBase const&) = default;
  ~ChannelBase() override;

  void memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const override;

  /// Shallowest depth with storage.
  virtual int minDepth() const = 0;
  /// Deepest depth with storage.
  virtual int depth() const = 0;
  /// Moves the shallow end of the range: depths that leave it are dropped, new ones are filled from `source`.
  virtual void setMinDepth(int minDepth, Component const& source) = 0;
  /// Moves the deep end of the range.
  virtual void setDepth(int depth, Component const& source) = 0;
  /// Whether `type` holds the identity of the element type, a std::type_index, or a value of it.
  virtual bool hasElementType(Ostil::Any const& type) const = 0;
  /// All elements as plain arrays: kind 0 is one flat Array<T>, kind 3 an array of 29 depths of tiles.
  /// @shape Kind 0: depth by depth, tile by tile, each tile whole with its halo. Kind 3: see NestedArrays.
  /// @error A new empty Array<T> of this channel's type for another type or kind.
  virtual Ostil::Ptr<void> channelData(unsigned int kind, Ostil::Any const& type) = 0;
  /// The way back. Sizes must match those of the tiles; otherwise nothing happens.
  virtual void setChannelData(unsigned int kind, Ostil::Any const& type, Ostil::Ptr<void> const& data) = 0;

  // The update protocol: the container has changed, then its topologies were updated, now the channels
  // follow.
  virtual void updateTilesAdded(Component const& tree) = 0;
  virtual void updateTilesRemoved(TileRemovalList const& removed, Component const& tree) = 0;
  virtual void updateTilesPermuted(TilePermutation const& newToOld) = 0;
  virtual void updateElements(ElementMoves const& moves, ElementOrder const& order,
                              DestinationTiles const& tiles, ArrivalMap const& arrivals) = 0;

  /// Identity of the element type.
  virtual std::type_index elementType() const = 0;
  virtual ChannelLayout layout() const = 0;
  /// Sets every element of the listed tiles of one depth to the default value. Tiles that the channel lacks
  /// are skipped.
  /// @cost Parallel over the tiles.
  virtual void fillTiles(int depth, std::vector<std::int64_t> const& tiles) = 0;

  using Component::elementCount;
  using Component::update;
  // Moves of elements. A move from or to a tile that the channel lacks, such as one of a depth outside its
  // range, does nothing. Channels of fixed size (ChannelLayout::fixedSize) are passed over: each of their
  // tiles holds what its place asks for, and no element of it is a point's.

  /// Moves elements to tiles of depth `first`. The moves are sorted by source unless they are so already. An
  /// element that leaves a tile is replaced by the tile's last one: the order in a tile is not kept.
  void update(std::vector<ElementToFrom>& moves, int first, int last, bool sorted);
  void update(std::vector<ElementToFrom>& moves, int depth, bool sorted);
  /// Moves elements between any depths: all destinations grow, all elements are copied, then all are removed.
  void update(ElementMoves& moves, bool sorted);
  /// Applies what an accessor has recorded.
  void update(TileDataElementAccessor& recorded);
  /// Prepares order, destination tiles and arrivals for moves to one depth.
  void computePermutation(std::vector<ElementToFrom>& moves, std::vector<std::uint64_t>& order,
                          std::vector<std::uint64_t>& tiles, TileArrivals& arrivals, int depth,
                          bool sorted) const;
  /// The same for each depth.
  void computePermutation(ElementMoves& moves, ElementOrder& order, DestinationTiles& tiles,
                          ArrivalMap& arrivals, bool sorted) const;

  /// For owners of handles on a channel that they do not own, such as the pool.
  ChangeGate& changeGate() const { return m_gate; }

protected:
  /// Every operation that changes tiles, counts or settings holds one.
  class VLN_API Change {
  public:
    explicit Change(ChannelBase const& channel);
    Change(Change&& other) noexcept
        : m_channel(std::exchange(other.m_channel, nullptr)) {}
    Change& operator=(Change&& other) noexcept {
      std::swap(m_channel, other.m_channel);
      return *this;
    }
    ~Change();

  private:
    ChannelBase const* m_channel;
  };

  void updateElementsNoDispatch(std::vector<ElementToFrom> const& moves,
                                std::vector<std::uint64_t> const& order,
                                std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                                int depth);
  void updateElementsNoDispatch(ElementPermutation const& permutation);
  /// Grows the destination tiles of one depth by what arrives there.
  virtual void allocateElementStorage(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                                      std::size_t moveCount, int depth) = 0;
  /// Writes the arrivals of one depth behind the elements that its tiles had.
  virtual void copyElements(std::vector<ElementToFrom> const& moves, std::vector<std::uint64_t> const& order,
                            std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                            int depth) = 0;
  /// Removes elements, filling the holes from each tile's tail.
  /// @pre Sorted by tile and element.
  virtual void removeElements(std::vector<ElementInTile> const& elements, int depth) = 0;

  /// Whether the channel has the source, and the destination tile if there is one, of every move.
  virtual bool holdsAll(std::vector<ElementToFrom> const& moves, int depth) const = 0;
  /// Makes sure that allocateElementStorage() does not fail. Changes capacities only.
  virtual void reserveElementStorage(std::vector<std::uint64_t> const& tiles, TileArrivals const& arrivals,
                                     std::size_t moveCount, int depth) = 0;

  void dumpCounts(std::ostream& os) const;
  /// Tells of a deep copy while the logger is on.
  void announceCopy(ChannelBase const& copy) const;
  /// A sharer's part of shared data; tells of the sharing while the logger dumps.
  static void addShared(std::uint64_t& used, std::uint64_t& allocated, std::uint64_t dataUsed,
                        std::uint64_t dataAllocated, std::int64_t sharers, bool notShared,
                        void const* storage);

private:
  /// @pre The channel holds what the moves name.
  void applyMoves(ElementPermutation const& permutation);
  /// The moves that the channel can follow; the others do nothing.
  void applyHeldMoves(ElementPermutation const& permutation);

  mutable ChangeGate m_gate;
};

} // namespace VLN::TileTree3D
