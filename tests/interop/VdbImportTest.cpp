#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "ImportCheck.h"
#include "Interop/FileError.h"
#include "Interop/VdbMake.h"
#include "support/RealVolumes.h"
#include "support/TempFolder.h"

#include <openvdb/tools/LevelSetSphere.h>

#include <limits>
#include <numeric>

namespace {

using namespace VLN::Interop;
using namespace VLN::Test;
using openvdb::Coord;
using openvdb::CoordBBox;
using openvdb::FloatGrid;

VdbFile inMemory(openvdb::GridPtrVec grids) {
  VdbFile file;
  file.path = "in memory";
  file.grids = std::move(grids);
  return file;
}

FloatGrid::Ptr makeGrid(std::string const& name, float background = 0) {
  openvdb::initialize();
  auto grid = FloatGrid::create(background);
  grid->setName(name);
  return grid;
}

// Imports one grid and holds it against OpenVDB's own reading.
VdbImport checkedImport(FloatGrid::Ptr grid) {
  VdbImport result = importGrids(inMemory({grid}));
  EXPECT_EQ(result.volumes.size(), 1u);
  EXPECT_TRUE(result.skipped.empty());
  TreeReader const reader(result.volumes.at(0), result.volumes[0].channels.at(0).name);
  expectSoundTree(reader.tree());
  Comparison const c = compareAll(*grid, reader);
  EXPECT_EQ(c.wrong, 0) << c.first;
  EXPECT_EQ(c.active, std::int64_t(grid->activeVoxelCount()));
  EXPECT_EQ(result.volumes[0].channels[0].activeVoxels, c.active);
  EXPECT_EQ(wrongSamples(*grid, reader), 0);
  return result;
}

std::vector<std::int64_t> tileCounts(VdbVolume const& volume) {
  std::vector<std::int64_t> counts;
  auto const tree = volume.object->component<Tree>("voxel_tile_tree");
  for (int d = 0; d <= Tree::kMaxDepth; ++d) counts.push_back(tree->tileCount(d));
  return counts;
}

// requirement: what the object is made of
TEST(VdbImportTest, AssemblesAnObject) {
  auto grid = makeGrid("density", 0.25f);
  grid->setTransform(openvdb::math::Transform::createLinearTransform(0.5));
  grid->tree().setValueOn(Coord(1, 2, 3), 7.0f);
  VdbImport const result = checkedImport(grid);
  VdbVolume const& volume = result.volumes[0];
  EXPECT_EQ(volume.voxelSize, 0.5);
  EXPECT_EQ(volume.transform, "");
  auto const tree = volume.object->component<Tree>("voxel_tile_tree");
  auto const topology = volume.object->component<VLN::TileTree3D::VoxelTopology<Shape>>("voxel_component");
  auto const channel = volume.object->component<FloatChannel>("density");
  ASSERT_TRUE(tree && topology && channel);
  EXPECT_EQ(tree->voxelSize(), 0.5f);
  EXPECT_EQ(topology->offsetType(), VLN::TileTree3D::kVoxelOffsetCorner);
  EXPECT_EQ(topology->voxelSize(), 0.5f);
  EXPECT_EQ(topology->getTargetName(), "voxel_tile_tree");
  EXPECT_EQ(topology->tileCount(-1), tree->tileCount(-1));
  EXPECT_EQ(channel->getTargetName(), "voxel_component");
  EXPECT_EQ(channel->defaultValue(), 0.25f);
  EXPECT_EQ(channel->size(), 64u * std::uint64_t(tree->tileCount(-1)));
  EXPECT_EQ(volume.channels[0].type, "float");
  EXPECT_EQ(volume.channels[0].minimum, 7);
  EXPECT_EQ(volume.channels[0].maximum, 7);
  EXPECT_EQ(volume.activeBox.min, (Velorn::Math::int3{1, 2, 3}));
  EXPECT_EQ(volume.activeBox.max, (Velorn::Math::int3{2, 3, 4}));
  // One leaf, of which only one block of four voxels is needed: the rest is background. The voxel lies at the
  // block's high side, so that a blend goes on into the next root.
  EXPECT_EQ(tree->tileCount(28), 2);
  EXPECT_EQ(tree->tileCount(-1), 2);
}

// What a tile of the widest kind needs round it fills gigabytes under a sanitizer.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kWidestTiles = false;
#else
constexpr bool kWidestTiles = true;
#endif

// requirement: active tiles become coarse samples, and stay coarse but for the blocks at their surfaces
TEST(VdbImportTest, KeepsActiveTilesOfEveryLevelCoarse) {
  struct Case {
    int width, depth, insideDepth;
  };
  for (Case const c : {Case{8, 25, 27}, Case{128, 21, 23}, Case{4096, 16, 18}}) {
    if (c.width == 4096 && !kWidestTiles) continue;
    auto grid = makeGrid("tiles");
    int const level = c.width == 8 ? 1 : c.width == 128 ? 2 : 3;
    Coord const corner(-c.width, 0, 3 * c.width);
    grid->tree().addTile(openvdb::Index(level), corner, 2.5f, true);
    VdbImport const result = checkedImport(grid);
    TreeReader const reader(result.volumes[0], "tiles");
    // As wide as the tile, below the one whose sample is the tile.
    EXPECT_EQ(reader.depthAt(corner), c.insideDepth) << "width " << c.width;
    EXPECT_EQ(reader.depthAt(corner.offsetBy(c.width - 1)), 28) << "width " << c.width;
    EXPECT_EQ(reader.depthAt(corner.offsetBy(-1)), 28) << "width " << c.width;
    // The tile's high sides and what lies before its low ones, and not more.
    std::int64_t const across = c.width / 4;
    std::int64_t const inside = across * across * across - (across - 1) * (across - 1) * (across - 1);
    std::int64_t const before = (across + 1) * (across + 1) * (across + 1) - across * across * across;
    auto const counts = tileCounts(result.volumes[0]);
    EXPECT_EQ(counts[28], inside + before) << "width " << c.width;
    EXPECT_GE(counts[std::size_t(c.depth)], 1) << "width " << c.width;
    EXPECT_EQ(result.volumes[0].activeBox.max.x, 0);
    EXPECT_EQ(result.volumes[0].activeBox.min.x, -c.width);
  }
}

// requirement
TEST(VdbImportTest, ReadsAFogWithTilesAtSeveralLevels) {
  auto grid = makeGrid("fog");
  grid->fill(CoordBBox(Coord(-300, -20, 5), Coord(200, 150, 290)), 0.75f);
  grid->fill(CoordBBox(Coord(0), Coord(63)), 0.0f, false);
  for (int n = 0; n < 200; ++n) grid->tree().setValueOn(Coord(n, n / 2, -n), float(n));
  if (kWidestTiles) grid->tree().addTile(3, Coord(4096, 0, 0), 0.125f, true);
  grid->tree().addTile(2, Coord(1024, 0, 128), 3.0f, false);
  checkedImport(grid);
}

// requirement: a level set keeps its negative inside in the coarse samples
TEST(VdbImportTest, ReadsALevelSet) {
  openvdb::initialize();
  auto grid = openvdb::tools::createLevelSetSphere<FloatGrid>(200, openvdb::Vec3f(3, -50, 20), 1.0f, 3.0f);
  grid->setName("sphere");
  VdbImport const result = checkedImport(grid);
  TreeReader const reader(result.volumes[0], "sphere");
  // 400 voxels across: roots at depth 27 would do, but the deep inside needs coarser samples.
  EXPECT_EQ(reader.tree().rootCount(27), 0);
  EXPECT_LT(reader.tree().tileCount(28), 8 * reader.tree().tileCount(27));
  EXPECT_LT(result.volumes[0].channels[0].minimum, -2.9);
}

// requirement: exactly as deep as the box asks
// The box counts with the voxels around it, and with one root more behind its high sides.
TEST(VdbImportTest, PutsRootsWhereTheBoxSpans64Tiles) {
  struct Case {
    int last, depth;
  };
  for (Case const c :
       {Case{0, 28}, Case{247, 28}, Case{248, 27}, Case{495, 27}, Case{496, 26}, Case{5000, 23}}) {
    auto grid = makeGrid("two");
    grid->tree().setValueOn(Coord(0), 1.0f);
    grid->tree().setValueOn(Coord(0, c.last, 0), 1.0f);
    VdbImport const result = checkedImport(grid);
    auto const tree = result.volumes[0].object->component<Tree>("voxel_tile_tree");
    EXPECT_GT(tree->rootCount(c.depth), 0) << "voxel " << c.last;
  }
}

// boundary
TEST(VdbImportTest, ReachesTheEndsOfTheDomain) {
  auto grid = makeGrid("ends");
  for (int a : {Shape::kMinTileCoord, -1, 0, Shape::kMaxTileCoord})
    for (int b : {Shape::kMinTileCoord, Shape::kMaxTileCoord}) grid->tree().setValueOn(Coord(a, b, b), 1.5f);
  checkedImport(grid);
}

// negative: what has no place in the tree is named, and the rest comes in
TEST(VdbImportTest, SkipsGridsBeyondTheDomain) {
  auto far = makeGrid("far"), near = makeGrid("near");
  far->tree().setValueOn(Coord(0, 0, Shape::kMaxTileCoord + 1), 1.0f);
  near->tree().setValueOn(Coord(-1, -2, -3), 1.0f);
  VdbImport const result = importGrids(inMemory({far, near}));
  ASSERT_EQ(result.skipped.size(), 1u);
  EXPECT_EQ(result.skipped[0].grid, "far");
  EXPECT_NE(result.skipped[0].reason.find("outside -536870912..536870911"), std::string::npos);
  ASSERT_EQ(result.volumes.size(), 1u);
  EXPECT_EQ(TreeReader(result.volumes[0], "near")(Coord(-1, -2, -3)), 1.0f);
}

// requirement
TEST(VdbImportTest, GridsThatShareATransformShareAnObject) {
  auto a = makeGrid("a"), b = makeGrid("b", -1), c = makeGrid("c");
  a->fill(CoordBBox(Coord(0), Coord(40)), 1.0f);
  b->fill(CoordBBox(Coord(20), Coord(90)), 2.0f);
  c->fill(CoordBBox(Coord(0), Coord(5)), 3.0f);
  c->setTransform(openvdb::math::Transform::createLinearTransform(0.1));
  VdbImport const result = importGrids(inMemory({a, c, b}));
  ASSERT_EQ(result.volumes.size(), 2u);
  ASSERT_EQ(result.volumes[0].channels.size(), 2u);
  ASSERT_EQ(result.volumes[1].channels.size(), 1u);
  EXPECT_EQ(result.volumes[0].activeBox.max, (Velorn::Math::int3{91, 91, 91}));
  struct {
    FloatGrid::Ptr grid;
    std::size_t volume;
  } const pairs[] = {{a, 0}, {b, 0}, {c, 1}};
  for (auto const& pair : pairs) {
    TreeReader const reader(result.volumes[pair.volume], pair.grid->getName());
    expectSoundTree(reader.tree());
    Comparison const difference = compareAll(*pair.grid, reader);
    EXPECT_EQ(difference.wrong, 0) << pair.grid->getName() << difference.first;
    EXPECT_EQ(wrongSamples(*pair.grid, reader), 0);
    EXPECT_EQ(reader.channel().tileCount(-1), reader.tree().tileCount(-1));
  }
}

// boundary
TEST(VdbImportTest, ChannelNamesAreDistinctAndFree) {
  openvdb::GridPtrVec grids;
  for (char const* name : {"density", "density", "", "voxel_tile_tree", "density_2"}) {
    auto grid = makeGrid(name);
    grid->tree().setValueOn(Coord(0), float(grids.size()) + 1);
    grids.push_back(grid);
  }
  VdbImport const result = importGrids(inMemory(grids));
  ASSERT_EQ(result.volumes.size(), 1u);
  std::vector<std::string> names;
  for (std::size_t n = 0; n < grids.size(); ++n) {
    names.push_back(result.volumes[0].channels[n].name);
    EXPECT_EQ(result.volumes[0].channels[n].gridName, grids[n]->getName());
    EXPECT_EQ(TreeReader(result.volumes[0], names.back())(Coord(0)), float(n) + 1);
  }
  EXPECT_EQ(names, (std::vector<std::string>{"density", "density_2", "unnamed", "voxel_tile_tree_2",
                                             "density_2_2"}));
}

// requirement: other transforms come in, and are told
TEST(VdbImportTest, TellsTransformsThatAreMoreThanAScale) {
  using openvdb::math::Transform;
  auto scaled = Transform::createLinearTransform(2.0);
  EXPECT_EQ(transformBesidesScale(*scaled), "");
  scaled->postTranslate(openvdb::Vec3d(1, 0, 0));
  EXPECT_EQ(transformBesidesScale(*scaled), "a uniform scale with a translation");
  auto stretched = Transform::createLinearTransform(2.0);
  stretched->preScale(openvdb::Vec3d(1, 1, 3));
  EXPECT_NE(transformBesidesScale(*stretched).find("not one uniform scale"), std::string::npos);
  auto turned = Transform::createLinearTransform(2.0);
  turned->preRotate(0.3);
  EXPECT_NE(transformBesidesScale(*turned).find("not one uniform scale"), std::string::npos);
  auto frustum =
      Transform::createFrustumTransform(openvdb::BBoxd(openvdb::Vec3d(0), openvdb::Vec3d(10)), 0.5, 4);
  EXPECT_NE(transformBesidesScale(*frustum).find("not linear"), std::string::npos);

  for (auto const& transform : {scaled, stretched, turned, frustum}) {
    auto grid = makeGrid("density");
    grid->setTransform(transform);
    grid->fill(CoordBBox(Coord(-20), Coord(20)), 4.0f);
    VdbImport const result = checkedImport(grid);
    EXPECT_NE(result.volumes[0].transform, "");
    EXPECT_GT(result.volumes[0].voxelSize, 0);
  }
}

// requirement
TEST(VdbImportTest, NamesSkippedGrids) {
  auto odd = openvdb::Grid<openvdb::tree::Tree4<float, 3, 2, 2>::Type>::create();
  odd->setName("odd");
  auto vectors = openvdb::Vec3SGrid::create();
  vectors->setName("velocity");
  VdbImport const result = importGrids(inMemory({odd, vectors}));
  ASSERT_EQ(result.volumes.size(), 1u);
  ASSERT_EQ(result.volumes[0].channels.size(), 1u);
  EXPECT_EQ(result.volumes[0].channels[0].type, "vec3s");
  ASSERT_EQ(result.skipped.size(), 1u);
  EXPECT_EQ(result.skipped[0].grid, "odd");
  EXPECT_EQ(result.skipped[0].reason, "grids of type Tree_float_3_2_2 are not read");
}

// boundary
TEST(VdbImportTest, AnEmptyGridGivesAnEmptyChannel) {
  VdbImport const result = checkedImport(makeGrid("nothing", 3));
  auto const& volume = result.volumes[0];
  EXPECT_EQ(TreeReader(volume, "nothing").channel().size(), 0u);
  EXPECT_EQ(volume.channels[0].activeVoxels, 0);
  EXPECT_FALSE(volume.channels[0].hasRange);
  EXPECT_TRUE(volume.activeBox.empty());
}

// boundary: values are carried bit by bit, and inactive ones are not lost
TEST(VdbImportTest, KeepsEveryBitOfInactiveValues) {
  auto grid = makeGrid("odd", 1);
  grid->tree().setValueOn(Coord(0), std::numeric_limits<float>::quiet_NaN());
  grid->tree().setValueOn(Coord(1), std::numeric_limits<float>::infinity());
  grid->tree().setValueOff(Coord(5, 0, 0), -0.0f);
  grid->tree().setValueOff(Coord(0, 5, 0), 1.0f);
  grid->tree().setValueOff(Coord(700, 5, 5), std::numeric_limits<float>::quiet_NaN());
  grid->tree().setValueOff(Coord(900, 5, 5), 9.0f);
  VdbImport const result = checkedImport(grid);
  EXPECT_EQ(result.volumes[0].channels[0].activeVoxels, 2);
  EXPECT_EQ(result.volumes[0].channels[0].maximum, std::numeric_limits<double>::infinity());
}

// requirement: the outcome does not depend on the threads
TEST(VdbImportTest, ThreadsDoNotMatter) {
  auto grid = makeGrid("density");
  grid->fill(CoordBBox(Coord(-300, 0, 0), Coord(100, 80, 90)), 1.0f);
  for (int n = 0; n < 4000; ++n)
    grid->tree().setValueOn(Coord((n * 37) % 301, (n * 91) % 211, (n * 53) % 97), float(n) + 0.5f);
  std::vector<std::vector<float>> all;
  for (int threads : {1, 2, 8}) {
    std::vector<float> values;
    VLN::withThreads(threads, [&] {
      VdbImport const result = importGrids(inMemory({grid}));
      TreeReader const reader(result.volumes[0], "density");
      for (int d = 0; d <= Tree::kMaxDepth; ++d)
        for (std::int64_t n = 0; n < reader.tree().tileCount(d); ++n) {
          auto const& tile = reader.tree().tile(n, d);
          for (int c : {tile.ti(), tile.tj(), tile.tk()}) values.push_back(float(c));
          for (int s = 0; s < 64; ++s)
            values.push_back(reader.channel().tileData(tile.treeIndex())({s & 3, s >> 2 & 3, s >> 4}));
        }
    });
    all.push_back(values);
  }
  EXPECT_EQ(all[0], all[1]);
  EXPECT_EQ(all[0], all[2]);
}

// negative: grids that lie apart share one tree, which can be far larger than the file
TEST(VdbImportTest, BoundsTheMemoryOfItsVolumes) {
  VdbFile file = inMemory({});
  for (int n = 0; n < 40; ++n) {
    auto grid = makeGrid("grid" + std::to_string(n));
    for (int k = 0; k < 40; ++k) grid->tree().setValueOn(Coord(8 * n, 0, 8 * k), 1.0f);
    file.grids.push_back(grid);
  }
  file.memoryBytes = 480000000;
  EXPECT_EQ(importGrids(file).volumes.size(), 1u);
  file.memoryBytes = 10000000;
  try {
    importGrids(file);
    ADD_FAILURE() << "imported";
  } catch (FileError const& error) {
    EXPECT_EQ(error.reason(), "its volumes need more than 10 MB of memory");
  }
  // The bound of the reading is that of the volumes.
  TempFolder folder;
  openvdb::io::File(folder / "apart.vdb").write(file.grids);
  EXPECT_EQ(importVdb(folder / "apart.vdb", {600000000, 0}).volumes.size(), 1u);
  EXPECT_THROW(importVdb(folder / "apart.vdb", {25000000, 0}), FileError);
}

// requirement
TEST(VdbImportTest, TellsItsProgress) {
  auto grid = makeGrid("density");
  grid->fill(CoordBBox(Coord(0), Coord(70)), 1.0f, true);
  double last = -1;
  importGrids(inMemory({grid}), [&](char const* stage, double done) {
    EXPECT_NE(std::string(stage), "");
    EXPECT_GE(done, last);
    EXPECT_LE(done, 1);
    last = done;
  });
  EXPECT_EQ(last, 1);
}

class RealFile : public testing::TestWithParam<char const*> {};

// requirement: each value of each float grid, against OpenVDB's own reading
TEST_P(RealFile, EqualsWhatOpenVdbReads) {
  std::string const path = dataFile(std::string("vdb/") + GetParam());
  if (path.empty()) GTEST_SKIP() << "no shared test data";
  openvdb::initialize();
  openvdb::io::File file(path);
  file.open(false);
  auto const grids = file.getGrids();
  VdbImport const result = importVdb(path);
  std::size_t read = 0;
  for (auto const& base : *grids) {
    auto const grid = openvdb::gridPtrCast<FloatGrid>(base);
    bool found = false;
    for (auto const& volume : result.volumes)
      for (auto const& channel : volume.channels) {
        if (channel.gridName != base->getName()) continue;
        found = true, ++read;
        SCOPED_TRACE(channel.name);
        if (!grid) continue; // other types are compared on their way back
        TreeReader const reader(volume, channel.name);
        Comparison const c = compareAll(*grid, reader);
        EXPECT_EQ(c.wrong, 0) << c.first;
        EXPECT_EQ(c.active, std::int64_t(grid->activeVoxelCount()));
        EXPECT_EQ(channel.activeVoxels, c.active);
        EXPECT_EQ(wrongSamples(*grid, reader), 0);
        expectSoundTree(reader.tree());
      }
    bool const isPoints = base->type() == "Tree_ptdataidx32_5_4_3";
    EXPECT_EQ(found, !isPoints) << base->getName();
  }
  EXPECT_EQ(read + result.skipped.size() + result.points.size(), grids->size());
}

INSTANTIATE_TEST_SUITE_P(Shared, RealFile, VLN::Test::realVolumes(), VLN::Test::volumeName);

} // namespace
