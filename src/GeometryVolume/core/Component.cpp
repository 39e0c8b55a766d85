#include "GeometryVolume/core/Component.h"

#include "GeometryVolume/core/Streaming.h"

#include <ostream>

namespace VLN {

Component& Component::operator=(Component const& other) {
  if (this != &other) {
    Base::operator=(other);
    m_targetName = other.m_targetName;
  }
  return *this;
}

Component::~Component() = default;

void Component::dump(std::ostream& os) const {
  Base::dump(os);
  auto const pad = Streaming::pad(os);
  os << pad << "size = " << size() << '\n';
  os << pad << "address = " << static_cast<void const*>(this) << '\n' << '\n';
}

void Component::memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const {
  Base::memUse(used, allocated, notShared);
  used += sizeof(Ostil::String);
  allocated += sizeof(Ostil::String);
}

void Component::copyTo(Ostil::Ptr<Component>& target) const {
  if (!target || target.get() == this) return;
  target->m_targetName = m_targetName;
  Base::copyTo(*target);
}

bool Component::empty() const { return size() == 0; }

} // namespace VLN
