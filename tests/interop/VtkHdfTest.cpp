// Levels of boxes, and .vtkhdf files. Values are compared with HDF5's and VTK's own readers in the tests of
// the Python module.
#include "Interop/VtkHdfWrite.h"

#include "Interop/AmrBoxesImpl.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/VdbMake.h"
#include "support/ReadAll.h"
#include "support/TempFolder.h"
#include "support/TurnedRamp.h"

#include <gtest/gtest.h>

#include <array>
#include <filesystem>
#include <map>
#include <random>
#include <set>

namespace VLN::Test {
namespace {

using namespace VLN::Interop;
using Traits = TileTree3D::PowerOfTwoTraits;
using Tree = TileTree3D::Container<Traits>;
using Corner = std::array<int, 3>;

/// The low end of the domain, in samples.
int lowOf(AmrLevel const& level) { return Traits::kMinTileCoord / level.width; }

/// The low corners of all blocks of 4 samples of a level's boxes; a block of two boxes is an error.
std::set<Corner> blocksOf(AmrLevel const& level) {
  std::set<Corner> blocks;
  for (IndexBox const& box : level.boxes) {
    int const side = box.max.x - box.min.x;
    EXPECT_TRUE(side == 4 || side == 8 || side == 16 || side == 32) << side;
    for (int a = 0; a < 3; ++a) {
      EXPECT_EQ(box.max[a] - box.min[a], side);
      EXPECT_EQ((box.min[a] - lowOf(level)) & (side - 1), 0) << "not aligned";
    }
    for (int z = box.min.z; z < box.max.z; z += 4)
      for (int y = box.min.y; y < box.max.y; y += 4)
        for (int x = box.min.x; x < box.max.x; x += 4) {
          bool const fresh = blocks.insert({x, y, z}).second;
          EXPECT_TRUE(fresh) << "boxes overlap";
        }
  }
  return blocks;
}

void expectSound(Tree const& tree) {
  auto const levels = amrLevels(tree);
  std::set<Corner> above;
  ASSERT_FALSE(levels.empty());
  EXPECT_GT(tree.tileCount(levels.front().depth), 0);
  for (std::size_t n = 0; n < levels.size(); ++n) {
    AmrLevel const& level = levels[n];
    EXPECT_EQ(level.depth, levels.front().depth + int(n));
    std::set<Corner> const blocks = blocksOf(level);
    EXPECT_EQ(std::int64_t(blocks.size()) * 64, level.samples());
    for (std::int64_t t = 0; t < tree.tileCount(level.depth); ++t) {
      auto const& tile = tree.tile(t, level.depth);
      Corner const corner{tile.ti() / level.width, tile.tj() / level.width, tile.tk() / level.width};
      EXPECT_TRUE(blocks.count(corner)) << "a tile is in no box";
    }
    for (Corner const& b : blocks)
      if (n > 0) {
        auto const up = [&](int c) { return ((c - lowOf(level)) >> 3) * 4 + lowOf(levels[n - 1]); };
        EXPECT_TRUE(above.count({up(b[0]), up(b[1]), up(b[2])})) << "a box leaves the level above";
      }
    above = blocks;
  }
  for (int depth = levels.back().depth + 1; depth <= Traits::kMaxDepth; ++depth)
    EXPECT_EQ(tree.tileCount(depth), 0);
}

TEST(AmrBoxesTest, RequirementBoxesHoldAllTilesAndLieInThoseAbove) {
  for (unsigned seed = 1; seed <= 6; ++seed) {
    SCOPED_TRACE(seed);
    std::mt19937 random(seed);
    Tree tree;
    Tree::TileLists lists;
    int const reach = seed % 2 ? 40 : 300, count = seed % 3 ? 300 : 4000;
    for (int n = 0; n < count; ++n) {
      auto const at = [&] { return 4 * (int(random() % unsigned(reach)) - reach / 2); };
      lists[Traits::kMaxDepth].append({at(), at(), at()});
    }
    auto const root = Traits::align({4000, -8000, 77777}, 20);
    lists[20].append(root);
    tree.tileAccessor().addTiles(lists);
    expectSound(tree);
  }
}

TEST(AmrBoxesTest, BoundaryTheEndsOfTheDomain) {
  Tree tree;
  Tree::TileLists lists;
  int const low = Traits::kMinTileCoord, high = Traits::kMaxTileCoord - 3;
  lists[Traits::kMaxDepth].append({low, high, low});
  lists[Traits::kMaxDepth].append({high, high, high});
  lists[0].append({low, low, low});
  tree.tileAccessor().addTiles(lists);
  expectSound(tree);
}

TEST(AmrBoxesTest, RequirementDenseTilesBecomeOneBox) {
  Tree tree;
  Tree::TileLists lists;
  for (int n = 0; n < 512; ++n)
    lists[Traits::kMaxDepth].append({4 * (n % 8), 4 * (n / 8 % 8) - 32, 4 * (n / 64)});
  tree.tileAccessor().addTiles(lists);
  auto const levels = amrLevels(tree);
  ASSERT_FALSE(levels.empty());
  ASSERT_EQ(levels.back().boxes.size(), 1u);
  EXPECT_EQ(levels.back().samples(), 32 * 32 * 32);
  EXPECT_EQ(levels.back().boxes[0].min.y, -32);
}

DenseVolume denseOf(std::string const& file) { return denseVolumeOf(importVdb(file).volumes.front()); }

std::string told(auto const& call) {
  try {
    call();
  } catch (FileError const& error) { return error.reason(); }
  return "";
}

TEST(VtkHdfTest, RequirementTheSameVolumeMakesTheSameFile) {
  TempFolder const folder;
  makeCloud(folder / "cloud.vdb", 20000);
  DenseVolume const volume = denseOf(folder / "cloud.vdb");
  if (!writesVtkHdf()) {
    EXPECT_NE(told([&] { writeVtkHdf(folder / "a.vtkhdf", volume); }).find("without HDF5"),
              std::string::npos);
    EXPECT_NE(told([&] { checkOutputFor(FileContent::kExports, folder / "a.vtkhdf"); }).find("without HDF5"),
              std::string::npos);
    return;
  }
  writeVtkHdf(folder / "a.vtkhdf", volume);
  writeVtkHdf(folder / "b.vtkhdf", volume);
  std::string const bytes = readAll(folder / "a.vtkhdf");
  EXPECT_EQ(bytes.substr(0, 8), "\x89HDF\r\n\x1a\n");
  EXPECT_TRUE(bytes == readAll(folder / "b.vtkhdf"));
}

TEST(VtkHdfTest, NegativeWhatTheFormatCannotTellLeavesNoFile) {
  if (!writesVtkHdf()) GTEST_SKIP() << "built without HDF5";
  TempFolder const folder;
  std::string const file = folder / "grid.vdb", out = folder / "a.vtkhdf";
  openvdb::io::File(file).write(openvdb::GridPtrVec{turnedRamp()});
  DenseVolume volume = denseOf(file);
  EXPECT_NE(told([&] { writeVtkHdf(out, volume); }).find("turns, mirrors or skews"), std::string::npos);
  volume.channels.clear();
  EXPECT_NE(told([&] { writeVtkHdf(out, volume); }).find("no channel"), std::string::npos);
  volume.channels = {"none of these"};
  EXPECT_NE(told([&] { writeVtkHdf(out, volume); }).find("of a type"), std::string::npos);
  EXPECT_FALSE(std::filesystem::exists(out));
}

} // namespace
} // namespace VLN::Test
