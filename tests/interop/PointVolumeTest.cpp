// Point sets as volumes, and as points grids of .vdb files.
#include "Interop/PointVolume.h"
#include "Interop/FileError.h"
#include "Interop/Ply.h"
#include "Interop/VdbPoints.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <filesystem>
#include <limits>
#include <map>
#include <random>

using namespace VLN::Interop;
using Velorn::Math::double3;
using Velorn::Math::float3;
using VLN::Test::TempFolder;

namespace {

PointSet randomPoints(std::size_t count, float extent, double voxelSize = 0.25) {
  PointSet set;
  set.voxelSize = voxelSize;
  set.origin = {10, -20, 30};
  std::mt19937 random(7);
  std::uniform_real_distribution<float> along(-extent, extent);
  set.attributes = {makeAttribute<int>("id"), makeAttribute<float>("weight"),
                    makeAttribute<float3>("normal")};
  for (std::size_t n = 0; n < count; ++n) {
    set.positions.push_back({along(random), along(random), along(random)});
    set.attributes[0].append(static_cast<int>(n));
    set.attributes[1].append(along(random));
    set.attributes[2].append(float3{along(random), 0, 1});
  }
  return set;
}
/// Points by their id.
std::map<int, std::size_t> byId(PointSet const& set) {
  std::map<int, std::size_t> result;
  for (auto const& attribute : set.attributes) {
    if (attribute.name != "id") continue;
    for (std::size_t n = 0; n < set.size(); ++n) result[attribute.value<int>(n)] = n;
  }
  return result;
}
PointAttribute const& named(PointSet const& set, std::string const& name) {
  for (auto const& attribute : set.attributes)
    if (attribute.name == name) return attribute;
  throw std::out_of_range(name);
}
void expectPlaced(PointVolume const& volume) {
  auto const tree = volume.object->component<PointContainer>(kPointContainerName);
  auto const topology = volume.object->component<PointTopology>(kPointTopologyName);
  auto const positions = volume.object->component<PositionChannel>(kPositionsName);
  EXPECT_TRUE(tree->checkConsistency(false));
  EXPECT_TRUE(tree->checkBranchSizes(false));
  for (auto t = tree->cbeginTiles(); t != tree->cendTiles(); ++t) {
    auto const data = std::as_const(*positions).tileData((*t).treeIndex());
    ASSERT_EQ(topology->elementCount((*t).treeIndex()), data.size());
    for (float3 const& p : data) {
      ASSERT_TRUE((*t).contains(static_cast<int>(std::floor(p.x)), static_cast<int>(std::floor(p.y)),
                                static_cast<int>(std::floor(p.z))));
    }
  }
  for (auto const& [name, channel] : volume.attributes)
    EXPECT_EQ(volume.object->component(channel)->size(), positions->size()) << name;
}

TEST(PointVolume, HoldsEveryPointInItsTile) {
  auto const set = randomPoints(5000, 300);
  PointVolume const volume = buildPointVolume(set);
  expectPlaced(volume);
  EXPECT_EQ(volume.dropped, 0);
  auto const back = pointSetOf(volume);
  ASSERT_EQ(back.size(), set.size());
  auto const ids = byId(back);
  ASSERT_EQ(ids.size(), set.size());
  for (auto const& [id, n] : ids) {
    auto const was = static_cast<std::size_t>(id);
    ASSERT_EQ(back.positions[n], set.positions[was]);
    ASSERT_EQ(named(back, "weight").value<float>(n), set.attributes[1].value<float>(was));
    ASSERT_EQ(named(back, "normal").value<float3>(n), set.attributes[2].value<float3>(was));
  }
}

TEST(PointVolume, OfNoPointsAndOfPointsOutOfReach) {
  PointVolume const none = buildPointVolume({});
  EXPECT_EQ(none.object->component(kPositionsName)->size(), 0u);
  EXPECT_EQ(pointSetOf(none).size(), 0u);
  PointSet set = randomPoints(4, 10);
  set.positions[0].x = std::numeric_limits<float>::quiet_NaN();
  set.positions[1].y = 536870912.0f;
  set.positions[2].z = -std::numeric_limits<float>::infinity();
  PointVolume const volume = buildPointVolume(set);
  EXPECT_EQ(volume.dropped, 3);
  expectPlaced(volume);
  EXPECT_EQ(pointSetOf(volume).attributes[0].value<int>(0), 3);
}

TEST(PointVolume, NamesThatAreTakenGetANumber) {
  PointSet set;
  set.positions = {{1, 2, 3}};
  for (char const* name : {"positions", "", "point_component"}) {
    set.attributes.push_back(makeAttribute<float>(name));
    set.attributes.back().append(1.0f);
  }
  PointVolume const volume = buildPointVolume(set);
  EXPECT_EQ(volume.attributes[0].second, "positions_2");
  EXPECT_EQ(volume.attributes[1].second, "unnamed");
  EXPECT_EQ(volume.attributes[2].second, "point_component_2");
  EXPECT_EQ(pointSetOf(volume).attributes[0].name, "positions");
}

TEST(PointVolume, MovingConservesPointsAndTheirAttributes) {
  for (double const voxelSize : {1.0, 0.25, 3.0}) {
    auto const set = randomPoints(3000, 60, voxelSize);
    PointVolume volume = buildPointVolume(set);
    std::int64_t tiles = volume.object->component<PointContainer>(kPointContainerName)->tileCount(-1);
    for (int step = 0; step < 100; ++step) {
      auto const statistics = advect(volume, {0.3 * voxelSize, -0.11 * voxelSize, 1.7 * voxelSize});
      tiles += statistics.tilesGained - statistics.tilesLost;
      ASSERT_EQ(volume.object->component<PointContainer>(kPointContainerName)->tileCount(-1), tiles);
      ASSERT_EQ(volume.object->component(kPositionsName)->size(), set.size()) << "step " << step;
    }
    expectPlaced(volume);
    auto const back = pointSetOf(volume);
    auto const ids = byId(back);
    ASSERT_EQ(ids.size(), set.size());
    for (auto const& [id, n] : ids) {
      auto const was = static_cast<std::size_t>(id);
      ASSERT_NEAR(back.positions[n].x, set.positions[was].x + 30, 0.01);
      ASSERT_NEAR(back.positions[n].z, set.positions[was].z + 170, 0.01);
      ASSERT_EQ(named(back, "weight").value<float>(n), set.attributes[1].value<float>(was));
    }
  }
}

TEST(VdbPoints, WhatIsWrittenReadsBack) {
  TempFolder folder;
  auto const set = randomPoints(2000, 100, 0.5);
  writeVdbPoints(folder / "p.vdb", set, "cloud");
  auto const volumes = importVdbPoints(folder / "p.vdb");
  ASSERT_EQ(volumes.size(), 1u);
  PointVolume const& volume = volumes[0];
  EXPECT_EQ(volume.name, "cloud");
  EXPECT_EQ(volume.voxelSize, 0.5);
  EXPECT_EQ(volume.origin, set.origin);
  EXPECT_TRUE(volume.skippedAttributes.empty());
  expectPlaced(volume);
  auto const back = pointSetOf(volume);
  auto const ids = byId(back);
  ASSERT_EQ(ids.size(), set.size());
  for (auto const& [id, n] : ids) {
    auto const was = static_cast<std::size_t>(id);
    for (int a = 0; a < 3; ++a) ASSERT_NEAR(back.world(n)[a], set.world(was)[a], 1e-4);
    ASSERT_EQ(named(back, "weight").value<float>(n), set.attributes[1].value<float>(was));
    ASSERT_EQ(named(back, "normal").value<float3>(n), set.attributes[2].value<float3>(was));
  }
}

TEST(VdbPoints, FilesThatCannotBeReadOrWritten) {
  TempFolder folder;
  EXPECT_THROW(importVdbPoints(folder / "missing.vdb"), FileError);
  EXPECT_THROW(writeVdbPoints(folder / "no/such/p.vdb", {}), FileError);
  EXPECT_TRUE(folder.names().empty());
}

TEST(VdbPoints, RealFilesKeepTheirCounts) {
  std::string const data = VLN_TEST_DATA_DIR;
  if (data.empty() || !std::filesystem::exists(data + "/vdb/sphere_points.vdb"))
    GTEST_SKIP() << "no folder of real input files";
  auto const volumes = importVdbPoints(data + "/vdb/sphere_points.vdb");
  ASSERT_EQ(volumes.size(), 1u);
  EXPECT_EQ(volumes[0].object->component(kPositionsName)->size(), 9802u);
  expectPlaced(volumes[0]);
  PointVolume scan = buildPointVolume(readPly(data + "/points/autzen_stadium.ply"));
  EXPECT_EQ(scan.object->component(kPositionsName)->size(), 368119u);
  expectPlaced(scan);
  for (int step = 0; step < 5; ++step) advect(scan, {3, 1, -2});
  EXPECT_EQ(scan.object->component(kPositionsName)->size(), 368119u);
  expectPlaced(scan);
}

} // namespace
