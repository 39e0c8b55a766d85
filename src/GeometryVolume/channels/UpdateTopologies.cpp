#include "GeometryVolume/channels/UpdateTopologies.h"

#include "GeometryVolume/channels/ChannelBase.h"
#include "GeometryVolume/channels/UpdateDispatch.h"
#include "GeometryVolume/topology/PointTopology.h"
#include "GeometryVolume/topology/VoxelTopology.h"

#include <utility>

namespace VLN::TileTree3D {

namespace {

/// A component, out of its object for as long as this lives; its key keeps its place.
class TakenComponent {
public:
  TakenComponent(VLN::Object& object, Ostil::String const& name)
      : m_object(object)
      , m_name(name) {
    auto shared = Ostil::staticCast<Component>(object.component(name));
    object.setProperty(name, Ostil::Any());
    m_component = Ostil::MutablePtr<Component>(std::move(shared));
  }
  ~TakenComponent() {
    Ostil::Ptr<VLN::Component> component = std::move(m_component);
    m_object.setProperty(m_name, Ostil::Any(std::move(component)));
  }
  TakenComponent(TakenComponent const&) = delete;
  TakenComponent& operator=(TakenComponent const&) = delete;
  Component& operator*() { return *m_component; }

private:
  VLN::Object& m_object;
  Ostil::String m_name;
  Ostil::MutablePtr<Component> m_component;
};

/// A channel of the topology that may hold a different number of elements in each tile; null without one.
Ostil::Ptr<ChannelBase> pointChannel(Component const& topology, VLN::Object const& object) {
  for (auto const& name : object.componentRange()) {
    auto channel = object.component<ChannelBase>(name);
    if (channel && !channel->layout().fixedSize() &&
        (channel->getTargetName() == topology.name() || channel->owner() == topology.name()))
      return channel;
  }
  return nullptr;
}

} // namespace

template <class TraitsT>
void updateTopologies(Container<TraitsT> const& tree, VLN::Object& object, TileRemovalList const* removed,
                      Component const* except) {
  for (auto const& name : object.componentRange()) {
    bool const points = bool(object.component<PointTopology<TraitsT>>(name));
    if (!points && !object.component<VoxelTopology<TraitsT>>(name)) continue;
    if (object.component(name)->getTargetName() != tree.name() || (except && except->name() == name))
      continue;
    TakenComponent taken(object, name);
    Component& topology = *taken;
    topology.update(tree);
    if (!removed) {
      updateTilesAdded(topology, object);
      continue;
    }
    updateTilesRemoved(*removed, topology, object);
    // Tiles have moved: the counts of points are those of the channels, which moved along.
    if (auto const channel = points ? pointChannel(topology, object) : nullptr) topology.update(*channel);
  }
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template VLN_API void updateTopologies(Container<TraitsT> const&, VLN::Object&, TileRemovalList const*,    \
                                         Component const*);
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
