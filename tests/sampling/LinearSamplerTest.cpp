#include "sampling/SamplerVolume.h"
#include "support/Print.h"
#include "support/Shapes.h"

#include <cmath>
#include <cstring>
#include <limits>

namespace VLN::Test {
namespace {

template <class TraitsT> using Sampler = OpenSampler<TraitsT>;

float linearField(double x, double y, double z) {
  return static_cast<float>(0.5 * x - 0.25 * y + 0.125 * z + 3);
}
float wavyField(double x, double y, double z) {
  return static_cast<float>(std::sin(0.7 * x) + std::cos(0.4 * y + 1) * std::sin(0.3 * z));
}

template <class F> void forRandomPoints(std::uint32_t seed, int count, double low, double high, F const& f) {
  std::mt19937 random(seed);
  std::uniform_real_distribution<float> axis(static_cast<float>(low), static_cast<float>(high));
  for (int n = 0; n < count; ++n) {
    float const x = axis(random), y = axis(random), z = axis(random);
    f(float3{x, y, z});
  }
}
bool sameBits(float a, float b) { return std::memcmp(&a, &b, sizeof a) == 0; }

VLN_SHAPE_SUITE(LinearSamplerTest);

// requirement: the cached core channel gives what the wide channel gives, bit for bit, in any order, on trees
// of mixed depths
TYPED_TEST(LinearSamplerTest, CoreEqualsWide) {
  using Traits = TypeParam;
  int cached = 0;
  for (std::uint32_t seed = 1; seed <= 8; ++seed) {
    SamplerVolume<Traits> volume;
    int const from = Traits::kMaxDepth - 4;
    int3 const centre{seed % 2 ? 3 : -500, 7, seed % 3 ? 0 : 9000};
    volume.addRandom(seed, centre, 60, from);
    volume.fill(wavyField, -5.0f, seed % 4 ? 0 : from + 1,
                seed % 5 ? Traits::kMaxDepth : Traits::kMaxDepth - 1);
    Sampler<Traits> const wide(volume.tree, volume.topology, *volume.wide);
    Sampler<Traits> const core(volume.tree, volume.topology, *volume.core);
    double const reach = 2 * Traits::width(Traits::kMaxDepth - 2);
    int found = 0, bad = 0;
    auto const check = [&](float3 p) {
      p = p + float3{float(centre.x), float(centre.y), float(centre.z)};
      float3 g, h;
      float const a = wide.sample(p, kSamplerTileSpace), b = core.sample(p, kSamplerTileSpace);
      float const c = wide.sampleGradient(p, kSamplerTileSpace, &g),
                  d = core.sampleGradient(p, kSamplerTileSpace, &h);
      found += a != -5.0f;
      if (!sameBits(a, b) || !sameBits(a, c) || !sameBits(a, d) || !(g == h)) ++bad;
    };
    forRandomPoints(seed, 4000, -reach, reach, check);
    // Along rays, and over and over between two far places.
    for (int n = 0; n < 2000; ++n) check({float(-reach + n * reach / 1000), 0.3f, 1.7f});
    for (int n = 0; n < 100; ++n) check({n % 2 ? 3.9f : -7.1f, 3.95f, float(n) * 0.01f});
    EXPECT_EQ(bad, 0) << "seed " << seed;
    EXPECT_GT(found, 500) << "seed " << seed;
    cached += core.accessCount() > 0;
    EXPECT_EQ(wide.accessCount(), 0u);
  }
  EXPECT_EQ(cached, 8);
}

// requirement: closed form. A linear field at corner samples is exact across tiles of one depth, and across
// borders of coarser tiles, except beyond the outermost tiles
TYPED_TEST(LinearSamplerTest, LinearFieldIsExact) {
  using Traits = TypeParam;
  constexpr int deep = Traits::kMaxDepth;
  SamplerVolume<Traits> volume;
  int const top = deep - 2, w = Traits::width(top), at = Traits::align(0, top);
  // 2 x 2 x 2 of the coarsest; the middle is finer, in patches.
  volume.tree.tileAccessor().addTiles({at - w, at - w, at - w}, {at + w, at + w, at + w}, top);
  std::mt19937 random(5);
  for (int n = 0; n < 60; ++n) {
    auto const c = [&] { return at + static_cast<int>(random() % static_cast<unsigned>(w)) - w / 2; };
    volume.add({c(), c(), c()}, deep - static_cast<int>(random() % 2), top);
  }
  volume.fill(linearField);
  Sampler<Traits> const wide(volume.tree, volume.topology, *volume.wide);
  Sampler<Traits> const core(volume.tree, volume.topology, *volume.core);
  // The last sample of the coarsest tiles has no further neighbour.
  double const low = at - w, high = at + w - 2.0 * w / Traits::kTDW;
  double worst = 0, slope = 0;
  float const factor = Traits::kTW == 2 ? 1.0f : 2.0f; // of the odd shape's gradient
  forRandomPoints(9, 20000, low, high, [&](float3 const& p) {
    double const expected = linearField(p.x, p.y, p.z);
    for (auto const* sampler : {&wide, &core}) {
      float3 g;
      worst = std::max(worst, std::abs(double(sampler->sampleGradient(p, kSamplerTileSpace, &g)) - expected));
      worst = std::max(worst, std::abs(double(sampler->sample(p, kSamplerTileSpace)) - expected));
      slope = std::max({slope, std::abs(double(g.x) / factor - 0.5), std::abs(double(g.y) / factor + 0.25),
                        std::abs(double(g.z) / factor - 0.125)});
    }
  });
  EXPECT_LT(worst, Traits::kTW == 2 ? 2e-5 : 2e-4);
  EXPECT_LT(slope, 2e-5);
}

// requirement: the gradient is the derivative of the cell, in world space
TYPED_TEST(LinearSamplerTest, GradientAgainstDifferences) {
  using Traits = TypeParam;
  for (int type = 0; type < 8; ++type) {
    SamplerVolume<Traits> volume(static_cast<VoxelOffsetType>(type), 0.5f);
    volume.addRandom(3, {0, 0, 0}, 40, Traits::kMaxDepth - 2);
    volume.fill(wavyField, 0.0f);
    Sampler<Traits> const core(volume.tree, volume.topology, *volume.core);
    float const factor = Traits::kTW == 2 ? 1.0f : 2.0f;
    int compared = 0;
    VoxelSampler<Traits, float, float3> const places(volume.tree, volume.topology);
    forRandomPoints(7, 3000, -8, 8, [&](float3 const& p) {
      float3 g;
      core.sampleGradient(p, &g);
      float const h = 1.0f / 128;
      for (int a = 0; a < 3; ++a) {
        float3 low = p, high = p;
        low[a] -= h, high[a] += h;
        // Only where both lie in the same cell as p.
        TreeIndex t, t0, t1;
        int3 c, c0, c1;
        float3 w;
        if (!places.prepareToSample(p, kSamplerWorldSpace, t, c, w, 28, nullptr) ||
            !places.prepareToSample(low, kSamplerWorldSpace, t0, c0, w, 28, nullptr) ||
            !places.prepareToSample(high, kSamplerWorldSpace, t1, c1, w, 28, nullptr) || t != t0 || t != t1 ||
            c != c0 || c != c1)
          continue;
        ++compared;
        EXPECT_NEAR(g[a] / factor, (core.sample(high) - core.sample(low)) / (2 * h), 2e-4f)
            << "type " << type << " axis " << a << " at " << p;
      }
    });
    EXPECT_GT(compared, 1000);
  }
}

// requirement: with samples elsewhere than on corners, every cell of the tile edges goes through the cache,
// the others do not
TYPED_TEST(LinearSamplerTest, CachesAreUsedOnTheEdges) {
  using Traits = TypeParam;
  constexpr int D = Traits::kTDW, deep = Traits::kMaxDepth;
  for (int type = 0; type < 7; ++type) {
    SamplerVolume<Traits> volume(static_cast<VoxelOffsetType>(type));
    volume.add({0, 0, 0}, deep, deep - 1);
    volume.fill(wavyField, 0.0f);
    auto const at = std::as_const(volume.tree).tile(0, deep).treeIndex();
    for (int i = -1; i < D; ++i) {
      Sampler<Traits> const sampler(volume.tree, volume.topology, *volume.core);
      float const before = sampler.sample(at, {i, 1, 1}, {0.5f, 0.5f, 0.5f});
      EXPECT_EQ(sampler.accessCount(), 1u);
      // A cached cell does not see a change of the channel; one that is read in place does.
      volume.core->tileData(at).set(100.0f);
      bool const cached = i <= 0 || i == D - 1;
      EXPECT_EQ(sampler.sample(at, {i, 1, 1}, {0.5f, 0.5f, 0.5f}), cached ? before : 100.0f)
          << type << ' ' << i;
      volume.fill(wavyField, 0.0f);
    }
  }
}

// requirement: with corner samples a cell between tiles of one depth is read in place; a tile beside gaps is
// widened once it is asked for many of them, and not before
TYPED_TEST(LinearSamplerTest, CornerCellsBetweenTilesAreReadInPlace) {
  using Traits = TypeParam;
  constexpr int D = Traits::kTDW, deep = Traits::kMaxDepth;
  SamplerVolume<Traits> volume;
  volume.add({0, 0, 0}, deep, deep - 1);
  volume.add({Traits::width(deep), 0, 0}, deep, deep - 1);
  volume.fill(wavyField, 0.0f);
  TreeIndex const at = std::as_const(volume.tree).tileAccessor().treeIndex(0, 0, 0, deep, true);
  Sampler<Traits> const sampler(volume.tree, volume.topology, *volume.core);
  auto const value = [&](int3 const& cell) { return sampler.sample(at, cell, {0.5f, 0.5f, 0.5f}); };
  auto const setAll = [&](float v) {
    for (int d : {deep - 1, deep})
      for (std::int64_t n = 0; n < volume.tree.tileCount(d); ++n) volume.core->tileData(n, d).set(v);
  };
  float last = 0;
  for (int n = 0; n < 40; ++n) {
    setAll(last = 1.0f + float(n));
    EXPECT_EQ(value({D - 1, 1, 1}), last) << "between two tiles";
  }
  int changes = 0, seen = 0;
  for (; changes < 40; ++changes) {
    setAll(last = 100.0f + float(changes));
    if (value({1, D - 1, 1}) != last) break;
    seen = changes;
  }
  EXPECT_GT(seen, 2) << "read in place at first";
  EXPECT_LT(changes, 40) << "widened in the end";
}

// boundary: a tile whose data were cleared is as one that is not there
TYPED_TEST(LinearSamplerTest, ClearedTilesBesideACellAreGaps) {
  using Traits = TypeParam;
  constexpr int D = Traits::kTDW, deep = Traits::kMaxDepth;
  float expected[3][3][3];
  for (bool const cleared : {false, true}) {
    SamplerVolume<Traits> volume;
    volume.add({0, 0, 0}, deep, deep - 1);
    if (cleared)
      for (int n = 1; n < 8; ++n) {
        int const w = Traits::width(deep);
        volume.add({n & 1 ? w : 0, n & 2 ? w : 0, n & 4 ? w : 0}, deep, deep - 1);
      }
    volume.fill(wavyField, 0.0f);
    auto const accessor = std::as_const(volume.tree).tileAccessor();
    TreeIndex const at = accessor.treeIndex(0, 0, 0, deep, true);
    for (std::int64_t n = 0; n < volume.tree.tileCount(deep); ++n)
      if (n != at.index) volume.core->tileDataAccessor().tileData(TreeIndex{n, deep}).clear();
    Sampler<Traits> const sampler(volume.tree, volume.topology, *volume.core);
    for (int c = 0; c < 27; ++c) {
      int3 const cell{c % 3 + D - 3, c / 3 % 3 + D - 3, c / 9 + D - 3};
      float& value = expected[c % 3][c / 3 % 3][c / 9];
      float const got = sampler.sample(at, cell, {0.25f, 0.5f, 0.75f});
      if (cleared)
        EXPECT_EQ(got, value) << c;
      else
        value = got;
    }
  }
}

// requirement: a sampler that has made tables of its channel gives what a new one gives, bit for bit, for
// every offset type, one by one and many at once; so do its copies
TYPED_TEST(LinearSamplerTest, TablesAndPortionsChangeNothing) {
  using Traits = TypeParam;
  float const nan = std::numeric_limits<float>::quiet_NaN(), inf = std::numeric_limits<float>::infinity();
  for (int type = 0; type < 8; ++type) {
    SamplerVolume<Traits> volume(static_cast<VoxelOffsetType>(type), 0.5f);
    int3 const centre{type % 2 ? 3 : -700, 7, 0};
    volume.addRandom(20 + static_cast<std::uint32_t>(type), centre, 80, Traits::kMaxDepth - 3);
    volume.fill(wavyField, -5.0f);
    double const reach = 2 * Traits::width(Traits::kMaxDepth - 2);
    float3 const c{float(centre.x), float(centre.y), float(centre.z)};
    auto const check = [&](auto const& channel, char const* name) {
      SCOPED_TRACE(name + std::string(" channel, type ") + std::to_string(type));
      Sampler<Traits> const used(volume.tree, volume.topology, channel);
      forRandomPoints(3, 30000, -reach, reach, [&](float3 p) { used.sample(p + c, kSamplerTileSpace); });
      Sampler<Traits> const copy(used);
      std::vector<float3> positions;
      forRandomPoints(4, 1000, -reach, reach, [&](float3 p) { positions.push_back((p + c) * 0.5f); });
      for (float3 const& bad : {float3{nan, 0, 0}, float3{0, inf, 0}, float3{0, 0, -inf}, float3{3e9f, 0, 0}})
        positions.insert(positions.begin() + 37, bad);
      std::vector<float> values(positions.size()), gradientValues(positions.size());
      std::vector<float3> gradients(positions.size());
      for (Sampler<Traits> const* sampler : {&used, &copy}) {
        for (int depth : {Traits::kMaxDepth, Traits::kMaxDepth + 1, Traits::kMaxDepth - 1}) {
          auto const n = static_cast<std::int64_t>(positions.size());
          sampler->sample(positions.data(), values.data(), n, depth);
          sampler->sampleGradient(positions.data(), gradientValues.data(), gradients.data(), n, depth);
          int bad = 0;
          for (std::size_t i = 0; i < positions.size(); ++i) {
            Sampler<Traits> const fresh(volume.tree, volume.topology, channel);
            float3 wanted, single;
            float const value = fresh.sampleGradient(positions[i], depth, &wanted);
            bad += !sameBits(value, values[i]) || !sameBits(value, gradientValues[i]) ||
                   !(wanted == gradients[i]) || !sameBits(value, sampler->sample(positions[i], depth)) ||
                   !sameBits(value, sampler->sampleGradient(positions[i], depth, &single)) ||
                   !(single == wanted);
          }
          EXPECT_EQ(bad, 0) << depth;
        }
      }
    };
    check(*volume.core, "core");
    check(*volume.wide, "wide");
  }
}

// requirement: values that are changed in place are seen; so are those of a channel whose storage is
// another's since
TYPED_TEST(LinearSamplerTest, TablesReadWhereTheValuesAre) {
  using Traits = TypeParam;
  SamplerVolume<Traits> volume;
  volume.addRandom(5, {0, 0, 0}, 60, Traits::kMaxDepth - 2);
  volume.fill(wavyField, 0.0f);
  Sampler<Traits> const sampler(volume.tree, volume.topology, *volume.wide);
  forRandomPoints(3, 30000, -20, 20, [&](float3 p) { sampler.sample(p, kSamplerTileSpace); });
  auto const& tile = std::as_const(volume.tree).tile(0, Traits::kMaxDepth);
  float3 const inside{float(tile.ti()) + 1.5f, float(tile.tj()) + 1.5f, float(tile.tk()) + 1.5f};
  volume.wide->tileData(tile.treeIndex()).set(7.0f);
  EXPECT_EQ(sampler.sample(inside, kSamplerTileSpace), 7.0f);
  auto const copy = *volume.wide; // shares the values until one of them has its own
  volume.wide->cloneData();
  volume.wide->tileData(tile.treeIndex()).set(8.0f);
  EXPECT_EQ(sampler.sample(inside, kSamplerTileSpace), 8.0f);
}

// requirement: cold copies; the clock; a second query of a tile does not move the last use
TYPED_TEST(LinearSamplerTest, CachesRememberTheirUse) {
  using Traits = TypeParam;
  constexpr int D = Traits::kTDW, deep = Traits::kMaxDepth;
  SamplerVolume<Traits> volume;
  volume.add({0, 0, 0}, deep, deep - 1);
  volume.add({1000, 0, 0}, deep, deep - 1);
  volume.fill(wavyField, 0.0f);
  Sampler<Traits> sampler(volume.tree, volume.topology, *volume.core);
  using Entry = typename Sampler<Traits>::template CacheEntry<typename Sampler<Traits>::OneSidedTile>;
  std::vector<Entry> cache(Traits::kDepths);
  auto const edge = [&](std::int64_t tile) { return sampler.sample({tile, deep}, {D - 1, 0, 0}, {0, 0, 0}); };
  edge(0);
  edge(0);
  EXPECT_EQ(sampler.accessCount(), 2u);
  // An own cache of the same form shows what updateCache() does.
  Sampler<Traits> other(volume.tree, volume.topology, *volume.core);
  for (int n = 0; n < 3; ++n) other.sample({0, deep}, {0, 0, 0}, {0, 0, 0});
  auto& first = other.updateCache(0, deep, cache);
  EXPECT_EQ(first.tile, 0);
  EXPECT_EQ(first.lastUse, 3u);
  EXPECT_EQ(&first, &cache[deep]);
  EXPECT_EQ(cache[deep - 1].tile, 0); // the parent is warm
  EXPECT_EQ(cache[deep - 1].lastUse, 3u);
  other.sample({0, deep}, {0, 0, 0}, {0, 0, 0});
  EXPECT_EQ(other.updateCache(0, deep, cache).lastUse, 3u); // found as the last tile
  EXPECT_EQ(&other.updateCache(1, deep, cache), &first);    // one entry a depth: displaced
  EXPECT_EQ(first.tile, 1);
  EXPECT_EQ(first.lastUse, 4u);
  Sampler<Traits> copy(other);
  EXPECT_EQ(copy.accessCount(), 0u);
  copy.sample({0, deep}, {0, 0, 0}, {0, 0, 0});
  EXPECT_EQ(copy.updateCache(1, deep, cache).lastUse, 1u); // not the last tile of the copy, found by its key
  copy = other;
  EXPECT_EQ(copy.accessCount(), 0u);
  EXPECT_TRUE(copy.is_initialized());
  EXPECT_EQ(kCacheSizeCoarserLevels, 1);
}

// requirement: findTile is exact
TYPED_TEST(LinearSamplerTest, FindTile) {
  using Traits = TypeParam;
  constexpr int deep = Traits::kMaxDepth;
  SamplerVolume<Traits> volume;
  volume.add({0, 0, 0}, deep, deep - 2);
  volume.fill(wavyField, 0.0f, deep - 1, deep);
  Sampler<Traits> const sampler(volume.tree, volume.topology, *volume.core);
  EXPECT_EQ(sampler.findTile(0, 0, 0, deep).data(), std::as_const(*volume.core).tileData(0, deep).data());
  EXPECT_EQ(sampler.findTile(0, 0, 0, deep).data(), std::as_const(*volume.core).tileData(0, deep).data());
  EXPECT_TRUE(sampler.findTile(0, 0, 0, deep - 1));
  EXPECT_FALSE(sampler.findTile(0, 0, 0, deep - 2)); // above the channel's depths
  EXPECT_FALSE(sampler.findTile(0, 0, 0, deep - 3));
  EXPECT_FALSE(sampler.findTile(1 << 20, 0, 0, deep));
}

// requirement: depths and places out of reach
TYPED_TEST(LinearSamplerTest, DepthsAndPlaces) {
  using Traits = TypeParam;
  constexpr int deep = Traits::kMaxDepth;
  SamplerVolume<Traits> volume;
  volume.add({0, 0, 0}, deep, deep - 3);
  volume.fill(wavyField, -5.0f, deep - 2, deep - 1);
  for (int which = 0; which < 2; ++which) {
    Sampler<Traits> const sampler = which ? Sampler<Traits>(volume.tree, volume.topology, *volume.core)
                                          : Sampler<Traits>(volume.tree, volume.topology, *volume.wide);
    auto const& tile = std::as_const(volume.tree).tile(0, deep - 1);
    float3 const p{float(tile.ti()), float(tile.tj()), float(tile.tk())};
    float const expected = std::as_const(*volume.core).tileData(0, deep - 1)(0, 0, 0);
    for (int depth : {deep - 1, deep, 28, 1000}) EXPECT_EQ(sampler.sample(p, depth), expected);
    EXPECT_NE(sampler.sample(p, deep - 2), -5.0f);
    float const nan = std::numeric_limits<float>::quiet_NaN();
    float3 const away[] = {{nan, 0, 0}, {0, 1e30f, 0}, {1e6f, 0, 0}, {0, 0, -INFINITY}};
    for (float3 const& q : away) {
      float3 g{7, 7, 7};
      EXPECT_EQ(sampler.sample(q), -5.0f);
      EXPECT_EQ(sampler.sampleGradient(q, &g), -5.0f);
      EXPECT_EQ(g, (float3{0, 0, 0}));
    }
    for (int depth : {deep - 3, 0, -1, -100}) {
      float3 g{7, 7, 7};
      EXPECT_EQ(sampler.sample(p, depth), -5.0f) << depth;
      EXPECT_EQ(sampler.sampleGradient(p, depth, &g), -5.0f);
      EXPECT_EQ(g, (float3{0, 0, 0}));
    }
    EXPECT_EQ(sampler.sample(TreeIndex{}, {0, 0, 0}, {0, 0, 0}), -5.0f);
    EXPECT_EQ(sampler.sample(TreeIndex{0, deep - 3}, {0, 0, 0}, {0, 0, 0}), -5.0f);
  }
}

// requirement: what exists and does nothing yet
TYPED_TEST(LinearSamplerTest, NamesAndPlaceholders) {
  using Traits = TypeParam;
  Sampler<Traits> const none;
  EXPECT_FALSE(none.is_initialized());
  SamplerVolume<Traits> volume;
  volume.add({0, 0, 0}, 5, 5);
  volume.fill([](double, double, double) { return 6.0f; });
  Sampler<Traits> const sampler(volume.tree, volume.topology, *volume.wide);
  EXPECT_TRUE(sampler.is_initialized());
  EXPECT_STREQ(sampler.idString(), "kLinear");
  VoxelSampler<Traits, float, float3> const plain(volume.tree, volume.topology);
  EXPECT_STREQ(plain.idString(), "kNone");
  auto const voxel = *volume.tree.cbegin();
  EXPECT_EQ(sampler.sample(voxel, int3{0, 0, 0}), 0.0f);
  EXPECT_EQ(sampler.sample(voxel, 1, 1, 1), 0.0f);
  EXPECT_EQ(sampler.begin(voxel, int3{0, 0, 0}).position, 0);
  EXPECT_EQ(sampler.begin(voxel, 0, 0, 0), sampler.end(voxel, 0, 0, 0));
  EXPECT_EQ(sizeof(typename Sampler<Traits>::ConstIterator), 4u);
  Sampler<Traits> const copy(none);
  EXPECT_FALSE(copy.is_initialized());
}

// boundary: on a wide channel with an offset, positions below the first sample extrapolate from the first
// cell
// regression: prepareToSample() finds tiles that the channel does not reach
TYPED_TEST(LinearSamplerTest, TilesDeeperThanTheChannelStandForTheirPlace) {
  using Traits = TypeParam;
  constexpr int kDeep = Traits::kMaxDepth;
  for (VoxelOffsetType const type : {kVoxelOffsetCorner, kVoxelOffsetCenter}) {
    SamplerVolume<Traits> volume(type, 0.5f);
    volume.addRandom(7, {0, 0, 0}, 60, kDeep - 4);
    volume.fill([](double x, double y, double z) { return float(x + 2 * y - z); }, 3.5f, 0, kDeep - 2);
    Sampler<Traits> const core(volume.tree, volume.topology, *volume.core);
    Sampler<Traits> const wide(volume.tree, volume.topology, *volume.wide);
    std::mt19937 random(11);
    int deeper = 0;
    for (int d = kDeep - 4; d <= kDeep; ++d)
      for (std::int64_t n = 0; n < volume.tree.tileCount(d); ++n) {
        auto const& there = std::as_const(volume.tree).tile(n, d);
        auto const c = [&](int corner) {
          return 0.5f * (float(corner) + float(random() % 1000u) * 0.001f * float(Traits::width(d)));
        };
        float3 const p{c(there.ti()), c(there.tj()), c(there.tk())};
        TreeIndex tile;
        int3 ijk{};
        float3 weights{};
        if (!core.prepareToSample(p, kSamplerWorldSpace, tile, ijk, weights, kDeep, nullptr)) continue;
        deeper += tile.depth > kDeep - 2 ? 1 : 0;
        EXPECT_NEAR(core.sample(tile, ijk, weights), core.sample(p), 1e-2f) << n;
        EXPECT_NEAR(wide.sample(tile, ijk, weights), wide.sample(p), 1e-2f) << n;
      }
    EXPECT_GT(deeper, 10);
    EXPECT_EQ(core.sample(TreeIndex{1 << 30, kDeep}, {0, 0, 0}, {0, 0, 0}), 3.5f);
    EXPECT_EQ(core.sample(TreeIndex{0, kDeep + 1}, {0, 0, 0}, {0, 0, 0}), 3.5f);
  }
}

TYPED_TEST(LinearSamplerTest, WideBelowTheFirstSample) {
  using Traits = TypeParam;
  constexpr int deep = Traits::kMaxDepth;
  SamplerVolume<Traits> volume(kVoxelOffsetCenter);
  volume.add({0, 0, 0}, deep, deep);
  volume.fill(linearField);
  Sampler<Traits> const sampler(volume.tree, volume.topology, *volume.wide);
  auto const& tile = std::as_const(volume.tree).tile(0, deep);
  float3 const p{float(tile.ti()) + 0.25f, float(tile.tj()) + 0.125f, float(tile.tk()) + 1.0f};
  float3 g;
  EXPECT_NEAR(sampler.sample(p), linearField(p.x, p.y, p.z), 1e-5f);
  EXPECT_NEAR(sampler.sampleGradient(p, &g), linearField(p.x, p.y, p.z), 1e-5f);
  EXPECT_NEAR(g.x, Traits::kTW == 2 ? 0.5f : 1.0f, 1e-5f);
}

} // namespace
} // namespace VLN::Test
