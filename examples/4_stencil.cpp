// Step 4, a stencil: heat spreads over the samples, across the borders of tiles.
#include "GeometryVolume/volume/ForEach.h"

#include <cmath>
#include <iostream>

using namespace VLN::TileTree3D;

int main() {
  Volume volume;
  auto heat = volume.addField<float>("heat", 0);
  for (int k = -10; k <= 10; ++k)
    for (int j = -10; j <= 10; ++j)
      for (int i = -10; i <= 10; ++i)
        if (i * i + j * j + k * k <= 100) heat.set(i, j, k, 1);

  // snippet: diffusion
  // Room for the heat to spread, then ten steps of a seven-point stencil, in parallel and across tiles.
  volume.addTiles({-24, -24, -24}, {24, 24, 24});
  auto next = volume.addField<float>("next", 0);
  for (int step = 0; step < 10; ++step) {
    forEachSample(heat, next, [](Neighbors<float> const& n) {
      return n(0, 0, 0) + 0.1f * (n(-1, 0, 0) + n(1, 0, 0) + n(0, -1, 0) + n(0, 1, 0) + n(0, 0, -1) +
                                  n(0, 0, 1) - 6 * n(0, 0, 0));
    });
    std::swap(heat, next);
  }
  // end snippet

  // Whole tiles with a layer of halo, for kernels of your own: the same values that the stencil reads.
  volume.fillHalos(heat.name());
  auto const& halos = heat.halos();
  auto const& tile = volume.tree().tileAccessor().tile(8, 0, 0, Volume::Shape::kMaxDepth, true);
  float const before = halos.tileData(tile.treeIndex())(-1, 0, 0);

  // No heat is lost: none has reached the rim.
  double sum = 0;
  for (float const value : heat.channel()) sum += double(value);
  std::cout << "after ten steps " << heat.get(0, 0, 0) << " in the middle, " << heat.get(11, 0, 0)
            << " outside the ball, " << sum << " in all\n";
  bool const right =
      std::abs(sum - 4169) < 1e-5 * sum && heat.get(11, 0, 0) > 0.1f && before == heat.get(7, 0, 0);
  return right ? 0 : 1;
}
