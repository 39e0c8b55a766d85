// Volumes out of packed leaves, beside those out of leaves as OpenVDB keeps them.
#include "GeometryVolume/core/ElementTypes.h"
#include "Interop/HalfFloatsImpl.h"
#include "Interop/VdbCheckedImpl.h"
#include "Interop/VdbImportImpl.h"
#include "Interop/VdbLeafPlacesImpl.h"
#include "support/TempFolder.h"
#include "support/VdbGrids.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstring>

namespace {

using namespace VLN;
using namespace VLN::Interop;
using namespace VLN::Test;
using openvdb::Coord;

using Shape = VdbTraits;

// Too little for the surface of the widest tiles, which has millions of tiles.
VdbReadLimits const kLimits{300000000, 0, {}};

/// All that a volume's tree and one of its channels hold, tile by tile.
template <class T>
void append(std::string& bytes, VdbContainer const& tree, TileTree3D::ChannelBase const& base) {
  auto const* const channel = dynamic_cast<TileTree3D::Channel<Shape, T, 4, 0> const*>(&base);
  if (!channel) return;
  auto const add = [&](auto const* values, std::size_t count) {
    bytes.append(reinterpret_cast<char const*>(values), count * sizeof *values);
  };
  T const background = channel->defaultValue();
  add(&background, 1);
  std::uint64_t used = 0, allocated = 0;
  channel->memUse(used, allocated, true);
  add(&used, 1), add(&allocated, 1);
  for (int depth = 0; depth <= Shape::kMaxDepth; ++depth)
    for (std::int64_t n = 0; n < tree.tileCount(depth); ++n) {
      auto const& tile = tree.tile(n, depth);
      int const place[4] = {tile.ti(), tile.tj(), tile.tk(), depth};
      add(place, 4);
      auto const data = channel->tileData(n, depth);
      add(data.data()->data(), data.data()->size());
    }
}

/// The same of everything that an import holds.
std::string bytesOf(VdbImport const& content) {
  std::string bytes = content.metadata;
  for (auto const& skipped : content.skipped) bytes += skipped.grid + ": " + skipped.reason + "\n";
  for (auto const& volume : content.volumes) {
    auto const tree = volume.object->component<VdbContainer>(kVdbContainerName);
    for (auto const& c : volume.channels) {
      bytes += c.name + c.gridName + c.type + std::to_string(c.activeVoxels) + (c.hasRange ? "r" : "n");
      bytes.append(reinterpret_cast<char const*>(&c.minimum), sizeof c.minimum);
      bytes.append(reinterpret_cast<char const*>(&c.maximum), sizeof c.maximum);
      bytes.append(reinterpret_cast<char const*>(&c.activeBox), sizeof c.activeBox);
    }
    for (auto const& name : volume.object->componentRange()) {
      bytes += "\n" + std::string(name.c_str()) + "\n";
      auto const channel = volume.object->component<TileTree3D::ChannelBase>(name);
      if (!channel) continue;
#define VLN_APPEND(type, name) append<type>(bytes, *tree, *channel);
      VLN_FOR_EACH_ELEMENT_TYPE(VLN_APPEND)
#undef VLN_APPEND
    }
  }
  return bytes;
}

std::string importedFromOwnLeaves(std::string const& path) {
  openvdb::io::File peer(path);
  peer.open(false);
  VdbFile file = readVdbFile(path, kLimits);
  auto const grids = peer.getGrids();
  // OpenVDB's own grids, in the order of the file.
  for (auto& grid : file.grids)
    for (auto const& other : *grids)
      if (other->getName() == grid->getName()) grid = other;
  return bytesOf(importGrids(file));
}

// requirement
TEST(VdbPacked, GivesTheVolumesThatLeavesWithBuffersGive) {
  openvdb::initialize();
  TempFolder const folder;
  std::string const path = folder / "all.vdb";
  for (std::uint32_t const compression : kCompressions) {
    SCOPED_TRACE(compression);
    for (auto const& grid : everyType()) {
      SCOPED_TRACE(grid->getName());
      write(path, {grid}, compression);
      auto const wanted = importedFromOwnLeaves(path);
      EXPECT_TRUE(bytesOf(importVdb(path, kLimits)) == wanted);
    }
  }
  write(path, everyType(), kMask); // several of them in one tree
  auto const wanted = importedFromOwnLeaves(path);
  for (int const threads : {1, 2, 8})
    withThreads(threads, [&] { EXPECT_TRUE(bytesOf(importVdb(path, kLimits)) == wanted) << threads; });
}

// requirement
TEST(VdbPacked, GivesTheVolumesOfRealFiles) {
  openvdb::initialize();
  int found = 0;
  for (char const* name :
       {"bunny_ls_128", "mantaflow_smoke_0010", "smoke", "sphere", "sphereCd", "spot_ls_128"})
    if (std::string const path = dataFile("vdb/" + std::string(name) + ".vdb"); !path.empty()) {
      EXPECT_TRUE(bytesOf(importVdb(path, kLimits)) == importedFromOwnLeaves(path)) << name;
      ++found;
    }
  if (found == 0) GTEST_SKIP() << "no volumes at hand";
}

/// A narrow band about a sphere, whose leaves take tens of megabytes, with voxels beside it that make tiles
/// of all widths.
openvdb::FloatGrid::Ptr largeBand() {
  constexpr int kRadius = 160, kFar = kRadius + 3;
  auto grid = openvdb::FloatGrid::create(3.0f);
  auto to = grid->getAccessor();
  for (int x = -kFar; x <= kFar; ++x)
    for (int y = -kFar; y <= kFar; ++y) {
      int const inner = (kRadius - 3) * (kRadius - 3) - x * x - y * y, outer = kFar * kFar - x * x - y * y;
      if (outer < 0) continue;
      int const first = inner > 0 ? int(std::sqrt(double(inner))) : 0;
      for (int z = first; z * z < outer; ++z)
        for (int const side : {-z, z})
          if (float const d = std::sqrt(float(x * x + y * y + z * z)) - kRadius; std::abs(d) < 3)
            to.setValueOn(Coord(x, y, side), d);
    }
  grid->tree().addTile(2, Coord(0, 0, 0), -3.0f, false);
  grid->tree().setValueOn(Coord(2000, -3000, 100), 1.0f);
  grid->setName("large");
  return grid;
}

// requirement: what was read goes piece by piece, and nothing is read behind that
TEST(VdbPacked, GivesTheVolumesOfLargeGrids) {
  openvdb::initialize();
  TempFolder const folder;
  std::string const path = folder / "large.vdb";
  auto const grid = largeBand();
  ASSERT_GT(grid->tree().leafCount() * 2048, std::size_t(16) << 20);
  write(path, {grid}, kMask);
  auto const wanted = importedFromOwnLeaves(path);
  for (int const threads : {1, 2, 8})
    withThreads(threads, [&] { EXPECT_TRUE(bytesOf(importVdb(path, kLimits)) == wanted) << threads; });
}

// regression: OpenVDB makes a buffer of any values for a leaf that has none when it is asked for one
TEST(VdbPacked, NobodyReachesForTheBuffersOfLeaves) {
  openvdb::initialize();
  TempFolder const folder;
  write(folder / "some.vdb", everyType(), kMask);
  auto file = readChecked(folder / "some.vdb", readAll(folder / "some.vdb").size(), std::uint64_t(1) << 32,
                          {}, LeafMemory::kPacked);
  ASSERT_TRUE(file);
  EXPECT_EQ(file->packed.size(), file->grids.size());
  file->memoryBytes = kLimits.memoryBytes;
  importGrids(*file);
  std::size_t leaves = 0;
  auto const look = [&]<class GridT>(GridT const*) {
    for (auto const& base : file->grids)
      if (auto const grid = openvdb::gridPtrCast<GridT>(base)) {
        for (auto leaf = grid->tree().cbeginLeaf(); leaf; ++leaf, ++leaves)
          EXPECT_TRUE(leaf->buffer().empty()) << base->getName();
      }
  };
#define VLN_LOOK(GridT) look(static_cast<openvdb::GridT const*>(nullptr));
  VLN_FOR_EACH_VDB_REAL_GRID(VLN_LOOK)
  VLN_FOR_EACH_VDB_VECTOR_GRID(VLN_LOOK)
  VLN_LOOK(Int64Grid)
#undef VLN_LOOK
  EXPECT_GT(leaves, 100u);
}

// boundary
TEST(VdbPacked, GivesMemoryBackFromTheFrontOn) {
  constexpr std::size_t kSize = std::size_t(25) << 20;
  PackedLeaves const none(0);
  EXPECT_EQ(none.begin(), nullptr);
  PackedLeaves leaves(kSize);
  auto* const bytes = static_cast<char*>(leaves.begin());
  std::memset(bytes, 7, kSize);
  std::size_t const from = std::size_t(5) << 20;
  leaves.drop(from);
  leaves.drop(100);
  for (std::size_t n = from; n < kSize; ++n) ASSERT_EQ(bytes[n], 7) << n;
  EXPECT_EQ(bytes[0], 0);
  leaves.drop(kSize);
  leaves.drop(kSize);
  EXPECT_EQ(leaves.begin(), nullptr);
  // Little memory goes as a whole.
  PackedLeaves few(4096);
  std::memset(few.begin(), 7, 4096);
  few.drop(4000);
  EXPECT_EQ(*static_cast<char const*>(few.begin()), 7);
  few.drop(4096);
  EXPECT_EQ(few.begin(), nullptr);
}

// requirement
TEST(HalfFloats, AreWidenedAsOpenVdbWidensThem) {
  std::vector<std::uint16_t> halves(65536);
  for (std::size_t n = 0; n < halves.size(); ++n) halves[n] = static_cast<std::uint16_t>(n);
  std::vector<float> floats(halves.size());
  std::vector<double> doubles(halves.size());
  widenHalves(halves.data(), halves.size(), floats.data());
  widenHalves(halves.data(), halves.size(), doubles.data());
  for (std::size_t n = 0; n < halves.size(); ++n) {
    openvdb::math::half half;
    half.setBits(halves[n]);
    float const wanted = half;
    double const wide = half;
    ASSERT_EQ(std::memcmp(&floats[n], &wanted, sizeof wanted), 0) << n;
    ASSERT_EQ(std::memcmp(&doubles[n], &wide, sizeof wide), 0) << n;
  }
  // Counts that are no multiple of the lanes leave what lies behind alone.
  for (std::size_t count = 0; count < 9; ++count) {
    float some[10];
    std::fill(std::begin(some), std::end(some), -1.0f);
    widenHalves(halves.data() + 0x3C00, count, some);
    for (std::size_t n = 0; n < 10; ++n) EXPECT_EQ(some[n], n < count ? floats[0x3C00 + n] : -1.0f);
  }
}

/// Blocks that are of one value but for a few voxels, most near the low sides.
template <class Value> void checkLayers(std::function<Value(unsigned)> const& value) {
  std::mt19937 random(3);
  for (int round = 0; round < 4000; ++round) {
    std::unique_ptr<Value[]> const leaf(new Value[512]);
    std::fill_n(leaf.get(), 512, value(0));
    for (unsigned n = random() % 4; n > 0; --n) {
      auto const at = [&] { return random() % 3 ? random() % 8 : random() % 2 * 4; };
      leaf[64 * at() + 8 * at() + at()] = value(random() % 3);
    }
    auto const digest = digestOf(leaf.get());
    for (int block = 0; block < 8; ++block)
      for (int layer = 0; layer < 8; ++layer) {
        auto const first = std::size_t(4 * (64 * (block >> 2) + 8 * (block >> 1 & 1) + (block & 1)));
        bool wanted = true;
        for (int i = 0; i < (layer & 4 ? 1 : 4); ++i)
          for (int j = 0; j < (layer & 2 ? 1 : 4); ++j)
            for (int k = 0; k < (layer & 1 ? 1 : 4); ++k)
              wanted = wanted && sameBits(leaf[first + std::size_t(64 * i + 8 * j + k)], leaf[first]);
        ASSERT_EQ(digest.uniform >> (8 * block + layer) & 1, unsigned(wanted))
            << round << " " << block << " " << layer;
        ASSERT_TRUE(sameBits(digest.first[block], leaf[first]));
        EXPECT_EQ(digest.holds(block, layer, value(1)), wanted && sameBits(leaf[first], value(1)));
      }
  }
}

// requirement
TEST(LeafDigests, TellWhichLayersAreOfOneValue) {
  checkLayers<float>([](unsigned n) { return n == 2 ? -0.0f : float(n); });
  checkLayers<openvdb::Int32>([](unsigned n) { return openvdb::Int32(n) << 30; });
  checkLayers<double>([](unsigned n) { return n == 2 ? std::nan("") : double(n); });
  checkLayers<openvdb::Vec3s>([](unsigned n) { return openvdb::Vec3s(1, 2, float(n)); });
  checkLayers<bool>([](unsigned n) { return n != 0; });
}

} // namespace
