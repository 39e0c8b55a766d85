#include "Render/Camera.h"

#include <gtest/gtest.h>

#include <random>
#include <stdexcept>

namespace VLN::Test {
namespace {

using namespace Render;

std::vector<Vec3d> someBox() {
  std::vector<Vec3d> points;
  for (int c = 0; c < 8; ++c) points.push_back({c & 1 ? 7.0 : -2.0, c & 2 ? 40.0 : 31.0, c & 4 ? 3.0 : -9.0});
  return points;
}

// requirement: everything is seen, and something touches the margin
TEST(Camera, RequirementFramesWhatItShows) {
  for (double aspect : {0.5, 1.0, 2.5})
    for (int n = 0; n < 60; ++n) {
      CameraOptions options;
      options.azimuth = 23 * n, options.elevation = n % 5 * 10 - 20;
      if (n % 3 == 1) options.viewUp = Vec3d{0, 0, 1};
      if (n % 3 == 2) options.focalPoint = Vec3d{2, 35, -3};
      Camera const camera(options, someBox(), 0, aspect);
      double widest = 0;
      for (Vec3d const& p : someBox()) {
        Vec3d const at = camera.project(p);
        EXPECT_GT(at.z, 0);
        widest = std::max({widest, std::abs(2 * at.x - 1), std::abs(2 * at.y - 1)});
        Vec3d const ray = camera.ray(at.x, at.y), back = normalized(p - camera.position);
        EXPECT_NEAR(dot(ray, back), 1, 1e-12);
      }
      EXPECT_NEAR(widest, 0.94, 1e-6) << n << " " << aspect;
    }
}

// requirement: what is printed of it puts it back
TEST(Camera, RequirementCanBeRepeated) {
  CameraOptions options;
  options.azimuth = 50, options.elevation = 12, options.zoom = 1.7;
  Camera const first(options, someBox(), 0.5, 1.5);
  CameraOptions again;
  again.position = first.position, again.focalPoint = first.focalPoint, again.viewUp = first.viewUp;
  again.viewAngle = first.viewAngle;
  Camera const second(again, someBox(), 0.5, 1.5);
  for (double u : {0.0, 0.4, 1.0})
    for (double v : {0.1, 0.9}) {
      EXPECT_NEAR(length(first.ray(u, v) - second.ray(u, v)), 0, 1e-9);
      EXPECT_NEAR(length(first.position - second.position), 0, 1e-9);
    }
}

// requirement
TEST(Camera, RequirementTakesDirections) {
  CameraOptions options;
  options.direction = Vec3d{0, 0, -2};
  Camera const camera(options, someBox(), 0, 1);
  EXPECT_EQ(camera.forward.z, -1);
  EXPECT_GT(camera.position.z, 3);
  EXPECT_EQ(camera.right.x, 1);
  options.position = Vec3d{1, 2, 3};
  Camera const placed(options, someBox(), 0, 1);
  EXPECT_EQ(placed.forward.z, -1);
  EXPECT_EQ(placed.position.y, 2);
}

// negative
TEST(Camera, NegativeDirectionsThatAreNone) {
  CameraOptions options;
  options.position = options.focalPoint = Vec3d{1, 1, 1};
  EXPECT_THROW(Camera(options, someBox(), 0, 1), std::invalid_argument);
  CameraOptions along;
  along.direction = Vec3d{0, 1, 0};
  EXPECT_THROW(Camera(along, someBox(), 0, 1), std::invalid_argument);
}

} // namespace
} // namespace VLN::Test
