// Fogs and projections against closed forms.
#include "Render/Fog.h"
#include "RenderCase.h"

#include <random>

namespace VLN::Test {
namespace {

using namespace Render;

constexpr int kHalf = 16;
float one(double, double, double) { return 1; }

TransferOptions unit() {
  TransferOptions options;
  options.low = 0, options.high = 1;
  return options;
}

// A box of value 1 whose extinction is 1 over 10 units.
struct Box {
  RenderCase volume{one, -kHalf, kHalf};
  Field field{volume.grid()};
  Transfer transfer{unit()};
  FogView fog;

  Box() {
    field.weigh([&](float low, float high) { return transfer.largestOpacity(low, high); });
    fog.field = field.view();
    fog.transfer = &transfer.view();
    fog.perUnit = 0.1f;
    fog.worldToLocal[0] = {1, 0, 0}, fog.worldToLocal[1] = {0, 1, 0}, fog.worldToLocal[2] = {0, 0, 1};
    fog.viewUp = {0, 1, 0};
    fog.light = fog.lightLocal = {0, 1, 0};
  }
  Ray axisRay() const { return Ray((Vec3d{0.3, 0.2, 100} - field.origin()).as<float>(), {0, 0, -1}); }
};

// requirement: samples -16..15 of 1 blend to 0 over one unit on each side, so the depth is 32 tenths
TEST(Fog, RequirementOpticalDepthOfABox) {
  Box const box;
  EXPECT_NEAR(opticalDepth(box.fog, box.axisRay(), 0, 300, 0.05f), 3.2, 0.01);
  Ray const slanted((Vec3d{50, 0, 50} - box.field.origin()).as<float>(),
                    Vec3{-std::sqrt(0.5f), 0, -std::sqrt(0.5f)});
  EXPECT_NEAR(opticalDepth(box.fog, slanted, 0, 300, 0.05f),
              0.1 * 31 * std::sqrt(2.0) + 0.1 * 2 * std::sqrt(2.0) / 3, 0.02);
}

// requirement: both trackings are free of bias
TEST(Fog, RequirementTrackingIsWithoutBias) {
  Box box;
  box.fog.perUnit = 0.05f;
  double const through = std::exp(-1.6);
  constexpr int kPaths = 40000;
  double ratio = 0, passed = 0;
  for (int n = 0; n < kPaths; ++n) {
    Random random(static_cast<std::uint32_t>(n), 1);
    ratio += double(ratioTrack(box.fog, box.axisRay(), 300, random));
    float at, place;
    passed += !collide(box.fog, box.axisRay(), 0, 300, random, at, place);
  }
  EXPECT_NEAR(ratio / kPaths, through, 0.006);
  EXPECT_NEAR(passed / kPaths, through, 5 * std::sqrt(through * (1 - through) / kPaths));
}

// requirement: where every direction is as bright and nothing is lost, a fog cannot be seen
TEST(Fog, RequirementWhiteFurnace) {
  Box box;
  box.fog.albedo = 1, box.fog.anisotropy = 0.4f;
  box.fog.sky = box.fog.ground = {1, 1, 1};
  box.fog.lightColor = {0, 0, 0};
  box.fog.bounces = 100000;
  for (int n = 0; n < 2000; ++n) {
    Random random(static_cast<std::uint32_t>(n), 2);
    FogSample const s = traceFog(box.fog, box.axisRay(), {0, 0, -1}, 0, 300, random);
    EXPECT_NEAR(s.color.x, s.opacity, 1e-4);
  }
}

// requirement
TEST(Fog, RequirementPhaseFunctionIsAShareOfAll) {
  for (float g : {-0.6f, 0.0f, 0.3f, 0.8f}) {
    double sum = 0, mean = 0, drawn = 0;
    constexpr int kSteps = 20000;
    for (int n = 0; n < kSteps; ++n) {
      double const cosine = -1 + (n + 0.5) * 2 / kSteps;
      double const p = double(henyeyGreenstein(static_cast<float>(cosine), g)) / 2;
      sum += p * 2 / kSteps, mean += p * cosine * 2 / kSteps;
      Random random(static_cast<std::uint32_t>(n), 5);
      float const u = random.next();
      drawn += double(dot(scatter({0.6f, 0, 0.8f}, g, u, random.next()), Vec3{0.6f, 0, 0.8f})) / kSteps;
    }
    EXPECT_NEAR(sum, 1, 1e-3);
    EXPECT_NEAR(mean, double(g), 1e-3);
    EXPECT_NEAR(drawn, double(g), 0.02);
  }
}

RenderOptions smallOptions(Mode mode) {
  RenderOptions options;
  options.mode = mode;
  options.width = 48, options.height = 40;
  options.transfer = unit();
  options.opacityUnit = 10;
  return options;
}

// requirement: opacity of the middle of a box, of the preview and of the final picture
TEST(Fog, RequirementPicturesHaveTheOpacityOfTheBox) {
  Box box;
  Camera const camera = frontCamera(2000, 0.5);
  for (Quality quality : {Quality::kPreview, Quality::kFinal}) {
    RenderOptions options = smallOptions(Mode::kFog);
    options.quality = quality;
    options.opacityUnit = 20;
    options.samples = quality == Quality::kFinal ? 40 : 1;
    Picture const picture = render(box.field, Affine{}, camera, options);
    double mean = 0;
    for (float a : picture.opacity) mean += double(a) / double(picture.opacity.size());
    EXPECT_NEAR(mean, 1 - std::exp(-1.6), 0.01) << static_cast<int>(quality);
  }
}

// requirement: extinction is per world length, whatever the voxels are
TEST(Fog, RequirementUnitIsAWorldLength) {
  Box box;
  Affine longer;
  longer.rows[2].z = 3;
  RenderOptions options = smallOptions(Mode::kFog);
  options.opacityUnit = 60;
  Picture const picture = render(box.field, longer, frontCamera(6000, 0.1), options);
  EXPECT_NEAR(picture.opacity[20 * 48 + 24], 1 - std::exp(-3 * 32.0 / 60), 0.01);
}

// requirement
TEST(Fog, RequirementChosenUnitShowsTheField) {
  RenderCase const volume(
      [](double x, double y, double z) {
        return static_cast<float>(std::max(0.0, 1 - std::sqrt(x * x + y * y + z * z) / 14));
      },
      -16, 16);
  for (double scale : {1e-3, 1.0, 1e4}) {
    Field field(volume.grid());
    Affine toWorld;
    for (int a = 0; a < 3; ++a) toWorld.rows[a][a] = scale;
    RenderOptions options = smallOptions(Mode::kFog);
    options.opacityUnit = 0;
    Picture const picture = render(field, toWorld, frontCamera(100 * scale, 20), options);
    double const depth = -std::log(1 - double(picture.opacity[20 * 48 + 24]));
    EXPECT_GT(depth, 1) << scale;
    EXPECT_LT(depth, 6) << scale;
  }
}

// requirement: along z through the middle of the picture the largest sample is seen, and the mean of all
TEST(Projection, RequirementMaximumAndMeanOfAKnownField) {
  auto const ramp = [](double, double, double z) { return static_cast<float>(1 + std::abs(z)); };
  RenderCase const volume(ramp, -kHalf, kHalf);
  Field field(volume.grid());
  Camera const camera = frontCamera(2000, 0.5);
  Picture const most = render(field, Affine{}, camera, smallOptions(Mode::kMaximum));
  EXPECT_NEAR(most.value[20 * 48 + 24], 17, 0.3); // of -16, met within a quarter of a step of 1 a sample
  Picture const mean = render(field, Affine{}, camera, smallOptions(Mode::kMean));
  // Over the 33 units from the sample before the first to the one behind the last.
  double sum = 0;
  for (int z = -kHalf; z < kHalf; ++z) sum += 1 + std::abs(z);
  EXPECT_NEAR(mean.value[20 * 48 + 24], sum / 33, 0.05);
}

// requirement: the same bytes at any number of threads
TEST(Fog, RequirementSameForAnyNumberOfThreads) {
  Box const box;
  Camera const camera = frontCamera(90, 30);
  for (Mode mode : {Mode::kFog, Mode::kMaximum, Mode::kMean})
    for (Quality quality : {Quality::kPreview, Quality::kFinal}) {
      std::vector<std::uint8_t> first;
      for (int threads : {1, 2, 8}) {
        RenderOptions options = smallOptions(mode);
        options.quality = quality, options.samples = 3, options.threads = threads, options.opacityUnit = 0;
        Field field(box.volume.grid(), {-1, threads});
        auto const bytes = toBytes(render(field, Affine{}, camera, options), {0.1f, 0.1f, 0.1f}, false);
        if (first.empty()) first = bytes;
        EXPECT_EQ(bytes, first) << threads;
      }
    }
}

// A ball that is lumpy from voxel to voxel.
float lumps(double x, double y, double z) {
  double const r = std::sqrt(x * x + y * y + z * z);
  return static_cast<float>(std::max(
      0.0, (1.2 - r / 13) * (0.6 + 0.4 * std::sin(2.1 * x) * std::cos(1.7 * y) * std::sin(1.9 * z + 0.3))));
}

// requirement: where voxels are several pixels wide most pixels need no ray, and they are no others than
// those that have one; voxels that are no cubes, or turned, and any camera and number of threads included
TEST(Fog, RequirementPixelsBetweenRaysAreThoseOfRays) {
  RenderCase const volume(lumps, -kHalf, kHalf);
  Affine turned;
  turned.rows[0] = {0.6, -0.8, 0.2}, turned.rows[1] = {0.8, 0.6, 0}, turned.rows[2] = {0, 0.3, 2.5};
  for (Affine const& toWorld : {Affine{}, turned})
    for (double distance : {25.0, 110.0}) {
      Field field(volume.grid());
      CameraOptions from;
      from.position = Vec3d{0.7 * distance, 0.3 * distance, 0.65 * distance},
      from.focalPoint = Vec3d{0, 0, 0};
      Camera const camera(from, {{0, 0, 0}}, 0, 237.0 / 211);
      RenderOptions options = smallOptions(Mode::kFog);
      options.width = 237, options.height = 211; // no multiples of anything
      options.colored = true;
      Picture const some = render(field, toWorld, camera, options);
      auto const bytes = toBytes(some, {0.1f, 0.1f, 0.1f}, true);
      options.samples = 1;
      Picture const all = render(field, toWorld, camera, options);
      EXPECT_LT(some.rays, all.rays * 2 / 3);
      double worst = 0, depth = 0;
      int seen = 0;
      for (std::size_t n = 0; n < all.opacity.size(); ++n) {
        worst = std::max(worst, std::abs(double(all.opacity[n]) - double(some.opacity[n])));
        for (int a = 0; a < 3; ++a)
          worst = std::max(worst, std::abs(double(all.color[n][a]) - double(some.color[n][a])));
        seen += all.opacity[n] > 0.05f;
        if (all.opacity[n] > 0.05f) depth = std::max(depth, std::abs(double(all.depth[n] - some.depth[n])));
      }
      EXPECT_GT(seen, 2000);
      EXPECT_LT(worst, 0.006);
      EXPECT_LT(depth, 1.0); // a voxel
      options.samples = 0;
      for (int threads : {1, 2, 8}) {
        options.threads = threads;
        EXPECT_EQ(toBytes(render(field, toWorld, camera, options), {0.1f, 0.1f, 0.1f}, true), bytes)
            << threads;
      }
    }
}

// requirement: a shell that is thinner than a voxel is not looked for between rays
TEST(Fog, RequirementThinShellsHaveARayForEachPixel) {
  RenderCase const volume(lumps, -kHalf, kHalf);
  Field field(volume.grid());
  RenderOptions options = smallOptions(Mode::kFog);
  options.width = options.height = 200;
  options.transfer.opacity = "0:0,0.49:0,0.5:1,0.51:0,1:0";
  EXPECT_EQ(render(field, Affine{}, frontCamera(90, 20), options).rays, 200 * 200);
}

// requirement
TEST(Transfer, RequirementLargestOpacityIsABound) {
  TransferOptions options = unit();
  for (std::string const opacity :
       {"linear", "linear_r", "sigmoid", "geom", "geom_r", "constant", "0:0,0.3:1,0.4:0.1,1:0.5"})
    for (bool isLog : {false, true}) {
      options.opacity = opacity, options.log = isLog, options.low = isLog ? 0.01f : 0.0f;
      Transfer const transfer(options);
      std::mt19937 random(4);
      std::uniform_real_distribution<float> value(-0.2f, 1.2f);
      for (int n = 0; n < 3000; ++n) {
        float a = value(random), b = value(random);
        if (b < a) std::swap(a, b);
        float const bound = transfer.largestOpacity(a, b);
        for (int k = 0; k <= 20; ++k) {
          float const v = a + (b - a) * static_cast<float>(k) / 20;
          ASSERT_LE(transfer.view().opacityAt(transfer.view().place(v)), bound + 1e-6f)
              << opacity << " " << v;
        }
      }
    }
}

// negative
TEST(Transfer, NegativeOptionsThatAreNone) {
  auto const refused = [](auto const& change) {
    TransferOptions options = unit();
    change(options);
    EXPECT_THROW(Transfer{options}, std::invalid_argument);
  };
  refused([](auto& o) { o.low = 1; });
  refused([](auto& o) { o.high = NAN; });
  refused([](auto& o) { o.log = true; });
  refused([](auto& o) { o.colors = "rainbow"; });
  for (std::string const opacity :
       {"", "lin", "1", "0:0,", "0:0,0.5", "0:0,x:1", "0:0,1:2", "1:0,0:1", "0:nan"})
    refused([&](auto& o) { o.opacity = opacity; });
}

} // namespace
} // namespace VLN::Test
