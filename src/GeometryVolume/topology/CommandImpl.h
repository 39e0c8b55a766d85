// Definitions of createChannel(), for the generated sources.
#pragma once

#include "GeometryVolume/topology/Command.h"

namespace VLN::TileTree3D::Command {

namespace Internal {

template <class ChannelT, class Source, class T>
Ostil::Ptr<ChannelT> makeChannel(Ostil::String const& name, Source const& source, T const& defaultValue,
                                 DataElementInitializerType initializer, int minDepth, int maxDepth) {
  auto channel = Ostil::makePtr<ChannelT>(name, &defaultValue, initializer, false, true, minDepth, maxDepth);
  channel->setTargetName(source.name());
  channel->setOwner(source.getTargetName());
  channel->update(source);
  return channel;
}

template <class ChannelT, class Source, class T>
Ostil::MutablePtr<ChannelT> addChannel(Ostil::String const& name, Source const& source, VLN::Object& object,
                                       T const& defaultValue, DataElementInitializerType initializer,
                                       int minDepth, int maxDepth) {
  auto channel = makeChannel<ChannelT>(name, source, defaultValue, initializer, minDepth, maxDepth);
  object.addComponent(channel);
  return Ostil::MutablePtr<ChannelT>::shareWith(std::move(channel));
}

} // namespace Internal

template <class T, int kTW, int kTDW, int E, int A, int H>
Ostil::MutablePtr<Channel<Traits<kTW, kTDW, A, 1>, T, E, H>>
createChannel(Ostil::String const& name, VoxelTopology<Traits<kTW, kTDW, A, 1>> const& source, T defaultValue,
              DataElementInitializerType initializer, int minDepth, int maxDepth) {
  using ChannelT = Channel<Traits<kTW, kTDW, A, 1>, T, E, H>;
  return Ostil::MutablePtr<ChannelT>(
      Internal::makeChannel<ChannelT>(name, source, defaultValue, initializer, minDepth, maxDepth));
}

template <class T, int kTW, int kTDW, int E, int A, int H>
Ostil::MutablePtr<Channel<Traits<kTW, kTDW, A, 1>, T, E, H>>
createChannel(Ostil::String const& name, VoxelTopology<Traits<kTW, kTDW, A, 1>> const& source,
              VLN::Object& object, T defaultValue, DataElementInitializerType initializer, int minDepth,
              int maxDepth) {
  return Internal::addChannel<Channel<Traits<kTW, kTDW, A, 1>, T, E, H>>(name, source, object, defaultValue,
                                                                         initializer, minDepth, maxDepth);
}

template <class T, int kTW, int kTDW, int E, int A, int H>
Ostil::MutablePtr<Channel<Traits<kTW, kTDW, A, 1>, T, E, H>>
createChannel(Ostil::String const& name, PointTopology<Traits<kTW, kTDW, A, 1>> const& source,
              VLN::Object& object, T defaultValue, DataElementInitializerType initializer, int minDepth,
              int maxDepth) {
  return Internal::addChannel<Channel<Traits<kTW, kTDW, A, 1>, T, E, H>>(name, source, object, defaultValue,
                                                                         initializer, minDepth, maxDepth);
}

template <class T, int kTW, int kTDW, int E, int A, int H>
Ostil::MutablePtr<Channel<Traits<kTW, kTDW, A, 1>, T, E, H>>
createChannel(Ostil::String const& name, Channel<Traits<kTW, kTDW, A, 1>, T, E, 0> const& source,
              VLN::Object& object, T defaultValue, DataElementInitializerType initializer, int minDepth,
              int maxDepth) {
  return Internal::addChannel<Channel<Traits<kTW, kTDW, A, 1>, T, E, H>>(name, source, object, defaultValue,
                                                                         initializer, minDepth, maxDepth);
}

} // namespace VLN::TileTree3D::Command
