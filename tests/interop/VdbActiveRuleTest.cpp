// Requirement tests: how an imported volume tells which voxels are active: by a rule, by a rule and a list,
// or by a channel of states.
#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/tiletree/TileAccessor.h"
#include "Interop/VdbExportImpl.h"
#include "Interop/VdbImportImpl.h"
#include "Interop/VdbRecord.h"
#include "Interop/VdbTreeImpl.h"
#include "support/VdbCompare.h"
#include "support/VdbGrids.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <random>
#include <set>

using namespace VLN::Interop;
using openvdb::Coord;
using openvdb::FloatGrid;

namespace {

using Values = VLN::TileTree3D::Channel<VdbTraits, float, 4, 0>;
using Voxels = std::set<std::array<int, 3>>;

VdbImport importOf(openvdb::GridPtrVec const& grids) {
  VdbFile file;
  file.path = "memory";
  file.grids = grids;
  return importGrids(file);
}

VdbGridRecord recordOf(VdbImport const& import, std::size_t n = 0) {
  Ostil::Any const holder = import.volumes.at(0).object->getProperty(kVdbGridsProperty);
  return (*holder.get<Ostil::Array<VdbGridRecord>>())[n];
}

Voxels listOf(VdbGridRecord const& record) {
  Voxels list;
  for (auto const& v : record.alsoActive) list.insert({v.x, v.y, v.z});
  return list;
}

FloatGrid::Ptr floatBand() { return openvdb::gridPtrCast<FloatGrid>(VLN::Test::band()); }

/// Gives some active voxels the background's value, of either sign.
Voxels flatten(FloatGrid& grid, std::size_t count) {
  std::vector<Coord> active;
  for (auto it = grid.cbeginValueOn(); it; ++it) active.push_back(it.getCoord());
  std::shuffle(active.begin(), active.end(), std::mt19937(3));
  Voxels changed;
  for (std::size_t n = 0; n < count; ++n) {
    grid.tree().setValueOnly(active[n], n % 2 ? grid.background() : -grid.background());
    changed.insert({active[n].x(), active[n].y(), active[n].z()});
  }
  return changed;
}

void expectSameBack(openvdb::GridBase const& grid, VdbImport const& import) {
  EXPECT_EQ(VdbCompare::difference(grid, *exportedGrids(import).at(0)), "");
}

} // namespace

TEST(VdbActiveRule, RequirementAFewVoxelsOffTheRuleAreListed) {
  openvdb::initialize();
  auto const grid = floatBand();
  Voxels const changed = flatten(*grid, std::size_t(grid->tree().leafCount()));
  VdbImport const import = importOf({grid});
  auto const record = recordOf(import);
  EXPECT_EQ(record.rule, VdbActiveRule::kInsideBand);
  EXPECT_EQ(record.stateChannel, "");
  EXPECT_EQ(listOf(record), changed);
  EXPECT_EQ(record.alsoActive.size(), changed.size());
  EXPECT_FALSE(import.volumes.at(0).object->hasComponentFromName("band_active"));
  expectSameBack(*grid, import);
}

TEST(VdbActiveRule, RequirementARuleWithoutExceptionsComesFirst) {
  openvdb::initialize();
  auto const grid = floatBand();
  EXPECT_EQ(recordOf(importOf({grid})).rule, VdbActiveRule::kInsideBand);
  EXPECT_TRUE(recordOf(importOf({grid})).alsoActive.empty());
  // Active are the same voxels by either rule, but one.
  auto const fog = FloatGrid::create(0.0f);
  for (int n = 0; n < 500; ++n) fog->tree().setValueOn(Coord(n % 9, n / 9 % 7, n / 63), float(n) + 1);
  fog->tree().setValueOn(Coord(2, 3, 4), 0);
  auto const record = recordOf(importOf({fog}));
  EXPECT_EQ(record.rule, VdbActiveRule::kNotBackground);
  EXPECT_EQ(listOf(record), (Voxels{{2, 3, 4}}));
}

TEST(VdbActiveRule, RequirementManyVoxelsOffTheRuleAreToldByAChannel) {
  openvdb::initialize();
  auto const grid = floatBand();
  flatten(*grid, std::size_t(grid->tree().leafCount()) + 1);
  VdbImport const import = importOf({grid});
  auto const record = recordOf(import);
  EXPECT_EQ(record.rule, VdbActiveRule::kChannel);
  EXPECT_TRUE(record.alsoActive.empty());
  EXPECT_TRUE(import.volumes.at(0).object->hasComponentFromName(record.stateChannel));
  expectSameBack(*grid, import);
}

TEST(VdbActiveRule, RequirementInactiveVoxelsThatLookActiveAreToldByAChannel) {
  openvdb::initialize();
  auto const grid = floatBand();
  grid->tree().setValueOff(Coord(9, 0, 0), 0.5f);
  VdbImport const import = importOf({grid});
  EXPECT_EQ(recordOf(import).rule, VdbActiveRule::kChannel);
  expectSameBack(*grid, import);
}

TEST(VdbActiveRule, RequirementActiveTilesAreToldByAChannel) {
  openvdb::initialize();
  auto const grid = floatBand();
  grid->tree().addTile(1, Coord(64, 64, 64), 1.0f, true);
  VdbImport const import = importOf({grid});
  EXPECT_EQ(recordOf(import).rule, VdbActiveRule::kChannel);
  expectSameBack(*grid, import);
}

