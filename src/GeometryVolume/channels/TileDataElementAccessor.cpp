#include "GeometryVolume/channels/TileDataElementAccessor.h"

#include "GeometryVolume/tiletree/Traits.h"

#include <ostream>

namespace VLN::TileTree3D {

TileDataElementAccessor::TileDataElementAccessor()
    : m_elementsTo(kChannelDepths)
    , m_elementsFrom(kChannelDepths) {}

void TileDataElementAccessor::move(ElementTreeIndex const& from, TreeIndex const& to) {
  m_elementsTo[to.depth].push_back({to.index, from.index, from.element, from.depth});
  remove(from);
}

void TileDataElementAccessor::remove(ElementTreeIndex const& element) {
  m_elementsFrom[element.depth].push_back({element.index, element.element});
}

void TileDataElementAccessor::join(TileDataElementAccessor const& other) {
  for (std::size_t d = 0; d < m_elementsTo.size(); ++d) {
    // Copies first: an accessor may be joined with itself.
    auto const to = other.m_elementsTo[d];
    auto const from = other.m_elementsFrom[d];
    m_elementsTo[d].insert(m_elementsTo[d].end(), to.begin(), to.end());
    m_elementsFrom[d].insert(m_elementsFrom[d].end(), from.begin(), from.end());
  }
}

void TileDataElementAccessor::dump(std::ostream& os) const {
  for (std::size_t d = 0; d < m_elementsTo.size(); ++d)
    os << "m_elementsTo[" << d << "].size() = " << m_elementsTo[d].size() << '\n';
  for (std::size_t d = 0; d < m_elementsFrom.size(); ++d)
    os << "m_elementsFrom[" << d << "].size() = " << m_elementsFrom[d].size() << '\n';
}

} // namespace VLN::TileTree3D
