// Where blocks of pixels say that there is nothing, there is nothing.
#include "Render/PixelBlocks.h"
#include "Render/Walk.h"
#include "RenderCase.h"

#include <random>

namespace VLN::Test {
namespace {

using namespace Render;

constexpr int kWidth = 83, kHeight = 61; // no multiples of a block

struct View {
  char const* name;
  Affine toWorld; // of tile space
  CameraOptions camera;
};

std::vector<View> views() {
  Affine const plain;
  Affine flat = plain, turned = plain, mirrored = plain, far = plain;
  flat.rows[2] = {0, 0, 40};
  turned.rows[0] = {0.6, -0.8, 0.3}, turned.rows[1] = {0.8, 0.6, 0}, turned.rows[2] = {0.1, 0.2, 2.5};
  mirrored.rows[0] = {-1, 0, 0};
  far.shift = {1e6, -2e6, 3e5};
  CameraOptions inside, close, wide, behind;
  inside.position = Vec3d{1, 2, 3}, inside.focalPoint = Vec3d{20, 9, -4};
  close.zoom = 7, close.azimuth = 40;
  wide.viewAngle = 150;
  behind.position = Vec3d{60, 0, 5}, behind.focalPoint = Vec3d{100, 3, 5};
  return {{"plain", plain, {}},      {"flat", flat, {}},
          {"turned", turned, {}},    {"mirrored", mirrored, {}},
          {"far", far, {}},          {"close", plain, close},
          {"wide", plain, wide},     {"inside", plain, inside},
          {"behind", plain, behind}, {"turned, inside", turned, inside}};
}

class PixelBlocksTest : public ::testing::TestWithParam<int> {};
INSTANTIATE_TEST_SUITE_P(Depths, PixelBlocksTest, ::testing::Values(25, 27, 28));

// requirement: whatever has weight lies between the two distances of its block, for any camera, any transform
// and trees of several depths
TEST_P(PixelBlocksTest, RequirementHoldEverythingOnTheRays) {
  RenderCase const volume(sphereOf(13.3, {3, -2, 1}), -20, 20, {}, 3,
                          [](int x, int y, int) { return x + y > -12; });
  Field field(volume.grid());
  field.limitDepth(GetParam());
  field.weigh([](float low, float high) { return low < 0 && high >= 0 ? 1.0f : 0.0f; });
  std::mt19937 random(5);
  std::uniform_real_distribution<double> part(0, 1);
  for (View const& view : views()) {
    SCOPED_TRACE(view.name);
    std::vector<Vec3d> corners(8);
    for (int c = 0; c < 8; ++c)
      corners[static_cast<std::size_t>(c)] =
          view.toWorld.point({c & 1 ? 20.0 : -20, c & 2 ? 20.0 : -20, c & 4 ? 20.0 : -20});
    Camera const camera(view.camera, corners, 0, double(kWidth) / kHeight);
    Affine toWorld = view.toWorld;
    toWorld.shift = toWorld.point(field.origin());
    Affine const toLocal = toWorld.inverse();
    PixelBlocks const blocks(field.view(), toWorld, camera, kWidth, kHeight);
    int found = 0;
    for (int y = 0; y < kHeight; ++y)
      for (int x = 0; x < kWidth; ++x) {
        Vec3d const world = camera.ray((x + part(random)) / kWidth, (y + part(random)) / kHeight),
                    d = toLocal.vector(world);
        // From a place near the box, so that floats are fine.
        Vec3d const middle = view.toWorld.point({0, 0, 0});
        double const base = std::max(0.0, length(middle - camera.position) - 1200);
        Ray const ray((toLocal.point(camera.position) + d * base).as<float>(), d.as<float>());
        Walk walk(field.view(), ray, 0, 3e38f);
        Segment s;
        auto const& span = blocks.at(x, y);
        double const slack = 1e-5 * base + 1e-3;
        while (walk.next(s)) {
          if (!(s.t1 - s.t0 > 1e-3f)) continue;
          ++found;
          ASSERT_FALSE(span.empty()) << x << ", " << y;
          ASSERT_LE(double(span.near), base + double(s.t0) + slack) << x << ", " << y;
          ASSERT_GE(double(span.far), base + double(s.t1) - slack) << x << ", " << y;
        }
      }
    bool const isBehind = std::string(view.name) == "behind";
    EXPECT_EQ(found > 0, !isBehind);
  }
}

// requirement: they are of use: most blocks beside a sphere are empty, and the others begin near it
TEST(PixelBlocks, RequirementAreNarrow) {
  RenderCase const volume(sphereOf(13.3), -20, 20, {}, 3);
  Field field(volume.grid());
  field.weigh([](float low, float high) { return low < 0 && high >= 0 ? 1.0f : 0.0f; });
  Affine toWorld;
  toWorld.shift = field.origin();
  CameraOptions options;
  options.position = Vec3d{0, 0, 100}, options.focalPoint = Vec3d{0, 0, 0};
  Camera const camera(options, {{0, 0, 0}}, 0, 1);
  PixelBlocks const blocks(field.view(), toWorld, camera, 256, 256);
  // 26.8 degrees of 30 would be a sphere that touches the edges; this one fills a quarter of the picture.
  int empty = 0;
  for (int y = 0; y < 256; ++y)
    for (int x = 0; x < 256; ++x) empty += blocks.at(x, y).empty();
  EXPECT_GT(empty, 256 * 256 * 55 / 100);
  EXPECT_LT(empty, 256 * 256 * 80 / 100);
  EXPECT_NEAR(double(blocks.at(128, 128).near), 100 - 13.3, 8);
  EXPECT_NEAR(double(blocks.at(128, 128).far), 100 + 13.3, 8);
  EXPECT_TRUE(blocks.at(0, 0).empty());
}

} // namespace
} // namespace VLN::Test
