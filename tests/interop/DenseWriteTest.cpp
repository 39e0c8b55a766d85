// Dense files are compared value for value with numpy and VTK in the tests of the Python module; here is what
// needs neither.
#include "Interop/DenseWrite.h"

#include "Interop/FileError.h"
#include "Interop/VdbMake.h"
#include "support/ReadAll.h"
#include "support/TempFolder.h"
#include "support/TurnedRamp.h"

#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <sstream>

namespace VLN::Test {
namespace {

using namespace VLN::Interop;

DenseVolume cloud(TempFolder const& folder) {
  std::string const file = folder / "cloud.vdb";
  makeCloud(file, 20000);
  return denseVolumeOf(importVdb(file).volumes.front());
}

std::string told(auto const& call) {
  try {
    call();
  } catch (FileError const& error) { return error.reason(); }
  return "";
}

TEST(DenseWriteTest, RequirementAVtiFileHoldsItsHeaderAndEveryValue) {
  TempFolder const folder;
  DenseVolume const volume = cloud(folder);
  std::string const file = folder / "a.vti";
  writeVti(file, volume);
  std::string const bytes = readAll(file);
  std::int64_t samples = 1;
  std::string extent;
  for (int a = 0; a < 3; ++a) {
    samples *= volume.box.max[a] - volume.box.min[a];
    extent +=
        (a ? " " : "") + std::to_string(volume.box.min[a]) + " " + std::to_string(volume.box.max[a] - 1);
  }
  EXPECT_NE(bytes.find("<Piece Extent=\"" + extent + "\">"), std::string::npos);
  std::size_t const data = bytes.find("encoding=\"raw\">\n_") + 17;
  std::uint64_t length = 0;
  std::memcpy(&length, bytes.data() + data, sizeof length);
  EXPECT_EQ(length, static_cast<std::uint64_t>(samples) * sizeof(float));
  EXPECT_EQ(bytes.substr(data + 8 + length), "\n</AppendedData>\n</VTKFile>\n");
}

TEST(DenseWriteTest, RequirementTheSameVolumeMakesTheSameFile) {
  TempFolder const folder;
  DenseVolume const volume = cloud(folder);
  writeNpz(folder / "a.npz", volume);
  writeNpz(folder / "b.npz", volume);
  std::string const bytes = readAll(folder / "a.npz");
  EXPECT_TRUE(bytes == readAll(folder / "b.npz"));
  EXPECT_EQ(bytes.substr(0, 4), "PK\x03\x04");
}

/// Of the grid, through a file.
DenseVolume denseOf(TempFolder const& folder, openvdb::GridBase::Ptr const& grid) {
  std::string const file = folder / "grid.vdb";
  openvdb::io::File(file).write(openvdb::GridPtrVec{grid});
  return denseVolumeOf(importVdb(file).volumes.front());
}

TEST(DenseWriteTest, RequirementATurnedVolumeHasItsDirections) {
  TempFolder const folder;
  auto const grid = turnedRamp();
  writeVti(folder / "a.vti", denseOf(folder, grid));
  std::string const bytes = readAll(folder / "a.vti");
  EXPECT_NE(bytes.find("WholeExtent=\"-8 15 0 15 8 23\""), std::string::npos);
  double origin[3] = {}, spacing[3] = {}, direction[9] = {};
  auto const numbers = [&](std::string const& name, double* to, int count) {
    std::istringstream in(bytes.substr(bytes.find(name + "=\"") + name.size() + 2, 400));
    for (int n = 0; n < count; ++n) in >> to[n];
  };
  numbers("Origin", origin, 3);
  numbers("Spacing", spacing, 3);
  numbers("Direction", direction, 9);
  for (openvdb::Vec3d const index :
       {openvdb::Vec3d(0, 0, 0), openvdb::Vec3d(-8, 3, 9), openvdb::Vec3d(15, 15, 23)}) {
    auto const expected = grid->transform().indexToWorld(index);
    for (int row = 0; row < 3; ++row) {
      double at = origin[row];
      for (int a = 0; a < 3; ++a) at += direction[3 * row + a] * spacing[a] * index[a];
      EXPECT_NEAR(at, expected[row], 1e-12);
    }
  }
}

TEST(DenseWriteTest, NegativeASkewedVolumeIsNoImage) {
  TempFolder const folder;
  auto const grid = turnedRamp();
  grid->transform().postScale(openvdb::Vec3d(1, 3, 1));
  DenseVolume const volume = denseOf(folder, grid);
  EXPECT_EQ(told([&] { writeVti(folder / "a.vti", volume); }),
            "the transform of the volume is skewed, which .vti files cannot tell");
  EXPECT_EQ(told([&] { writeNpz(folder / "a.npz", volume); }), "");
}

TEST(DenseWriteTest, NegativeWhatCannotBeWrittenIsToldAndLeavesNoFile) {
  TempFolder const folder;
  std::string const file = folder / "a.npz";
  DenseVolume const good = cloud(folder);
  auto const write = [&](DenseVolume const& volume) {
    std::string const reason = told([&] { writeNpz(file, volume); });
    EXPECT_EQ(told([&] { writeVti(file, volume); }), reason);
    EXPECT_FALSE(std::filesystem::exists(file));
    return reason;
  };
  DenseVolume volume = good;
  volume.channels.clear();
  EXPECT_EQ(write(volume), "there is no channel to be written");
  volume = good;
  volume.channels = {"there is none"};
  EXPECT_EQ(write(volume), "the channel 'there is none' is of a type that is not written");
  volume = good;
  volume.box = {};
  EXPECT_EQ(write(volume), "the volume has no active voxel, and so no box that could be written");
  volume = good;
  volume.depth = 29;
  EXPECT_EQ(write(volume), "depth 29 is none");
  volume = good;
  volume.box = {{-(1 << 28), -(1 << 28), 0}, {1 << 28, 1 << 28, 1}};
  EXPECT_NE(write(volume).find("choose a coarser depth"), std::string::npos);
  volume.depth = 8;
  EXPECT_EQ(told([&] { writeNpz(file, volume); }), "");
}

} // namespace
} // namespace VLN::Test