TEST(VdbActiveRule, BoundaryAListedVoxelAloneHasALeaf) {
  openvdb::initialize();
  auto const grid = FloatGrid::create(5.0f);
  for (int n = 0; n < 20; ++n) grid->tree().setValueOn(Coord(n, 2 * n, n / 2), float(n) / 5);
  // Leaves on both sides of the origin in which no value differs from the background.
  grid->tree().setValueOn(Coord(-1, -1, -1), 5.0f);
  grid->tree().setValueOn(Coord(1000, -2000, 3000), 5.0f);
  grid->setName("alone");
  VdbImport const import = importOf({grid});
  EXPECT_EQ(listOf(recordOf(import)), (Voxels{{-1, -1, -1}, {1000, -2000, 3000}}));
  expectSameBack(*grid, import);
}

TEST(VdbActiveRule, RequirementOtherTypesHaveListsAsWell) {
  openvdb::initialize();
  auto const ints = openvdb::Int32Grid::create(7);
  auto const vectors = openvdb::Vec3SGrid::create(openvdb::Vec3s(1, 2, 3));
  std::mt19937 random(8);
  auto const place = [&] { return int(random() % 60) - 30; };
  for (int n = 0; n < 2000; ++n) {
    ints->tree().setValueOn(Coord(place(), place(), place()), n + 8);
    vectors->tree().setValueOn(Coord(place(), place(), place()), openvdb::Vec3s(float(n), 0, 1));
  }
  for (int n = 0; n < 10; ++n) {
    ints->tree().setValueOn(Coord(place(), place(), place()), 7);
    vectors->tree().setValueOn(Coord(place(), place(), place()), openvdb::Vec3s(1, 2, 3));
  }
  VdbImport const a = importOf({ints}), b = importOf({vectors});
  EXPECT_FALSE(recordOf(a).alsoActive.empty());
  EXPECT_FALSE(recordOf(b).alsoActive.empty());
  expectSameBack(*ints, a);
  expectSameBack(*vectors, b);
}

TEST(VdbActiveRule, RequirementListedVoxelsStayActiveWhateverIsWritten) {
  openvdb::initialize();
  auto const grid = floatBand();
  Voxels const changed = flatten(*grid, 6);
  VdbImport const import = importOf({grid});
  auto& object = *import.volumes.at(0).object;
  auto const tree = object.component<VdbContainer>(kVdbContainerName);
  auto const values = object.component<Values>("band");
  auto tiles = tree->tileAccessor();
  auto writable = values->tileDataAccessor();
  auto const write = [&](std::array<int, 3> const& c, float value) {
    auto const at = tiles.treeIndex(c[0], c[1], c[2], VdbTraits::kMaxDepth, true);
    ASSERT_TRUE(at.valid());
    writable.tileData(at)(c[0] & 3, c[1] & 3, c[2] & 3) = value;
  };
  write(*changed.begin(), 0.25f);
  write(*std::next(changed.begin()), 3.0f);
  auto const back = openvdb::gridPtrCast<FloatGrid>(exportedGrids(import).at(0));
  for (auto const& c : changed) EXPECT_TRUE(back->tree().isValueOn(Coord(c[0], c[1], c[2])));
  auto const first = *changed.begin();
  EXPECT_EQ(back->tree().getValue(Coord(first[0], first[1], first[2])), 0.25f);
  EXPECT_EQ(back->activeVoxelCount(), grid->activeVoxelCount());
}

TEST(VdbActiveRule, RequirementListedVoxelsGoWithTheirTiles) {
  openvdb::initialize();
  auto const grid = floatBand();
  Voxels const changed = flatten(*grid, 6);
  VdbImport const import = importOf({grid});
  auto& object = *import.volumes.at(0).object;
  auto tree = object.extractComponent<VdbContainer>(kVdbContainerName);
  auto topology = object.extractComponent<VdbTopology>(kVdbTopologyName);
  auto values = object.extractComponent<Values>("band");
  auto const gone = *changed.begin();
  auto const at = tree->tileAccessor().treeIndex(gone[0], gone[1], gone[2], VdbTraits::kMaxDepth, true);
  ASSERT_TRUE(at.valid());
  tree->tileAccessor().removeTile(at, true);
  topology->update(*tree);
  values->update(*topology);
  object.addComponent(std::move(tree));
  object.addComponent(std::move(topology));
  object.addComponent(std::move(values));
  auto const back = openvdb::gridPtrCast<FloatGrid>(exportedGrids(import).at(0));
  int const corner[3] = {gone[0] & -4, gone[1] & -4, gone[2] & -4};
  std::int64_t lost = 0;
  for (int n = 0; n < 64; ++n) {
    Coord const c(corner[0] + n % 4, corner[1] + n / 4 % 4, corner[2] + n / 16);
    lost += grid->tree().isValueOn(c);
    if (changed.contains({c.x(), c.y(), c.z()})) { EXPECT_FALSE(back->tree().isValueOn(c)) << c; }
  }
  EXPECT_GT(lost, 0);
  // What the tile above says there is the rule's.
  EXPECT_FALSE(back->tree().isValueOn(Coord(gone[0], gone[1], gone[2])));
}
