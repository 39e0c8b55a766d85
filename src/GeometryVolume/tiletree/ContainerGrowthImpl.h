// Growth that is taken back where it cannot be finished.
#pragma once

#include "GeometryVolume/tiletree/ContainerDataImpl.h"

#include <iterator>
#include <optional>
#include <utility>
#include <vector>

namespace VLN::TileTree3D {

/// Tiles that are being added. Without keep() they are taken back when it ends: links that lead to them, and
/// roots that were hung below them. That needs no memory.
template <class TraitsT> class ContainerGrowth {
  using Data = ContainerData<TraitsT>;
  using Counts = typename Data::Counts;
  using TileType = typename Data::TileType;
  using TileLists = typename Container<TraitsT>::TileLists;
  static constexpr int kMaxDepth = TraitsT::kMaxDepth, kTileSize = TraitsT::kTileSize;

public:
  explicit ContainerGrowth(Data& data, TileLists* newTiles = nullptr)
      : m_data(data)
      , m_before(data.m_tileCounts)
      , m_newTiles(newTiles) {
    if (!newTiles) return;
    auto& listed = m_listed.emplace();
    for (std::size_t d = 0; d < listed.size(); ++d) listed[d] = (*newTiles)[d].size();
  }
  ~ContainerGrowth() {
    if (!m_kept) rollBack();
  }
  ContainerGrowth(ContainerGrowth const&) = delete;
  ContainerGrowth& operator=(ContainerGrowth const&) = delete;

  Counts const& before() const { return m_before; }
  void keep() { m_kept = true; }
  /// Room for so many roots more that stop being ones.
  void reserve(std::size_t roots) { m_adopted.reserve(m_adopted.size() + roots); }
  void adopt(RootTable::iterator root) {
    --m_data.m_rootCounts[root->second.depth];
    m_adopted.push_back(m_data.m_roots.extract(root));
  }

private:
  bool isNew(std::int64_t index, int depth) const { return index >= m_before[depth]; }
  void rollBack() {
    if (m_data.m_tileCounts == m_before) return;
    for (auto root = m_data.m_roots.begin(); root != m_data.m_roots.end();) {
      auto const next = std::next(root);
      TreeIndex const at = root->second;
      if (isNew(at.index, at.depth)) {
        --m_data.m_rootCounts[at.depth];
        m_data.m_roots.erase(root);
      }
      root = next;
    }
    for (auto& root : m_adopted) {
      TreeIndex const at = root.mapped();
      if (isNew(at.index, at.depth)) continue;
      ++m_data.m_rootCounts[at.depth];
      m_data.m_roots.insert(std::move(root));
    }
    for (int d = 0; d <= kMaxDepth; ++d) {
      auto& tiles = m_data.editTiles(d);
      std::int64_t const before = m_before[d];
      m_data.m_tileCountTotal -= m_data.m_tileCounts[d] - before;
      m_data.m_tileCounts[d] = before;
      if (d == kMaxDepth)
        tiles.shrinkRaw(before); // some may not have been made
      else if (tiles.size() > before)
        tiles.resize(before);
      for (TileType& t : tiles) {
        if (!t.valid()) continue;
        if (d > 0 && isNew(t.parentIndex(), d - 1)) t.setParentIndex(-1);
        for (int slot = 0; d < kMaxDepth && slot < kTileSize; ++slot)
          if (isNew(t.childIndex(slot), d + 1)) t.childIndex(slot) = -1;
      }
    }
    for (std::size_t d = 0; m_listed && d < m_listed->size(); ++d) (*m_newTiles)[d].resize((*m_listed)[d]);
  }

  Data& m_data;
  Counts m_before;
  TileLists* m_newTiles;
  /// How long the lists were. Not there for the addition of single tiles, which is to be quick.
  std::optional<PerDepth<std::uint64_t, TraitsT::kDepths>> m_listed;
  std::vector<RootTable::node_type> m_adopted;
  bool m_kept = false;
};

} // namespace VLN::TileTree3D
