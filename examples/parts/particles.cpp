// Particles: points in tiles, carried from tile to tile step after step, with a channel that follows.
#include "GeometryVolume/channels/ElementReTile.h"
#include "GeometryVolume/topology/Command.h"

#include <cmath>
#include <iostream>

using namespace VLN::TileTree3D;
using Shape = PowerOfTwoTraits;
using Velorn::Math::float3;

int main() {
  // A tree, and a topology that counts points.
  auto container = Command::createContainer<2, 4, 0>("tree", 1.0f);
  auto object = Command::createVLN<Shape>(container);
  container = nullptr;
  auto tree = object->extractComponent<Container<Shape>>("tree");
  tree->tileAccessor().addTile(0, 0, 0, Shape::kMaxDepth);
  Command::createPointTopology<2, 4, 0>("points", *tree, *object);
  auto topology = object->extractComponent<PointTopology<Shape>>("points");

  // Two channels: positions, and the number of each particle.
  Command::createChannel<float3, 2, 4, 4, 0, 0>("positions", *topology, *object, float3{0, 0, 0},
                                                kInitializeDefaultValue, 0, Shape::kMaxDepth);
  Command::createChannel<float, 2, 4, 4, 0, 0>("number", *topology, *object, 0.0f, kInitializeDefaultValue, 0,
                                               Shape::kMaxDepth);
  auto positions = object->extractComponent<Channel<Shape, float3, 4, 0>>("positions");
  {
    // A thousand particles in the first tile.
    auto numbers = object->extractComponent<Channel<Shape, float, 4, 0>>("number");
    TreeIndex const first{0, Shape::kMaxDepth};
    auto at = positions->tileDataAccessor().tileData(first);
    auto number = numbers->tileDataAccessor().tileData(first);
    for (int n = 0; n < 1000; ++n) {
      at.push(float3{0.004f * static_cast<float>(n), 2.0f, 2.0f});
      number.push(static_cast<float>(n));
    }
    object->putComponent(std::move(numbers));
  }
  topology->update(*positions);

  // They fly apart. Each step every particle goes to the tile where it now is; empty tiles go.
  for (int step = 0; step < 50; ++step) {
    for (float3& p : *positions) p = {p.x * 1.05f, p.y + 0.5f * std::sin(p.x), p.z + 0.25f};
    channelElementReTile(*tree, *topology, *positions, *object, true);
  }

  auto const numbers = object->component<Channel<Shape, float, 4, 0>>("number");
  double sum = 0;
  for (float const n : std::as_const(*numbers)) sum += static_cast<double>(n);
  std::cout << topology->size() << " particles in " << tree->tileCount(Shape::kMaxDepth) << " tiles\n";
  return topology->size() == 1000 && sum == 499500.0 && tree->tileCount(Shape::kMaxDepth) > 1 ? 0 : 1;
}
