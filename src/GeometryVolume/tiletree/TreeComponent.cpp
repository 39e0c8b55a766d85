#include "GeometryVolume/tiletree/TreeComponent.h"

namespace VLN::TileTree3D {

Component::~Component() = default;

void Component::copyTo(Ostil::Ptr<VLN::Component>& target) const {
  VLN::Component::copyTo(target);
  if (target.get() == this) return;
  if (auto* copy = dynamic_cast<Component*>(target.get())) copy->m_owner = m_owner;
}

} // namespace VLN::TileTree3D
