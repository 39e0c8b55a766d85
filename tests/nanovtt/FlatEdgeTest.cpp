// Small volumes made for one rule each.
#include "FlatChecks.h"
#include "GeometryVolume/pools/ChannelPool.h"
#include "support/CaptureStream.h"

#include <gtest/gtest.h>

namespace {

using namespace Support;
using nanovtt::AlignedHostBuffer;

FlatModel read(nanovtt::GridHandle<AlignedHostBuffer> const& handle) {
  return FlatModel(handle.data(), handle.size());
}

/// Tiles in a row along x, all below one coarse tile.
FlatVolume row(int count, int depth) {
  FlatVolume volume;
  for (int n = 0; n < count; ++n) volume.add({n * FlatTraits::width(depth), 0, 0}, depth - 8, depth);
  volume.finish();
  return volume;
}

TEST(FlatRoots, BoundarySixtyFourTilesFitAndSixtyFiveGoOneDepthUp) {
  FlatOptions options;
  options.rootLevelLimit = 8;
  for (auto const& [count, depth] :
       {std::pair{64, 20}, std::pair{65, 19}, std::pair{1, 20}, std::pair{129, 18}}) {
    auto const volume = row(count, 20);
    auto const handle = flatten(*volume.object, options);
    EXPECT_EQ(read(handle).rootDepth, depth) << count;
    expectFlat(volume, options, handle, std::to_string(count) + " tiles");
  }
}

/// One branch from depth 10 down to 20, under voxel (0,0,0) each time.
FlatVolume branch() {
  FlatVolume volume;
  volume.add({0, 0, 0}, 10, 20);
  volume.finish();
  return volume;
}
/// A value in one sample of one depth, the default elsewhere.
void plant(FlatVolume& volume, std::string const& name, float defaultValue, int depth, int sample,
           float value) {
  volume.channel<float>(name, defaultValue, [=](auto const& tile, int k) {
    return tile.depth() == depth && k == sample ? value : defaultValue;
  });
}

TEST(FlatRoots, RequirementVisibleCoarseContentRaisesTheRoots) {
  struct Case {
    char const* name;
    float defaultValue, value;
    int sample, rootDepth;
  };
  // Sample 63 lies in the last voxel, which has no child; sample 0 in the first, which has one.
  for (auto const& c : {Case{"voxel_fog_density", 0, 1, 63, 13}, Case{"voxel_fog_density", 0, 1, 0, 20},
                        Case{"voxel_fog_density", 2, 1, 63, 13}, Case{"voxel_signed_distance", 1, -1, 63, 13},
                        Case{"voxel_signed_distance", 1, -1, 0, 20},
                        Case{"voxel_signed_distance", 1, 0.5f, 63, 20}, Case{"density", 0, 1, 63, 20}}) {
    auto volume = branch();
    plant(volume, c.name, c.defaultValue, 13, c.sample, c.value);
    auto const handle = flatten(*volume.object, {});
    EXPECT_EQ(read(handle).rootDepth, c.rootDepth) << c.name << ' ' << c.sample;
    expectFlat(volume, {}, handle, c.name, c.rootDepth);
  }
}

TEST(FlatRoots, RequirementRaisedRootsThatDoNotFitGoFurtherUp) {
  FlatVolume volume;
  // Under one tile of depth 5: a hundred tiles of depth 12 in a row, which the table cannot span, and depth
  // 20 in a corner.
  for (int n = 0; n < 100; ++n) volume.add({n * FlatTraits::width(12), 0, 0}, 5, 12);
  volume.add({0, 0, 0}, 5, 20);
  volume.finish();
  plant(volume, "voxel_fog_density", 0, 12, 63, 1);
  auto const handle = flatten(*volume.object, {});
  EXPECT_EQ(read(handle).rootDepth, 11);
  expectFlat(volume, {}, handle, "raised", 12);
}

TEST(FlatRoots, NegativeRootsBelowTheTableAreRefusedAloud) {
  FlatVolume volume;
  volume.add({0, 0, 0}, 10, 12);
  volume.add({1 << 20, 0, 0}, 15);
  volume.finish();
  FlatOptions options;
  options.rootLevelLimit = 28 - 10;
  CaptureStream err(std::cerr);
  EXPECT_TRUE(flatten(*volume.object, options).empty());
  EXPECT_EQ(err.text(),
            "VTTToNanoVTT: roots at depths finer than rootDepth (in this case 10 not supported)\n");
}

TEST(FlatRoots, BoundaryEndsOfTheDomain) {
  for (int const depth : {0, 1, 2, 3, 28}) {
    FlatVolume volume;
    int const low = FlatTraits::kMinTileCoord, high = FlatTraits::kMaxTileCoord;
    volume.add({low, low, low}, depth);
    if (depth < 7) volume.add({high, high, high}, depth);
    volume.finish();
    volume.channel<float>("f", 0, [](auto const&, int k) { return k == 63 ? 1.0f : 0.0f; });
    for (float const fraction : {0.0f, 1.0f}) {
      FlatOptions options;
      options.haloFraction = fraction;
      expectFlat(volume, options, flatten(*volume.object, options), "depth " + std::to_string(depth));
    }
  }
}

TEST(FlatHalo, BoundaryFractionsOfOneAndNone) {
  auto volume = row(40, 20);
  volume.channel<float>("f", 0, [](auto const& tile, int k) { return static_cast<float>(tile.index() + k); });
  FlatOptions options;
  options.rootLevelLimit = 10;
  for (float const fraction : {1.0f, 0.0f, -1.0f, 2.0f}) {
    options.haloFraction = fraction;
    auto const handle = flatten(*volume.object, options);
    auto const model = read(handle);
    for (std::size_t n = 0; n < model.tiles.size(); ++n)
      ASSERT_EQ(model.grids[0].width(n), fraction >= 1 ? 5 : 4) << fraction << ' ' << n;
    expectFlat(volume, options, handle, "fraction");
  }
}

TEST(FlatGrid, RequirementBrickNoneHoldsTheDefaultValue) {
  auto volume = row(3, 20);
  volume.channel<float>("f", 2.5f, [](auto const&, int k) { return static_cast<float>(k); });
  FlatOptions options;
  options.textures = true, options.haloFraction = 1;
  auto const handle = flatten(*volume.object, options);
  auto const model = read(handle);
  ASSERT_EQ(model.tiles.size(), 3u);
  for (float const v : model.brick<float>(model.grids[0], 10, 0, 0, 0)) EXPECT_EQ(v, 2.5f);
  EXPECT_EQ(model.grids[0].table[0], 5u | std::uint64_t(5) << 48) << "tile 0 is brick 1";
  expectFlat(volume, options, handle, "textures");
}

TEST(FlatGrid, BoundaryConstantTilesHaveNoQuantum) {
  auto volume = row(5, 20);
  volume.channel<float>("f", 0,
                        [](auto const& tile, int) { return 0.1f * static_cast<float>(tile.index()); });
  for (bool const dither : {false, true}) {
    FlatOptions options;
    options.dither = dither;
    auto const handle = flatten<nanovdb::Fp16>(*volume.object, options);
    expectFlat<nanovdb::Fp16>(volume, options, handle, "Fp16");
    expectFlat<nanovdb::Fp4>(volume, options, flatten<nanovdb::Fp4>(*volume.object, options), "Fp4");
    expectFlat<nanovdb::Fp8>(volume, options, flatten<nanovdb::Fp8>(*volume.object, options), "Fp8");
    expectFlat<nanovdb::FpN>(volume, options, flatten<nanovdb::FpN>(*volume.object, options), "FpN");
    auto const q = read(handle).quantised(read(handle).grids[0], 3);
    EXPECT_EQ(q.quantum, 0.0f);
    EXPECT_EQ(q.value(5), 0.1f * 3);
  }
}

TEST(FlatGrid, BoundaryValuesThatNoRangeHolds) {
  float const inf = std::numeric_limits<float>::infinity(), nan = std::numeric_limits<float>::quiet_NaN(),
              most = std::numeric_limits<float>::max();
  for (float const odd : {inf, -inf, nan, most, -most, 1e-45f}) {
    auto volume = row(3, 20);
    volume.channel<float>("f", 0, [&](auto const&, int k) {
      return k == 7 ? odd : k == 8 ? -odd : static_cast<float>(k);
    });
    FlatOptions options;
    EXPECT_FALSE(read(flatten(*volume.object, options)).grids.empty());
    EXPECT_FALSE(read(flatten<nanovdb::Fp4>(*volume.object, options)).grids.empty());
    EXPECT_FALSE(read(flatten<nanovdb::Fp8>(*volume.object, options)).grids.empty());
    EXPECT_FALSE(read(flatten<nanovdb::Fp16>(*volume.object, options)).grids.empty());
    EXPECT_FALSE(read(flatten<nanovdb::FpN>(*volume.object, options)).grids.empty());
  }
}

TEST(FlatGrid, RequirementTheFirstChannelSettlesTheTolerance) {
  auto const say = [](FlatVolume const& volume, float tolerance) {
    FlatOptions options;
    options.tolerance = tolerance, options.verbosity = 1;
    CaptureStream out(std::cout);
    flatten<nanovdb::FpN>(*volume.object, options);
    std::vector<std::string> said;
    std::istringstream text(out.text());
    for (std::string line; std::getline(text, line);)
      if (line.find("tolerance = ") != std::string::npos)
        said.push_back(line.substr(line.find("tolerance = ") + 12));
    return said;
  };
  auto const named = [](std::vector<std::string> const& names) {
    auto volume = row(5, 20);
    for (auto const& name : names)
      volume.channel<float>(name, 1.0f, [](auto const&, int k) { return static_cast<float>(k); });
    return volume;
  };
  // Names in the order of the object, which is that of their text.
  EXPECT_EQ(say(named({"surface"}), -1), std::vector<std::string>{"0.025"}) << "a tenth of a voxel";
  EXPECT_EQ(say(named({"voxel_fog_density"}), -1), std::vector<std::string>{"0.01"});
  EXPECT_EQ(say(named({"x"}), -1), std::vector<std::string>{"0"});
  EXPECT_EQ(say(named({"surface"}), 0.5f), std::vector<std::string>{"0.5"}) << "as it was given";
  auto const volume = named({"surface", "voxel_fog_density"});
  std::string const first = volume.object->componentRange()[0] == "voxel_fog_density" ? "0.01" : "0.025";
  EXPECT_EQ(say(volume, -1), (std::vector<std::string>{first, first})) << "it stays";
}

TEST(FlatGrid, RequirementClassesComeFromNamesAndDefaults) {
  auto volume = row(2, 20);
  auto const ramp = [](auto const&, int k) { return static_cast<float>(k - 30); };
  for (char const* name :
       {"voxel_signed_distance", "voxel_flame_level_set", "surface", "voxel_fog_density", "other"})
    volume.channel<float>(name, 1.0f, ramp);
  // Distances below 0 raise the roots to the coarsest tile.
  expectFlat(volume, {}, flatten(*volume.object, {}), "above 0", 12);
  auto const classOf = [](FlatModel const& model, char const* name) { return model.grid(name).gridClass; };
  auto const handle = flatten(*volume.object, {});
  auto const model = read(handle);
  EXPECT_EQ(classOf(model, "voxel_signed_distance"), 1u);
  EXPECT_EQ(classOf(model, "voxel_flame_level_set"), 1u);
  EXPECT_EQ(classOf(model, "surface"), 1u);
  EXPECT_EQ(classOf(model, "voxel_fog_density"), 2u);
  EXPECT_EQ(classOf(model, "other"), 0u);
  auto zero = row(2, 20);
  for (char const* name : {"surface", "voxel_fog_density"}) zero.channel<float>(name, 0.0f, ramp);
  auto const zeroHandle = flatten(*zero.object, {});
  EXPECT_EQ(classOf(read(zeroHandle), "surface"), 0u);
  EXPECT_EQ(classOf(read(zeroHandle), "voxel_fog_density"), 2u);
}

TEST(FlatGrid, BoundaryLongNamesAreCut) {
  auto volume = row(2, 20);
  std::string const name(300, 'n');
  volume.channel<float>(name, 0.0f, [](auto const&, int) { return 1.0f; });
  auto const handle = flatten(*volume.object, {});
  EXPECT_EQ(read(handle).grids[0].name, name.substr(0, 255));
}

TEST(FlatGrid, BoundaryWithoutAnActiveSampleTheBoxIsEmpty) {
  auto volume = row(2, 20);
  volume.channel<float>("f", 3.0f, [](auto const&, int) { return 3.0f; });
  expectFlat(volume, {}, flatten(*volume.object, {}), "nothing active");
}

TEST(FlatFog, RequirementTheFixRaisesWhatBordersOnFog) {
  for (std::uint32_t seed = 1; seed < 6; ++seed) {
    FlatVolume volume;
    fillRandom(volume, seed, 120);
    std::mt19937 random(seed);
    volume.channel<float>("voxel_fog_density", 0.0f, [&](auto const&, int) {
      return random() % 3 ? 0.0f : static_cast<float>(random() % 5) / 4;
    });
    FlatOptions options;
    options.filter = "voxel_fog_density";
    options.fogFix = true, options.haloFraction = 1, options.coarserTolerance = 0.25f;
    options.rootLevelLimit = 28 - volume.top;
    // Fog is everywhere: the roots go up as far as there are tiles.
    for (bool const coalesce : {false, true}) {
      options.coalesce = coalesce;
      auto const handle = flatten(*volume.object, options);
      if (handle.empty()) continue;
      int const rootDepth = read(handle).rootDepth;
      FlatExpectation const expected(volume.tree, options, rootDepth);
      ASSERT_EQ(expected.rootDepth, rootDepth);
      auto const model = read(handle);
      FlatGridCheck<float>(volume, options, expected, model, model.grids[0], "seed " + std::to_string(seed))
          .run(0);
    }
  }
}

TEST(FlatFog, RequirementOutBoxIsThatAboveTheThreshold) {
  auto volume = row(2, 20);
  // One sample above the threshold in the first tile; samples below it all over the second.
  volume.channel<float>("voxel_fog_density", 0.0f, [](auto const& tile, int k) {
    return tile.ti() == 0 ? (k == 21 ? 1.0f : 0.0f) : 0.1f;
  });
  FlatOptions options;
  options.fogFix = true, options.haloFraction = 1, options.coarserTolerance = 0.25f,
  options.rootLevelLimit = 8;
  Velorn::Math::bbox<Velorn::Math::float3, float> box;
  flatten<void, AlignedHostBuffer>(*volume.object, options, nullptr, nullptr, &box);
  float const s = 0.25f * static_cast<float>(FlatTraits::width(20)) / 4;
  for (int a = 0; a < 3; ++a) {
    EXPECT_EQ(box.min[a], (1 - 2) * s) << a;
    EXPECT_EQ(box.max[a], (1 + 2) * s) << a;
  }
  // Without the fix, and for other names, nothing is written.
  options.fogFix = false;
  Velorn::Math::bbox<Velorn::Math::float3, float> untouched;
  untouched.min = {1, 2, 3}, untouched.max = {4, 5, 6};
  flatten<void, AlignedHostBuffer>(*volume.object, options, nullptr, nullptr, &untouched);
  EXPECT_EQ(untouched.min[0], 1.0f);
  EXPECT_EQ(untouched.max[2], 6.0f);
}

TEST(FlatCoarser, RequirementCoarseSamplesTakeThoseOfTheirChildren) {
  for (bool const pooled : {false, true}) {
    if (pooled) VLN::TileTree3D::ChannelPool::enable();
    FlatVolume volume;
    volume.complete({0, 0, 0}, 20, 3);
    volume.finish();
    std::mt19937 random(8);
    volume.channel<float>("f", 0.0f, [&](auto const&, int) { return flatValue<float>(random); });
    FlatOptions options;
    options.rootLevelLimit = 8, options.setCoarser = true;
    auto const handle = flatten(*volume.object, options);
    expectFlat(volume, options, handle, "set");
    EXPECT_EQ(read(handle).grids[0].name, "f") << "the name of the source";
    options.coarserTolerance = 1000;
    expectFlat(volume, options, flatten(*volume.object, options), "within the tolerance");
    if (pooled) VLN::TileTree3D::ChannelPool::disable();
  }
}

} // namespace
