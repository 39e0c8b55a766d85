// Step 1, make: a volume with two fields, set and read by position.
#include "GeometryVolume/volume/Volume.h"

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
  return heat.get(3, 4, 5) == 1 && heat.get(30, 40, 50) == 0 && solid.get(0, 0, 0) == 1 && blended == 1 ? 0
                                                                                                        : 1;
}
