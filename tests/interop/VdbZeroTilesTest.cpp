// Tiles of zeros that take no memory, and grids that share a tree with others.
#include "GeometryVolume/core/Parallel.h"
#include "ImportCheck.h"
#include "Interop/VdbGridSourceImpl.h"
#include "Interop/VdbImportImpl.h"
#include "Interop/VdbLeafImpl.h"
#include "Interop/VdbZeroTilesImpl.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <random>
#include <set>

namespace {

using namespace VLN;
using namespace VLN::Interop;
using namespace VLN::Test;
using openvdb::Coord;
using openvdb::CoordBBox;
using openvdb::FloatGrid;
using Values = TileTree3D::Channel<VdbTraits, float, 4, 0>;

/// Grids of boxes side by side, the n-th filled with n + 1.
VdbFile boxesApart(int count, float background = 0) {
  openvdb::initialize();
  VdbFile file;
  file.path = "in memory";
  for (int n = 0; n < count; ++n) {
    auto const grid = FloatGrid::create(background);
    grid->setName("grid" + std::to_string(n));
    grid->fill(CoordBBox(Coord(64 * n, 0, 0), Coord(64 * n + 50, 40, 30)), float(n + 1), true);
    grid->tree().voxelizeActiveTiles();
    file.grids.push_back(grid);
  }
  return file;
}

bool isAtHand(TileVector<float> const& tile) { return !tile.get_allocator().isStatic(); }

// requirement
TEST(ZeroTiles, AreApartAlignedAndZero) {
  constexpr std::int64_t kCount = 5000, kElements = 64;
  ZeroTiles<float> zeros(kElements);
  std::vector<TileVector<float>> tiles(kCount);
  withThreads(4, [&] {
    parallelFor(0, kCount,
                [&](std::int64_t begin, std::int64_t end) {
                  ZeroTiles<float>::Run run;
                  for (auto n = begin; n < end; ++n) zeros.make(run, tiles[std::size_t(n)]);
                },
                {.grain = 37});
  });
  std::set<float const*> places;
  for (auto& tile : tiles) {
    ASSERT_EQ(tile.size(), std::size_t(kElements));
    ASSERT_EQ(tile.capacity(), std::size_t(kElements));
    ASSERT_EQ(reinterpret_cast<std::uintptr_t>(tile.data()) % 64, 0u);
    ASSERT_TRUE(areZeros(tile.data(), tile.size()));
    places.insert(tile.data());
    tile.assign(kElements, 1.0f); // would be seen in a tile that shares memory with it
  }
  EXPECT_EQ(places.size(), std::size_t(kCount));
}

// boundary: zeros by value that are none by their bits
TEST(ZeroTiles, GoByTheBits) {
  float values[3] = {0, 0, 0};
  EXPECT_TRUE(areZeros(values, 3));
  EXPECT_TRUE(areZeros(values, 0));
  for (std::size_t n = 0; n < 3; ++n)
    for (float const other : {-0.0f, std::numeric_limits<float>::denorm_min(), 1.0f}) {
      values[n] = other;
      EXPECT_FALSE(areZeros(values, 3)) << n;
      values[n] = 0;
    }
  unsigned char bytes[11] = {};
  EXPECT_TRUE(areZeros(bytes, 11));
  bytes[10] = 1;
  EXPECT_FALSE(areZeros(bytes, 11));
}

// requirement: where a grid has nothing, tiles are of zeros that nobody wrote; elsewhere they are as ever
TEST(ZeroTiles, StandWhereAGridHasNothing) {
  auto const content = importGrids(boxesApart(3));
  auto const& volume = content.volumes.at(0);
  auto const tree = volume.object->component<VdbContainer>(kVdbContainerName);
  for (int n = 0; n < 3; ++n) {
    auto const channel = volume.object->component<Values>("grid" + std::to_string(n));
    std::int64_t zeros = 0, others = 0;
    for (std::int64_t t = 0; t < tree->tileCount(VdbTraits::kMaxDepth); ++t) {
      auto const& tile = *channel->tileData(t, VdbTraits::kMaxDepth).data();
      EXPECT_EQ(isAtHand(tile), !areZeros(tile.data(), tile.size()));
      (isAtHand(tile) ? others : zeros) += 1;
    }
    EXPECT_GT(others, 0);
    EXPECT_GT(zeros, others);
  }
}

// boundary: a background with a sign is no background of zeros
TEST(ZeroTiles, KeepTheSignOfABackground) {
  auto const content = importGrids(boxesApart(2, -0.0f));
  auto const channel = content.volumes.at(0).object->component<Values>("grid0");
  auto const tree = content.volumes[0].object->component<VdbContainer>(kVdbContainerName);
  for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth)
    for (std::int64_t t = 0; t < tree->tileCount(depth); ++t)
      for (float const v : channel->tileData(t, depth)) ASSERT_TRUE(v == 1.0f || std::signbit(v));
}

