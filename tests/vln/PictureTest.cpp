// Pictures of grids as people have them, judged by their pixels.
#include "Interop/VdbTypesImpl.h"
#include "support/PngReader.h"
#include "support/TurnedRamp.h"
#include "support/VlnProgram.h"

#include <cmath>
#include <limits>

namespace {

using namespace VLN::Test;
using VLN::Interop::Image;
using VLN::Interop::Rgb;

constexpr Rgb kPaper{255, 255, 255}, kGrey{222, 222, 222};

class PictureTest : public testing::Test {
protected:
  PictureTest() { openvdb::initialize(); }
  std::string file(openvdb::GridPtrVec const& grids) {
    std::string const path = m_folder / "grid.vdb";
    openvdb::io::File(path).write(grids);
    return path;
  }
  Image slice(std::string const& path, std::vector<std::string> more) {
    std::string const picture = m_folder / "p.png";
    more.insert(more.begin(), {"slice", path, "--size", "200", "--no-title", "-o", picture});
    RunResult const run = vln(more);
    EXPECT_EQ(run.code, 0) << run.err;
    m_said = run.out;
    return readPng(picture);
  }
  // Width and height of what is neither paper nor ink, left of the scale.
  static std::pair<int, int> planeSize(Image const& image) {
    int const row = image.height() / 2;
    int left = 0, right = 0, top = 0, bottom = image.height() - 1;
    while (image(left, row) == kPaper) ++left;
    for (right = left; !(image(right, row) == kPaper);) ++right;
    int const column = (left + right) / 2;
    while (image(column, top) == kPaper) ++top;
    while (image(column, bottom) == kPaper) --bottom;
    return {right - left, bottom + 1 - top};
  }
  static int count(Image const& image, Rgb color) {
    int n = 0;
    for (int y = 0; y < image.height(); ++y)
      for (int x = 0; x < image.width(); ++x) n += image(x, y) == color;
    return n;
  }
  template <class GridT> typename GridT::Ptr filled(char const* name, int width, auto const& value) {
    auto grid = GridT::create();
    grid->setName(name);
    for (auto it = openvdb::CoordBBox({0, 0, 0}, openvdb::Coord(width - 1)).begin(); it; ++it)
      grid->tree().setValueOn(*it, value(*it));
    return grid;
  }

