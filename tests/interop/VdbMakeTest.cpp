#include "Interop/VdbMake.h"
#include "GeometryVolume/core/Parallel.h"
#include "Interop/FileError.h"
#include "Interop/NoiseImpl.h"
#include "Interop/VdbFileImpl.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <cmath>

namespace {

using namespace VLN::Interop;
using namespace VLN::Test;

openvdb::FloatGrid::Ptr onlyGrid(std::string const& path) {
  VdbFile const file = readVdbFile(path);
  if (file.grids.size() != 1) throw std::runtime_error("not one grid");
  return openvdb::gridPtrCast<openvdb::FloatGrid>(file.grids[0]);
}

// requirement
TEST(VdbMakeTest, ACloudIsAFogOfAboutTheWantedSize) {
  TempFolder folder;
  for (std::int64_t voxels : {1000, 30000, 200000}) {
    makeCloud(folder / "cloud.vdb", voxels);
    auto const grid = onlyGrid(folder / "cloud.vdb");
    ASSERT_TRUE(grid);
    EXPECT_EQ(grid->getName(), "density");
    EXPECT_EQ(grid->getGridClass(), openvdb::GRID_FOG_VOLUME);
    EXPECT_EQ(grid->background(), 0.0f);
    auto const count = double(grid->activeVoxelCount());
    EXPECT_NEAR(count / double(voxels), 1, voxels > 10000 ? 0.03 : 0.2);
    for (auto it = grid->cbeginValueOn(); it; ++it) {
      ASSERT_GT(*it, 0.0f);
      ASSERT_LE(*it, 1.0f);
    }
  }
}

// requirement: closed form, each value is the distance to the torus
TEST(VdbMakeTest, ATorusHoldsExactDistances) {
  TempFolder folder;
  makeTorus(folder / "torus.vdb", 100000);
  auto const grid = onlyGrid(folder / "torus.vdb");
  ASSERT_TRUE(grid);
  EXPECT_EQ(grid->getName(), "surface");
  EXPECT_EQ(grid->getGridClass(), openvdb::GRID_LEVEL_SET);
  EXPECT_NEAR(double(grid->activeVoxelCount()), 100000, 500);
  double const size = grid->voxelSize().x();
  EXPECT_NEAR(grid->background() / size, 3, 1e-6);
  for (auto it = grid->cbeginValueOn(); it; ++it) {
    auto const p = grid->indexToWorld(it.getCoord());
    double const ring = std::hypot(p.x(), p.y()) - 1;
    double const distance = std::hypot(ring, p.z()) - 0.4;
    ASSERT_NEAR(*it, distance, 1e-5) << it.getCoord();
    ASSERT_LT(std::abs(distance), 3.001 * size);
  }
  auto const values = grid->getConstAccessor();
  auto const at = [&](double x, double z) {
    return values.getValue(openvdb::Coord(int(x / size), 0, int(z / size)));
  };
  EXPECT_EQ(at(1, 0), -grid->background());
  EXPECT_EQ(at(0, 0), grid->background());
  EXPECT_EQ(at(1, 0.9), grid->background());
}

// requirement: same bytes on every run, whatever the threads
TEST(VdbMakeTest, MakesTheSameBytesEachTime) {
  TempFolder folder;
  for (auto* make : {&makeCloud, &makeTorus}) {
    std::vector<std::string> files;
    for (int threads : {1, 2, 8}) {
      VLN::withThreads(threads, [&] { make(folder / "made.vdb", 20000, {}); });
      files.push_back(readAll(folder / "made.vdb"));
    }
    EXPECT_TRUE(files[0] == files[1]);
    EXPECT_TRUE(files[0] == files[2]);
  }
  EXPECT_EQ(folder.names(), std::vector<std::string>{"made.vdb"});
}

// negative
TEST(VdbMakeTest, RefusesWhatItCannotDo) {
  TempFolder folder;
  EXPECT_THROW(makeCloud(folder / "a.vdb", kFewestMadeVoxels - 1), std::invalid_argument);
  EXPECT_THROW(makeTorus(folder / "a.vdb", kMostMadeVoxels + 1), std::invalid_argument);
  EXPECT_THROW(makeTorus(folder / "no/a.vdb", 2000), FileError);
  EXPECT_TRUE(folder.names().empty());
}

// boundary
TEST(NoiseTest, IsSmoothAndBounded) {
  double low = 0, high = 0;
  for (int n = 0; n < 20000; ++n) {
    double const x = n * 0.137 - 1000, y = n * 0.071, z = -n * 0.0311;
    double const a = gradientNoise(x, y, z, 5), b = gradientNoise(x + 1e-6, y, z, 5);
    ASSERT_NEAR(a, b, 1e-5);
    low = std::min(low, a), high = std::max(high, a);
    ASSERT_LT(std::abs(fractalNoise(x, y, z, 6, 1)), 2);
  }
  EXPECT_LT(low, -0.5);
  EXPECT_GT(high, 0.5);
  EXPECT_EQ(gradientNoise(3, -7, 12, 9), 0);
}

} // namespace
