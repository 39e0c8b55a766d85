// A first volume, and a diffusion step on it: fields set and read by position, stencils over all samples.
#include "GeometryVolume/volume/ForEach.h"

#include <cmath>
#include <iostream>

using namespace VLN::TileTree3D;

int main() {
  // snippet: first
  Volume volume(0.1f); // samples lie 0.1 world units apart
  auto heat = volume.addField<float>("heat", 0);
  auto solid = volume.addField<unsigned char>("solid", 0); // a second field on the same tiles
  for (int k = -10; k <= 10; ++k)
    for (int j = -10; j <= 10; ++j)
      for (int i = -10; i <= 10; ++i)
        if (i * i + j * j + k * k <= 100) heat.set(i, j, k, 1);
  solid.set(0, 0, 0, 1);
  float const blended = heat.sample({0.35f, 0.4f, 0.5f}); // in world space
  // end snippet
  std::cout << "heat " << heat.get(3, 4, 5) << " inside, " << heat.get(30, 40, 50) << " outside, "
            << volume.tileCount() << " tiles; blended " << blended << "\n";

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

  // No heat is lost: none has reached the rim.
  double sum = 0;
  for (float const value : heat.channel()) sum += double(value);
  std::cout << "after ten steps " << heat.get(0, 0, 0) << " in the middle, " << heat.get(11, 0, 0)
            << " outside the ball, " << sum << " in all\n";
  return std::abs(sum - 4169) < 1e-5 * sum && heat.get(11, 0, 0) > 0.1f && solid.get(0, 0, 0) == 1 ? 0 : 1;
}
