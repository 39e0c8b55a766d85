#include "GeometryVolume/topology/VoxelTopology.h"

#include "GeometryVolume/core/Const.h"
#include "GeometryVolume/core/LoggerHooks.h"
#include "GeometryVolume/core/Streaming.h"

#include <ostream>

namespace VLN::TileTree3D {

template <class TraitsT>
VoxelTopology<TraitsT>::VoxelTopology(Ostil::String const& name, VoxelOffsetType offsetType)
    : Component(name.empty() ? Ostil::String(Const::TileTreeVoxelTopologyName) : name, Incomplete())
    , m_offsetType(offsetType) {
  objectComplete(this);
}

template <class TraitsT>
VoxelTopology<TraitsT>::VoxelTopology(VoxelTopology const& other)
    : Component(other, Incomplete())
    , m_counts(other.m_counts)
    , m_offsetType(other.m_offsetType)
    , m_voxelSize(other.m_voxelSize)
    , m_voxelSizeInv(other.m_voxelSizeInv) {
  objectComplete(this);
}

template <class TraitsT>
VoxelTopology<TraitsT>& VoxelTopology<TraitsT>::operator=(VoxelTopology const& other) {
  ObjectChange const change(this);
  Component::operator=(other);
  m_offsetType = other.m_offsetType;
  m_counts = other.m_counts;
  m_voxelSize = other.m_voxelSize;
  m_voxelSizeInv = other.m_voxelSizeInv;
  return *this;
}

template <class TraitsT> VoxelTopology<TraitsT>::~VoxelTopology() { objectIncomplete(this); }

template <class TraitsT> std::uint64_t VoxelTopology<TraitsT>::size() const {
  return static_cast<std::uint64_t>(tileCount(-1)) * TraitsT::kTileSize;
}

template <class TraitsT> void VoxelTopology<TraitsT>::update(VLN::Component const& source) {
  ObjectChange const change(this);
  constexpr auto kElements = static_cast<std::uint32_t>(TraitsT::kTileDataSize);
  if (auto const* container = dynamic_cast<Container<TraitsT> const*>(&source)) {
    m_counts.countTiles(*container, kElements);
    m_counts.elementCountTotal = 0;
    for (std::size_t d = 0; d < m_counts.tileCounts.size(); ++d) {
      m_counts.elementCounts[d] = m_counts.tileCounts[d] * kElements;
      m_counts.elementCountTotal += m_counts.elementCounts[d];
    }
    m_voxelSize = container->voxelSize();
    m_voxelSizeInv = 1.0f / m_voxelSize;
  } else if (auto const* other = dynamic_cast<Component const*>(&source)) {
    m_counts.countElements(*other, kElements);
  }
}

template <class TraitsT> void VoxelTopology<TraitsT>::copyTo(Ostil::Ptr<VLN::Component>& target) const {
  if (target.get() == this) return;
  target = Ostil::makePtr<VoxelTopology>(*this);
  Component::copyTo(target);
}

template <class TraitsT> void VoxelTopology<TraitsT>::dump(std::ostream& os) const {
  Component::dump(os);
  auto const pad = Streaming::pad(os);
  os << pad << "tileCountTotal {" << tileCount(-1) << "}\n";
  for (int d = 0; d < TraitsT::kDepths; ++d) os << pad << "tileCount[" << d << "] = " << tileCount(d) << '\n';
  os << pad << "offsetType = " << static_cast<int>(m_offsetType) << '\n';
  os << pad << "voxelSize = " << m_voxelSize << '\n';
  os << pad << "voxelSizeInv = " << m_voxelSizeInv << '\n';
}

template <class TraitsT>
void VoxelTopology<TraitsT>::memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const {
  Component::memUse(used, allocated, notShared);
  m_counts.addMemory(used, allocated);
}

#define VLN_INSTANTIATE(TraitsT) template class VLN_API VoxelTopology<TraitsT>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
