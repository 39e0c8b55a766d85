// Step 6, flatten: a volume as one buffer without pointers, read in place as a GPU would.
#include "GeometryVolume/volume/Volume.h"
#include "Interop/Flatten.h"
#include "Reader/NanoVTTReader.h"
#include "Reader/NanoVTTValidate.h"

#include <cmath>
#include <iostream>

using namespace VLN::TileTree3D;

int main() {
  // A ball of fog, 40 samples across.
  Volume volume(0.1f);
  auto density = volume.addField<float>("density", 0);
  for (int k = -20; k <= 20; ++k)
    for (int j = -20; j <= 20; ++j)
      for (int i = -20; i <= 20; ++i)
        if (float const r = std::hypot(float(i), float(j), float(k)); r < 20)
          density.set(i, j, k, 1 - r / 20);

  // Codes of 8 bits in place of floats.
  auto const flat =
      VLN::Interop::flattenVolume(volume.object(), {.quantisation = VLN::Interop::Quantisation::kFp8});

  // Bytes from outside are validated once; then any lookup is safe.
  if (!nanovtt::validate(flat.buffer.data(), flat.buffer.size()).ok()) return 1;
  nanovtt::BufferReader const reader(flat.buffer.data());
  std::uint32_t const number = reader.find("density");
  if (number == reader.gridCount()) return 1;
  auto const grid = reader.grid(number);
  double const centre = grid.valueAt(0, 0, 0), half = grid.valueAt(10, 0, 0),
               beyond = grid.valueAt(1000, 0, 0);
  std::cout << flat.buffer.size() << " bytes, " << reader.container().tileCount() << " tiles; density "
            << centre << ", " << half << ", " << beyond << "\n";
  return std::abs(centre - 1) < 0.01 && std::abs(half - 0.5) < 0.01 && beyond == 0 ? 0 : 1;
}