// requirement: such tiles can be written, and live as long as the storage does, whoever holds it
TEST(ZeroTiles, CanBeWrittenAndOutliveTheirChannel) {
  std::unique_ptr<Values> copy;
  {
    auto const content = importGrids(boxesApart(2));
    copy = std::make_unique<Values>(*content.volumes.at(0).object->component<Values>("grid1"));
  }
  copy->cloneData();
  auto tiles = copy->tileDataAccessor();
  auto const count = copy->tileCount(VdbTraits::kMaxDepth);
  auto const sum = [&] {
    float all = 0;
    for (std::int64_t t = 0; t < count; ++t)
      for (float const v : copy->tileData(t, VdbTraits::kMaxDepth)) all += v;
    return all;
  };
  constexpr float kSum = 2.0f * 51 * 41 * 31;
  EXPECT_EQ(sum(), kSum);
  float written = 0;
  for (std::int64_t t = 0; t < count; ++t) {
    auto& tile = *tiles.tileData({t, VdbTraits::kMaxDepth}).data();
    if (isAtHand(tile)) continue;
    tile[3] = 1;
    ++written;
  }
  EXPECT_GT(written, 0);
  EXPECT_EQ(sum(), kSum + written);
}

// requirement: as any tile, one of zeros grows out of its place, and goes with a compaction
TEST(ZeroTiles, GrowAndGoAsOthersDo) {
  auto const content = importGrids(boxesApart(2));
  auto const channel = content.volumes.at(0).object->extractComponent<Values>("grid1");
  auto tiles = channel->tileDataAccessor();
  std::int64_t at = 0;
  while (isAtHand(*tiles.tileData({at, VdbTraits::kMaxDepth}).data())) ++at;
  auto& tile = *tiles.tileData({at, VdbTraits::kMaxDepth}).data();
  tile[5] = 7;
  TileTree3D::Internal::resizeOutOfBlock(tile, 100, 3.0f);
  EXPECT_TRUE(isAtHand(tile));
  EXPECT_EQ(tile[5], 7.0f);
  EXPECT_EQ(tile[99], 3.0f);
  std::uint64_t used = 0, allocated = 0;
  channel->memUse(used, allocated, true);
  channel->compactStorage();
  EXPECT_EQ(tile[5], 7.0f);
  EXPECT_TRUE(channel->removeAll());
}

