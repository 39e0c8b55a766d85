// The walk through a .vdb file, beside OpenVDB's own reading: the same grids, or nothing.
#include "Interop/VdbCheckedImpl.h"
#include "support/TempFolder.h"
#include "support/VdbCompare.h"

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

void write(std::string const& path, openvdb::GridPtrVec const& grids, std::uint32_t compression) {
  openvdb::io::File file(path);
  file.setCompression(compression);
  openvdb::MetaMap metadata;
  metadata.insertMeta("made by", openvdb::StringMetadata("a test"));
  metadata.insertMeta("flag", openvdb::BoolMetadata(true));
  metadata.insertMeta("place", openvdb::Vec3DMetadata(openvdb::Vec3d(1, 2, 3)));
  file.write(grids, metadata);
  file.close();
}

/// Voxels, tiles of two widths, some of them inactive, on both sides of the origin.
template <class GridT>
GridBase::Ptr mixed(char const* name, std::function<typename GridT::ValueType(int)> value) {
  auto const grid = GridT::create(value(0));
  std::mt19937 random(5);
  auto const place = [&](int width) { return int(random() % (2 * unsigned(width))) - width; };
  for (int n = 0; n < 3000; ++n)
    grid->tree().setValueOn(Coord(place(20), place(30), place(9)), value(int(random() % 100)));
  // Leaves with one and with two inactive values besides the background, and with many.
  for (int n = 0; n < 200; ++n) grid->tree().setValueOff(Coord(40 + n % 8, n % 40, 0), value(7));
  for (int n = 0; n < 200; ++n) grid->tree().setValueOff(Coord(56 + n % 8, n % 40, 0), value(7 + n % 2));
  for (int n = 0; n < 200; ++n) grid->tree().setValueOff(Coord(72 + n % 8, n % 40, 0), value(n));
  for (int n = 0; n < 512; ++n) grid->tree().setValueOn(Coord(n / 64, n / 8 % 8, 80 + n % 8), value(n));
  grid->tree().addTile(1, Coord(-64, 8, 8), value(3), true);
  grid->tree().addTile(1, Coord(-64, 16, 8), value(4), false);
  grid->tree().addTile(2, Coord(512, 0, 0), value(5), true);
  grid->tree().addTile(3, Coord(-8192, 4096, 0), value(6), true);
  grid->setName(name);
  return grid;
}

/// A narrow band: the inactive voxels inside have the background's other sign.
GridBase::Ptr band() {
  auto const grid = openvdb::FloatGrid::create(3.0f);
  for (int x = -12; x < 12; ++x)
    for (int y = -12; y < 12; ++y)
      for (int z = -12; z < 12; ++z) {
        float const d = std::sqrt(float(x * x + y * y + z * z)) - 9;
        if (std::abs(d) < 3)
          grid->tree().setValueOn(Coord(x, y, z), d);
        else
          grid->tree().setValueOff(Coord(x, y, z), d < 0 ? -3.0f : 3.0f);
      }
  grid->setGridClass(openvdb::GRID_LEVEL_SET);
  grid->setTransform(openvdb::math::Transform::createLinearTransform(0.25));
  grid->setName("band");
  return grid;
}

openvdb::GridPtrVec everyType() {
  using namespace openvdb;
  auto const half = mixed<FloatGrid>("half", [](int n) { return 0.1f * float(n); });
  half->setSaveFloatAsHalf(true);
  half->transform().postRotate(0.3, math::Y_AXIS);
  auto const halfVectors = mixed<Vec3SGrid>("half v", [](int n) { return Vec3s(float(n), 0.1f, -1); });
  halfVectors->setSaveFloatAsHalf(true);
  halfVectors->transform().postScale(Vec3d(1, 2, 3));
  halfVectors->transform().postTranslate(Vec3d(5, 6, 7));
  auto const fog = mixed<FloatGrid>("fog", [](int n) { return float(n) / 3; });
  fog->setGridClass(GRID_FOG_VOLUME);
  fog->insertMeta("author", StringMetadata("a test"));
  return {fog,
          half,
          band(),
          halfVectors,
          mixed<DoubleGrid>("double", [](int n) { return n / 3.0; }),
          mixed<Int32Grid>("int", [](int n) { return n - 50; }),
          mixed<Int64Grid>("long", [](int n) { return Int64(n) << 33; }),
          mixed<Vec3SGrid>("v", [](int n) { return Vec3s(float(n), 1, 2); }),
          mixed<Vec3DGrid>("vd", [](int n) { return Vec3d(n, 1, 2); }),
          mixed<Vec3IGrid>("vi", [](int n) { return Vec3i(n, -1, 2); }),
          FloatGrid::create(1.5f)};
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

constexpr std::uint32_t kMask = openvdb::io::COMPRESS_ACTIVE_MASK;
constexpr std::uint32_t kCompressions[] = {openvdb::io::COMPRESS_NONE,  kMask,
                                           openvdb::io::COMPRESS_ZIP,   openvdb::io::COMPRESS_ZIP | kMask,
                                           openvdb::io::COMPRESS_BLOSC, openvdb::io::COMPRESS_BLOSC | kMask};

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
      if (auto const file = walked(path)) {
        for (auto const& grid : file->grids) EXPECT_GE(grid->activeVoxelCount(), 0u);
      } else {
        ++refused;
      }
    }
  }
  EXPECT_GT(refused, cases / 10);
  EXPECT_LT(refused, cases);
}

} // namespace
