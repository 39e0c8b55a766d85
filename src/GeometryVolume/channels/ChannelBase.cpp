#include "GeometryVolume/channels/ChannelBase.h"

namespace VLN::TileTree3D {

ChannelBase::~ChannelBase() = default;

void ChannelBase::memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const {
  VLN::Component::memUse(used, allocated, notShared);
}

} // namespace VLN::TileTree3D