// requirement: the search for tiles with another value finds what looking at each of them finds
template <class TreeT>
void expectOthersAreFound(typename TreeT::ValueType background,
                          std::vector<typename TreeT::ValueType> const& values) {
  using Upper = typename TreeT::RootNodeType::ChildNodeType;
  std::mt19937 random(3);
  for (int const others : {0, 1, 2, 64, 30000}) {
    Upper node(Coord(0), background);
    for (int n = 0; n < others; ++n)
      node.addTile(2, Coord(int(random() % 32) * 128, int(random() % 32) * 128, int(random() % 32) * 128),
                   values[random() % values.size()], false);
    auto const* const table = node.getTable();
    OtherValues<std::remove_cvref_t<decltype(*table)>, typename TreeT::ValueType> const other(background);
    for (openvdb::Index n = 0; n < Upper::NUM_VALUES; n += 64) {
      std::uint64_t wanted = 0;
      for (openvdb::Index k = 0; k < 64; ++k)
        wanted |= std::uint64_t(!sameBits(table[n + k].getValue(), background)) << k;
      ASSERT_EQ(other.among(table + n), wanted) << others << " at " << n;
    }
  }
}
TEST(VdbNodes, OtherValuesThanTheBackgroundAreFound) {
  expectOthersAreFound<openvdb::FloatTree>(0.0f, {0.0f, -0.0f, 1.0f});
  expectOthersAreFound<openvdb::DoubleTree>(3.0, {3.0, std::nextafter(3.0, 4.0)});
  expectOthersAreFound<openvdb::Int64Tree>(-1, {-1, std::int64_t(0xFFFFFFFF)});
  expectOthersAreFound<openvdb::BoolTree>(false, {false, true});
  expectOthersAreFound<openvdb::Vec3STree>(openvdb::Vec3s(1), {openvdb::Vec3s(1), openvdb::Vec3s(1, 1, 2)});
  expectOthersAreFound<openvdb::Vec3DTree>(openvdb::Vec3d(1), {openvdb::Vec3d(1), openvdb::Vec3d(1, 1, 2)});
}

// requirement: a leaf that is active throughout gives the range that voxel after voxel gives, zeros with the
// sign of the first
TEST(VdbLeaves, RangeOfFullLeavesIsThatOfTheirVoxels) {
  using Leaf = FloatGrid::TreeType::LeafNodeType;
  std::mt19937 random(4);
  constexpr float kNan = std::numeric_limits<float>::quiet_NaN(),
                  kFar = std::numeric_limits<float>::infinity();
  std::vector<std::vector<float>> const palettes{
      {1, 2, 3}, {-1, 5, kNan}, {0.0f, -0.0f},     {-0.0f, 0.0f, 1}, {kNan},
      {kFar},    {-kFar, kFar}, {-2, -0.0f, 0.0f}, {kNan, 0, 3},     {7}};
  for (auto const& palette : palettes)
    for (int round = 0; round < 20; ++round) {
      Leaf leaf(Coord(0), 0.0f, true);
      float low = kFar, high = -kFar;
      for (openvdb::Index n = 0; n < Leaf::SIZE; ++n) {
        float const v = palette[random() % palette.size()];
        leaf.setValueOn(n, v);
        if (v < low) low = v;
        if (v > high) high = v;
      }
      auto const range = activeRange(leaf, LeafValues<Leaf>(leaf, leaf.buffer().data()));
      EXPECT_EQ(range.minimum, double(low));
      EXPECT_EQ(range.maximum, double(high));
      EXPECT_EQ(std::signbit(range.minimum), std::signbit(low));
      EXPECT_EQ(std::signbit(range.maximum), std::signbit(high));
    }
}

// requirement: who hands a file over gets it back without the grids, and who shows it keeps them
TEST(VdbImportMemory, GridsGoAsTheirChannelsAreMade) {
  VdbFile file = boxesApart(3);
  std::weak_ptr<openvdb::GridBase> const first = file.grids.front();
  importGrids(static_cast<VdbFile const&>(file));
  ASSERT_EQ(file.grids.size(), 3u);
  EXPECT_FALSE(first.expired());
  auto const content = importGrids(file, VdbReadLimits(), {});
  EXPECT_TRUE(file.grids.empty());
  EXPECT_TRUE(first.expired());
  ASSERT_EQ(content.volumes.size(), 1u);
  EXPECT_EQ(content.volumes[0].channels.size(), 3u);
}

} // namespace
