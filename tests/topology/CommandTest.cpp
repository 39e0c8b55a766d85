// Requirement and boundary tests of the commands that assemble a volume.
#include "GeometryVolume/topology/Command.h"
#include "GeometryVolume/core/ElementTypes.h"

#include <gtest/gtest.h>

using namespace VLN;
using namespace VLN::TileTree3D;
using Command::createChannel;

namespace {

using Shape = PowerOfTwoTraits;

/// An object with a container of three tiles at the deepest depth and a topology that has followed it.
struct Volume {
  Ostil::MutablePtr<VLN::Object> object =
      Command::createVoxelVLN<Shape>("tree", "topo", 0.5f, kVoxelOffsetCorner);
  Ostil::Ptr<Container<Shape>> tree;
  Ostil::Ptr<VoxelTopology<Shape>> topology;

  explicit Volume(int tiles = 3) {
    auto container = object->extractComponent<Container<Shape>>("tree");
    for (int n = 0; n < tiles; ++n) container->tileAccessor().addTile(8 * n, 0, 0, Shape::kMaxDepth);
    auto followed = object->extractComponent<VoxelTopology<Shape>>("topo");
    followed->update(*container);
    object->putComponent(std::move(container));
    object->putComponent(std::move(followed));
    tree = object->component<Container<Shape>>("tree");
    topology = object->component<VoxelTopology<Shape>>("topo");
  }
};

} // namespace

TEST(CreateVoxelVLN, EmptyNamesTakeTheDefaults) {
  auto const object = Command::createVoxelVLN<Shape>("", "", 1.0f, kVoxelOffsetCenter);
  EXPECT_TRUE(object->hasComponentFromName<Container<Shape>>("tileTreeContainer"));
  EXPECT_TRUE(object->hasComponentFromName<VoxelTopology<Shape>>("tileTreeVoxelTopo"));
}

TEST(CreateVoxelVLN, TopologyComesFirstAndTargetsTheContainer) {
  auto const object = Command::createVoxelVLN<OddTraits>("tree", "topo", 1.0f, kVoxelOffsetFaceX);
  auto const names = object->componentRange();
  ASSERT_EQ(names.size(), 2u);
  EXPECT_EQ(names[0], "topo");
  EXPECT_EQ(names[1], "tree");
  auto const topology = object->component<VoxelTopology<OddTraits>>("topo");
  EXPECT_EQ(topology->getTargetName(), "tree");
  EXPECT_EQ(topology->offsetType(), kVoxelOffsetFaceX);
}

TEST(CreateContainer, IsInNoObjectUntilOneIsMade) {
  auto container = Command::createContainer<5, 5, 0>("tree", 0.25f);
  EXPECT_EQ(container->voxelSize(), 0.25f);
  auto const object = Command::createVLN<OddTraits>(container);
  EXPECT_TRUE(object->hasComponentFromName<Container<OddTraits>>("tree"));
  EXPECT_EQ(object->size(), 1u);
}

TEST(CreateTopology, FollowsTheContainerAndIsStored) {
  Volume volume;
  auto const voxels =
      Command::createVoxelTopology<2, 4, 0>("more", *volume.tree, *volume.object, kVoxelOffsetCenter);
  EXPECT_EQ(voxels->tileCount(-1), 3);
  EXPECT_EQ(voxels->getTargetName(), "tree");
  EXPECT_EQ(volume.object->component("more").get(), voxels.get());
  auto const points = Command::createPointTopology<2, 4, 0>("points", *volume.tree, *volume.object);
  EXPECT_EQ(points->tileCount(-1), 3);
  EXPECT_EQ(points->elementCount(-1), 0);
}

