// Definitions of Channel. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/TypedChannelImpl.h"

namespace VLN::TileTree3D {

template <class TraitsT, class T, int E, int H>
Channel<TraitsT, T, E, H>::Channel(Ostil::String const& name, T const* defaultValue,
                                   DataElementInitializerType initializer, bool useStaticAllocation,
                                   bool callElementConstructor, int minDepth, int depth)
    : Base(name, Ostil::makePtr<Data>(defaultValue, initializer, useStaticAllocation, callElementConstructor,
                                      minDepth, depth)) {
  objectComplete(this);
}

template <class TraitsT, class T, int E, int H>
Channel<TraitsT, T, E, H>::Channel(Channel const& other)
    : Base(other) {
  objectComplete(this);
}

template <class TraitsT, class T, int E, int H>
Channel<TraitsT, T, E, H>& Channel<TraitsT, T, E, H>::operator=(Channel const& other) {
  Base::operator=(other);
  return *this;
}

// Not defaulted: a defaulted destructor cannot be instantiated alone.
template <class TraitsT, class T, int E, int H> Channel<TraitsT, T, E, H>::~Channel() {
  objectIncomplete(this);
}

template <class TraitsT, class T, int E, int H>
void Channel<TraitsT, T, E, H>::copyTo(Ostil::Ptr<VLN::Component>& target) const {
  if (target.get() == this) return;
  auto const& data = *this->m_data;
  auto copy = Ostil::makePtr<Channel>(this->name(), &data.defaultValue(), data.initializer(),
                                      data.useStaticAllocation(), data.callElementConstructor(),
                                      data.minDepth(), data.depth());
  this->deepCopyTo(*copy);
  target = std::move(copy);
  ChannelBase::copyTo(target);
}

} // namespace VLN::TileTree3D
