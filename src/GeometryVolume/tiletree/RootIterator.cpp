#include "GeometryVolume/tiletree/RootIterator.h"

#include "GeometryVolume/tiletree/ContainerDataImpl.h"

#include <bit>
#include <iterator>

namespace VLN::TileTree3D {

namespace {

RootTable::const_iterator in(void const* place) { return std::bit_cast<RootTable::const_iterator>(place); }

} // namespace

RootIterator::reference RootIterator::operator*() const { return *in(m_place); }

RootIterator& RootIterator::operator++() {
  m_place = std::bit_cast<void const*>(std::next(in(m_place)));
  return *this;
}

} // namespace VLN::TileTree3D
