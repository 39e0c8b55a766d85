#include "GeometryVolume/channels/UpdateTopologies.h"

#include "GeometryVolume/topology/Command.h"
#include "support/Shapes.h"

namespace {

using namespace VLN::TileTree3D;

VLN_SHAPE_SUITE(UpdateTopologiesTest);

// requirement: counts of points go where the tiles went, without a word from whoever put the points there
TYPED_TEST(UpdateTopologiesTest, PointsOfAMovedTileAreCountedThere) {
  using Shape = TypeParam;
  constexpr int kLast = Shape::kMaxDepth, kW = Shape::kTDW;
  using Ids = Channel<Shape, int, kW, 0>;
  Container<Shape> tree("tree", 1.0f);
  auto accessor = tree.tileAccessor();
  for (int n = 0; n < 3; ++n) accessor.addTile(2 * n * Shape::width(kLast), 0, 0, kLast);
  VLN::Object object;
  auto topology = Ostil::makePtr<PointTopology<Shape>>("dust");
  topology->setTargetName(tree.name());
  topology->update(tree);
  object.addComponent(topology);
  Command::createChannel<int, Shape::kTW, kW, kW, 0, 0>("ids", *topology, object, 0, kInitializeDefaultValue,
                                                        0, kLast);
  {
    auto ids = object.template extractComponent<Ids>("ids");
    for (int id = 0; id < 5; ++id) ids->tileDataAccessor().tileData(TreeIndex{2, kLast}).push(id);
    object.putComponent(std::move(ids));
  }
  TileMoves moves;
  accessor.removeTile({0, kLast}, true, &moves);
  updateTopologies(tree, object, &moves);

  auto const counts = object.template component<PointTopology<Shape>>("dust");
  auto const ids = object.template component<Ids>("ids");
  ASSERT_EQ(counts->tileCount(kLast), 2);
  ASSERT_EQ(ids->tileCount(kLast), 2);
  EXPECT_EQ(counts->elementCount(kLast), 5);
  for (std::int64_t n = 0; n < 2; ++n) {
    TreeIndex const at{n, kLast};
    EXPECT_EQ(counts->elementCount(at), ids->elementCount(at));
    EXPECT_EQ(ids->elementCount(at), n == 0 ? 5 : 0); // the last tile filled the hole
  }
}

} // namespace
