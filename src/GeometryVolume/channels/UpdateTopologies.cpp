#include "GeometryVolume/channels/UpdateTopologies.h"

#include "GeometryVolume/channels/ChannelBase.h"
#include "GeometryVolume/channels/UpdateDispatch.h"
#include "GeometryVolume/core/ScopedExtraction.h"
#include "GeometryVolume/topology/PointTopology.h"
#include "GeometryVolume/topology/VoxelTopology.h"

namespace VLN::TileTree3D {

namespace {

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
    VLN::Internal::ScopedExtraction<Component> const taken(object, name);
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
