// Flatten: a volume as one buffer without pointers, read in place as a GPU would.
#include "GeometryVolume/nanovtt/VTTToNanoVTT.h"
#include "GeometryVolume/topology/Command.h"
#include "Reader/NanoVTTReader.h"
#include "Reader/NanoVTTValidate.h"

#include <algorithm>
#include <cmath>
#include <iostream>

using namespace VLN::TileTree3D;
using Shape = PowerOfTwoTraits;

int main() {
  // A ball of fog, 40 voxels across.
  auto object =
      Command::createVoxelVLN<Shape>("voxel_tile_tree", "voxel_component", 0.1f, kVoxelOffsetCorner);
  auto tree = object->extractComponent<Container<Shape>>("voxel_tile_tree");
  auto accessor = tree->tileAccessor();
  accessor.addTile(int3{-32, -32, -32}, int3{31, 31, 31}); // the root: roots lie at one depth
  accessor.addTiles(int3{-20, -20, -20}, int3{20, 20, 20}, Shape::kMaxDepth);
  auto topology = object->extractComponent<VoxelTopology<Shape>>("voxel_component");
  topology->update(*tree);
  auto density = Command::createChannel<float, 2, 4, 4, 0, 0>("density", *topology, 0.0f,
                                                              kInitializeDefaultValue, 0, Shape::kMaxDepth);
  for (std::int64_t n = 0; n < tree->tileCount(Shape::kMaxDepth); ++n) {
    auto const& tile = std::as_const(*tree).tile(n, Shape::kMaxDepth);
    auto data = density->tileData(tile.treeIndex());
    for (int s = 0; s < 64; ++s) {
      auto const p = tile.childDataTIJK(s % 4, s / 4 % 4, s / 16);
      float const r = std::hypot(float(p.x), float(p.y), float(p.z));
      data(s) = std::max(0.0f, 1.0f - r / 20.0f);
    }
  }
  int const rootLevel = Shape::kMaxDepth - tree->cbeginRoots()->second.depth;
  object->putComponent(std::move(density));
  object->putComponent(std::move(topology));
  object->putComponent(std::move(tree));

  // One buffer, float samples as codes of 8 bits, halos for all tiles.
  using Buffer = nanovtt::AlignedHostBuffer;
  Buffer const pool; // belongs to none: the conversion makes its own
  auto const flat = nanovtt::vttToNanoVTT<Buffer, nanovdb::Fp8, nanovdb::AbsDiff, true>(
      *object, "density", nanovdb::StatsMode(0), nanovdb::ChecksumMode(1), 0, -1.0f, false, 1.0f, rootLevel,
      0, false, false, false, 1, false, false, 0.0f, false, false, nullptr, nullptr, nullptr, pool);

  // Bytes from outside are validated once; then any lookup is safe.
  if (!nanovtt::validate(flat.data(), flat.size()).ok()) return 1;
  nanovtt::BufferReader const reader(flat.data());
  std::uint32_t const number = reader.find("density");
  if (number == reader.gridCount()) return 1;
  auto const grid = reader.grid(number);
  double const centre = grid.valueAt(0, 0, 0), half = grid.valueAt(10, 0, 0),
               beyond = grid.valueAt(1000, 0, 0);
  std::cout << flat.size() << " bytes, " << reader.container().tileCount() << " tiles; density " << centre
            << ", " << half << ", " << beyond << "\n";
  bool const right = std::abs(centre - 1) < 0.01 && std::abs(half - 0.5) < 0.01 && beyond == 0;
  return right ? 0 : 1;
}
