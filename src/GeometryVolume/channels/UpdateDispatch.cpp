#include "GeometryVolume/channels/UpdateDispatch.h"

#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/ScopedExtraction.h"
#include "GeometryVolume/core/YieldPointImpl.h"

#include <vector>

namespace VLN::TileTree3D {

namespace {

/// The channels of a tree, out of their object for as long as this lives.
class TakenChannels {
public:
  TakenChannels(Component const& tree, VLN::Object& object) {
    // Names first: whoever is asked for its target is held, and what is held is copied when it is taken.
    std::vector<Ostil::String> names;
    for (auto const& name : object.componentRange())
      if (belongs(object.component<ChannelBase>(name), tree)) names.push_back(name);
    m_channels.reserve(names.size());
    VLN_YIELD_POINT(); // they are known, and not taken yet
    for (auto const& name : names) m_channels.emplace_back(object, name);
  }

  void forEach(FunctionRef<void(ChannelBase&)> body) {
    auto const n = static_cast<std::int64_t>(m_channels.size());
    if (n == 1) return body(*m_channels.front());
    parallelFor(0, n, [&](std::int64_t begin, std::int64_t end) {
      for (auto i = begin; i < end; ++i) {
        VLN_YIELD_POINT();
        body(*m_channels[i]);
      }
    });
  }

private:
  static bool belongs(Ostil::Ptr<ChannelBase> const& channel, Component const& tree) {
    return channel && (channel->getTargetName() == tree.name() || channel->owner() == tree.name());
  }

  std::vector<VLN::Internal::ScopedExtraction<ChannelBase>> m_channels;
};

} // namespace

void updateTilesAdded(Component const& tree, VLN::Object& object) {
  TakenChannels(tree, object).forEach([&](ChannelBase& c) { c.updateTilesAdded(tree); });
}

void updateTilesRemoved(TileRemovalList const& removed, Component const& tree, VLN::Object& object) {
  TakenChannels(tree, object).forEach([&](ChannelBase& c) { c.updateTilesRemoved(removed, tree); });
}

void updateTilesPermuted(TilePermutation const& newToOld, Component const& tree, VLN::Object& object) {
  TakenChannels(tree, object).forEach([&](ChannelBase& c) { c.updateTilesPermuted(newToOld); });
}

void updateElements(ElementMoves const& moves, ElementOrder const& order, DestinationTiles const& tiles,
                    ArrivalMap const& arrivals, Component const& tree, VLN::Object& object) {
  TakenChannels(tree, object).forEach([&](ChannelBase& c) {
    c.updateElements(moves, order, tiles, arrivals);
  });
}

} // namespace VLN::TileTree3D
