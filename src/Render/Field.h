// Field: what rays need of a grid beside its buffer, made once and in parallel.
#pragma once

#include "Reader/NanoVTTBounds.h"
#include "Render/Export.h"
#include "Render/FieldView.h"

#include <functional>
#include <utility>
#include <vector>

namespace VLN::Render {

struct FieldOptions {
  int component = -1; ///< of vectors; -1 for their length
  int threads = 0;    ///< 0: one for each processor
  /// Bounds that BoundsReader::check() found sound, of a .nvtt file or made by makeBounds(), which live
  /// longer than the field; null to make them. Those of one component are made in any case.
  void const* bounds = nullptr;
};

class Scalar;

class VLN_RENDER_API Field {
public:
  /// Samples of tiles of floats that have their layer already stay where they are; others are gathered
  /// beside the buffer, as floats: quantised ones, other types, vectors by their length. What is no finite
  /// number counts as the background.
  /// @pre The buffer was validated, and lives longer than this.
  /// @error std::invalid_argument for a component that the grid lacks, and for a grid whose box is wider
  /// than rays can be told apart in.
  /// @numeric The same for any number of threads.
  explicit Field(nanovtt::GridReader const& grid, FieldOptions const& options = {});

  /// Of all samples. Both 0 without tiles.
  float low() const { return m_bounds.low(); }
  float high() const { return m_bounds.high(); }
  float background() const { return m_view.background; }
  std::uint32_t tileCount() const { return static_cast<std::uint32_t>(m_tiles.size()); }
  /// By number; not valid where a merged block has the samples.
  std::vector<nanovtt::TileRef> const& tiles() const { return m_tiles; }
  /// Smallest and largest value of a tile and of all below it, the layer beyond its high sides included: no
  /// blend that begins in the tile lies outside. Means are those of the finest samples in the tile.
  nanovtt::BoundsReader const& bounds() const { return m_bounds; }

  /// Tile-space position of local (0, 0, 0).
  Vec3d origin() const { return m_origin; }
  /// Local box of the active samples: first and last.
  Vec3 activeLow() const { return m_activeLow; }
  Vec3 activeHigh() const { return m_activeHigh; }
  bool empty() const { return m_isEmpty; }
  /// Corners of boxes between which all tiles lie whose bounds pass, cut to the active box; of that box when
  /// none does.
  /// @cost Looks at every tile; one thread.
  std::vector<Vec3> outline(std::function<bool(float low, float high)> const& shows) const;

  /// How much a range of values matters to a picture: 0 for not at all.
  using Weight = std::function<float(float low, float high)>;
  /// Weighs all tiles and cells anew; the view is valid until the next call.
  /// @pre `weight` of a range is no less than that of a range inside it.
  void weigh(Weight const& weight, int threads = 0);
  FieldView const& view() const { return m_view; }
  /// Rays stop at tiles of this depth. Samples of those that have deeper ones are then means: of the finest
  /// samples about their places, as far as the next one on each side.
  /// @cost For each such tile 216 means, most of them of tiles.
  void limitDepth(int depth, int threads = 0);
  /// All depths, and samples as they are stored, whatever limitDepth() was given.
  FieldView wholeView() const;

  /// Values that differ from the background, of the deepest tiles, sorted: each n-th one, so that at most
  /// about `count` come.
  std::vector<float> sortedValues(std::size_t count) const;

private:
  /// Whether the samples are one apart: of a tile of the deepest depth, or of a merged block of such.
  bool isFinest(std::uint32_t n) const;
  void fillBricks(Scalar const& scalar, bool isAllFinite, int threads);
  void makeMeans(int depth, int threads);
  void place(double const lowest[3], double const highest[3]);
  /// Of a tile, as rays see it.
  std::pair<float, float> range(std::uint32_t n) const {
    return n < m_limitedRanges.size() ? m_limitedRanges[n] : std::pair(m_bounds.low(n), m_bounds.high(n));
  }

  nanovtt::GridReader m_grid;
  FieldView m_view;
  Vec3d m_origin;
  Vec3 m_activeLow, m_activeHigh;
  bool m_isEmpty = true;
  std::vector<nanovtt::TileRef> m_tiles;
  std::vector<std::uint64_t> m_bricks;
  std::vector<float> m_gathered;
  std::vector<unsigned char> m_madeBounds;
  nanovtt::BoundsReader m_bounds;
  std::uint64_t m_gatheredCount = 0; ///< floats beside the buffer, which bricks of means follow
  // Of tiles down to a limited depth.
  std::vector<std::uint64_t> m_limitedBricks;
  std::vector<std::pair<float, float>> m_limitedRanges;
  std::vector<float> m_weights, m_rootWeights;
  std::vector<std::uint64_t> m_cells;
};

} // namespace VLN::Render
