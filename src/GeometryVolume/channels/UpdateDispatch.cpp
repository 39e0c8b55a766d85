#include "GeometryVolume/channels/UpdateDispatch.h"

#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/core/Parallel.h"

#include <utility>
#include <vector>

namespace VLN::TileTree3D {

namespace {

/// The channels of a tree, out of their object for as long as this lives.
class TakenChannels {
public:
  TakenChannels(Component const& tree, VLN::Object& object)
      : TakenChannels(object) {
    for (auto const& name : object.componentRange()) {
      auto const channel = object.component<ChannelBase>(name);
      if (!channel || (channel->getTargetName() != tree.name() && channel->owner() != tree.name())) continue;
      take(name);
    }
  }
  ~TakenChannels() {
    for (auto& [name, channel] : m_channels) {
      Ostil::Ptr<VLN::Component> component = std::move(channel);
      m_object.setProperty(name, Ostil::Any(std::move(component)));
    }
  }
  TakenChannels(TakenChannels const&) = delete;
  TakenChannels& operator=(TakenChannels const&) = delete;

  void forEach(FunctionRef<void(ChannelBase&)> body) {
    auto const n = static_cast<std::int64_t>(m_channels.size());
    if (n == 1) return body(*m_channels.front().second);
    parallelFor(0, n, [&](std::int64_t begin, std::int64_t end) {
      for (auto i = begin; i < end; ++i) body(*m_channels[static_cast<std::size_t>(i)].second);
    });
  }

private:
  // Complete before the first channel is taken, so that all come back whatever is thrown.
  explicit TakenChannels(VLN::Object& object)
      : m_object(object) {}

  /// As Object::extractComponent, but leaves the key in its place in the order of the object's properties.
  void take(Ostil::String const& name) {
    auto shared = Ostil::staticCast<ChannelBase>(m_object.component(name));
    m_object.setProperty(name, Ostil::Any());
    m_channels.emplace_back(name, Ostil::MutablePtr<ChannelBase>(std::move(shared)));
  }

  VLN::Object& m_object;
  std::vector<std::pair<Ostil::String, Ostil::MutablePtr<ChannelBase>>> m_channels;
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
