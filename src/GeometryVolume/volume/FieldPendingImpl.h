// PendingTiles: elements of tiles that writes made and the tree lacks.
#pragma once

#include "GeometryVolume/core/RollbackImpl.h"
#include "GeometryVolume/pools/TileDataAllocator.h"
#include "GeometryVolume/volume/detail/FieldBlocks.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <iterator>
#include <span>
#include <utility>
#include <vector>

namespace VLN::TileTree3D::Internal {

template <class T> struct PendingTile {
  PendingTile(int3 const& at, TileVector<T>&& its)
      : corner(at)
      , elements(std::move(its)) {}

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

  /// Takes all groups over.
  /// @error std::bad_alloc; nothing has changed then.
  void take(std::span<PendingTiles* const> others) {
    std::size_t count = m_groups.size();
    for (PendingTiles const* other : others) count += other->m_groups.size();
    m_groups.reserve(count);
    for (PendingTiles* other : others) {
      std::move(other->m_groups.begin(), other->m_groups.end(), std::back_inserter(m_groups));
      other->clear();
    }
  }
  /// Drops the groups from `first` on.
  void cutBack(std::size_t first) { m_groups.resize(std::min(first, m_groups.size())); }
  /// Calls `fill` for `count` groups to be filled.
  /// @error What it throws leaves all as it was.
  template <class Fill> void append(std::size_t count, Fill const& fill) {
    std::size_t const first = m_groups.size();
    VLN::Internal::Rollback added([&] { cutBack(first); });
    m_groups.resize(first + count);
    fill(m_groups.data() + first);
    added.dismiss();
  }
  /// The same for few tiles: `fill` gets a group that has room for them.
  template <class Fill> void appendFew(std::size_t count, Fill const& fill) {
    if (!m_groups.empty() && m_groups.back().capacity() - m_groups.back().size() >= count)
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
