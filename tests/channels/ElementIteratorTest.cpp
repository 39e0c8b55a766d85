// Walking all elements, and growing single tiles.
#include "FakeTree.h"
#include "ProbeChannel.h"

#include <gtest/gtest.h>
#include <numeric>
#include <utility>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using namespace VLN::Test;

using Points = ProbeChannel<PowerOfTwoTraits, int, 4, 0>;
using Voxels = ProbeChannel<PowerOfTwoTraits, int, 5, 0>;

TEST(ElementIterator, BoundaryEmptyChannel) {
  Points channel;
  EXPECT_TRUE(channel.begin() == channel.end());
  EXPECT_TRUE(channel.cbegin() == channel.cend());
  channel.update(FakeTree().set(3, 4, 0));
  EXPECT_TRUE(channel.begin() == channel.end());
}

TEST(ElementIterator, RequirementEmptyTilesAndDepthsAreInvisible) {
  Points channel;
  FakeTree tree;
  tree.elements[2] = {0, 3, 0, 2};
  tree.elements[9] = {0, 0};
  tree.elements[28] = {1, 0};
  channel.update(tree);
  int n = 0;
  for (int& v : channel) v = n++;
  EXPECT_EQ(n, 6);
  std::vector<std::pair<TreeIndex, std::int64_t>> places;
  n = 0;
  Points const& read = channel;
  for (auto it = read.begin(); it != read.end(); ++it) {
    EXPECT_EQ(*it, n++);
    places.emplace_back(it.tile(), it.position());
  }
  EXPECT_EQ(places, (std::vector<std::pair<TreeIndex, std::int64_t>>{
                        {{1, 2}, 0}, {{1, 2}, 1}, {{1, 2}, 2}, {{3, 2}, 0}, {{3, 2}, 1}, {{0, 28}, 0}}));
  EXPECT_EQ(std::accumulate(read.cbegin(), read.cend(), 0), 15);
}

TEST(ElementIterator, RequirementJumpsByWholeTiles) {
  Voxels channel;
  FakeTree tree;
  tree.set(1, 2).set(4, 3);
  channel.update(tree);
  std::iota(channel.begin(), channel.end(), 0);
  int const total = 5 * Voxels::kSize;
  for (int from : {0, 1, 124, 125, 300, total - 1}) {
    for (int to : {0, 124, 125, 249, 250, 500, total - 1}) {
      auto it = channel.begin();
      it += from;
      ASSERT_EQ(*it, from);
      it += to - from;
      ASSERT_EQ(*it, to) << from;
    }
  }
  auto it = channel.begin();
  it += total;
  EXPECT_TRUE(it == channel.end());
  it += -1;
  EXPECT_EQ(*it, total - 1);
  ++it;
  EXPECT_TRUE(it == channel.end());
}

TEST(TileDataAccessor, RequirementChangesTheTileInTheChannel) {
  Points channel;
  channel.update(FakeTree().set(3, 2, 1).set(5, 1, 1));
  auto accessor = channel.tileDataAccessor();
  for (int n = 0; n < 100; ++n) accessor.tileData(TreeIndex{1, 3}).push(n);
  EXPECT_EQ(channel.elementCount(TreeIndex{1, 3}), 101);
  auto moved = std::move(accessor);
  moved.tileData(2).resize(5, 7);
  EXPECT_EQ(channel.elementCount(TreeIndex{0, 5}), 5);
  EXPECT_EQ(std::as_const(channel).tileData(0, 5)[4], 7);
}

} // namespace
