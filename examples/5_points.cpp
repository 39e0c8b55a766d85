// Step 5, points: particles in the tiles that hold them, and a density of them on the same tiles.
#include "GeometryVolume/volume/Volume.h"

#include <cmath>
#include <iostream>
#include <vector>

using namespace VLN::TileTree3D;

int main() {
  // A spiral of particles.
  std::vector<float3> positions;
  for (int n = 0; n < 10000; ++n) {
    float const a = 0.002f * float(n);
    positions.push_back({a * std::cos(a), a * std::sin(a), 0.1f * a});
  }

  Volume volume(0.25f);
  auto density = volume.addField<float>("density", 0);
  std::int64_t const inside = volume.addPoints("spiral", positions); // makes the tiles that are missing

  // One for each particle in the sample that holds it.
  for (float3 const& p : volume.points("spiral")) {
    int3 const at{int(std::floor(p.x / 0.25f)), int(std::floor(p.y / 0.25f)), int(std::floor(p.z / 0.25f))};
    density.set(at, density.get(at) + 1);
  }

  double sum = 0;
  for (float const value : density.channel()) sum += double(value);
  std::cout << inside << " particles in " << volume.tree().tileCount(Volume::Shape::kMaxDepth)
            << " tiles of the deepest depth; the densities add up to " << sum << "\n";
  return inside == 10000 && sum == 10000 ? 0 : 1;
}
