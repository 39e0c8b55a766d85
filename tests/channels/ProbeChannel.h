// A channel that opens its protected parts to tests.
#pragma once

#include "GeometryVolume/channels/Channel.h"

namespace VLN::Test {

using TileTree3D::OddTraits;
using TileTree3D::PowerOfTwoTraits;

/// The flags of a channel's maker.
struct Flags {
  bool useStatic = false, construct = true, empty = false;
  int minDepth = 0, depth = 28;
};

template <class Traits, class T, int E, int H>
class ProbeChannel : public TileTree3D::Channel<Traits, T, E, H> {
  using Base = TileTree3D::Channel<Traits, T, E, H>;

public:
  using Base::Base;
  explicit ProbeChannel(Flags const& f = {}, T const& defaultValue = T{}, Ostil::String const& name = "probe")
      : Base(name, &defaultValue, TileTree3D::kInitializeDefaultValue, f.useStatic, f.construct, f.minDepth,
             f.depth) {
    if (f.empty) this->enableAllocateEmptyTileData();
  }

  using Base::allocateElementStorage;
  using Base::dataPtr;
  using Base::getData;
  using Base::indexToTreeIndex;
  using Base::remove;
  using Base::treeIndexToIndex;
  using Base::updateElementResizeNoDispatch;
  using Base::updateElementsNoDispatch;
  using Base::updateResize;
  using Base::updateTilePermuteNoDispatch;
  using Base::updateTileResizeNoDispatch;
  using Base::updateTilesNoDispatch;

  std::size_t blockCount() const { return this->getData()->allocations().size(); }
  bool isStatic(TileTree3D::TreeIndex const& t) const {
    return this->getData()->vector(t).get_allocator().isStatic();
  }
};

} // namespace VLN::Test
