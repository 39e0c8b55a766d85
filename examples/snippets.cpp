// The shorter pieces of code that the documents show, one after another, so that they stay true.
#include "GeometryVolume/channels/ChannelReader.h"
#include "GeometryVolume/channels/UpdateDispatch.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "GeometryVolume/topology/Command.h"
#include "GeometryVolume/volume/Volume.h"

#include <iostream>

// snippet: flat_buffer
#include "Reader/NanoVTTReader.h"
#include "Reader/NanoVTTValidate.h"

double densityAt(void const* bytes, std::uint64_t length, int x, int y, int z) {
  if (!nanovtt::validate(bytes, length).ok()) return 0; // once for each buffer, not for each read
  nanovtt::BufferReader const buffer(bytes);
  std::uint32_t const number = buffer.find("density");
  if (number == buffer.gridCount()) return 0;
  return buffer.grid(number).valueAt(x, y, z); // tile space
}
// end snippet

using namespace VLN::TileTree3D;
using Shape = PowerOfTwoTraits;

namespace {

bool right = true;
void expect(bool holds, char const* what) {
  if (!holds) std::cerr << what << "\n";
  right = right && holds;
}

void byHand() {
  // snippet: assemble
  auto object =
      Command::createVoxelVLN<Shape>("voxel_tile_tree", "voxel_component", 0.1f, kVoxelOffsetCorner);
  auto tree = object->extractComponent<Container<Shape>>("voxel_tile_tree");
  tree->tileAccessor().addTile(10, 20, 30, Shape::kMaxDepth);
  auto topology = object->extractComponent<VoxelTopology<Shape>>("voxel_component");
  topology->update(*tree);
  auto channel = Command::createChannel<float, 2, 4, 4, 0, 0>("density", *topology, 0.0f,
                                                              kInitializeDefaultValue, 0, Shape::kMaxDepth);
  // end snippet
  object->putComponent(std::move(channel));
  expect(object->hasComponentFromName("density"), "assembled");
  TreeIndex const tile{0, Shape::kMaxDepth};
  int const i = 1, j = 2, k = 3;
  {
    // snippet: write
    auto density = object->extractComponent<Channel<Shape, float, 4, 0>>("density");
    density->tileData(tile)(i, j, k) = 1.0f;
    object->putComponent(std::move(density));
    // end snippet
  }
  auto const density = object->component<Channel<Shape, float, 4, 0>>("density");
  {
    int3 const at = std::as_const(*tree).tile(tile).childDataTIJK(i, j, k);
    // snippet: reader
    ChannelReader const reader(*tree, *density);
    float const value = reader.value(at.x, at.y, at.z);
    // end snippet
    expect(value == 1.0f, "read");
    std::vector<int3> const positions{at, {0, 0, -1}, at};
    // snippet: reader_many
    std::vector<float> values(positions.size());
    reader.read(positions, values);
    // end snippet
    expect(values == std::vector<float>{1.0f, reader.value(positions[1]), 1.0f}, "read many");
  }
  {
    float3 const position{10.5f, 20.5f, 30.5f};
    // snippet: sampler
    FloatVoxelSamplerLinear<Shape> const sampler(*tree, *topology, *density);
    float const value = sampler.sample({1.0f, 2.0f, 3.0f}); // world space
    float3 gradient;
    sampler.sampleGradient({1.0f, 2.0f, 3.0f}, &gradient);
    float const coarse = sampler.sample(position, 20, kSamplerTileSpace); // at depth 20 at most, tile space
    // end snippet
    expect(value >= 0 && gradient.x == gradient.x && coarse == 0, "sampled");
  }
}

void cursor() {
  Container<Shape> tree("tree", 1.0f);
  // snippet: cursor
  auto accessor = tree.tileAccessor();
  auto const& tile = accessor.addTile(10, 20, 30, tree.kMaxDepth);    // makes it, or finds it
  auto const& near = accessor.tile(12, 20, 30, tree.kMaxDepth, true); // exact: this depth or invalid
  // end snippet
  expect(tile.valid() && !near.valid(), "found");
}

void movePoints() {
  std::vector<float3> const all{{1, 1, 1}, {2, 2, 2}, {9, 1, 1}};
  Volume volume;
  volume.addPoints("points", all);
  VLN::Object copy = volume.object();
  VLN::Object* const object = &copy;
  auto topology = object->extractComponent<PointTopology<Shape>>("points");
  auto positions = object->extractComponent<Channel<Shape, float3, 4, 0>>("points_positions");
  ElementMoves moves(29);
  moves[28].push_back({1, 0, 0, 28}); // the first point of tile 0 to tile 1
  ElementOrder order;
  DestinationTiles tiles;
  ArrivalMap arrivals;
  // snippet: move
  positions->computePermutation(moves, order, tiles, arrivals, false); // false: not sorted yet
  positions->updateElements(moves, order, tiles, arrivals);
  topology->update(*positions);                                      // counts its points anew
  updateElements(moves, order, tiles, arrivals, *topology, *object); // the other channels
  // end snippet
  expect(topology->elementCount(TreeIndex{1, 28}) == 2, "moved");
}

} // namespace

int main() {
  byHand();
  cursor();
  movePoints();
  expect(densityAt("", 0, 0, 0, 0) == 0, "no buffer");
  std::cout << (right ? "all as the documents say\n" : "not as the documents say\n");
  return right ? 0 : 1;
}
