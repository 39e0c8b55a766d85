// Surfaces against closed forms.
#include "Render/Surface.h"
#include "RenderCase.h"

#include <random>

namespace VLN::Test {
namespace {

using namespace Render;

// requirement: the first crossing, as small steps find it
TEST(Cubic, RequirementFindsTheFirstRoot) {
  std::mt19937 random(3);
  std::uniform_real_distribution<float> value(-1, 1), place(0, 1);
  int found = 0;
  for (int n = 0; n < 4000; ++n) {
    float corners[8];
    for (float& c : corners) c = value(random);
    Vec3 const from{0, place(random), place(random)}, to{1, place(random), place(random)};
    float c[4];
    cubicAlong(corners, 2, from, to - from, c);
    auto const direct = [&](double s) {
      Vec3 const p = from + (to - from) * static_cast<float>(s);
      return double(trilinear(corners, 2, p.x, p.y, p.z));
    };
    for (double s : {0.0, 0.3, 0.7, 1.0})
      ASSERT_NEAR(double(c[0]) + s * (double(c[1]) + s * (double(c[2]) + s * double(c[3]))), direct(s), 1e-5);
    double expected = -1;
    constexpr int kSteps = 4000;
    for (int k = 1; k <= kSteps && expected < 0; ++k)
      if ((direct(double(k - 1) / kSteps) < 0) != (direct(double(k) / kSteps) < 0))
        expected = (k - 0.5) / kSteps;
    float const got = firstRoot(c, 1);
    // Two crossings within a step are seen by the formula alone.
    if (expected < 0 && got >= 0) {
      EXPECT_NEAR(direct(double(got)), 0, 1e-4) << n;
      continue;
    }
    EXPECT_TRUE(std::abs(double(got) - expected) < 1.0 / kSteps ||
                (got >= 0 && double(got) < expected && std::abs(direct(double(got))) < 1e-5))
        << n << ": " << got << " for " << expected;
    found += got >= 0;
  }
  EXPECT_GT(found, 1500);
}

// requirement: silhouette, depth and normal of a sphere, for a transform without cubes and a turn
TEST(Surface, RequirementSphereIsWhereItIs) {
  constexpr double kRadius = 20;
  double const turn = 0.5;
  // In the world a sphere of radius 20 about the origin, in the grid an ellipsoid.
  Affine const transforms[] = {
      Affine{},
      Affine{{{std::cos(turn), 0, 2 * std::sin(turn)}, {0, 0.8, 0}, {-std::sin(turn), 0, 2 * std::cos(turn)}},
             {}}};
  for (Affine const& toWorld : transforms) {
    RenderCase const volume(
        [&](double x, double y, double z) {
          return static_cast<float>(std::clamp(length(toWorld.point({x, y, z})) - kRadius, -6.0, 6.0));
        },
        -32, 32, {}, 6);
    Field field(volume.grid());
    double const distance = 100;
    Camera const camera = frontCamera(distance, 30);
    RenderOptions options;
    options.mode = Mode::kSurface;
    options.width = options.height = 101;
    options.samples = 1, options.occlusionRays = 0;
    Picture const picture = render(field, toWorld, camera, options);
    int hits = 0;
    for (int y = 0; y < 101; ++y)
      for (int x = 0; x < 101; ++x) {
        auto const n = static_cast<std::size_t>(y * 101 + x);
        Vec3d const d = camera.ray((x + 0.5) / 101, (y + 0.5) / 101);
        double const b = dot(camera.position, d), c = distance * distance - kRadius * kRadius,
                     root = b * b - c;
        // The blend of samples of a distance is nearer to the centre than the sphere by at most h^2 / (4 r).
        bool const nearEdge = std::abs(std::sqrt(distance * distance - b * b) - kRadius) < 0.15;
        if (!nearEdge) { ASSERT_EQ(picture.opacity[n], root > 0 ? 1 : 0) << x << " " << y; }
        if (!(root > 0) || nearEdge) continue;
        ++hits;
        double const t = -b - std::sqrt(root);
        Vec3d const normal = normalized(camera.position + d * t);
        double const slant = std::abs(dot(normal, d));
        EXPECT_NEAR(picture.depth[n], t, 0.12 / slant) << x << " " << y;
        EXPECT_GT(dot(picture.normal[n].as<double>(), normal), 0.998) << x << " " << y;
      }
    EXPECT_GT(hits, 1000);
  }
}

// requirement: where a sample looks like those about it, it stands for all: with fewer rays nearly the same
// picture, edges and shadows included, at any number of threads
TEST(Surface, RequirementCalmPixelsNeedNoMoreSamples) {
  RenderCase const volume(
      [](double x, double y, double z) {
        double const ball = std::sqrt(x * x + y * y + z * z) - 12, plate = std::abs(y + 11) - 1.5;
        return static_cast<float>(std::clamp(std::min(ball, plate), -3.0, 3.0));
      },
      -20, 20, {}, 3);
  Field field(volume.grid());
  CameraOptions from;
  from.position = Vec3d{60, 50, 70}, from.focalPoint = Vec3d{0, -3, 0};
  Camera const camera(from, {{0, 0, 0}}, 0, 1);
  RenderOptions options;
  options.mode = Mode::kSurface;
  options.width = options.height = 160;
  Picture const some = render(field, Affine{}, camera, options);
  auto const bytes = toBytes(some, {0.1f, 0.1f, 0.1f}, true);
  options.samples = some.samples;
  Picture const all = render(field, Affine{}, camera, options);
  EXPECT_LT(some.rays, all.rays * 3 / 4);
  double sum = 0, most = 0;
  for (std::size_t n = 0; n < all.opacity.size(); ++n) {
    EXPECT_NEAR(some.opacity[n], all.opacity[n], 0.26);
    double const by = std::abs(double(all.color[n].y) - double(some.color[n].y));
    sum += by, most = std::max(most, by);
    if (all.opacity[n] == 1 && some.opacity[n] == 1) { ASSERT_NEAR(some.depth[n], all.depth[n], 2) << n; }
  }
  EXPECT_LT(sum / double(all.opacity.size()), 0.002);
  EXPECT_LT(most, 0.4);
  options.samples = 0;
  for (int threads : {1, 2, 8}) {
    options.threads = threads;
    EXPECT_EQ(toBytes(render(field, Affine{}, camera, options), {0.1f, 0.1f, 0.1f}, true), bytes) << threads;
  }
}

// requirement: a plane through samples is met once, and zeros round a positive field are no surface
TEST(Surface, BoundaryValuesThatAreExactlyThere) {
  RenderCase const plane([](double, double, double z) { return static_cast<float>(-z); }, -16, 16, {}, 100);
  Field field(plane.grid());
  Camera const camera = frontCamera(60, 10);
  RenderOptions options;
  options.mode = Mode::kSurface;
  options.width = options.height = 20;
  options.samples = 1, options.occlusionRays = 0;
  Picture picture = render(field, Affine{}, camera, options);
  for (std::size_t n = 0; n < picture.depth.size(); ++n)
    // From outside the background rises to 100 at once: the first surface lies at the first samples.
    EXPECT_NEAR(picture.opacity[n], 1, 0);

  RenderCase const box([](double, double, double) { return 5.0f; }, -16, 16, {}, 0);
  Field positive(box.grid());
  picture = render(positive, Affine{}, camera, options);
  for (float opacity : picture.opacity) EXPECT_EQ(opacity, 0);
}

// requirement: the same bytes at any number of threads
TEST(Surface, RequirementSameForAnyNumberOfThreads) {
  RenderCase const volume(sphereOf(20), -28, 28, {}, 3);
  Camera const camera = frontCamera(90, 30);
  RenderOptions options;
  options.mode = Mode::kSurface;
  options.width = 80, options.height = 60;
  std::vector<std::uint8_t> first;
  for (int threads : {1, 2, 8}) {
    options.threads = threads;
    Field field(volume.grid(), {-1, threads});
    auto const bytes = toBytes(render(field, Affine{}, camera, options), {0.1f, 0.1f, 0.1f}, false);
    if (first.empty()) first = bytes;
    EXPECT_EQ(bytes, first) << threads;
  }
}

} // namespace
} // namespace VLN::Test
