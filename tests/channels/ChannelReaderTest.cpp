#include "GeometryVolume/channels/ChannelReader.h"

#include "channels/HaloModel.h"
#include "support/RandomForest.h"
#include "support/Shapes.h"

#include <algorithm>
#include <limits>
#include <span>
#include <stdexcept>
#include <utility>
#include <vector>

namespace VLN::Test {
namespace {

// The sample of the deepest tile with data that holds the point, by looking at every tile.
template <class ChannelT, class TreeT>
typename ChannelT::value_type modelValue(TreeT const& tree, ChannelT const& channel, int3 const& p) {
  for (int d = TreeT::kMaxDepth; d >= 0; --d)
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
      auto const& tile = tree.tile(n, d);
      if (!tile.valid() || !tile.contains(p) || d < channel.minDepth() || d > channel.depth()) continue;
      if (channel.tileData(n, d).size() == ChannelT::kSize) return channel(tile, tile.childDataIJK(p));
    }
  return channel.defaultValue();
}

VLN_SHAPE_SUITE(ChannelReaderTest);

template <class TraitsT, int E, int H> void expectModel(std::uint32_t seed) {
  using ChannelT = Channel<TraitsT, float, TraitsT::kTDW + E, H>;
  Support::RandomForest<TraitsT> forest(seed);
  for (int n = 0; n < 30; ++n) forest.grow();
  auto const& tree = forest.tree();
  // Every third channel ends above the deepest tiles, every fifth begins below the roots.
  int const low = seed % 5 == 0 ? forest.minDepth() + 1 : 0;
  int const high = seed % 3 == 0 ? TraitsT::kMaxDepth - 1 : TraitsT::kMaxDepth;
  auto channel = channelOn<ChannelT>(tree, -1.0f, low, high);
  fillRandom(channel, tree, seed);
  ChannelReader<ChannelT> const reader(tree, channel);
  ChannelReader<ChannelT> const copy(reader);
  int3 p{0, 0, 0};
  for (int n = 0; n < 400; ++n) {
    // Jumps and steps, so that the last block holds the next point, or does not.
    p = n % 4 == 0 ? forest.point() : forest.near(p, TraitsT::kMaxDepth);
    float const expected = modelValue(tree, channel, p);
    ASSERT_EQ(reader.value(p), expected) << "seed " << seed << " at " << p.x << ' ' << p.y << ' ' << p.z;
    ASSERT_EQ(ChannelReader<ChannelT>(copy).value(p.x, p.y, p.z), expected);
  }
}

// model: random forests of mixed depths, all layouts
TYPED_TEST(ChannelReaderTest, GivesTheDeepestTilesSample) {
  for (std::uint32_t seed = 1; seed <= 40; ++seed) {
    expectModel<TypeParam, 0, 0>(seed);
    if (seed % 4 == 0) {
      expectModel<TypeParam, 0, 1>(seed);
      expectModel<TypeParam, 0, 2>(seed);
      expectModel<TypeParam, 1, 0>(seed);
    }
  }
}

/// Positions in the orders that read() tells apart: at random, in walks, and through whole blocks.
template <class TraitsT> std::vector<int3> manyPositions(Support::RandomForest<TraitsT>& forest) {
  std::vector<int3> out;
  for (int n = 0; n < 700; ++n) out.push_back(forest.point());
  for (int n = 0; n < 700; ++n)
    out.push_back(n % 9 == 0 ? forest.point() : forest.near(out.back(), TraitsT::kMaxDepth));
  constexpr int kBlock = TraitsT::width(TraitsT::kMaxDepth - 1);
  for (int n = 0; n < 4; ++n) {
    int3 const corner = TraitsT::align(forest.point(), TraitsT::kMaxDepth - 1);
    for (int i = 0; i < kBlock; ++i)
      for (int j = 0; j < kBlock; j += 1 + kBlock / 16)
        for (int k = 0; k < kBlock; ++k) out.push_back({corner.x + i, corner.y + j, corner.z + k});
  }
  constexpr int kLow = std::numeric_limits<int>::min(), kTop = std::numeric_limits<int>::max();
  for (int const c : {kLow, TraitsT::kMinTileCoord - 1, TraitsT::kMinTileCoord, TraitsT::kMaxTileCoord,
                      TraitsT::kMaxTileCoord + 1, kTop})
    out.push_back({c, out.back().y, c});
  return out;
}

template <class ChannelT, class TraitsT> void expectReadsMany(std::uint32_t seed) {
  using T = typename ChannelT::value_type;
  Support::RandomForest<TraitsT> forest(seed);
  for (int n = 0; n < 30; ++n) forest.grow();
  // Tiles close together: blocks that are full, and no nodes between cells and blocks.
  bool const close = seed % 2 == 0;
  Container<TraitsT> box("", 1.0f);
  constexpr int kTile = TraitsT::width(TraitsT::kMaxDepth);
  for (int n = 0; n < 64; ++n)
    box.tileAccessor().addTile(n % 4 * kTile, n / 4 % 4 * kTile, n / 16 * kTile, TraitsT::kMaxDepth);
  auto const& tree = close ? box : forest.tree();
  auto channel = channelOn<ChannelT>(tree, T{});
  fillRandom(channel, tree, seed);
  auto positions = manyPositions(forest);
  if (close)
    for (int3& p : positions)
      for (int a = 0; a < 3; ++a) p[a] = p[a] & (8 * kTile - 1);
  ChannelReader<ChannelT> const reader(tree, channel);
  ChannelReader<ChannelT> const single(reader);
  for (std::size_t const count : {std::size_t(0), std::size_t(1), std::size_t(7), std::size_t(256),
                                  std::size_t(257), std::size_t(513), positions.size()}) {
    auto const some = std::span(positions).last(count);
    std::vector<T> values(count, T{});
    reader.read(some, values);
    for (std::size_t n = 0; n < count; ++n)
      ASSERT_EQ(values[n], single.value(some[n])) << "seed " << seed << ", " << n << " of " << count;
  }
}

// model: single reads, themselves tested above; elements of several sizes, all layouts
TYPED_TEST(ChannelReaderTest, ReadsManyAsOneByOne) {
  using Traits = TypeParam;
  for (std::uint32_t seed = 1; seed <= 6; ++seed) {
    expectReadsMany<Channel<Traits, float, Traits::kTDW, 0>, Traits>(seed);
    expectReadsMany<Channel<Traits, float, Traits::kTDW, 2>, Traits>(seed);
    expectReadsMany<Channel<Traits, std::uint8_t, Traits::kTDW, 0>, Traits>(seed);
    expectReadsMany<Channel<Traits, double3, Traits::kTDW, 1>, Traits>(seed);
    expectReadsMany<Channel<Traits, float3, Traits::kTDW + 1, 0>, Traits>(seed);
    if (this->HasFatalFailure()) return;
  }
}

TYPED_TEST(ChannelReaderTest, RefusesToReadManyIntoFewer) {
  using Traits = TypeParam;
  using ChannelT = Channel<Traits, float, Traits::kTDW, 0>;
  Container<Traits> const tree("", 1.0f);
  auto const channel = channelOn<ChannelT>(tree, 3.0f);
  std::vector<float> values(1, -1.0f);
  try {
    ChannelReader<ChannelT>(tree, channel).read(std::vector<int3>(2), values);
    FAIL();
  } catch (std::invalid_argument const& e) { EXPECT_STREQ(e.what(), "2 positions with 1 values"); }
  EXPECT_EQ(values[0], -1.0f);
}

// edge: every int32 position, empty trees, channels without storage
TYPED_TEST(ChannelReaderTest, GivesTheDefaultValueWhereNothingIs) {
  using Traits = TypeParam;
  using ChannelT = Channel<Traits, float, Traits::kTDW, 0>;
  Container<Traits> tree("", 1.0f);
  auto const empty = channelOn<ChannelT>(tree, 3.0f, 0, Traits::kMaxDepth);
  ChannelReader<ChannelT> const nothing(tree, empty);
  constexpr int kLow = std::numeric_limits<int>::min(), kTop = std::numeric_limits<int>::max();
  for (int c : {kLow, Traits::kMinTileCoord - 1, Traits::kMinTileCoord, 0, Traits::kMaxTileCoord,
                Traits::kMaxTileCoord + 1, kTop})
    EXPECT_EQ(nothing.value(c, c, c), 3.0f);
  // The two ends of the domain: a dense box between them would not fit.
  tree.tileAccessor().addTile(Traits::kMinTileCoord, Traits::kMinTileCoord, Traits::kMinTileCoord,
                              Traits::kMaxDepth);
  tree.tileAccessor().addTile(Traits::kMaxTileCoord, Traits::kMaxTileCoord, Traits::kMaxTileCoord,
                              Traits::kMaxDepth);
  auto channel = channelOn<ChannelT>(tree, 3.0f, 0, Traits::kMaxDepth);
  channel.tileData(0, Traits::kMaxDepth).set(1.0f);
  channel.tileData(1, Traits::kMaxDepth).set(2.0f);
  ChannelReader<ChannelT> const reader(tree, channel);
  for (int pass = 0; pass < 2; ++pass)
    for (int c : {kLow, Traits::kMinTileCoord - 1, Traits::kMinTileCoord, 0, Traits::kMaxTileCoord,
                  Traits::kMaxTileCoord + 1, kTop})
      EXPECT_EQ(reader.value(c, c, c), c == Traits::kMinTileCoord   ? 1.0f
                                       : c == Traits::kMaxTileCoord ? 2.0f
                                                                    : 3.0f)
          << c;
  EXPECT_LT(reader.memUsage(), 1u << 20);
}

// edge: a table of blocks at either end of the domain, positions around it and at the ends of all integers
TYPED_TEST(ChannelReaderTest, GivesTheDefaultValueBesideEitherEndOfTheDomain) {
  using Traits = TypeParam;
  using ChannelT = Channel<Traits, float, Traits::kTDW, 0>;
  constexpr int kLow = std::numeric_limits<int>::min(), kTop = std::numeric_limits<int>::max();
  constexpr int kWidth = Traits::width(Traits::kMaxDepth - 1);
  for (int const end : {Traits::kMinTileCoord, Traits::kMaxTileCoord, -1, 0}) {
    Container<Traits> tree("", 1.0f);
    auto const corner = tree.tileAccessor().addTile(end, end, end, Traits::kMaxDepth).tijk();
    auto channel = channelOn<ChannelT>(tree, 3.0f, 0, Traits::kMaxDepth);
    channel.tileData(0, Traits::kMaxDepth).set(1.0f);
    ChannelReader<ChannelT> const reader(tree, channel);
    for (std::int64_t const step : {0, 1, -1, kWidth, -kWidth, 1 << 29, -(1 << 29), 1 << 30, -(1 << 30)}) {
      auto const c = static_cast<int>(std::clamp<std::int64_t>(std::int64_t(corner.x) + step, kLow, kTop));
      bool const within = c >= corner.x && c < corner.x + Traits::width(Traits::kMaxDepth);
      for (int axis = 0; axis < 3; ++axis) {
        int3 p = corner;
        p[axis] = c;
        EXPECT_EQ(reader.value(p), within ? 1.0f : 3.0f) << end << " and " << step << " on axis " << axis;
      }
    }
    for (int const c : {kLow, kTop}) EXPECT_EQ(reader.value(corner.x, c, corner.z), 3.0f);
  }
}

// model: ways of short and long steps along each axis, with the samples of blocks ahead, to beyond the domain
TYPED_TEST(ChannelReaderTest, ReadsTheSameOnWaysFromBlockToBlock) {
  using Traits = TypeParam;
  using ChannelT = Channel<Traits, float, Traits::kTDW, 0>;
  using Wide = Channel<Traits, float, Traits::kTDW, 1>;
  constexpr int kBlock = Traits::width(Traits::kMaxDepth - 1);
  Container<Traits> tree("", 1.0f);
  int const top = Traits::kMaxTileCoord;
  for (int n = 0; n < 6; n += 1 + n % 2) {
    tree.tileAccessor().addTile(n * kBlock, 0, -n, Traits::kMaxDepth);
    tree.tileAccessor().addTile(top - n * kBlock, top, top, Traits::kMaxDepth);
  }
  auto channel = channelOn<ChannelT>(tree, 3.0f, 0, Traits::kMaxDepth);
  auto wide = channelOn<Wide>(tree, 3.0f, 0, Traits::kMaxDepth);
  fillRandom(channel, tree, 1);
  fillRandom(wide, tree, 2);
  ChannelReader<ChannelT> const reader(tree, channel);
  ChannelReader<Wide> const wideReader(tree, wide);
  for (int3 const& start : {int3{-2 * kBlock, 0, 0}, int3{top - 7 * kBlock, top, top}})
    for (int const step : {1, kBlock - 1, kBlock, -kBlock, 2 * kBlock})
      for (int axis = 0; axis < 3; ++axis) {
        int3 p = start;
        for (int n = 0; n < 20; ++n) {
          float const expected = modelValue(tree, channel, p);
          ASSERT_EQ(reader.value(p), expected) << p.x << ' ' << p.y << ' ' << p.z;
          ASSERT_EQ(wideReader.value(p), modelValue(tree, wide, p)) << p.x << ' ' << p.y << ' ' << p.z;
          // Readers fetch ahead once they have read much of a block.
          for (int again = 0; again < 60; ++again) ASSERT_EQ(reader.value(p), expected) << again;
          p[axis] += step;
        }
      }
}

TYPED_TEST(ChannelReaderTest, CopiesReadByThemselves) {
  using Traits = TypeParam;
  using ChannelT = Channel<Traits, float, Traits::kTDW, 0>;
  Container<Traits> trees[2] = {Container<Traits>("", 1.0f), Container<Traits>("", 1.0f)};
  std::vector<ChannelT> channels;
  for (auto& tree : trees) {
    tree.tileAccessor().addTile(0, 0, 0, Traits::kMaxDepth - 1);
    channels.push_back(channelOn<ChannelT>(tree, 3.0f, 0, Traits::kMaxDepth));
    channels.back().tileData(0, Traits::kMaxDepth - 1).set(static_cast<float>(channels.size()));
  }
  ChannelReader<ChannelT> a(trees[0], channels[0]), b(trees[1], channels[1]);
  EXPECT_EQ(a.value(0, 0, 0), 1.0f);
  ChannelReader<ChannelT> c(a);
  a = b;
  EXPECT_EQ(a.value(0, 0, 0), 2.0f);
  EXPECT_EQ(c.value(0, 0, 0), 1.0f);
  auto const& same = c;
  c = same;
  b = std::move(c);
  EXPECT_EQ(b.value(0, 0, 0), 1.0f);
  EXPECT_EQ(b.value(Traits::kMaxTileCoord, 0, 0), 3.0f);
}

// edge: a tile that lost elements is no whole tile, and its parent answers
TYPED_TEST(ChannelReaderTest, PassesOverTilesWithFewerElements) {
  using Traits = TypeParam;
  using ChannelT = Channel<Traits, float, Traits::kTDW, 0>;
  Container<Traits> tree("", 1.0f);
  tree.tileAccessor().addTile(0, 0, 0, Traits::kMaxDepth - 1);
  tree.tileAccessor().addTile(0, 0, 0, Traits::kMaxDepth);
  auto channel = channelOn<ChannelT>(tree, 0.0f, 0, Traits::kMaxDepth);
  channel.tileData(0, Traits::kMaxDepth - 1).set(1.0f);
  channel.tileData(0, Traits::kMaxDepth).set(2.0f);
  EXPECT_EQ((ChannelReader<ChannelT>(tree, channel).value(0, 0, 0)), 2.0f);
  channel.tileDataAccessor().tileData(TreeIndex{0, Traits::kMaxDepth}).pop();
  EXPECT_EQ((ChannelReader<ChannelT>(tree, channel).value(0, 0, 0)), 1.0f);
}

} // namespace
} // namespace VLN::Test
