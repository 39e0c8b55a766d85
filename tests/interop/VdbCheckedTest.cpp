// The walk through a .vdb file, beside OpenVDB's own reading: the same grids, or nothing.
#include "Interop/VdbCheckedImpl.h"
#include "support/TempFolder.h"
#include "support/VdbCompare.h"
#include "support/VdbGrids.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <functional>
#include <random>
#include <stdexcept>

#include <sys/resource.h>

namespace {

using namespace VLN::Interop;
using namespace VLN::Test;
using openvdb::Coord;
using openvdb::GridBase;

constexpr std::uint64_t kMuch = std::uint64_t(1) << 32;

std::optional<VdbFile> walked(std::string const& path, std::uint64_t memoryBytes = kMuch) {
  openvdb::initialize();
  return readChecked(path, readAll(path).size(), memoryBytes);
}

void expectAsOpenVdbReads(std::string const& path) {
  auto const file = walked(path);
  ASSERT_TRUE(file) << path;
  openvdb::io::File peer(path);
  peer.open(false);
  auto const grids = peer.getGrids();
  EXPECT_EQ(*file->metadata, *peer.getMetadata());
  ASSERT_EQ(file->grids.size(), grids->size());
  for (auto const& peersGrid : *grids) { // by name, not in the order of the file
    auto const named = [&](GridBase::Ptr const& grid) { return grid->getName() == peersGrid->getName(); };
    auto const found = std::find_if(file->grids.begin(), file->grids.end(), named);
    ASSERT_NE(found, file->grids.end()) << path << ", " << peersGrid->getName();
    GridBase const &ours = **found, &theirs = *peersGrid;
    EXPECT_EQ(VdbCompare::difference(ours, theirs), "") << path;
    EXPECT_EQ(ours.baseTree().leafCount(), theirs.baseTree().leafCount());
    EXPECT_TRUE(static_cast<openvdb::MetaMap const&>(ours) == theirs) << path << ", " << ours.getName();
  }
}

// requirement
TEST(VdbChecked, ReadsGridsOfEveryTypeAndCompressionAsOpenVdbDoes) {
  openvdb::initialize();
  TempFolder const folder;
  for (std::uint32_t const compression : kCompressions) {
    SCOPED_TRACE(compression);
    write(folder / "all.vdb", everyType(), compression);
    expectAsOpenVdbReads(folder / "all.vdb");
  }
}

// requirement
TEST(VdbChecked, ReadsRealFilesAsOpenVdbDoes) {
  openvdb::initialize();
  int found = 0;
  for (char const* name :
       {"bunny_ls_128", "mantaflow_smoke_0010", "smoke", "sphere", "sphereCd", "spot_ls_128"})
    if (std::string const path = dataFile("vdb/" + std::string(name) + ".vdb"); !path.empty()) {
      expectAsOpenVdbReads(path);
      ++found;
    }
  if (found == 0) GTEST_SKIP() << "no volumes at hand";
}

// requirement: whoever reads a sound file does not pay for a child process
TEST(VdbChecked, ASoundFileTakesNoChildProcess) {
  openvdb::initialize();
  TempFolder const folder;
  auto const faultsOfChildren = [] {
    rusage used{};
    getrusage(RUSAGE_CHILDREN, &used);
    return used.ru_minflt;
  };
  write(folder / "fog.vdb", {mixed<openvdb::FloatGrid>("fog", [](int n) { return float(n); })}, kMask);
  auto const before = faultsOfChildren();
  EXPECT_EQ(readVdbFile(folder / "fog.vdb").grids.size(), 1u);
  EXPECT_EQ(faultsOfChildren(), before);
  // What the walk does not know takes one.
  write(folder / "bools.vdb", {openvdb::BoolGrid::create()}, kMask);
  EXPECT_EQ(readVdbFile(folder / "bools.vdb").grids.size(), 1u);
  EXPECT_GT(faultsOfChildren(), before);
}

// boundary
TEST(VdbChecked, LeavesToOthersWhatItDoesNotKnow) {
  openvdb::initialize();
  using namespace openvdb;
  TempFolder const folder;
  auto const fog = mixed<FloatGrid>("fog", [](int n) { return float(n); });
  auto const outcome = [&](GridPtrVec const& grids) {
    write(folder / "some.vdb", grids, kMask);
    return walked(folder / "some.vdb").has_value();
  };
  EXPECT_TRUE(outcome({fog}));
  EXPECT_TRUE(outcome({}));
  EXPECT_FALSE(outcome({fog, BoolGrid::create()}));
  EXPECT_FALSE(outcome({fog, MaskGrid::create()}));
  EXPECT_FALSE(outcome({fog, fog->copyGrid()})) << "a tree of two grids";
  auto const frustum = fog->deepCopyGrid();
  frustum->setTransform(math::Transform::createFrustumTransform(BBoxd(Vec3d(0), Vec3d(9)), 0.5, 2.0));
  EXPECT_FALSE(outcome({frustum}));
  auto const least = Int32Grid::create(std::numeric_limits<Int32>::min());
  EXPECT_FALSE(outcome({least}));
  if (std::string const points = dataFile("vdb/sphere_points.vdb"); !points.empty()) {
    EXPECT_FALSE(walked(points));
  }
}

// boundary
TEST(VdbChecked, KeepsToItsMemory) {
  openvdb::initialize();
  TempFolder const folder;
  auto const grid = openvdb::FloatGrid::create(0.0f);
  for (int n = 0; n < 100; ++n) grid->tree().setValueOn(Coord(4096 * n, 0, 0), 1.0f);
  write(folder / "sparse.vdb", {grid}, kMask);
  EXPECT_FALSE(walked(folder / "sparse.vdb", 20u << 20)); // nodes of 270 kB each
  EXPECT_TRUE(walked(folder / "sparse.vdb", 60u << 20));
  EXPECT_FALSE(walked(folder / "sparse.vdb", 100));
}

// negative
TEST(VdbChecked, TellsHowFarItIsAndStopsWhereItIsTold) {
  TempFolder const folder;
  auto const grid = openvdb::FloatGrid::create();
  for (int n = 0; n < 40000; ++n)
    grid->tree().touchLeaf(Coord(8 * (n % 200), 8 * (n / 200), 0))->setValueOn(0, 1);
  write(folder / "many.vdb", {grid}, openvdb::io::COMPRESS_ACTIVE_MASK);
  auto const read = [&](std::function<void(double)> const& told) {
    openvdb::initialize();
    return readChecked(folder / "many.vdb", readAll(folder / "many.vdb").size(), kMuch, told);
  };
  std::vector<double> shares;
  ASSERT_TRUE(read([&](double share) { shares.push_back(share); }));
  EXPECT_GE(shares.size(), 3u);
  EXPECT_TRUE(std::is_sorted(shares.begin(), shares.end()));
  EXPECT_GT(shares.front(), 0.0);
  EXPECT_LT(shares.back(), 1.0);
  // An error of theirs is not taken for one of the file.
  struct Enough : std::runtime_error {
    using std::runtime_error::runtime_error;
  };
  EXPECT_THROW(read([](double share) {
                 if (share > 0.6) throw Enough("stop");
               }),
               Enough);
}

TEST(VdbChecked, RefusesATruncatedFileOfAnyLength) {
  openvdb::initialize();
  TempFolder const folder;
  write(folder / "whole.vdb", {band()}, kMask);
  std::string const whole = readAll(folder / "whole.vdb");
  for (std::size_t length = 8; length < whole.size(); length += length < 600 ? 7 : 997) {
    writeAll(folder / "cut.vdb", whole.substr(0, length));
    EXPECT_FALSE(walked(folder / "cut.vdb")) << "cut to " << length << " of " << whole.size() << " bytes";
  }
}

// negative: OpenVDB's readers meet nothing that they cannot bear, whatever is changed
TEST(VdbChecked, SurvivesChangedBytes) {
  openvdb::initialize();
  TempFolder const folder;
  std::string const path = folder / "changed.vdb";
#ifdef __SANITIZE_ADDRESS__
  constexpr unsigned kSeeds = 40;
#else
  constexpr unsigned kSeeds = 120;
#endif
  int refused = 0, cases = 0;
  for (std::uint32_t const compression : kCompressions) {
    auto const doubles = mixed<openvdb::DoubleGrid>("double", [](int n) { return n / 3.0; });
    write(path, {band(), doubles}, compression);
    std::string const whole = readAll(path);
    for (unsigned seed = 0; seed < kSeeds; ++seed, ++cases) {
      std::mt19937 random(seed);
      std::string bytes = whole;
      // Most where the structure is: at the begin, and at the begin of leaves.
      std::size_t const reach = seed % 3 ? std::min<std::size_t>(bytes.size(), 2500) : bytes.size();
      for (unsigned n = 0; n <= seed % 4; ++n) {
        std::size_t const at = 8 + random() % (reach - 16);
        if (random() % 4 == 0)
          std::memset(&bytes[at], random() % 2 ? 0xFF : 0x7F, 1 + random() % 8);
        else
          bytes[at] = static_cast<char>(random());
      }
      writeAll(path, bytes);
      auto const packed = readChecked(path, bytes.size(), kMuch, {}, LeafMemory::kPacked);
      if (auto const file = walked(path)) {
        ASSERT_TRUE(packed);
        for (auto const& grid : file->grids) EXPECT_GE(grid->activeVoxelCount(), 0u);
      } else {
        EXPECT_FALSE(packed);
        ++refused;
      }
    }
  }
  EXPECT_GT(refused, cases / 10);
  EXPECT_LT(refused, cases);
}

} // namespace
