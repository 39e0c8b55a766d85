// A picture of a field, drawn by a program: what docs/rendering.md shows.
#include "Interop/Picture.h"
#include "GeometryVolume/volume/Volume.h"
#include "Interop/Flatten.h"

#include <cmath>
#include <iostream>

// snippet: picture
#include "Render/Look.h"

using namespace VLN::Render;

// grid: of validated bytes, which must live as long as the field.
Picture pictureOf(nanovtt::GridReader const& grid, Affine const& tileToWorld) {
  Field field(grid);
  RenderOptions options;
  options.width = options.height = 256;
  chooseLook(field, {.channel = "distance", .gridClass = "level set"}, options);
  Camera const camera({}, outlineOf(field, tileToWorld, options), 0, 1);
  return render(field, tileToWorld, camera, options);
}
// end snippet

int main() {
  // The distance from a sphere, in a band of three samples.
  VLN::TileTree3D::Volume volume(0.1f);
  auto distance = volume.addField<float>("distance", 0.3f);
  for (int k = -24; k <= 24; ++k)
    for (int j = -24; j <= 24; ++j)
      for (int i = -24; i <= 24; ++i)
        if (float const d = std::hypot(float(i), float(j), float(k)) - 20; std::abs(d) < 3)
          distance.set(i, j, k, d * 0.1f);
  auto const flat = VLN::Interop::flattenVolume(volume.object(), {});
  nanovtt::BufferReader const reader(flat.buffer.data());
  Affine scale;
  for (Vec3d& row : scale.rows) row = row * 0.1;

  Picture const picture = pictureOf(reader.grid(reader.find("distance")), scale);
  auto const rgba = toBytes(picture, {0.15f, 0.17f, 0.2f}, true);
  VLN::Interop::writeRgbaPng("picture.png", picture.width, picture.height, rgba);
  double drawn = 0;
  for (float const opacity : picture.opacity) drawn += double(opacity);
  drawn /= double(picture.opacity.size());
  std::cout << "drawn: " << 100 * drawn << " % of picture.png\n";
  return drawn > 0.2 && drawn < 0.8 ? 0 : 1;
}
