#include "GeometryVolume/topology/Command.h"

#include "GeometryVolume/core/ScopedExtraction.h"

#include <algorithm>

namespace VLN::TileTree3D::Command {

template <int kTW, int kTDW, int A>
Ostil::Ptr<Container<Traits<kTW, kTDW, A, 1>>> createContainer(Ostil::String const& name, float voxelSize) {
  return Ostil::makePtr<Container<Traits<kTW, kTDW, A, 1>>>(name, voxelSize);
}

template <class TraitsT> Ostil::MutablePtr<VLN::Object> createVLN(Ostil::Ptr<Container<TraitsT>>& container) {
  auto object = createEmptyVLN();
  object->addComponent(container);
  return object;
}

template <class TraitsT>
Ostil::MutablePtr<VLN::Object> createVoxelVLN(Ostil::String const& containerName,
                                              Ostil::String const& topologyName, float voxelSize,
                                              VoxelOffsetType offsetType) {
  auto object = createEmptyVLN();
  auto container = Ostil::makePtr<Container<TraitsT>>(containerName, voxelSize);
  auto topology = Ostil::makePtr<VoxelTopology<TraitsT>>(topologyName, offsetType);
  topology->setTargetName(container->name());
  topology->update(*container);
  object->addComponent(std::move(topology));
  object->addComponent(std::move(container));
  return object;
}

namespace {

template <class Topology, class ContainerT>
Ostil::Ptr<Topology> attach(Ostil::Ptr<Topology> topology, ContainerT const& container, VLN::Object& object) {
  topology->setTargetName(container.name());
  topology->update(container);
  object.addComponent(topology);
  return topology;
}

template <class TraitsT> bool isChannelOf(Ostil::Ptr<ChannelBase> const& channel) {
  return channel && channel->layout().tileDataWidth == TraitsT::kTileDataWidth &&
         channel->layout().maxDepth == TraitsT::kMaxDepth;
}

} // namespace

template <int kTW, int kTDW, int A>
Ostil::Ptr<VoxelTopology<Traits<kTW, kTDW, A, 1>>>
createVoxelTopology(Ostil::String const& name, Container<Traits<kTW, kTDW, A, 1>> const& container,
                    VLN::Object& object, VoxelOffsetType offsetType) {
  return attach(Ostil::makePtr<VoxelTopology<Traits<kTW, kTDW, A, 1>>>(name, offsetType), container, object);
}

template <int kTW, int kTDW, int A>
Ostil::Ptr<PointTopology<Traits<kTW, kTDW, A, 1>>>
createPointTopology(Ostil::String const& name, Container<Traits<kTW, kTDW, A, 1>> const& container,
                    VLN::Object& object) {
  return attach(Ostil::makePtr<PointTopology<Traits<kTW, kTDW, A, 1>>>(name), container, object);
}

template <class TraitsT>
void initializeTileData(Container<TraitsT> const& container,
                        typename Container<TraitsT>::TileLists const& newTiles, VLN::Object& object) {
  // Look the tiles up once for all channels.
  PerDepth<std::vector<std::int64_t>, TraitsT::kDepths> tiles;
  auto accessor = container.tileAccessor();
  for (int d = 0; d < TraitsT::kDepths; ++d) {
    for (int3 const& corner : newTiles[d]) {
      auto const& tile = accessor.tile(corner, d, true);
      if (tile.valid()) tiles[d].push_back(tile.index());
    }
  }
  for (auto const& name : object.componentRange()) {
    if (!isChannelOf<TraitsT>(object.component<ChannelBase>(name))) continue;
    VLN::Internal::ScopedExtraction<ChannelBase> const taken(object, name);
    ChannelBase& channel = *taken;
    int const last = std::min(channel.depth(), TraitsT::kMaxDepth);
    for (int d = std::max(channel.minDepth(), 0); d <= last; ++d) channel.fillTiles(d, tiles[d]);
  }
}

#define VLN_INSTANTIATE(TW, TDW)                                                                             \
  template VLN_API Ostil::Ptr<Container<Traits<TW, TDW, 0, 1>>> createContainer<TW, TDW, 0>(                 \
      Ostil::String const&, float);                                                                          \
  template VLN_API Ostil::MutablePtr<VLN::Object> createVLN(Ostil::Ptr<Container<Traits<TW, TDW, 0, 1>>>&);  \
  template VLN_API Ostil::MutablePtr<VLN::Object> createVoxelVLN<Traits<TW, TDW, 0, 1>>(                     \
      Ostil::String const&, Ostil::String const&, float, VoxelOffsetType);                                   \
  template VLN_API Ostil::Ptr<VoxelTopology<Traits<TW, TDW, 0, 1>>> createVoxelTopology<TW, TDW, 0>(         \
      Ostil::String const&, Container<Traits<TW, TDW, 0, 1>> const&, VLN::Object&, VoxelOffsetType);         \
  template VLN_API Ostil::Ptr<PointTopology<Traits<TW, TDW, 0, 1>>> createPointTopology<TW, TDW, 0>(         \
      Ostil::String const&, Container<Traits<TW, TDW, 0, 1>> const&, VLN::Object&);                          \
  template VLN_API void initializeTileData(Container<Traits<TW, TDW, 0, 1>> const&,                          \
                                           Container<Traits<TW, TDW, 0, 1>>::TileLists const&,               \
                                           VLN::Object&);
VLN_INSTANTIATE(2, 4)
VLN_INSTANTIATE(5, 5)

} // namespace VLN::TileTree3D::Command
