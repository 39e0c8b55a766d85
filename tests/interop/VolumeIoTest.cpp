#include "Interop/VolumeIo.h"

#include "Interop/FileError.h"
#include "Interop/VdbMake.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <random>

namespace VLN::Test {
namespace {

using namespace VLN::Interop;
using TileTree3D::Volume;
using Velorn::Math::float3;

TEST(VolumeIoTest, RequirementFieldsComeBackFromAVdbFile) {
  TempFolder const folder;
  std::string const file = folder / "made.vdb";
  Volume volume(0.25f);
  auto density = volume.addField<float>("density", 0.5f);
  auto velocity = volume.addField<float3>("velocity", {});
  std::mt19937 random(1);
  std::vector<Velorn::Math::int3> positions;
  for (int n = 0; n < 3000; ++n) {
    auto const c = [&] { return static_cast<int>(random() % 300) - 150; };
    positions.push_back({c(), c(), c()});
    density.set(positions.back(), float(n));
    if (n % 3 == 0) velocity.set(positions.back(), {float(n), 1, 2});
  }
  save(volume, file);
  Volume const back = load(file);
  EXPECT_EQ(back.fieldNames(), (std::vector<std::string>{"density", "velocity"}));
  EXPECT_EQ(back.voxelSize(), 0.25f);
  auto const d = back.field<float>("density");
  auto const v = back.field<float3>("velocity");
  EXPECT_EQ(d.background(), 0.5f);
  for (auto const& p : positions) {
    ASSERT_EQ(d.get(p), density.get(p));
    ASSERT_EQ(v.get(p), velocity.get(p));
    ASSERT_EQ(d.get(p + Velorn::Math::int3{1, 1, 0}), density.get(p + Velorn::Math::int3{1, 1, 0}));
  }
}

TEST(VolumeIoTest, RequirementALoadedVolumeCanBeWrittenOnAndSavedAgain) {
  TempFolder const folder;
  std::string const file = folder / "cloud.vdb", again = folder / "again.vdb";
  makeCloud(file, 20000);
  Volume volume = load(file);
  auto density = volume.field<float>("density");
  float const before = density.get(0, 0, 0);
  density.set(1000, 0, 0, 3.0f);
  volume.addField<int>("id", 0).set(5, 5, 5, 9);
  save(volume, again);
  Volume const back = load(again);
  EXPECT_EQ(back.field<float>("density").get(0, 0, 0), before);
  EXPECT_EQ(back.field<float>("density").get(1000, 0, 0), 3.0f);
  EXPECT_EQ(back.field<int>("id").get(5, 5, 5), 9);
  EXPECT_EQ(back.voxelSize(), volume.voxelSize());
}

TEST(VolumeIoTest, RequirementFieldsComeBackFromAFlatFile) {
  TempFolder const folder;
  std::string const file = folder / "made.nvtt";
  Volume volume(0.5f);
  auto density = volume.addField<float>("density", 0);
  for (int n = 0; n < 500; ++n) density.set(n % 10, n / 10 % 10, n / 100, float(n));
  save(volume, file);
  Volume const back = load(file);
  auto const d = back.field<float>("density");
  for (int n = 0; n < 500; ++n) ASSERT_EQ(d.get(n % 10, n / 10 % 10, n / 100), float(n));
}

TEST(VolumeIoTest, NegativeSuffixesTypesAndFilesThatAreNone) {
  TempFolder const folder;
  Volume volume;
  volume.addField<unsigned char>("mask", 0).set(0, 0, 0, 1);
  EXPECT_THROW(save(volume, folder / "a.ply"), FileError);
  EXPECT_THROW(save(volume, folder / "a.vdb"), FileError);
  EXPECT_THROW(load(folder / "none.vdb"), FileError);
}

} // namespace
} // namespace VLN::Test
