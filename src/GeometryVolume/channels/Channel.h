// Channel<Traits, T, E, H>: one named field over a tile tree, a tile of elements for each tile of the tree.
//
//   Traits         (E,H)                     kExtended
//   <2,4,0,1>      (4,0) (4,1) (4,2)         0
//                  (5,0)                     1: one more sample on the far side of each axis
//   <5,5,0,1>      (5,0) (5,1) (5,2)         0
//                  (6,0)                     1
//
// Each combination exists for the 18 element types. Channels with E of the tree's tile data width and no halo
// follow the counts of the component they are updated from, and so may hold points; the others have kSize
// elements in every tile.
#pragma once

#include "GeometryVolume/channels/ChannelLayouts.h"
#include "GeometryVolume/channels/ElementIterator.h"
#include "GeometryVolume/channels/TileData.h"
#include "GeometryVolume/channels/TypedChannel.h"
#include "GeometryVolume/tiletree/Tile.h"

#include <utility>

namespace VLN::TileTree3D {

template <class TraitsT, class T, int E, int H> class VLN_API Channel : public TypedChannel<T> {
  using Base = TypedChannel<T>;

public:
  using Traits = TraitsT;
  using value_type = T;
  using ConstTile = ConstTileData<T, E, H>;
  using WritableTile = TileData<T, E, H>;
  using TileDataElementAccessor = TileTree3D::TileDataElementAccessor;

  static constexpr int kExtended = E - TraitsT::kTileDataWidth;
  static constexpr int kHalo = H;
  static constexpr int kSize = ConstTile::kSize;
  static constexpr ChannelLayout kLayout{E, H, kExtended, TraitsT::kTileDataWidth, kSize, TraitsT::kMaxDepth};
  static_assert(isLayout(kExtended, H), "no such channel");

  /// What channels that were assigned to each other share.
  class Data : public ChannelData<T> {
  public:
    Data()
        : ChannelData<T>(kLayout) {}
    Data(T const* defaultValue, DataElementInitializerType initializer, bool useStaticAllocation,
         bool callElementConstructor, int minDepth, int depth)
        : ChannelData<T>(kLayout, defaultValue, initializer, useStaticAllocation, callElementConstructor,
                         minDepth, depth) {}
    Data(Data const&) = default;

    WritableTile tileData(TreeIndex const& tile) { return WritableTile(&this->vector(tile)); }
    ConstTile tileData(TreeIndex const& tile) const { return ConstTile(&this->vector(tile)); }
    WritableTile tileData(std::int64_t flat) { return tileData(this->indexToTreeIndex(flat)); }
    ConstTile tileData(std::int64_t flat) const { return tileData(this->indexToTreeIndex(flat)); }
  };

  /// Direct growth of single tiles. Owns nothing; the channel must outlive it. While it lives the channel
  /// counts as being changed: what other threads report of it is what they saw before.
  class TileDataAccessor {
  public:
    using DynamicTile = DynamicTileData<WritableTile>;

    TileDataAccessor(TileDataAccessor&&) noexcept = default;
    TileDataAccessor& operator=(TileDataAccessor&&) noexcept = default;

    /// A handle whose operations change the element count of the tile inside the channel.
    DynamicTile tileData(TreeIndex const& tile) { return DynamicTile(&m_channel->tileVector(tile)); }
    DynamicTile tileData(std::int64_t flat) { return tileData(m_channel->indexToTreeIndex(flat)); }

  protected:
    explicit TileDataAccessor(Channel& channel)
        : m_channel(&channel)
        , m_change(channel) {}

  private:
    friend class Channel;
    Channel* m_channel;
    ChannelBase::Change m_change;
  };

  template <class TD, class VecIterator, class Reference, class Pointer, class ChannelPointer>
  using IteratorBase = TileTree3D::IteratorBase<TD, VecIterator, Reference, Pointer, ChannelPointer>;
  using iterator = IteratorBase<WritableTile, typename TileVector<T>::iterator, T&, T*, Channel*>;
  using const_iterator =
      IteratorBase<ConstTile, typename TileVector<T>::const_iterator, T const&, T const*, Channel const*>;

  /// A channel without tiles. An empty name becomes Const::TileTreeChannelName, a null default value zero.
  /// With static allocation, the tiles of one update lie in one block.
  Channel(Ostil::String const& name, T const* defaultValue, DataElementInitializerType initializer,
          bool useStaticAllocation, bool callElementConstructor, int minDepth, int depth);
  Channel(Channel const& other);
  Channel& operator=(Channel const& other);
  ~Channel() override;

  /// A deep copy, as a new channel.
  void copyTo(Ostil::Ptr<VLN::Component>& target) const override;

  // Elements, unchecked. The forms that may write need a channel that shares nothing.
  T& operator[](ElementTreeIndex const& e) { return element(this->tileVector(e), e.element); }
  T const& operator[](ElementTreeIndex const& e) const { return element(this->tileVector(e), e.element); }
  T& operator[](VoxelTreeIndex const& v) { return element(this->tileVector(v), ConstTile::index(v.ijk)); }
  T const& operator[](VoxelTreeIndex const& v) const {
    return element(this->tileVector(v), ConstTile::index(v.ijk));
  }
  /// By flat tile index * kSize + position: for channels that hold kSize elements in every tile.
  T& operator[](std::int64_t flat) {
    return element(this->tileVector(this->indexToTreeIndex(flat / kSize)), static_cast<int>(flat % kSize));
  }
  T const& operator[](std::int64_t flat) const {
    return element(this->tileVector(this->indexToTreeIndex(flat / kSize)), static_cast<int>(flat % kSize));
  }
  template <int N> T& operator()(Tile<TraitsT, N> const& tile, int3 const& ijk) {
    return element(this->tileVector(tile.treeIndex()), ConstTile::index(ijk));
  }
  template <int N> T const& operator()(Tile<TraitsT, N> const& tile, int3 const& ijk) const {
    return element(this->tileVector(tile.treeIndex()), ConstTile::index(ijk));
  }

  // Tiles, as views
  WritableTile tileData(TreeIndex const& tile) { return WritableTile(&this->tileVector(tile)); }
  ConstTile tileData(TreeIndex const& tile) const { return ConstTile(&this->tileVector(tile)); }
  WritableTile tileData(std::int64_t flat) { return tileData(this->indexToTreeIndex(flat)); }
  ConstTile tileData(std::int64_t flat) const { return tileData(this->indexToTreeIndex(flat)); }
  WritableTile tileData(std::int64_t index, int depth) { return tileData(TreeIndex{index, depth}); }
  ConstTile tileData(std::int64_t index, int depth) const { return tileData(TreeIndex{index, depth}); }

  TileDataAccessor tileDataAccessor() { return TileDataAccessor(*this); }

  // All elements, depth by depth and tile by tile
  iterator begin() { return iterator(this, TreeIndex{0, 0}); }
  iterator end() { return iterator(this, TreeIndex()); }
  const_iterator begin() const { return cbegin(); }
  const_iterator end() const { return cend(); }
  const_iterator cbegin() const { return const_iterator(this, TreeIndex{0, 0}); }
  const_iterator cend() const { return const_iterator(this, TreeIndex()); }

protected:
  template <class, class, class, class, class> friend class TileTree3D::IteratorBase;

  Ostil::Ptr<Data> getData() const { return Ostil::staticCast<Data>(this->m_data); }

private:
  template <class Vector> static auto& element(Vector& v, int at) { return v[at]; }
};

} // namespace VLN::TileTree3D
