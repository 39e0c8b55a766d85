// TileSamples: the samples that a flat buffer stores for a tile.
#pragma once

#include "GeometryVolume/channels/HaloDriverImpl.h"
#include "GeometryVolume/nanovtt/GridTaskImpl.h"

#include <memory>

namespace nanovtt::Internal {

/// A tile's samples, width x width x width, i fastest.
struct StoredTile {
  void const* samples;
  int width;
};

/// @threads One for each thread.
class TileSamples {
public:
  TileSamples(GridTask const& task, Tree::ConstTileAccessor const& accessor)
      : m_task(task)
      , m_accessor(accessor) {}
  TileSamples(TileSamples const&) = delete;
  TileSamples& operator=(TileSamples const&) = delete;

  /// The tile's own samples; those of its deepest ancestor that the channel reaches, when it is deeper than
  /// the channel; the default value where there are none. With `halo`, what the neighbours hold on the high
  /// sides, blended where they are coarser; deeper than the channel, then, blends all through. The task's fog
  /// fix comes last.
  /// @return Stays until the next call.
  StoredTile get(TileType const& tile, bool halo);

private:
  void const* plain(TileType const& tile);
  std::uint8_t* work();

  /// Most tiles of most grids have no halo, and making these costs more than a tile.
  struct Halo;

  GridTask const& m_task;
  Tree::ConstTileAccessor const& m_accessor;
  std::shared_ptr<Halo> m_halo;
  std::unique_ptr<std::uint8_t[]> m_work, m_fixed;
  bool m_workIsDefault = false;
};

} // namespace nanovtt::Internal
