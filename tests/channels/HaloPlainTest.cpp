// The plain form of computeHalo() and the tile form of setHaloTile().
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"
#include "channels/HaloModel.h"
#include "support/Shapes.h"
#include "support/Threads.h"

#include <limits>
#include <sstream>

namespace VLN::Test {
namespace {

template <class TraitsT, class T, int E, int H> using Layout = Channel<TraitsT, T, TraitsT::kTDW + E, H>;

// Bytes of all tiles of a channel.
template <class ChannelT, class TraitsT>
std::string allBytes(ChannelT const& channel, Container<TraitsT> const& tree) {
  std::string bytes;
  forTiles(tree, channel.minDepth(), channel.depth(),
           [&](auto const& t) { bytes += bytesOf(*channel.tileData(t.treeIndex()).data()); });
  return bytes;
}

template <class TraitsT, class T, int a, int b, int c, int d>
void expectPlainModel(Container<TraitsT> const& tree, int minDepth, int maxDepth, int first, int last,
                      std::string const& label) {
  using Source = Layout<TraitsT, T, a, b>;
  using Target = Layout<TraitsT, T, c, d>;
  auto source = channelOn<Source>(tree, value<T>(7), minDepth, maxDepth);
  fillRandom(source, tree, 5);
  auto const before = channelOn<Target>(tree, value<T>(9));
  Target target(before);
  computeHalo<TraitsT, T, a, b, c, d>(source, tree, target, first, last);
  HaloModel<TraitsT, Source> const model(tree, source);
  int const low = first == -1 ? std::max(minDepth, 0) : std::max(first, minDepth);
  int const high = last == -1 ? maxDepth : std::min(last, maxDepth);
  int bad = 0;
  forTiles(tree, 0, TraitsT::kMaxDepth, [&](auto const& tile) {
    if (bad > 3) return;
    auto const data = std::as_const(target).tileData(tile.treeIndex());
    if (tile.depth() < low || tile.depth() > high) {
      EXPECT_EQ(bytesOf(*data.data()), bytesOf(*before.tileData(tile.treeIndex()).data())) << label;
      return;
    }
    auto const* parent = tile.isRoot() || tile.depth() == low ? nullptr : &tree.tile(tile.parentTreeIndex());
    typename Target::ConstTile const parentData =
        parent ? std::as_const(target).tileData(parent->treeIndex()) : typename Target::ConstTile();
    forBox(Target::ConstTile::kMinCoord, Target::ConstTile::kMaxCoord, [&](int i, int j, int k) {
      T const expected = model.plain(tile, i, j, k, kHaloModeReplicate, parent, &parentData);
      if (sameBytes(expected, data(i, j, k)) || ++bad > 3) return;
      ADD_FAILURE() << label << ": tile " << tile.index() << " of depth " << tile.depth() << ", element " << i
                    << ' ' << j << ' ' << k;
    });
  });
}

template <class TraitsT, class T>
void expectAllPlainLayouts(Container<TraitsT> const& tree, int minDepth, int maxDepth, int first, int last) {
  std::ostringstream label;
  label << "depths " << minDepth << ".." << maxDepth << " asked " << first << ".." << last << ", "
        << sizeof(T) << " bytes, layouts ";
  expectPlainModel<TraitsT, T, 0, 0, 0, 0>(tree, minDepth, maxDepth, first, last, label.str() + "0000");
  expectPlainModel<TraitsT, T, 0, 0, 0, 1>(tree, minDepth, maxDepth, first, last, label.str() + "0001");
  expectPlainModel<TraitsT, T, 0, 0, 1, 0>(tree, minDepth, maxDepth, first, last, label.str() + "0010");
  expectPlainModel<TraitsT, T, 0, 1, 1, 0>(tree, minDepth, maxDepth, first, last, label.str() + "0110");
  expectPlainModel<TraitsT, T, 1, 0, 1, 0>(tree, minDepth, maxDepth, first, last, label.str() + "1010");
}

VLN_SHAPE_SUITE(HaloPlainTest);

// requirement: against one element at a time, on random forests of mixed depths
TYPED_TEST(HaloPlainTest, EqualsTheModel) {
  for (std::uint32_t seed = 1; seed <= 12; ++seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    HaloForest<TypeParam> forest(seed);
    expectAllPlainLayouts<TypeParam, float>(forest.tree(), 0, TypeParam::kMaxDepth, -1, -1);
    int const low = forest.forest.pick(0, TypeParam::kMaxDepth),
              high = forest.forest.pick(low, TypeParam::kMaxDepth);
    expectAllPlainLayouts<TypeParam, float>(forest.tree(), low, high, -1, -1);
    expectAllPlainLayouts<TypeParam, float>(forest.tree(), low, TypeParam::kMaxDepth,
                                            forest.forest.pick(0, TypeParam::kMaxDepth), high);
  }
}

// requirement: each element type
TYPED_TEST(HaloPlainTest, EqualsTheModelForAllElementTypes) {
  HaloForest<TypeParam> forest(77);
#define VLN_CHECK(type, name)                                                                                \
  expectAllPlainLayouts<TypeParam, type>(forest.tree(), 0, TypeParam::kMaxDepth, -1, -1);
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_CHECK)
}

// requirement: the same with the table of neighbours, and for any number of threads
TYPED_TEST(HaloPlainTest, ThreadsAndTablesChangeNothing) {
  HaloForest<TypeParam> forest(31, 30);
  auto& tree = forest.forest.tree();
  auto source = channelOn<Layout<TypeParam, float, 0, 0>>(tree, 3.0f);
  fillRandom(source, tree, 8);
  auto const result = [&](int threads) {
    auto target = channelOn<Layout<TypeParam, float, 0, 1>>(tree, 0.0f);
    withThreads(threads, [&] { computeHalo<TypeParam, float, 0, 0, 0, 1>(source, tree, target, -1, -1); });
    return allBytes(target, tree);
  };
  std::string const one = result(1);
  EXPECT_TRUE(one == result(2));
  EXPECT_TRUE(one == result(8));
  tree.precomputeTileNeighbors();
  EXPECT_TRUE(one == result(2));
}

// boundary: the same layout copies the core and nothing else
TYPED_TEST(HaloPlainTest, SameLayoutCopiesTheCore) {
  HaloForest<TypeParam> forest(4);
  auto source = channelOn<Layout<TypeParam, float, 0, 0>>(forest.tree(), 3.0f);
  fillRandom(source, forest.tree(), 8);
  auto target = channelOn<Layout<TypeParam, float, 0, 0>>(forest.tree(), 0.0f);
  computeHalo<TypeParam, float, 0, 0, 0, 0>(source, forest.tree(), target, -1, -1);
  EXPECT_TRUE(allBytes(source, forest.tree()) == allBytes(target, forest.tree()));
}

// boundary: the range of depths
TYPED_TEST(HaloPlainTest, DepthsAreLimitedToBothChannels) {
  Container<TypeParam> tree("", 1.0f);
  tree.tileAccessor().addTile(0, 0, 0, 2);
  for (int d = 3; d <= 6; ++d) tree.tileAccessor().addTile(0, 0, 0, d);
  auto source = channelOn<Layout<TypeParam, float, 0, 0>>(tree, 3.0f, 3, 6);
  auto target = channelOn<Layout<TypeParam, float, 0, 1>>(tree, 0.0f, 2, 5);
  auto const filled = [&](int first, int last) {
    Layout<TypeParam, float, 0, 1> copy(target);
    computeHalo<TypeParam, float, 0, 0, 0, 1>(source, tree, copy, first, last);
    std::string depths;
    for (int d = 2; d <= 5; ++d)
      if (std::as_const(copy).tileData(0, d)(0, 0, 0) == 3.0f) depths += std::to_string(d);
    return depths;
  };
  EXPECT_EQ(filled(-1, -1), "345");
  EXPECT_EQ(filled(0, 28), "345");
  EXPECT_EQ(filled(4, 4), "4");
  EXPECT_EQ(filled(5, 4), "");
  EXPECT_EQ(filled(-7, 3), "3");
  EXPECT_EQ(filled(6, -1), "");
}

// requirement: a target that shares its tiles with a copy leaves the copy alone
TYPED_TEST(HaloPlainTest, SeparatesASharedTarget) {
  HaloForest<TypeParam> forest(4);
  auto source = channelOn<Layout<TypeParam, float, 0, 0>>(forest.tree(), 3.0f);
  auto target = channelOn<Layout<TypeParam, float, 0, 1>>(forest.tree(), 1.0f);
  auto const copy = target;
  std::string const before = allBytes(copy, forest.tree());
  computeHalo<TypeParam, float, 0, 0, 0, 1>(source, forest.tree(), target, -1, -1);
  EXPECT_TRUE(before == allBytes(copy, forest.tree()));
  EXPECT_FALSE(before == allBytes(target, forest.tree()));
}

// requirement: a lone tile repeats its edge in mode 2 and takes the default value in any other
TYPED_TEST(HaloPlainTest, LoneTile) {
  Container<TypeParam> tree("", 1.0f);
  for (int const depth : {0, 5}) {
    TreeIndex const at = tree.tileAccessor().addTile(0, 0, 0, depth).treeIndex();
    auto source = channelOn<Layout<TypeParam, float, 0, 0>>(tree, -4.0f);
    fillRandom(source, tree, 8);
    HaloModel<TypeParam, decltype(source)> const model(tree, source);
    auto accessor = std::as_const(tree).tileAccessor();
    for (int mode = -1; mode <= 7; ++mode) {
      using Tile = TileData<float, TypeParam::kTDW, 1>;
      Tile dst(Tile::kSize, 99.0f), none;
      auto const& tile = std::as_const(tree).tile(at);
      setHaloTile<TypeParam, float, 0, 0, 0, 1>(tile, nullptr, source, dst, static_cast<HaloMode>(mode),
                                                accessor, none);
      constexpr int w = TypeParam::kTDW;
      forBox(-1, w, [&](int i, int j, int k) {
        bool const core = std::min({i, j, k}) >= 0 && std::max({i, j, k}) < w;
        auto const c = [&](int x) { return std::clamp(x, 0, w - 1); };
        float const expected =
            core || mode == 2 ? std::as_const(source).tileData(at)(c(i), c(j), c(k)) : -4.0f;
        ASSERT_EQ(dst(i, j, k), expected) << mode << ": " << i << ' ' << j << ' ' << k;
      });
    }
  }
}

// requirement: the layout that only the tile form has, with the parent's finished tile
TYPED_TEST(HaloPlainTest, WideTargetOfTheTileForm) {
  for (std::uint32_t seed = 1; seed <= 6; ++seed) {
    HaloForest<TypeParam> forest(seed);
    auto const& tree = forest.tree();
    auto source = channelOn<Layout<TypeParam, float, 0, 1>>(tree, -4.0f);
    fillRandom(source, tree, seed);
    using Tile = TileData<float, TypeParam::kTDW + 1, 1>;
    std::vector<std::vector<Tile>> tiles(TypeParam::kDepths);
    HaloModel<TypeParam, decltype(source)> const model(tree, source);
    auto accessor = tree.tileAccessor();
    forTiles(tree, 0, TypeParam::kMaxDepth, [&](auto const& tile) {
      auto& depth = tiles[static_cast<std::size_t>(tile.depth())];
      depth.emplace_back(Tile::kSize, 99.0f);
      Tile none;
      auto const* parent = tile.isRoot() ? nullptr : &tree.tile(tile.parentTreeIndex());
      Tile& parentTile = parent ? tiles[std::size_t(parent->depth())][std::size_t(parent->index())] : none;
      setHaloTile<TypeParam, float, 0, 1, 1, 1>(tile, parent, source, depth.back(), kHaloModeReplicate,
                                                accessor, parentTile);
      forBox(Tile::kMinCoord, Tile::kMaxCoord, [&](int i, int j, int k) {
        float const expected =
            model.plain(tile, i, j, k, kHaloModeReplicate, parent, &std::as_const(parentTile));
        ASSERT_EQ(std::as_const(depth.back())(i, j, k), expected)
            << seed << ": " << i << ' ' << j << ' ' << k;
      });
    });
  }
}

// requirement: elements that the definition does not name are never read
TYPED_TEST(HaloPlainTest, OnlyCoresAreRead) {
  HaloForest<TypeParam> forest(9, 30);
  auto const& tree = forest.tree();
  auto const poison = [&](auto& channel) {
    fillRandom(channel, tree, 3);
    forTiles(tree, 0, TypeParam::kMaxDepth, [&](auto const& tile) {
      auto data = channel.tileData(tile.treeIndex());
      using Data = decltype(data);
      forBox(Data::kMinCoord, Data::kMaxCoord, [&](int i, int j, int k) {
        if (std::min({i, j, k}) < 0 || std::max({i, j, k}) >= TypeParam::kTDW)
          data(i, j, k) = std::numeric_limits<float>::quiet_NaN();
      });
    });
  };
  float const nan = std::numeric_limits<float>::quiet_NaN();
  auto const expectNumbers = [&](auto const& channel) {
    forTiles(tree, 0, TypeParam::kMaxDepth, [&](auto const& tile) {
      for (float v : channel.tileData(tile.treeIndex())) ASSERT_EQ(v, v);
    });
  };
  auto withHalo = channelOn<Layout<TypeParam, float, 0, 1>>(tree, nan);
  auto wide = channelOn<Layout<TypeParam, float, 1, 0>>(tree, nan);
  poison(withHalo), poison(wide);
  auto a = channelOn<Layout<TypeParam, float, 1, 0>>(tree, nan), b = a;
  computeHalo<TypeParam, float, 0, 1, 1, 0>(withHalo, tree, a, -1, -1);
  computeHalo<TypeParam, float, 1, 0, 1, 0>(wide, tree, b, -1, -1);
  expectNumbers(a), expectNumbers(b);
}

// requirement: integers stay within the range of the corners that they are blended from
TYPED_TEST(HaloPlainTest, IntegersStayInRange) {
  HaloForest<TypeParam> forest(12, 30);
  auto const& tree = forest.tree();
  std::int64_t const high = std::numeric_limits<std::int64_t>::max(), low = high - 5;
  auto source = channelOn<Layout<TypeParam, std::int64_t, 0, 0>>(tree, low);
  std::mt19937 random(1);
  forTiles(tree, 0, TypeParam::kMaxDepth, [&](auto const& tile) {
    for (auto& v : source.tileData(tile.treeIndex())) v = low + std::int64_t(random() % 6);
  });
  auto target = channelOn<Layout<TypeParam, std::int64_t, 0, 1>>(tree, std::int64_t(0));
  computeHalo<TypeParam, std::int64_t, 0, 0, 0, 1>(source, tree, target, -1, -1);
  forTiles(tree, 0, TypeParam::kMaxDepth, [&](auto const& tile) {
    for (auto v : std::as_const(target).tileData(tile.treeIndex())) ASSERT_GE(v, low);
  });
}

// requirement: closed form. A linear field given at corner samples is exact beside the same depth and beside
// coarser tiles
TYPED_TEST(HaloPlainTest, LinearFieldIsExact) {
  using Traits = TypeParam;
  Container<Traits> tree("", 1.0f);
  constexpr int deep = Traits::kMaxDepth, w = Traits::kTDW;
  // Fine tiles in a coarse one with room round it, so that every region has a source or a coarse parent
  // whose own neighbours exist.
  int const cw = Traits::width(deep - 1), at = Traits::align(0, deep - 1);
  int const fw = Traits::width(deep);
  tree.tileAccessor().addTiles({at - cw, at - cw, at - cw}, {at + 2 * cw, at + 2 * cw, at + 2 * cw},
                               deep - 1);
  for (int n = 0; n < Traits::kTW; ++n) tree.tileAccessor().addTile(at + n * fw, at, at + n * fw, deep);
  auto const field = [](double x, double y, double z) { return 0.5 * x - 2 * y + 0.25 * z + 8; };
  auto source = channelOn<Layout<Traits, float, 0, 0>>(tree, 0.0f);
  forTiles(tree, 0, deep, [&](auto const& tile) {
    auto data = source.tileData(tile.treeIndex());
    forBox(0, w - 1, [&](int i, int j, int k) {
      int3 const p = tile.childDataTIJK(i, j, k);
      data(i, j, k) = static_cast<float>(field(p.x, p.y, p.z));
    });
  });
  auto target = channelOn<Layout<Traits, float, 0, 1>>(tree, 0.0f);
  computeHalo<Traits, float, 0, 0, 0, 1>(source, tree, target, -1, -1);
  double worst = 0;
  forTiles(tree, deep, deep, [&](auto const& tile) {
    auto const data = std::as_const(target).tileData(tile.treeIndex());
    forBox(-1, w, [&](int i, int j, int k) {
      worst = std::max(worst,
                       std::abs(double(data(i, j, k)) - field(tile.ti() + i, tile.tj() + j, tile.tk() + k)));
    });
  });
  // Fractions of the odd shape are not exact.
  EXPECT_LE(worst, Traits::kTW == 2 ? 0.0 : 1e-4);
}

} // namespace
} // namespace VLN::Test
