// Step 2, grow: tiles where they are wanted, coarse ones elsewhere, and away with those that nobody needs.
#include "GeometryVolume/volume/ForEach.h"

#include <cmath>
#include <iostream>

using namespace VLN::TileTree3D;

namespace {

float distanceToSphere(int3 const& p) { return std::hypot(float(p.x), float(p.y), float(p.z)) - 40.0f; }

} // namespace

int main() {
  Volume volume;
  auto distance = volume.addField<float>("distance", 1000);

  // From the roots over a box downwards, each tile that the surface may pass through.
  volume.refineWhere({-64, -64, -64}, {64, 64, 64}, [](TileBox const& box) {
    int const half = box.width / 2;
    return std::abs(distanceToSphere({box.corner.x + half, box.corner.y + half, box.corner.z + half})) <
           float(box.width);
  });
  std::int64_t const fine = volume.tree().tileCount(Volume::Shape::kMaxDepth), all = volume.tileCount();
  forEachSample(distance, [](int3 const& p, float& value) { value = distanceToSphere(p); });

  // The half below goes; a whole box comes.
  std::int64_t const gone = volume.removeWhere([](TileBox const& box) { return box.corner.z < 0; });
  volume.addTiles({0, 0, 100}, {16, 16, 116});

  std::cout << fine << " of " << all << " tiles are of the deepest depth; " << gone
            << " of them went, 64 came\n"
            << "on the surface " << distance.get(0, 0, 40) << ", beyond every tile "
            << distance.get(0, 0, 500) << "\n";
  bool const right = distance.get(0, 0, 40) == 0 && distance.get(0, 0, 500) == 1000 && gone > fine / 3 &&
                     volume.tree().tileCount(Volume::Shape::kMaxDepth) == fine - gone + 64;
  return right ? 0 : 1;
}
