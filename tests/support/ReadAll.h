// Every lookup that a reader offers, over a whole buffer: what must stay inside after validate() said yes.
#pragma once

#include "Reader/NanoVTTCursor.h"

#include <cstdint>
#include <vector>

namespace Support {

/// @return A sum of what was read, so that nothing is left out.
inline std::uint64_t readAll(void const* bytes) {
  nanovtt::BufferReader const reader(bytes);
  auto const& container = reader.container();
  std::uint64_t sum = 1;
  auto const add = [&](double v) { sum = sum * 31 + static_cast<std::uint64_t>(v != v ? 7 : v > 0 ? 1 : 2); };
  sum += reader.find("a");
  for (std::uint32_t tile = 0; tile < container.tileCount(); ++tile) {
    int const depth = container.depthOf(tile);
    sum += container.parent(tile);
    if (depth < nanovtt::kMaxDepth) {
      auto const children = container.children(tile);
      for (std::uint32_t n = 0; n < children.count(); ++n) sum += children[n];
    }
  }
  nanovtt::Coord low{-536870912, -536870912, -536870912};
  container.forEachTile([&](nanovtt::TileRef const& tile) {
    low = tile.corner;
    int const half = tile.width() / 2;
    for (int d = 0; d <= nanovtt::kMaxDepth; d += 3)
      sum += container.find(low.x + half, low.y + half, low.z + half, d).number;
    sum += container.find(low.x - 1, low.y + half, low.z).number;
  });
  nanovtt::CellTable cells(container, 4096);
  std::vector<std::uint32_t> memory(cells.bytes() / sizeof(std::uint32_t));
  cells.write(container, memory.data());
  for (std::uint32_t g = 0; g < reader.gridCount(); ++g) {
    auto const grid = reader.grid(g);
    if (grid.type() == nanovtt::GridType::kFloat || nanovtt::isQuantised(grid.type())) {
      nanovtt::GridCursor cursor(grid, cells);
      container.forEachTile([&](nanovtt::TileRef const& tile) {
        nanovtt::Coord const c = tile.corner;
        add(cursor.value(c.x, c.y, c.z));
        add(cursor.trilinear(float(c.x) - 0.5f, float(c.y) + float(tile.width()) - 0.5f, float(c.z)));
      });
      add(cursor.value(INT32_MIN, INT32_MAX, 0));
    }
    for (char const* c = grid.name(); *c; ++c) sum += static_cast<unsigned char>(*c);
    int const components = nanovtt::componentCount(grid.type());
    for (int c = 0; c < components; ++c) add(grid.defaultValue().getComponent(0, c));
    for (int n = 0; n < 6; ++n) add(grid.worldBox(n) + grid.tileBox(n));
    container.forEachTile([&](nanovtt::TileRef const& tile) {
      auto const block = grid.block(tile.number);
      for (int n = 0; n < block.width; ++n)
        for (int c = 0; c < components; ++c) {
          add(block.getComponent(block.index(n, block.width - 1, block.width - 1 - n), c));
          add(block.getComponent(block.index(n, n, n), c));
        }
      auto const last = tile.width() - 1;
      add(grid.valueAt(tile.corner.x + last, tile.corner.y, tile.corner.z + last, components - 1));
    });
    add(grid.valueAt(low.x, low.y, low.z));
    add(grid.valueAt(INT32_MAX, INT32_MIN, 0));
  }
  return sum;
}

} // namespace Support
