// Command: the way to assemble a volume. Parts of a volume find each other by name:
//
//   Object { "tree" : Container, "topo" : VoxelTopology --target--> "tree", "density" : Channel --target-->
//   "topo" }
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/topology/PointTopology.h"
#include "GeometryVolume/topology/VoxelTopology.h"

/// @threads Commands are called on one thread. What fails ends as the allocator's exception.
namespace VLN::TileTree3D::Command {

/// A container that is in no object yet. An empty name takes the default of its class, here and below.
template <int kTW, int kTDW, int A>
Ostil::Ptr<Container<Traits<kTW, kTDW, A, 1>>> createContainer(Ostil::String const& name, float voxelSize);

/// An object that holds the container.
template <class TraitsT> Ostil::MutablePtr<VLN::Object> createVLN(Ostil::Ptr<Container<TraitsT>>& container);

/// An object with a container and a voxel topology on it.
template <class TraitsT>
Ostil::MutablePtr<VLN::Object> createVoxelVLN(Ostil::String const& containerName,
                                              Ostil::String const& topologyName, float voxelSize,
                                              VoxelOffsetType offsetType);

/// Makes a topology that has followed the container, and adds it to the object.
template <int kTW, int kTDW, int A>
Ostil::Ptr<VoxelTopology<Traits<kTW, kTDW, A, 1>>>
createVoxelTopology(Ostil::String const& name, Container<Traits<kTW, kTDW, A, 1>> const& container,
                    VLN::Object& object, VoxelOffsetType offsetType);
template <int kTW, int kTDW, int A>
Ostil::Ptr<PointTopology<Traits<kTW, kTDW, A, 1>>>
createPointTopology(Ostil::String const& name, Container<Traits<kTW, kTDW, A, 1>> const& container,
                    VLN::Object& object);

/// A channel with storage for all tiles of `source`, each element at the default value.
///
/// The forms with an object add the channel to it; the result is then a handle on the very channel that the
/// object holds. T is any of the element types; (E, H) is (kTDW, 0), (kTDW, 1) or (kTDW + 1, 0).
template <class T, int kTW, int kTDW, int E, int A, int H>
Ostil::MutablePtr<Channel<Traits<kTW, kTDW, A, 1>, T, E, H>>
createChannel(Ostil::String const& name, VoxelTopology<Traits<kTW, kTDW, A, 1>> const& source, T defaultValue,
              DataElementInitializerType initializer, int minDepth, int maxDepth);
template <class T, int kTW, int kTDW, int E, int A, int H>
Ostil::MutablePtr<Channel<Traits<kTW, kTDW, A, 1>, T, E, H>>
createChannel(Ostil::String const& name, VoxelTopology<Traits<kTW, kTDW, A, 1>> const& source,
              VLN::Object& object, T defaultValue, DataElementInitializerType initializer, int minDepth,
              int maxDepth);
template <class T, int kTW, int kTDW, int E, int A, int H>
Ostil::MutablePtr<Channel<Traits<kTW, kTDW, A, 1>, T, E, H>>
createChannel(Ostil::String const& name, PointTopology<Traits<kTW, kTDW, A, 1>> const& source,
              VLN::Object& object, T defaultValue, DataElementInitializerType initializer, int minDepth,
              int maxDepth);
/// Takes the tile layout from another channel.
template <class T, int kTW, int kTDW, int E, int A, int H>
Ostil::MutablePtr<Channel<Traits<kTW, kTDW, A, 1>, T, E, H>>
createChannel(Ostil::String const& name, Channel<Traits<kTW, kTDW, A, 1>, T, E, 0> const& source,
              VLN::Object& object, T defaultValue, DataElementInitializerType initializer, int minDepth,
              int maxDepth);

/// Fills new tiles of all channels of an object with each channel's default value.
/// @param newTiles For each depth the corners of the tiles that were made. Corners without a tile are
/// skipped.
/// @pre The channels have followed the tree.
/// @cost Parallel over the tiles of one depth at a time.
template <class TraitsT>
void initializeTileData(Container<TraitsT> const& container,
                        typename Container<TraitsT>::TileLists const& newTiles, VLN::Object& object);

} // namespace VLN::TileTree3D::Command