  TempFolder m_folder;
  std::string m_said;
};

// regression: voxels of 1 x 1 x 4 were drawn as cubes
TEST_F(PictureTest, RegressionLongVoxelsAreLong) {
  auto grid = filled<openvdb::FloatGrid>("f", 16, [](auto const& c) { return float(c.x() + c.z()); });
  auto transform = openvdb::math::Transform::createLinearTransform(1.0);
  transform->preScale(openvdb::Vec3d(1, 1, 4));
  grid->setTransform(transform);
  std::string const path = file({grid});
  EXPECT_EQ(planeSize(slice(path, {"--channel", "f", "--axis", "x"})), std::pair(50, 200));
  EXPECT_EQ(planeSize(slice(path, {"--channel", "f", "--axis", "z"})), std::pair(200, 200));
  EXPECT_EQ(planeSize(slice(path, {"--channel", "f", "--axis", "x", "--index-space"})), std::pair(200, 200));
  slice(path, {"--channel", "f", "--axis", "z", "--at", "20"});
  EXPECT_NE(m_said.find("z = 20"), std::string::npos) << m_said;
}

// regression: on a turned grid the position named a plane of the grid's own
TEST_F(PictureTest, RegressionPlanesLieInTheWorld) {
  // The ramp grows by (2, -1, 0.5) in world space, and the grid is turned about z.
  std::string const path = file({turnedRamp()});
  double const far = 1000;
  Image const image = slice(path, {"--channel", "ramp", "--axis", "x", "--at", "2.35", "--range",
                                   std::to_string(-far), std::to_string(far), "--cmap", "gray"});
  EXPECT_NE(m_said.find("x = 2.35"), std::string::npos);
  EXPECT_GT(count(image, kGrey), 0) << "beyond the turned box";
  Image const top = slice(
      path, {"--channel", "ramp", "--axis", "z", "--at", "5.1", "--cmap", "gray", "--range", "20", "60"});
  // Along a row x grows by the same step in each pixel, and with it the value: 2 * step * 255 / 40 levels.
  auto const size = planeSize(top);
  int const row = top.height() / 2, middle = 8 + size.first / 2;
  int const left = top(middle - 20, row).r, right = top(middle + 20, row).r;
  int const above = top(middle, row - 20).r, below = top(middle, row + 20).r;
  EXPECT_GT(right, left);
  EXPECT_NEAR(double(right - left) / (below - above), 2.0, 0.35)
      << "values grow by 2 along x, fall by 1 along y";
}

// regression: one outlier blanked the picture
TEST_F(PictureTest, RegressionOneOutlierLeavesTheRest) {
  for (float const sign : {1.0f, -1.0f}) {
    auto grid = filled<openvdb::FloatGrid>("f", 32, [](auto const& c) { return float(c.x()); });
    grid->tree().setValueOn({16, 16, 16}, sign * 1e9f);
    Image const image = slice(file({grid}), {"--channel", "f", "--axis", "z", "--nearest", "--at", "16"});
    Rgb const a = image(8 + 20, image.height() / 4), b = image(8 + 180, image.height() / 4);
    EXPECT_GT(std::abs(a.r - b.r) + std::abs(a.g - b.g) + std::abs(a.b - b.b), 150) << sign;
  }
}

// requirement: integers, vectors and their components
TEST_F(PictureTest, RequirementIntegersAndVectors) {
  auto counts = filled<openvdb::Int32Grid>("count", 8, [](auto const& c) { return c.x() * 10; });
  auto vectors = filled<openvdb::Vec3fGrid>(
      "v", 8, [](auto const& c) { return openvdb::Vec3f(float(c.x()) - 3.5f, 4, float(c.y())); });
  std::string const path = file({counts, vectors});
  slice(path, {"--channel", "count", "--axis", "z"});
  EXPECT_NE(m_said.find("values 0 .. 70"), std::string::npos) << m_said;
  slice(path, {"--channel", "v", "--axis", "z", "--component", "x"});
  EXPECT_NE(m_said.find("v_x at z = 3.5: values -3.5 .. 3.5"), std::string::npos) << m_said;
  slice(path, {"--channel", "v", "--axis", "z", "--component", "y"});
  EXPECT_NE(m_said.find("values 4 .. 4"), std::string::npos) << m_said;
  RunResult const run = vln(
      {"slice", path, "--channel", "count", "--axis", "z", "--component", "x", "-o", m_folder / "no.png"});
  expectFailure(run, path + ": channel 'count' has no component x");
}

// requirement: two-sided colours only where both signs matter
TEST_F(PictureTest, RequirementTwoSidesWhereBothSignsMatter) {
  auto const gridFrom = [&](float low) {
    return filled<openvdb::FloatGrid>("f", 16, [=](auto const& c) { return low + float(c.x()); });
  };
  auto const whiteAtZero = [&](openvdb::FloatGrid::Ptr const& grid) {
    Image const image = slice(file({grid}), {"--channel", "f", "--axis", "z", "--nearest"});
    double const zero = -double(grid->tree().getValue({0, 0, 0}));
    Rgb const c = image(8 + int((zero + 0.5) * 200 / 16), image.height() / 2);
    return c.r > 200 && c.g > 200 && c.b > 200;
  };
  EXPECT_TRUE(whiteAtZero(gridFrom(-8)));
  EXPECT_FALSE(whiteAtZero(gridFrom(-0.01f)));
}

// requirement: what is no number has a place in the legend
TEST_F(PictureTest, RequirementNotANumberIsInTheLegend) {
  auto grid = filled<openvdb::FloatGrid>("f", 8, [](auto const& c) { return float(c.x()); });
  std::string const path = file({grid});
  Rgb const magenta{255, 0, 255};
  EXPECT_EQ(count(slice(path, {"--channel", "f", "--axis", "z", "--nearest"}), magenta), 0);
  grid->tree().setValueOn({3, 3, 3}, std::numeric_limits<float>::quiet_NaN());
  Image const image = slice(file({grid}), {"--channel", "f", "--axis", "z", "--nearest", "--at", "3"});
  EXPECT_EQ(count(image, magenta), 25 * 25 + 12 * 12);
}

// requirement: the title stands above, and can be left out
TEST_F(PictureTest, RequirementATitleNamesThePlane) {
  auto grid = filled<openvdb::FloatGrid>("f", 8, [](auto const& c) { return float(c.x()); });
  std::string const path = file({grid}), picture = m_folder / "titled.png";
  Image const bare = slice(path, {"--channel", "f", "--axis", "z"});
  ASSERT_EQ(vln({"slice", path, "--channel", "f", "--axis", "z", "--size", "200", "-o", picture}).code, 0);
  Image const titled = readPng(picture);
  EXPECT_EQ(titled.height(), bare.height() + 15);
  EXPECT_EQ(titled.width(), bare.width());
}

} // namespace
