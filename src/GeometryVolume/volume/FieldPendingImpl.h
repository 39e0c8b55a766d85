// PendingTiles: elements of tiles that writes made and the tree lacks.
#pragma once

#include "GeometryVolume/core/RollbackImpl.h"
#include "GeometryVolume/pools/TileDataAllocator.h"
#include "GeometryVolume/volume/detail/FieldBlocks.h"

#include <cstddef>
#include <cstdint>
#include <vector>

namespace VLN::TileTree3D::Internal {

template <class T> struct PendingTile {
  int3 corner;
  TileVector<T> elements;
  std::int64_t arrival = -1; ///< place among the tiles that are being adopted
};

/// In the order of the writes, in groups: each is filled by one thread, and none moves while it grows.
template <class T> class PendingTiles {
public:
  using Group = std::vector<PendingTile<T>>;

  bool empty() const { return m_groups.empty(); }
  void clear() { m_groups.clear(); }
  std::size_t groupCount() const { return m_groups.size(); }
  Group& group(std::size_t n) { return m_groups[n]; }
  Group const& group(std::size_t n) const { return m_groups[n]; }

  /// Calls `fill` for `count` groups to be filled.
  /// @error What it throws leaves all as it was.
  template <class Fill> void append(std::size_t count, Fill const& fill) {
    std::size_t const first = m_groups.size();
    VLN::Internal::Rollback added([&] { m_groups.resize(first); });
    m_groups.resize(first + count);
    fill(m_groups.data() + first);
    added.dismiss();
  }
  /// The same for a tile alone: `fill` gets a group that has room for it.
  template <class Fill> void appendOne(Fill const& fill) {
    if (!m_groups.empty() && m_groups.back().size() < m_groups.back().capacity())
      return fill(m_groups.back());
    append(1, [&](Group* group) {
      group->reserve(kTogether);
      fill(*group);
    });
  }

private:
  static constexpr std::size_t kTogether = 256; ///< tiles that were made one by one

  std::vector<Group> m_groups;
};

} // namespace VLN::TileTree3D::Internal
