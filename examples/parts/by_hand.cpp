// A first volume: assemble it, add tiles, add a channel, write values, read them back.
#include "GeometryVolume/topology/Command.h"

#include <cmath>
#include <iostream>

using namespace VLN::TileTree3D;
using Shape = PowerOfTwoTraits; // tiles of 2 x 2 x 2 voxels and 4 x 4 x 4 samples

int main() {
  // An object with a tree and a topology on it. Samples lie on the low corners of their voxels; one unit of
  // tile space is 0.1 world units.
  auto object =
      Command::createVoxelVLN<Shape>("voxel_tile_tree", "voxel_component", 0.1f, kVoxelOffsetCorner);

  // Take the tree out, grow it where a sphere's surface passes, put it back.
  constexpr int kRadius = 40;
  auto tree = object->extractComponent<Container<Shape>>("voxel_tile_tree");
  Container<Shape>::TileLists corners;
  for (int k = -48; k < 48; k += 4) {
    for (int j = -48; j < 48; j += 4) {
      for (int i = -48; i < 48; i += 4) {
        double const distance = std::hypot(i + 2.0, j + 2.0, k + 2.0) - kRadius;
        if (std::abs(distance) < 8.0) corners[Shape::kMaxDepth].append({i, j, k});
      }
    }
  }
  tree->tileAccessor().addTiles(corners);

  // The topology follows the tree, and the channel is made to the topology's measure.
  auto topology = object->extractComponent<VoxelTopology<Shape>>("voxel_component");
  topology->update(*tree);
  auto distance = Command::createChannel<float, 2, 4, 4, 0, 0>("distance", *topology, 0.0f,
                                                               kInitializeDefaultValue, 0, Shape::kMaxDepth);
  for (std::int64_t n = 0; n < tree->tileCount(Shape::kMaxDepth); ++n) {
    auto const& tile = std::as_const(*tree).tile(n, Shape::kMaxDepth);
    auto data = distance->tileData(tile.treeIndex());
    for (int k = 0; k < 4; ++k) {
      for (int j = 0; j < 4; ++j) {
        for (int i = 0; i < 4; ++i)
          data(i, j, k) =
              static_cast<float>(std::hypot(tile.ti() + i, tile.tj() + j, tile.tk() + k)) - kRadius;
      }
    }
  }
  object->putComponent(std::move(tree));
  object->putComponent(std::move(topology));
  object->putComponent(std::move(distance));

  // Read: find the tile that holds a point, then the sample inside it.
  auto const readTree = object->component<Container<Shape>>("voxel_tile_tree");
  auto const field = object->component<Channel<Shape, float, 4, 0>>("distance");
  auto const accessor = readTree->tileAccessor();
  auto const& tile = accessor.tile(40, 1, 2, Shape::kMaxDepth, true);
  if (!tile.valid()) return 1;
  float const value = std::as_const(*field).tileData(tile.treeIndex())(tile.childDataIJK(40, 1, 2));
  std::cout << readTree->tileCount(-1) << " tiles, " << field->size() << " samples\n"
            << "distance at (40, 1, 2): " << value << " voxels\n";
  return std::abs(value - (std::hypot(40.0, 1.0, 2.0) - kRadius)) < 1e-5 ? 0 : 1;
}
