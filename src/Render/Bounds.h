// makeBounds(): the smallest, the largest and the mean value of each tile, as Reader/NanoVTTBounds.h reads
// them.
#pragma once

#include "Reader/NanoVTTBounds.h"
#include "Render/Export.h"
#include "Render/FieldView.h"

#include <functional>
#include <vector>

namespace VLN::Render {

struct BoundsOptions {
  int component = -1; ///< of vectors; -1 for their length
  int bits = 16;      ///< of a code: 8 or 16
  int threads = 0;    ///< 0: one for each processor
};

/// @pre The buffer was validated.
/// @error std::invalid_argument for a component that the grid lacks.
/// @numeric Bounds are rounded outward: what they were made of lies between them. The same bytes for any
/// number of threads.
/// @cost Reads all samples once, and those beyond the high sides of tiles without a halo.
VLN_RENDER_API std::vector<unsigned char> makeBounds(nanovtt::GridReader const& grid,
                                                     BoundsOptions const& options = {});

/// The same from bricks that are there already.
/// @param brick The brick of a tile.
/// @param tiles By number; not valid where a merged block has the samples.
/// @param background What samples outside of the tiles are.
std::vector<unsigned char>
boundsOf(nanovtt::GridReader const& grid, std::vector<nanovtt::TileRef> const& tiles, float background,
         std::function<Brick(std::uint32_t tile, std::vector<float>& room)> const& brick, bool isAllFinite,
         BoundsOptions const& options);

} // namespace VLN::Render
