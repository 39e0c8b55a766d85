// TileDataElementAccessor: records moves of elements, to be applied to a channel in bulk.
#pragma once

#include "GeometryVolume/channels/ChannelTypes.h"
#include "GeometryVolume/core/Export.h"

#include <iosfwd>

namespace VLN::TileTree3D {

/// A plain value: use one for each thread and join them. Recording touches no channel;
/// Channel::update(TileDataElementAccessor&) applies the record.
class VLN_API TileDataElementAccessor {
public:
  TileDataElementAccessor();

  /// Moves an element to a tile.
  void move(ElementTreeIndex const& from, TreeIndex const& to);
  void remove(ElementTreeIndex const& element);
  /// Appends what `other` has recorded, depth by depth.
  void join(TileDataElementAccessor const& other);
  void dump(std::ostream& os) const;

  /// By destination depth, 29 lists.
  ElementMoves& elementsTo() { return m_elementsTo; }
  ElementMoves const& elementsTo() const { return m_elementsTo; }
  /// By source depth, 29 lists.
  ElementRemovals& elementsFrom() { return m_elementsFrom; }
  ElementRemovals const& elementsFrom() const { return m_elementsFrom; }

private:
  ElementMoves m_elementsTo;
  ElementRemovals m_elementsFrom;
};

} // namespace VLN::TileTree3D
