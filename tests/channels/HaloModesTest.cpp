// The forms with modes and masks: computeHalo() and setHaloTile() by index.
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"
#include "channels/HaloModel.h"
#include "support/Shapes.h"

#include <sstream>

namespace VLN::Test {
namespace {

// Elements of a tile before anything is filled: bytes that no fill would leave.
template <class Tile> Tile planted(std::uint32_t seed) {
  Tile tile(Tile::kSize);
  std::mt19937 random(seed);
  for (auto& v : tile) {
    auto* const bytes = reinterpret_cast<unsigned char*>(&v);
    for (std::size_t n = 0; n < sizeof v; ++n) bytes[n] = static_cast<unsigned char>(random());
  }
  return tile;
}

template <class Source, class Tile, class Model, class TileType>
void expectTile(Tile const& data, Tile const& before, Model const& model, TileType const& tile,
                typename Model::Request const& request, std::string const& label) {
  int bad = 0;
  forBox(Tile::kMinCoord, Tile::kMaxCoord, [&](int i, int j, int k) {
    auto const own = [&](int a, int b, int c) { return data(a, b, c); };
    auto const expected = model.moded(tile, i, j, k, request, own).value_or(before(i, j, k));
    if (sameBytes(expected, data(i, j, k)) || ++bad > 1) return;
    ADD_FAILURE() << label << ", mode " << request.mode << ", type " << request.type << ", offset type "
                  << request.offsetType << ": tile " << tile.index() << " of depth " << tile.depth()
                  << ", element " << i << ' ' << j << ' ' << k;
  });
}

template <class Model, class Random> typename Model::Request anyRequest(int mode, Random& random) {
  int const types[] = {7, 1, 2, 4, 3, 5, 0};
  int type = types[random() % 7];
  if (random() % 3 == 0) type |= static_cast<int>((random() % (1 << 26)) << 3) & ~haloSkip(kNeighborSelf);
  return {static_cast<HaloMode>(mode), static_cast<HaloType>(type), random() % 2 ? 3.5f : -1e9f,
          random() % 2 ? 1.0f : 0.5f, static_cast<VoxelOffsetType>(random() % 8)};
}

// One index form, on every tile of the tree, also those out of the source's range.
template <class TraitsT, class T, int h1, int h2, int e1, int e2>
void expectIndexModel(Container<TraitsT> const& tree, int minDepth, int maxDepth, std::uint32_t seed) {
  using Source = Channel<TraitsT, T, TraitsT::kTDW + e1, h1>;
  using Tile = TileData<T, TraitsT::kTDW + e2, h2>;
  auto source = channelOn<Source>(tree, value<T>(7), minDepth, maxDepth);
  fillRandom(source, tree, seed);
  HaloModel<TraitsT, Source> const model(tree, source);
  using Model = HaloModel<TraitsT, Source>;
  auto accessor = tree.tileAccessor();
  std::mt19937 random(seed);
  std::ostringstream label;
  label << "layouts " << h1 << h2 << e1 << e2 << ", source depths " << minDepth << ".." << maxDepth;
  forTiles(tree, 0, TraitsT::kMaxDepth, [&](auto const& tile) {
    int const mode = static_cast<int>(random() % 8) - 1;
    auto const request = anyRequest<Model>(mode, random);
    Tile const before = planted<Tile>(seed);
    Tile data(before);
    setHaloTile<TraitsT, T, h1, h2, e1, e2>(tile.treeIndex(), source, request.mode, request.type, accessor,
                                            data, request.constant, request.scale, request.offsetType);
    expectTile<Source>(std::as_const(data), before, model, tile, request, label.str());
  });
}

template <class TraitsT, class T>
void expectAllIndexLayouts(Container<TraitsT> const& tree, int low, int high, std::uint32_t seed) {
  expectIndexModel<TraitsT, T, 0, 0, 0, 1>(tree, low, high, seed);
  expectIndexModel<TraitsT, T, 0, 0, 1, 1>(tree, low, high, seed);
  expectIndexModel<TraitsT, T, 0, 1, 0, 0>(tree, low, high, seed);
  expectIndexModel<TraitsT, T, 0, 1, 0, 1>(tree, low, high, seed);
  expectIndexModel<TraitsT, T, 0, 1, 1, 0>(tree, low, high, seed);
  expectIndexModel<TraitsT, T, 0, 1, 1, 1>(tree, low, high, seed);
  expectIndexModel<TraitsT, T, 0, 2, 0, 0>(tree, low, high, seed);
  expectIndexModel<TraitsT, T, 1, 1, 0, 0>(tree, low, high, seed);
}

template <class TraitsT, class T, int h1, int h2>
void expectModeModel(Container<TraitsT> const& tree, int low, int high, int mode, std::uint32_t seed) {
  using Source = Channel<TraitsT, T, TraitsT::kTDW, h1>;
  using Target = Channel<TraitsT, T, TraitsT::kTDW, h2>;
  auto source = channelOn<Source>(tree, value<T>(7), low, high);
  fillRandom(source, tree, seed);
  auto before = channelOn<Target>(tree, value<T>(3));
  fillRandom(before, tree, seed + 1);
  HaloModel<TraitsT, Source> const model(tree, source);
  std::mt19937 random(seed);
  auto const request = anyRequest<HaloModel<TraitsT, Source>>(mode, random);
  auto const run = [&](int threads) {
    Target target(before);
    withThreads(threads, [&] {
      computeHalo<TraitsT, T, TraitsT::kTDW, h1, h2>(request.mode, request.type, -1, -1, source, tree, target,
                                                     request.scale, request.offsetType, request.constant);
    });
    return target;
  };
  Target const one = run(1), two = run(2), eight = run(8);
  forTiles(tree, 0, TraitsT::kMaxDepth, [&](auto const& tile) {
    auto const data = one.tileData(tile.treeIndex()), old = std::as_const(before).tileData(tile.treeIndex());
    EXPECT_TRUE(bytesOf(*data.data()) == bytesOf(*two.tileData(tile.treeIndex()).data()));
    EXPECT_TRUE(bytesOf(*data.data()) == bytesOf(*eight.tileData(tile.treeIndex()).data()));
    if (tile.depth() < low || tile.depth() > high)
      EXPECT_TRUE(bytesOf(*data.data()) == bytesOf(*old.data()));
    else
      expectTile<Source>(data, old, model, tile, request, "computeHalo " + std::to_string(h2));
  });
}

VLN_SHAPE_SUITE(HaloModesTest);

// requirement: all layouts, modes and masks against one element at a time; tiles above and below the source's
// depths too
TYPED_TEST(HaloModesTest, IndexFormEqualsTheModel) {
  for (std::uint32_t seed = 1; seed <= 15; ++seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    HaloForest<TypeParam> forest(seed, 8);
    int const low = seed % 3 == 0 ? 0 : forest.forest.pick(forest.forest.minDepth(), TypeParam::kMaxDepth);
    int const high = seed % 4 == 0 ? TypeParam::kMaxDepth : forest.forest.pick(low, TypeParam::kMaxDepth);
    expectAllIndexLayouts<TypeParam, float>(forest.tree(), low, high, seed);
  }
}

// requirement: each element type
TYPED_TEST(HaloModesTest, IndexFormForAllElementTypes) {
  HaloForest<TypeParam> forest(5, 10);
  int const high = std::max(forest.forest.minDepth(), TypeParam::kMaxDepth - 2);
#define VLN_CHECK(type, name) expectAllIndexLayouts<TypeParam, type>(forest.tree(), 0, high, 3);
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_CHECK)
}

// requirement: the pass over a channel, at 1, 2 and 8 threads
TYPED_TEST(HaloModesTest, PassEqualsTheModel) {
  for (std::uint32_t seed = 1; seed <= 4; ++seed) {
    HaloForest<TypeParam> forest(seed, 10);
    int const low = forest.forest.pick(0, TypeParam::kMaxDepth);
    for (int mode = -1; mode <= kHaloModeCount; ++mode) {
      SCOPED_TRACE("seed " + std::to_string(seed) + ", mode " + std::to_string(mode));
      int const from = seed % 2 ? 0 : low;
      expectModeModel<TypeParam, float, 0, 1>(forest.tree(), from, TypeParam::kMaxDepth, mode, seed);
      expectModeModel<TypeParam, float, 0, 2>(forest.tree(), from, TypeParam::kMaxDepth, mode, seed + 7);
      expectModeModel<TypeParam, unsigned char, 1, 1>(forest.tree(), from, TypeParam::kMaxDepth, mode, seed);
    }
  }
}

// A tile of depth 5, and the elements of its target in a form with one layer of halo.
template <class TraitsT> struct OneTile {
  using Source = Channel<TraitsT, float, TraitsT::kTDW, 0>;
  using Data = TileData<float, TraitsT::kTDW, 1>;

  OneTile() {
    at = tree.tileAccessor().addTile(0, 0, 0, 5).treeIndex();
    int3 const corner = std::as_const(tree).tile(at).tijk();
    tree.tileAccessor().addTile(corner.x + TraitsT::width(5), corner.y, corner.z, 5);
  }
  Data fill(Source const& source, int mode, int type, float constant = 0, float scale = 1) {
    Data data(Data::kSize, 99.0f);
    auto accessor = std::as_const(tree).tileAccessor();
    setHaloTile<TraitsT, float, 0, 1, 0, 0>(at, source, static_cast<HaloMode>(mode),
                                            static_cast<HaloType>(type), accessor, data, constant, scale,
                                            kVoxelOffsetCorner);
    return data;
  }

  Container<TraitsT> tree{"", 1.0f};
  TreeIndex at;
};

// requirement: what the bits leave alone
TYPED_TEST(HaloModesTest, MasksLeaveRegionsAlone) {
  constexpr int w = TypeParam::kTDW;
  OneTile<TypeParam> one;
  auto const source = channelOn<typename OneTile<TypeParam>::Source>(one.tree, 1.0f);
  auto const count = [&](int type) {
    int untouched = 0;
    for (float v : one.fill(source, kHaloModeDefault, type)) untouched += v == 99.0f;
    return untouched;
  };
  int const all = (w + 2) * (w + 2) * (w + 2), core = w * w * w, face = w * w;
  EXPECT_EQ(count(7), 0);
  EXPECT_EQ(count(kHaloCore), all - core);
  EXPECT_EQ(count(kHaloFaces), all - 6 * face);
  EXPECT_EQ(count(kHaloEdges), core + 6 * face);
  EXPECT_EQ(count(0), all);
  EXPECT_EQ(count(7 | 1 << 25), face); // +i
  auto const without = one.fill(source, kHaloModeDefault, 7 | 1 << 25);
  EXPECT_EQ(without(w, 1, 2), 99.0f);
  EXPECT_EQ(without(-1, 1, 2), 1.0f);
  EXPECT_EQ(one.fill(source, kHaloModeDefault, 7 | 1 << 19)(1, w, 2), 99.0f); // +j
  EXPECT_EQ(haloSkip(neighborDirection(1, 0, 0)), 1 << 25);
}

// boundary: a number that is no mode fills nothing, the core neither
TYPED_TEST(HaloModesTest, UnknownModesFillNothing) {
  OneTile<TypeParam> one;
  auto const source = channelOn<typename OneTile<TypeParam>::Source>(one.tree, 1.0f);
  for (int const mode : {-1, int(kHaloModeCount), kHaloModeCount + 1, 1 << 30})
    for (float v : one.fill(source, mode, 7)) ASSERT_EQ(v, 99.0f);
}

// boundary: the constant goes into every component, limited to what the type holds
TYPED_TEST(HaloModesTest, ConstantIsBroadcast) {
  using Traits = TypeParam;
  Container<Traits> tree("", 1.0f);
  auto const parent = tree.tileAccessor().addTile(0, 0, 0, 4).treeIndex();
  auto const at = tree.tileAccessor().addTile(std::as_const(tree).tile(parent).tijk(), 5).treeIndex();
  auto const check = [&](auto zero, float constant, auto expected) {
    using T = decltype(zero);
    auto const source = channelOn<Channel<Traits, T, Traits::kTDW, 0>>(tree, zero);
    TileData<T, Traits::kTDW, 1> data(TileData<T, Traits::kTDW, 1>::kSize, zero);
    auto accessor = std::as_const(tree).tileAccessor();
    setHaloTile<Traits, T, 0, 1, 0, 0>(at, source, kHaloModeConstant, kHaloAll, accessor, data, constant,
                                       2.0f, kVoxelOffsetCenter);
    // The far side lies in the parent: coarser, so the constant. The near side lies out of it: the default.
    EXPECT_TRUE(sameBytes(data(Traits::kTDW, 0, 0), static_cast<T>(expected)));
    EXPECT_TRUE(sameBytes(data(-1, 0, 0), zero));
  };
  check(Velorn::Math::float3{0, 0, 0}, 2.5f, Velorn::Math::float3{2.5f, 2.5f, 2.5f});
  check(static_cast<unsigned char>(0), 1000.0f, static_cast<unsigned char>(255));
  check(static_cast<unsigned char>(0), -3.0f, static_cast<unsigned char>(0));
  check(std::int64_t(0), 1e30f, std::numeric_limits<std::int64_t>::max());
  check(int(0), -2.75f, int(-2));
}

// requirement: a scale of exactly 1 multiplies nothing, also not a value that a product would change
TYPED_TEST(HaloModesTest, ScaleOfOneMultipliesNothing) {
  using Traits = TypeParam;
  Container<Traits> tree("", 1.0f);
  tree.tileAccessor().addTile(0, 0, 0, 4);
  int3 const corner = std::as_const(tree).tile(0, 4).tijk();
  auto const at = tree.tileAccessor().addTile(corner, 5).treeIndex();
  std::int64_t const odd = (std::int64_t(1) << 53) + 1; // not in double
  auto const source = channelOn<Channel<Traits, std::int64_t, Traits::kTDW, 0>>(tree, odd, 0, 4);
  auto const core = [&](float scale) {
    TileData<std::int64_t, Traits::kTDW, 1> data(TileData<std::int64_t, Traits::kTDW, 1>::kSize, 0);
    auto accessor = std::as_const(tree).tileAccessor();
    setHaloTile<Traits, std::int64_t, 0, 1, 0, 0>(at, source, kHaloModeLinearCoarse, kHaloCore, accessor,
                                                  data, 0.0f, scale, kVoxelOffsetCorner);
    return data(1, 1, 1);
  };
  EXPECT_EQ(core(1.0f), odd);
  EXPECT_EQ(core(2.0f), std::int64_t(1) << 54);
}

// boundary: at depth 0 there is nothing beside or above a tile
TYPED_TEST(HaloModesTest, WholeDomain) {
  using Traits = TypeParam;
  Container<Traits> tree("", 1.0f);
  auto const at = tree.tileAccessor().addTile(0, 0, 0, 0).treeIndex();
  using Source = Channel<Traits, float, Traits::kTDW, 0>;
  auto source = channelOn<Source>(tree, 5.0f);
  fillRandom(source, tree, 2);
  auto accessor = std::as_const(tree).tileAccessor();
  for (int mode = 0; mode < kHaloModeCount; ++mode) {
    using Data = TileData<float, Traits::kTDW, 2>;
    Data data(Data::kSize, 99.0f);
    setHaloTile<Traits, float, 0, 2, 0, 0>(at, source, static_cast<HaloMode>(mode), kHaloAll, accessor, data,
                                           1.0f, 1.0f, kVoxelOffsetCorner);
    forBox(Data::kMinCoord, Data::kMaxCoord, [&](int i, int j, int k) {
      bool const core = std::min({i, j, k}) >= 0 && std::max({i, j, k}) < Traits::kTDW;
      ASSERT_EQ(data(i, j, k), core ? std::as_const(source).tileData(at)(i, j, k) : 5.0f);
    });
  }
}

} // namespace
} // namespace VLN::Test
