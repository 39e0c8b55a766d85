#include "GeometryVolume/topology/PointTopology.h"

#include "GeometryVolume/core/Const.h"
#include "GeometryVolume/core/LoggerHooks.h"
#include "GeometryVolume/core/Streaming.h"

#include <ostream>

namespace VLN::TileTree3D {

template <class TraitsT>
PointTopology<TraitsT>::PointTopology(Ostil::String const& name)
    : Component(name.empty() ? Ostil::String(Const::TileTreePointTopologyName) : name, Incomplete()) {
  objectComplete(this);
}

template <class TraitsT>
PointTopology<TraitsT>::PointTopology(PointTopology const& other)
    : Component(other, Incomplete())
    , m_counts(other.m_counts) {
  objectComplete(this);
}

template <class TraitsT>
PointTopology<TraitsT>& PointTopology<TraitsT>::operator=(PointTopology const& other) {
  ObjectChange const change(this);
  Component::operator=(other);
  m_counts = other.m_counts;
  return *this;
}

template <class TraitsT> PointTopology<TraitsT>::~PointTopology() { objectIncomplete(this); }

template <class TraitsT> std::uint64_t PointTopology<TraitsT>::size() const {
  return static_cast<std::uint64_t>(elementCount(-1));
}

template <class TraitsT> void PointTopology<TraitsT>::update(VLN::Component const& source) {
  ObjectChange const change(this);
  if (auto const* container = dynamic_cast<Container<TraitsT> const*>(&source))
    m_counts.countTiles(*container, 0);
  else if (auto const* other = dynamic_cast<Component const*>(&source))
    m_counts.countElements(*other, 0);
}

template <class TraitsT> void PointTopology<TraitsT>::copyTo(Ostil::Ptr<VLN::Component>& target) const {
  if (target.get() == this) return;
  target = Ostil::makePtr<PointTopology>(*this);
  Component::copyTo(target);
}

template <class TraitsT> void PointTopology<TraitsT>::dump(std::ostream& os) const {
  Component::dump(os);
  auto const pad = Streaming::pad(os);
  os << pad << "tileCountTotal {" << tileCount(-1) << "}\n";
  for (int d = 0; d < TraitsT::kDepths; ++d) os << pad << "tileCount[" << d << "] = " << tileCount(d) << '\n';
  os << pad << "elementCountTotal {" << elementCount(-1) << "}\n";
  for (int d = 0; d < TraitsT::kDepths; ++d)
    os << pad << "elementCount[" << d << "] = " << elementCount(d) << '\n';
}

template <class TraitsT>
void PointTopology<TraitsT>::memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const {
  Component::memUse(used, allocated, notShared);
  m_counts.addMemory(used, allocated);
}

#define VLN_INSTANTIATE(TraitsT) template class VLN_API PointTopology<TraitsT>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