TEST(CreateChannel, HasStorageAtOnce) {
  Volume volume;
  auto const channel = createChannel<float, 2, 4, 4, 0, 0>("density", *volume.topology, 2.5f,
                                                           kInitializeDefaultValue, 0, Shape::kMaxDepth);
  EXPECT_EQ(channel->tileCount(-1), 3);
  EXPECT_EQ(channel->elementCount(-1), 192);
  EXPECT_EQ(channel->getTargetName(), "topo");
  EXPECT_EQ(channel->owner(), "tree");
  for (float const v : channel->tileData(TreeIndex{1, Shape::kMaxDepth})) EXPECT_EQ(v, 2.5f);
  EXPECT_FALSE(volume.object->hasComponentFromName("density"));
}

TEST(CreateChannel, ResultIsTheVeryChannelThatTheObjectHolds) {
  Volume volume;
  auto const channel = createChannel<int, 2, 4, 5, 0, 0>("flags", *volume.topology, *volume.object, 7,
                                                         kInitializeDefaultValue, 0, Shape::kMaxDepth);
  EXPECT_EQ(volume.object->component("flags").get(), channel.get());
  EXPECT_EQ(channel.useCount(), 2);
  EXPECT_EQ(channel->elementCount(-1), 3 * 125);
}

TEST(CreateChannel, FromAChannelTakesItsLayoutAndName) {
  Volume volume;
  auto const source = createChannel<float, 2, 4, 4, 0, 0>("a", *volume.topology, *volume.object, 0.0f,
                                                          kInitializeDefaultValue, 0, Shape::kMaxDepth);
  auto const derived = createChannel<float, 2, 4, 4, 0, 1>("b", *source, *volume.object, 1.0f,
                                                           kInitializeDefaultValue, 0, Shape::kMaxDepth);
  EXPECT_EQ(derived->tileCount(Shape::kMaxDepth), 3);
  EXPECT_EQ(derived->elementCount(-1), 3 * 216);
  EXPECT_EQ(derived->getTargetName(), "a");
}

TEST(CreateChannel, OnPointsHasNoElements) {
  Volume volume;
  auto const points = Command::createPointTopology<2, 4, 0>("points", *volume.tree, *volume.object);
  auto const channel = createChannel<Velorn::Math::float3, 2, 4, 4, 0, 0>(
      "position", *points, *volume.object, {}, kInitializeDefaultValue, 0, Shape::kMaxDepth);
  EXPECT_EQ(channel->tileCount(-1), 3);
  EXPECT_EQ(channel->elementCount(-1), 0);
}

namespace {

template <class T>
void createEachLayout(VoxelTopology<Shape> const& even, VoxelTopology<OddTraits> const& odd) {
  auto const sizeOf = [](auto channel) { return channel->size(); };
  EXPECT_EQ(sizeOf(createChannel<T, 2, 4, 4, 0, 0>("c", even, T{}, kInitializeZero, 0, 28)), 64u);
  EXPECT_EQ(sizeOf(createChannel<T, 2, 4, 4, 0, 1>("c", even, T{}, kInitializeZero, 0, 28)), 216u);
  EXPECT_EQ(sizeOf(createChannel<T, 2, 4, 5, 0, 0>("c", even, T{}, kInitializeZero, 0, 28)), 125u);
  EXPECT_EQ(sizeOf(createChannel<T, 5, 5, 5, 0, 0>("c", odd, T{}, kInitializeZero, 0, 12)), 125u);
  EXPECT_EQ(sizeOf(createChannel<T, 5, 5, 5, 0, 1>("c", odd, T{}, kInitializeZero, 0, 12)), 343u);
  EXPECT_EQ(sizeOf(createChannel<T, 5, 5, 6, 0, 0>("c", odd, T{}, kInitializeZero, 0, 12)), 216u);
}

} // namespace

TEST(CreateChannel, EveryElementTypeAndLayout) {
  Volume const volume(1);
  Container<OddTraits> tree("tree", 1.0f);
  tree.tileAccessor().addTile(0, 0, 0, OddTraits::kMaxDepth);
  VoxelTopology<OddTraits> odd("topo", kVoxelOffsetCenter);
  odd.update(tree);
#define VLN_CHECK(T, NAME) createEachLayout<T>(*volume.topology, odd);
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_CHECK)
}

