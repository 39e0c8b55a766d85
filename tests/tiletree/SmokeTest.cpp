#include "GeometryVolume/tiletree/Container.h"

#include <gtest/gtest.h>

using namespace VLN::TileTree3D;

TEST(ContainerSmoke, AncestorAdoptsDeeperRoot) {
  Container<PowerOfTwoTraits> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTile(0, 0, 0, 3);
  EXPECT_EQ(tree.rootCount(), 1);
  accessor.addTile(0, 0, 0, 1);
  EXPECT_EQ(tree.rootCount(), 1);
  EXPECT_EQ(tree.tileCount(1), 1);
  EXPECT_EQ(tree.tileCount(2), 1);
  EXPECT_EQ(tree.tileCount(3), 1);
  EXPECT_EQ(tree.tileCount(-1), 3);
  EXPECT_TRUE(tree.checkConsistency(false));
}
