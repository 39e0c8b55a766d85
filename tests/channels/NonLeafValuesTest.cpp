#include "GeometryVolume/channels/NonLeafValues.h"

#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"
#include "channels/HaloModel.h"
#include "support/Shapes.h"

namespace VLN::Test {
namespace {

// The child sample of a parent sample, by the definition: an independent copy of the rule.
template <class TraitsT, class ConstTile>
typename ConstTile::value_type childValue(ConstTile const& child, VoxelOffsetType type, int3 const& ijk) {
  float const fraction[3] = {type & 1 ? 0.0f : 0.5f, type & 2 ? 0.0f : 0.5f, type & 4 ? 0.0f : 0.5f};
  int c[3];
  for (int a = 0; a < 3; ++a) {
    c[a] = static_cast<int>(fraction[a] * float(ConstTile::kCore));
    if (TraitsT::kTW == 2) c[a] += ijk[a] % 2 * 2;
  }
  int const flat = ConstTile::index(c[0], c[1], c[2]);
  constexpr int last = ConstTile::kCore - 1;
  return flat < ConstTile::kSize ? child(flat)
                                 : child(std::min(c[0], last), std::min(c[1], last), std::min(c[2], last));
}

template <class TraitsT, class T, int E, int H>
void expectModel(Container<TraitsT> const& tree, int minDepth, int maxDepth, int first, int last,
                 VoxelOffsetType type, std::uint32_t seed) {
  using ChannelT = Channel<TraitsT, T, TraitsT::kTDW + E, H>;
  auto before = channelOn<ChannelT>(tree, value<T>(7), minDepth, maxDepth);
  fillRandom(before, tree, seed);
  ChannelT expected(before);
  expected.cloneData();
  int const low = std::max(minDepth, first), high = std::min({last, maxDepth - 1, TraitsT::kMaxDepth - 1});
  bool differs = false;
  for (int d = high; d >= low; --d)
    forTiles(tree, d, d, [&](auto const& tile) {
      auto data = expected.tileData(tile.treeIndex());
      forBox(0, TraitsT::kTDW - 1, [&](int i, int j, int k) {
        constexpr int perVoxel = TraitsT::kTDW / TraitsT::kTW;
        int3 const voxel{i / perVoxel, j / perVoxel, k / perVoxel};
        if (tile.isLeaf(voxel)) return;
        auto const child = std::as_const(expected).tileData(tile.childTreeIndex(voxel));
        data(i, j, k) = childValue<TraitsT>(child, type, {i, j, k});
      });
    });
  for (int d = high; d >= low; --d)
    forTiles(tree, d, d, [&](auto const& tile) {
      forBox(0, TraitsT::kTDW - 1, [&](int i, int j, int k) {
        constexpr int perVoxel = TraitsT::kTDW / TraitsT::kTW;
        int3 const voxel{i / perVoxel, j / perVoxel, k / perVoxel};
        if (tile.isLeaf(voxel)) return;
        auto const child = std::as_const(before).tileData(tile.childTreeIndex(voxel));
        differs =
            differs || ElementTraits<T>::distance(std::as_const(before).tileData(tile.treeIndex())(i, j, k),
                                                  childValue<TraitsT>(child, type, {i, j, k})) > 20;
      });
    });
  EXPECT_EQ(checkIfNonLeafValueIsSetToChildValue(before, tree, type, 20.0f, first, last), differs);
  for (int threads : {1, 2, 8}) {
    ChannelT channel(before);
    withThreads(threads, [&] { setNonLeafValueToChildValue(channel, tree, type, first, last); });
    forTiles(tree, minDepth, maxDepth, [&](auto const& tile) {
      EXPECT_TRUE(bytesOf(*std::as_const(channel).tileData(tile.treeIndex()).data()) ==
                  bytesOf(*std::as_const(expected).tileData(tile.treeIndex()).data()))
          << "seed " << seed << ", layout " << E << H << ", type " << type;
    });
    EXPECT_FALSE(checkIfNonLeafValueIsSetToChildValue(channel, tree, type, 0.0f, first, last));
  }
}

VLN_SHAPE_SUITE(NonLeafValuesTest);

// requirement: on random forests, every layout and offset type
TYPED_TEST(NonLeafValuesTest, EqualsTheModel) {
  for (std::uint32_t seed = 1; seed <= 16; ++seed) {
    HaloForest<TypeParam> forest(seed, 20);
    auto const type = static_cast<VoxelOffsetType>(seed % 8);
    auto const& tree = forest.tree();
    int const low = seed % 2 ? 0 : forest.forest.pick(0, 5), high = TypeParam::kMaxDepth;
    expectModel<TypeParam, float, 0, 0>(tree, low, high, 0, high, type, seed);
    expectModel<TypeParam, float, 0, 1>(tree, low, high - 1, 0, high, type, seed);
    expectModel<TypeParam, float, 1, 0>(tree, low, high, forest.forest.pick(0, high), high - 2, type, seed);
  }
}

// requirement: each element type
TYPED_TEST(NonLeafValuesTest, EqualsTheModelForAllElementTypes) {
  HaloForest<TypeParam> forest(3, 20);
#define VLN_CHECK(type, name)                                                                                \
  expectModel<TypeParam, type, 0, 1>(forest.tree(), 0, TypeParam::kMaxDepth, 0, 99, kVoxelOffsetCenter, 3);
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_CHECK)
}

// boundary: only leaves; depths without anything to do
TYPED_TEST(NonLeafValuesTest, NothingToDo) {
  using ChannelT = Channel<TypeParam, float, TypeParam::kTDW, 0>;
  Container<TypeParam> tree("", 1.0f);
  tree.tileAccessor().addTile(0, 0, 0, 3);
  auto channel = channelOn<ChannelT>(tree, 1.0f);
  fillRandom(channel, tree, 1);
  std::string const before = bytesOf(*std::as_const(channel).tileData(0, 3).data());
  setNonLeafValueToChildValue(channel, tree, kVoxelOffsetCorner, 0, 28);
  EXPECT_TRUE(before == bytesOf(*std::as_const(channel).tileData(0, 3).data()));
  EXPECT_FALSE(checkIfNonLeafValueIsSetToChildValue(channel, tree, kVoxelOffsetCorner, 0.0f, 0, 28));

  Container<TypeParam> two("", 1.0f);
  two.tileAccessor().addTile(0, 0, 0, 0);
  two.tileAccessor().addTile(0, 0, 0, 1);
  auto shallow = channelOn<ChannelT>(two, 1.0f, 0, 0);
  fillRandom(shallow, two, 1);
  EXPECT_FALSE(checkIfNonLeafValueIsSetToChildValue(shallow, two, kVoxelOffsetCorner, 0.0f, 0, 28));
  auto deep = channelOn<ChannelT>(two, 1.0f);
  fillRandom(deep, two, 1);
  EXPECT_TRUE(checkIfNonLeafValueIsSetToChildValue(deep, two, kVoxelOffsetCorner, 0.0f, -5, 28));
  EXPECT_FALSE(checkIfNonLeafValueIsSetToChildValue(deep, two, kVoxelOffsetCorner, 0.0f, 1, 28));
  EXPECT_FALSE(checkIfNonLeafValueIsSetToChildValue(deep, two, kVoxelOffsetCorner, 0.0f, 28, 0));
}

// requirement: in a chain of three the root's sample holds the deepest value; the tolerance is strict
TYPED_TEST(NonLeafValuesTest, ValuesRiseThroughSeveralDepths) {
  using ChannelT = Channel<TypeParam, float, TypeParam::kTDW, 0>;
  Container<TypeParam> tree("", 1.0f);
  tree.tileAccessor().addTile(0, 0, 0, 4);
  int3 const corner = std::as_const(tree).tile(0, 4).tijk();
  tree.tileAccessor().addTile(corner, 5);
  tree.tileAccessor().addTile(corner, 6);
  auto channel = channelOn<ChannelT>(tree, 1.0f);
  channel.tileData(0, 6).set(42.0f);
  ChannelT const same(channel);
  setNonLeafValueToChildValue(channel, tree, kVoxelOffsetCorner, 0, 28);
  ChannelT const& result = channel;
  EXPECT_EQ(result.tileData(0, 4)(0, 0, 0), 42.0f);
  EXPECT_EQ(result.tileData(0, 5)(0, 0, 0), 42.0f);
  EXPECT_EQ(result.tileData(0, 4)(TypeParam::kTDW - 1, 0, 0), 1.0f);
  EXPECT_EQ(same.tileData(0, 4)(0, 0, 0), 1.0f);
  EXPECT_FALSE(checkIfNonLeafValueIsSetToChildValue(result, tree, kVoxelOffsetCorner, 0.0f, 0, 28));
  EXPECT_TRUE(checkIfNonLeafValueIsSetToChildValue(same, tree, kVoxelOffsetCorner, 40.75f, 0, 28));
  EXPECT_FALSE(checkIfNonLeafValueIsSetToChildValue(same, tree, kVoxelOffsetCorner, 41.0f, 0, 28));
}

// requirement: corner samples of the odd shape take the child's first sample
TEST(NonLeafValues, OddShapeTakesTheFirstSample) {
  using ChannelT = Channel<OddTraits, float, 5, 0>;
  Container<OddTraits> tree("", 1.0f);
  tree.tileAccessor().addTile(0, 0, 0, 3);
  int3 const corner = std::as_const(tree).tile(0, 3).tijk();
  int const v = OddTraits::width(4);
  tree.tileAccessor().addTiles(corner, {corner.x + 5 * v, corner.y + 5 * v, corner.z + 5 * v}, 4);
  auto channel = channelOn<ChannelT>(tree, 1.0f);
  fillRandom(channel, tree, 4);
  setNonLeafValueToChildValue(channel, tree, kVoxelOffsetCorner, 0, 28);
  ChannelT const& result = channel;
  auto const& tile = std::as_const(tree).tile(0, 3);
  forBox(0, 4, [&](int i, int j, int k) {
    EXPECT_EQ(result.tileData(0, 3)(i, j, k), result.tileData(tile.childTreeIndex(i, j, k))(0, 0, 0));
  });
}

} // namespace
} // namespace VLN::Test