TEST(InitializeTileData, FillsListedTilesOfAllChannelsAndSkipsUnknownOnes) {
  Volume volume;
  auto a = createChannel<float, 2, 4, 4, 0, 0>("a", *volume.topology, *volume.object, 1.0f,
                                               kInitializeDefaultValue, 0, Shape::kMaxDepth);
  auto b = createChannel<int, 2, 4, 4, 0, 1>("b", *volume.topology, *volume.object, 9,
                                             kInitializeDefaultValue, 0, Shape::kMaxDepth);
  constexpr int kDepth = Shape::kMaxDepth;
  for (std::int64_t n = 0; n < 3; ++n) {
    a->tileData(TreeIndex{n, kDepth}).set(-5.0f);
    b->tileData(TreeIndex{n, kDepth}).set(-5);
  }
  a = nullptr, b = nullptr;
  Container<Shape>::TileLists newTiles;
  newTiles[kDepth].append({8, 0, 0});
  newTiles[kDepth].append({4000, 0, 0}); // no such tile
  newTiles[3].append({0, 0, 0});
  Command::initializeTileData(*volume.tree, newTiles, *volume.object);
  auto const floats = volume.object->component<Channel<Shape, float, 4, 0>>("a");
  auto const ints = volume.object->component<Channel<Shape, int, 4, 1>>("b");
  ASSERT_TRUE(floats && ints);
  for (std::int64_t n = 0; n < 3; ++n) {
    for (float const v : std::as_const(*floats).tileData(TreeIndex{n, kDepth}))
      EXPECT_EQ(v, n == 1 ? 1.0f : -5.0f) << n;
    for (int const v : std::as_const(*ints).tileData(TreeIndex{n, kDepth}))
      EXPECT_EQ(v, n == 1 ? 9 : -5) << n;
  }
}

TEST(InitializeTileData, RegressionChannelsOfTheOtherShapeStayUntouched) {
  Volume volume;
  auto other = Ostil::makePtr<Channel<OddTraits, float, 5, 1>>("other", nullptr, kInitializeDefaultValue,
                                                               false, true, 0, Shape::kMaxDepth);
  int const depth = Shape::kMaxDepth;
  std::int64_t counts[kChannelDepths]{};
  counts[depth] = 3;
  other->resize(counts, 343);
  for (std::int64_t n = 0; n < 3; ++n) other->tileData(TreeIndex{n, depth}).set(-5.0f);
  auto const* address = other.get();
  volume.object->addComponent(std::move(other));
  auto const shared = *volume.object;
  Container<Shape>::TileLists newTiles;
  newTiles[static_cast<std::size_t>(depth)].append(volume.tree->tile(0, depth).tijk());
  Command::initializeTileData(*volume.tree, newTiles, *volume.object);
  auto const after = volume.object->component<Channel<OddTraits, float, 5, 1>>("other");
  EXPECT_EQ(after.get(), address) << "nor was it copied";
  for (float const v : std::as_const(*after).tileData(TreeIndex{0, depth})) EXPECT_EQ(v, -5.0f);
}

TEST(InitializeTileData, EmptyListsLeaveAllAsItWas) {
  Volume volume;
  createChannel<float, 2, 4, 4, 0, 0>("a", *volume.topology, *volume.object, 1.0f, kInitializeDefaultValue, 0,
                                      Shape::kMaxDepth)
      ->tileData(TreeIndex{0, Shape::kMaxDepth})
      .set(3.0f);
  Command::initializeTileData(*volume.tree, Container<Shape>::TileLists{}, *volume.object);
  auto const a = volume.object->component<Channel<Shape, float, 4, 0>>("a");
  ASSERT_TRUE(a);
  EXPECT_EQ(*std::as_const(*a).tileData(TreeIndex{0, Shape::kMaxDepth}).begin(), 3.0f);
  EXPECT_EQ(volume.object->componentRange().size(), 3u);
}
