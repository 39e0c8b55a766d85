// Step 3, sample: values and gradients between the samples, in world space.
#include "GeometryVolume/volume/ForEach.h"

#include <algorithm>
#include <cmath>
#include <iostream>

using namespace VLN::TileTree3D;

int main() {
  // Distances to a sphere of radius 2, in a box of finest tiles.
  Volume volume(0.1f);
  auto distance = volume.addField<float>("distance", 10);
  volume.addTiles({-32, -32, -32}, {32, 32, 32});
  forEachSample(distance, [](int3 const& p, float& value) {
    value = 0.1f * std::hypot(float(p.x), float(p.y), float(p.z)) - 2.0f;
  });

  // Write first, then sample: reads in a row share one sampler.
  float worst = 0, slope = 0;
  for (int n = 0; n < 1000; ++n) {
    float const a = 0.1f * float(n), z = float(n) / 500 - 1, r = std::sqrt(std::max(0.0f, 1 - z * z));
    float3 const onSphere{2 * r * std::cos(a), 2 * r * std::sin(a), 2 * z};
    float3 const g = distance.gradient(onSphere);
    worst = std::max(worst, std::abs(distance.sample(onSphere)));
    slope = std::max(slope, std::abs(std::hypot(g.x, g.y, g.z) - 1));
  }
  std::cout << "on the sphere the distance is at most " << worst << ", its gradient 1 within " << slope
            << "\n"
            << "far outside: " << distance.sample({100.0f, 0.0f, 0.0f}) << "\n";
  return worst < 0.01f && slope < 0.05f && distance.sample({100.0f, 0.0f, 0.0f}) == 10 ? 0 : 1;
}
