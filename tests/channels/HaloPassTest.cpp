// Passes over many tiles at once against tiles filled one by one, each by a driver of its own.
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"
#include "channels/HaloModel.h"
#include "support/Shapes.h"

namespace VLN::Test {
namespace {

/// A shell of tiles some wide, below their ancestors: tiles with all neighbours, with few, and parents with
/// one child or all.
template <class TraitsT> Container<TraitsT> shell(int rootDepth) {
  typename Container<TraitsT>::TileLists corners;
  constexpr int kDeep = TraitsT::kMaxDepth, kRadius = 52, kReach = 70;
  std::mt19937 random(11);
  for (int d = rootDepth; d <= kDeep; ++d) {
    int const w = TraitsT::width(d), low = TraitsT::align(-kReach, d);
    for (int k = low; k < kReach; k += w)
      for (int j = low; j < kReach; j += w)
        for (int i = low; i < kReach; i += w) {
          double const distance = std::hypot(i + w / 2.0, 1.3 * (j + w / 2.0), k + w / 2.0) - kRadius;
          if (std::abs(distance) < 2 + 0.87 * w && random() % 11 != 0)
            corners[static_cast<std::size_t>(d)].append({i, j, k});
        }
  }
  Container<TraitsT> tree;
  tree.tileAccessor().addTiles(corners);
  return tree;
}

template <class TraitsT> class HaloPassTest : public ::testing::Test {};
TYPED_TEST_SUITE(HaloPassTest, Support::Shapes, Support::ShapeNames);

template <class TraitsT, class T, int h1, int h2> void expectModePass(Container<TraitsT> const& tree) {
  using Target = Channel<TraitsT, T, TraitsT::kTDW, h2>;
  for (int const maxDepth : {TraitsT::kMaxDepth, TraitsT::kMaxDepth - 1}) {
    auto source = channelOn<Channel<TraitsT, T, TraitsT::kTDW, h1>>(tree, value<T>(7), 0, maxDepth);
    fillRandom(source, tree, 5);
    for (int mode = 0; mode < kHaloModeCount; ++mode)
      for (float const scale : {1.0f, 0.5f}) {
        auto const offset = static_cast<VoxelOffsetType>(mode + (scale == 1.0f ? 0 : 3));
        auto const before = channelOn<Target>(tree, value<T>(3));
        auto target = before;
        withThreads(2, [&] {
          computeHalo<TraitsT, T, TraitsT::kTDW, h1, h2>(static_cast<HaloMode>(mode), kHaloAll, -1, -1,
                                                         source, tree, target, scale, offset, 4.0f);
        });
        auto accessor = tree.tileAccessor();
        int bad = 0;
        forTiles(tree, 0, maxDepth, [&](auto const& tile) {
          auto one = TileData<T, TraitsT::kTDW, h2>(std::as_const(before).tileData(tile.treeIndex()).size());
          std::copy_n(before.tileData(tile.treeIndex()).begin(), one.size(), one.begin());
          setHaloTile<TraitsT, T, h1, h2, 0, 0>(tile.treeIndex(), source, static_cast<HaloMode>(mode),
                                                kHaloAll, accessor, one, 4.0f, scale, offset);
          if (bytesOf(*one.data()) != bytesOf(*std::as_const(target).tileData(tile.treeIndex()).data()))
            ++bad;
        });
        EXPECT_EQ(bad, 0) << "mode " << mode << ", scale " << scale << ", depths to " << maxDepth;
      }
  }
}

template <class TraitsT, class T, int a, int b, int c, int d>
void expectPlainPass(Container<TraitsT> const& tree) {
  using Target = Channel<TraitsT, T, TraitsT::kTDW + c, d>;
  auto source = channelOn<Channel<TraitsT, T, TraitsT::kTDW + a, b>>(tree, value<T>(7));
  fillRandom(source, tree, 6);
  auto target = channelOn<Target>(tree, value<T>(3));
  withThreads(2, [&] { computeHalo<TraitsT, T, a, b, c, d>(source, tree, target, -1, -1); });
  auto accessor = tree.tileAccessor();
  using Tile = TileData<T, TraitsT::kTDW + c, d>;
  int bad = 0;
  forTiles(tree, 0, TraitsT::kMaxDepth, [&](auto const& tile) {
    auto const* const parent = tile.isRoot() ? nullptr : &tree.tile(tile.parentTreeIndex());
    Tile one(Tile::kSize), parentTile;
    if (parent) parentTile = target.tileData(parent->treeIndex());
    setHaloTile<TraitsT, T, a, b, c, d>(tile, parent, source, one, kHaloModeReplicate, accessor, parentTile);
    if (bytesOf(*one.data()) != bytesOf(*std::as_const(target).tileData(tile.treeIndex()).data())) ++bad;
  });
  EXPECT_EQ(bad, 0) << a << b << c << d;
}

// requirement: what a pass finds for many tiles at once is what each tile finds alone
TYPED_TEST(HaloPassTest, RequirementPlainFormEqualsTheTileForm) {
  for (int const rootDepth : {TypeParam::kMaxDepth - 3, TypeParam::kMaxDepth - 1}) {
    auto const tree = shell<TypeParam>(rootDepth);
    expectPlainPass<TypeParam, float, 0, 0, 1, 0>(tree);
    expectPlainPass<TypeParam, float, 0, 0, 0, 1>(tree);
    expectPlainPass<TypeParam, float, 0, 1, 1, 0>(tree);
    expectPlainPass<TypeParam, float, 1, 0, 1, 0>(tree);
    expectPlainPass<TypeParam, std::uint8_t, 0, 0, 0, 1>(tree);
  }
}
TYPED_TEST(HaloPassTest, RequirementModesEqualTheTileForm) {
  for (int const rootDepth : {TypeParam::kMaxDepth - 3, TypeParam::kMaxDepth - 1}) {
    auto const tree = shell<TypeParam>(rootDepth);
    expectModePass<TypeParam, float, 0, 1>(tree);
    expectModePass<TypeParam, float, 0, 2>(tree);
    expectModePass<TypeParam, float, 1, 1>(tree);
    expectModePass<TypeParam, std::uint8_t, 0, 1>(tree);
  }
}

// boundary: dead tiles stay in place until the tree is compacted
TYPED_TEST(HaloPassTest, BoundaryDeadTilesAreLeftOut) {
  auto tree = shell<TypeParam>(TypeParam::kMaxDepth - 3);
  tree.setCompactOnRemoval(false);
  std::vector<std::int64_t> dead;
  for (std::int64_t n = 0; n < tree.tileCount(TypeParam::kMaxDepth); n += 5) dead.push_back(n);
  tree.tileAccessor().removeTiles(dead, TypeParam::kMaxDepth, true);
  expectPlainPass<TypeParam, float, 0, 0, 1, 0>(tree);
  expectPlainPass<TypeParam, float, 0, 0, 0, 1>(tree);
  expectModePass<TypeParam, float, 0, 1>(tree);
}

} // namespace
} // namespace VLN::Test
