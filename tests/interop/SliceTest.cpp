#include "Interop/Slice.h"
#include "ImportCheck.h"
#include "Interop/ColorMap.h"
#include "support/TurnedRamp.h"

#include <openvdb/tools/LevelSetSphere.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <limits>
#include <set>

namespace {

using namespace VLN::Interop;
using namespace VLN::Test;
using openvdb::Coord;

VdbVolume volumeOf(openvdb::FloatGrid::Ptr grid) {
  VdbFile file;
  file.path = "in memory";
  file.grids = {grid};
  return importGrids(file).volumes.at(0);
}

// A ramp of a different slope on each axis, so that every voxel has its own value.
openvdb::FloatGrid::Ptr ramp(Coord const& low, Coord const& high, double voxelSize) {
  openvdb::initialize();
  auto grid = openvdb::FloatGrid::create(0.0f);
  grid->setName("ramp");
  grid->setTransform(openvdb::math::Transform::createLinearTransform(voxelSize));
  for (int i = low.x(); i <= high.x(); ++i)
    for (int j = low.y(); j <= high.y(); ++j)
      for (int k = low.z(); k <= high.z(); ++k)
        grid->tree().setValueOn(Coord(i, j, k),
                                float(1 + (i - low.x()) + 100 * (j - low.y()) + 10000 * (k - low.z())));
  return grid;
}

// requirement: each pixel shows the voxel below it, the second axis upwards
TEST(SliceTest, ShowsTheNearestSample) {
  Coord const low(-5, 3, 10), high(10, 10, 13); // 16 x 8 x 4 voxels
  VdbVolume const volume = volumeOf(ramp(low, high, 0.5));
  struct Case {
    int axis, across, up;
  };
  for (Case const c : {Case{0, 1, 2}, Case{1, 0, 2}, Case{2, 0, 1}}) {
    int const at = low[c.axis] + 1;
    int const wide = high[c.across] - low[c.across] + 1, tall = high[c.up] - low[c.up] + 1;
    int const zoom = 8;
    // Anywhere within half a voxel the same samples are the nearest.
    for (double off : {-0.49, 0.0, 0.49}) {
      Slice const slice = drawSlice(
          volume, "ramp",
          {.axis = c.axis, .at = (at + off) * 0.5, .size = zoom * std::max(wide, tall), .nearest = true});
      EXPECT_EQ(slice.at, at * 0.5);
      EXPECT_EQ(slice.drawn, std::int64_t(zoom) * wide * zoom * tall);
      ColorMap const map = ColorMap::forRange(slice.low, slice.top);
      int const left = 8, top = (slice.image.height() - zoom * tall) / 2;
      for (int v = 0; v < tall; ++v)
        for (int u = 0; u < wide; ++u) {
          Coord p;
          p[c.axis] = 1, p[c.across] = u, p[c.up] = v;
          double const value = 1 + p.x() + 100 * p.y() + 10000 * p.z();
          int const x = left + zoom * u + zoom / 2, y = top + zoom * (tall - 1 - v) + zoom / 2;
          ASSERT_EQ(slice.image(x, y), map.color(value)) << "axis " << c.axis << " at " << p;
        }
    }
  }
}

// requirement: by default linear between samples, also off the samples' planes; the gradient is that of the
// ramp
TEST(SliceTest, BlendsLinearly) {
  Coord const low(-5, 3, 10), high(10, 10, 13);
  VdbVolume const volume = volumeOf(ramp(low, high, 0.5));
  int const zoom = 8, wide = 16, tall = 8;
  SliceOptions options{2, 11.25 * 0.5, zoom * wide};
  Slice const slice = drawSlice(volume, "ramp", options);
  EXPECT_NEAR(slice.at, 11.25 * 0.5, 1e-9);
  EXPECT_EQ(slice.drawn, std::int64_t(zoom) * wide * zoom * tall);
  ColorMap const map = ColorMap::forRange(slice.low, slice.top);
  int const left = 8, top = (slice.image.height() - zoom * tall) / 2;
  for (int y = 0; y < zoom * tall; ++y)
    for (int x = 0; x < zoom * wide; ++x) {
      auto const place = [](double c, int last) { return std::clamp(c, 0.0, double(last)); };
      double const u = place((x + 0.5) / zoom - 0.5, wide - 1),
                   v = place(tall - (y + 0.5) / zoom - 0.5, tall - 1);
      Rgb const got = slice.image(left + x, top + y), expected = map.color(1 + u + 100 * v + 12500);
      // Of 255: the values differ by rounding.
      ASSERT_LE(std::abs(got.r - expected.r) + std::abs(got.g - expected.g) + std::abs(got.b - expected.b),
                6);
    }
  options.gradient = true;
  options.at = 11.25 * 0.5;
  // In the middle; at the border the ramp falls to the background.
  Slice const gradient = drawSlice(volume, "ramp", options);
  Rgb const got = gradient.image(left + zoom * wide / 2, top + zoom * tall / 2);
  Rgb const expected =
      ColorMap::forRange(gradient.low, gradient.top).color(2 * std::sqrt(1 + 100.0 * 100 + 10000.0 * 10000));
  EXPECT_LE(std::abs(got.r - expected.r) + std::abs(got.g - expected.g) + std::abs(got.b - expected.b), 6);
}

// requirement
TEST(SliceTest, DefaultsToTheMiddleAndKeepsTheAspect) {
  VdbVolume const volume = volumeOf(ramp(Coord(0), Coord(40, 20, 6), 2.0));
  Slice const slice = drawSlice(volume, "ramp", {.axis = 2, .at = {}, .size = 164, .nearest = true});
  EXPECT_EQ(slice.at, 6);
  EXPECT_EQ(slice.drawn, 164 * 84);
}

// requirement: coarse tiles are shown, and what has no tile is grey
TEST(SliceTest, ShowsCoarseTilesAndGaps) {
  openvdb::initialize();
  auto grid = openvdb::FloatGrid::create(0.0f);
  grid->setName("fog");
  grid->fill(openvdb::CoordBBox(Coord(0), Coord(127)), 0.5f);
  grid->tree().setValueOn(Coord(3000, 64, 64), 2.0f);
  Slice const slice = drawSlice(volumeOf(grid), "fog", {2, 64.0, 3001});
  EXPECT_EQ(slice.low, 0);
  EXPECT_EQ(slice.high, 2);
  std::set<std::array<int, 3>> colors;
  for (int y = 0; y < slice.image.height(); ++y)
    for (int x = 0; x < slice.image.width(); ++x) {
      Rgb const c = slice.image(x, y);
      colors.insert({c.r, c.g, c.b});
    }
  EXPECT_TRUE(colors.count({222, 222, 222}));
  Rgb const half = ColorMap::forRange(slice.low, slice.top).color(0.5);
  EXPECT_TRUE(colors.count({half.r, half.g, half.b}));
}

// requirement: gradients are those of world space, also where the grid is turned and its voxels are no cubes
TEST(SliceTest, GradientFollowsTheWholeTransform) {
  // Along z the middle line of the box is not turned: index 15.5 lies at 2 + 0.25 * 15.5.
  Slice const slice =
      drawSlice(volumeOf(turnedRamp()), "ramp", {.axis = 2, .at = 5.875, .size = 240, .gradient = true});
  EXPECT_NEAR(slice.at, 5.875, 1e-9);
  Rgb const expected = ColorMap::forRange(slice.low, slice.top).color(std::sqrt(5.25));
  Rgb const middle = slice.image(8 + 120, slice.image.height() / 2);
  EXPECT_NEAR(middle.r, expected.r, 1);
  EXPECT_NEAR(middle.g, expected.g, 1);
  EXPECT_NEAR(middle.b, expected.b, 1);
}

// requirement: tiles above the roots are made of their children's values
TEST(SliceTest, DepthsAboveTheRoots) {
  VdbVolume const volume = volumeOf(ramp(Coord(0), Coord(31), 1));
  for (int depth : {28, 27, 26, 25}) {
    SCOPED_TRACE(depth);
    // Pixels on samples: the field is linear, so that every depth draws the same there but at the far ends.
    Slice const slice = drawSlice(volume, "ramp", {.axis = 2, .at = 8.0, .size = 32, .depth = depth});
    EXPECT_EQ(slice.drawn, 32 * 32);
    Rgb const expected = ColorMap::forRange(slice.low, slice.top).color(1 + 9 + 100 * 10 + 10000 * 8);
    int const top = (slice.image.height() - 32) / 2;
    Rgb const pixel = slice.image(8 + 9, top + 31 - 10);
    EXPECT_NEAR(pixel.r, expected.r, 1);
    EXPECT_NEAR(pixel.g, expected.g, 1);
    EXPECT_NEAR(pixel.b, expected.b, 1);
  }
}

// requirement: a level set is white at its surface, blue inside, red outside
TEST(SliceTest, ALevelSetShowsItsZero) {
  openvdb::initialize();
  auto grid = openvdb::tools::createLevelSetSphere<openvdb::FloatGrid>(20, openvdb::Vec3f(0), 1.0f, 3.0f);
  grid->setName("sphere");
  Slice const slice =
      drawSlice(volumeOf(grid), "sphere", {.axis = 1, .at = 0.0, .size = 460, .nearest = true});
  EXPECT_LT(slice.low, 0);
  EXPECT_GT(slice.high, 0);
  EXPECT_EQ(slice.top, slice.high);
  // 45 voxels across on 460 pixels: along the middle row the surface lies at 20 voxels from the centre.
  int const row = slice.image.height() / 2;
  auto const pixel = [&](double voxels) {
    return slice.image(8 + int((voxels + 22.5 + 0.5) * 460 / 46), row);
  };
  EXPECT_GT(pixel(20).r, 220);
  EXPECT_GT(pixel(20).b, 220);
  EXPECT_GT(pixel(17.6).b, pixel(17.6).r + 80);
  EXPECT_GT(pixel(22).r, pixel(22).b + 80);
}

// boundary: what is no number has a colour of its own and no part in the range
TEST(SliceTest, NotANumber) {
  auto grid = ramp(Coord(0), Coord(7), 1);
  grid->tree().setValueOn(Coord(3, 3, 3), std::nanf(""));
  grid->tree().setValueOn(Coord(4, 3, 3), std::numeric_limits<float>::infinity());
  Slice const slice = drawSlice(volumeOf(grid), "ramp", {2, 3.0, 80});
  EXPECT_TRUE(std::isfinite(slice.high));
  EXPECT_EQ(slice.image(8 + 35, (slice.image.height() - 80) / 2 + 45), ColorMap::notANumber());
}

// negative
TEST(SliceTest, NamesWhatCannotBeDrawn) {
  VdbVolume const volume = volumeOf(ramp(Coord(0), Coord(7), 0.5));
  auto message = [&](std::string const& channel, SliceOptions const& options) {
    try {
      drawSlice(volume, channel, options);
      return std::string();
    } catch (std::invalid_argument const& error) { return std::string(error.what()); }
  };
  EXPECT_EQ(message("none", {}), "there is no channel 'none'");
  EXPECT_EQ(message("ramp", {2, 9.0, 100}),
            "position 9 on axis z misses the active voxels, which lie in 0..3.5");
  EXPECT_NE(message("ramp", {2, std::nan(""), 100}), "");
  EXPECT_NE(message("ramp", {2, 1e300, 100}), "");
  EXPECT_NE(message("ramp", {3, {}, 100}), "");
  EXPECT_NE(message("ramp", {2, {}, 1}), "");
  EXPECT_EQ(message("ramp", {2, 3.5, 100}), "");
  auto empty = openvdb::FloatGrid::create(1.0f);
  empty->setName("empty");
  EXPECT_THROW(drawSlice(volumeOf(empty), "empty", {}), std::invalid_argument);
}

} // namespace
