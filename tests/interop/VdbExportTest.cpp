// Requirement tests: what is imported comes out again bit for bit, as OpenVDB reads it.
#include "Interop/VdbExport.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "Interop/VdbExportImpl.h"
#include "Interop/VdbImportImpl.h"
#include "support/VdbCompare.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <random>

using namespace VLN::Interop;
namespace fs = std::filesystem;

namespace {

fs::path scratch(std::string const& name) {
  return fs::temp_directory_path() / (name + "." + std::to_string(::getpid()) + ".vdb");
}

/// Removes a file at the end of a test.
struct Removed {
  fs::path path;
  ~Removed() { fs::remove(path); }
};

openvdb::GridPtrVec readBack(fs::path const& path, openvdb::MetaMap::Ptr& metadata) {
  openvdb::io::File file(path.string());
  file.open(false);
  metadata = file.getMetadata();
  return *file.getGrids();
}

/// Through import, export and reading; compared grid by grid in the order of names.
void expectSame(openvdb::GridPtrVec const& grids, openvdb::MetaMap::Ptr const& metadata,
                std::string const& what) {
  VdbFile file;
  file.path = what;
  file.grids = grids;
  file.metadata = metadata;
  VdbImport const import = importGrids(file);
  Removed const out{scratch("export-test")};
  exportVdb(import.volumes, out.path.string());
  openvdb::MetaMap::Ptr metadataBack;
  auto back = readBack(out.path, metadataBack);
  // Metadata of a file lives on its volumes.
  if (metadata && !import.volumes.empty()) {
    EXPECT_EQ(VdbCompare::metadataDifference(*metadata, *metadataBack), "") << what;
  }
  auto const isPoints = [](auto const& grid) { return grid->type() == "Tree_ptdataidx32_5_4_3"; };
  auto const points = static_cast<std::size_t>(std::count_if(grids.begin(), grids.end(), isPoints));
  std::size_t const expected = grids.size() - points - import.skipped.size();
  ASSERT_EQ(back.size(), expected) << what;
  auto const byName = [](auto const& a, auto const& b) { return a->getName() < b->getName(); };
  auto sorted = grids;
  std::erase_if(sorted, isPoints);
  std::erase_if(sorted, [&](auto const& grid) {
    return std::any_of(import.skipped.begin(), import.skipped.end(),
                       [&](auto const& s) { return s.grid == grid->getName(); });
  });
  std::stable_sort(sorted.begin(), sorted.end(), byName);
  std::stable_sort(back.begin(), back.end(), byName);
  for (std::size_t n = 0; n < sorted.size(); ++n)
    EXPECT_EQ(VdbCompare::difference(*sorted[n], *back[n]), "") << what << ", grid " << sorted[n]->getName();
}

template <class V> V valueOf(std::mt19937& random) {
  auto const number = [&] { return double(random() % 2001) / 8.0 - 125.0; };
  if constexpr (std::is_same_v<V, bool>)
    return random() % 2 == 0;
  else if constexpr (std::is_arithmetic_v<V>)
    return static_cast<V>(number());
  else {
    using S = typename V::ValueType;
    return V(static_cast<S>(number()), static_cast<S>(number()), static_cast<S>(number()));
  }
}

/// Active and inactive voxels and tiles at every level, at random.
template <class GridT> typename GridT::Ptr randomGrid(unsigned seed) {
  using V = typename GridT::ValueType;
  std::mt19937 random(seed);
  auto grid = GridT::create(valueOf<V>(random));
  grid->setName("random_" + std::to_string(seed));
  auto const coord = [&](int reach) {
    auto const c = [&] { return int(random() % unsigned(2 * reach)) - reach; };
    return openvdb::Coord(c(), c(), c());
  };
  for (int n = 0; n < 3; ++n) grid->tree().addTile(2, coord(3000), valueOf<V>(random), random() % 2 == 0);
  for (int n = 0; n < 12; ++n) grid->tree().addTile(1, coord(400), valueOf<V>(random), random() % 2 == 0);
  for (int n = 0; n < 400; ++n) {
    auto const c = coord(200);
    if (random() % 4 == 0)
      grid->tree().setValueOff(c, valueOf<V>(random));
    else
      grid->tree().setValueOn(c, valueOf<V>(random));
  }
  return grid;
}

template <class GridT> void roundTripRandom() {
  openvdb::initialize();
  for (unsigned seed = 1; seed <= 4; ++seed)
    expectSame({randomGrid<GridT>(seed)}, nullptr, "seed " + std::to_string(seed));
}

} // namespace

TEST(VdbExport, RequirementFloatGridsWithTilesAtEveryLevel) { roundTripRandom<openvdb::FloatGrid>(); }
TEST(VdbExport, RequirementInt32Grids) { roundTripRandom<openvdb::Int32Grid>(); }
TEST(VdbExport, RequirementInt64Grids) { roundTripRandom<openvdb::Int64Grid>(); }
TEST(VdbExport, RequirementBoolGrids) { roundTripRandom<openvdb::BoolGrid>(); }
TEST(VdbExport, RequirementVec3SGrids) { roundTripRandom<openvdb::Vec3SGrid>(); }
TEST(VdbExport, RequirementVec3DGrids) { roundTripRandom<openvdb::Vec3DGrid>(); }
#if VLN_HAS_ELEMENT_DOUBLE
TEST(VdbExport, RequirementDoubleGrids) { roundTripRandom<openvdb::DoubleGrid>(); }
#endif
#if VLN_HAS_ELEMENT_INT3
TEST(VdbExport, RequirementVec3IGrids) { roundTripRandom<openvdb::Vec3IGrid>(); }
#endif

TEST(VdbExport, RequirementGridsOfOneObjectKeepApart) {
  openvdb::initialize();
  // An active tile of one grid where another has leaves, an empty grid, two grids of one name.
  auto tiles = openvdb::FloatGrid::create(0.5f);
  tiles->setName("tiles");
  tiles->tree().addTile(2, {0, 0, 0}, 3.0f, true);
  tiles->tree().addTile(1, {-8, 0, 0}, 4.0f, false);
  auto voxels = openvdb::FloatGrid::create(-1.0f);
  voxels->setName("voxels");
  for (int n = 0; n < 40; ++n) voxels->tree().setValueOn({n, n / 2, 3 * n}, float(n));
  auto empty = openvdb::FloatGrid::create(7.0f);
  empty->setName("empty");
  auto flags = randomGrid<openvdb::Int32Grid>(9);
  expectSame({tiles, voxels, empty, flags}, nullptr, "grids of one object");
}

TEST(VdbExport, RequirementTransformsClassesMetadataAndHalf) {
  openvdb::initialize();
  auto a = randomGrid<openvdb::FloatGrid>(21);
  a->setName("half");
  a->setSaveFloatAsHalf(true);
  // Not the background, which fills all nodes: apart from it, these would be tiles of another value, each
  // with a shell.
  for (auto it = a->beginValueAll(); it; ++it)
    if (*it != a->background()) it.setValue(float(int(*it)));
  a->setGridClass(openvdb::GRID_FOG_VOLUME);
  a->insertMeta("note", openvdb::StringMetadata("kept"));
  auto b = randomGrid<openvdb::FloatGrid>(22);
  b->setName("turned");
  auto const turned = openvdb::math::Transform::createLinearTransform(0.1);
  turned->preRotate(0.7, openvdb::math::Y_AXIS);
  turned->postTranslate({1, 2, 3});
  b->setTransform(turned);
  b->setGridClass(openvdb::GRID_LEVEL_SET);
  auto c = randomGrid<openvdb::Vec3SGrid>(23);
  c->setName("frustum");
  c->setTransform(openvdb::math::Transform::createFrustumTransform(openvdb::BBoxd({0, 0, 0}, {100, 100, 100}),
                                                                   0.5, 10.0, 1.0));
  c->setVectorType(openvdb::VEC_CONTRAVARIANT_RELATIVE);
  // Scales that OpenVDB's comparison takes for the same.
  auto d = randomGrid<openvdb::FloatGrid>(24), e = randomGrid<openvdb::FloatGrid>(25);
  d->setName("fine"), e->setName("finer");
  d->setTransform(openvdb::math::Transform::createLinearTransform(0.1));
  e->setTransform(openvdb::math::Transform::createLinearTransform(0.10000005));
  ASSERT_TRUE(d->transform() == e->transform());
  auto metadata = std::make_shared<openvdb::MetaMap>();
  metadata->insertMeta("author", openvdb::StringMetadata("somebody"));
  metadata->insertMeta("frame", openvdb::Int32Metadata(12));
  expectSame({a, b, c, d, e}, metadata, "transforms");
}

/// A file without its identity, which OpenVDB draws and which is computed here.
std::string withoutIdentity(fs::path const& path) {
  std::ifstream in(path, std::ios::binary);
  std::string bytes((std::istreambuf_iterator<char>(in)), {});
  return bytes.erase(21, 36);
}

TEST(VdbExport, RequirementGridsInTurnGiveTheBytesThatOpenVdbWritesOfAll) {
  openvdb::initialize();
  VdbFile file;
  file.path = "memory";
  for (char const* name : {"a", "", "b", "a", "", "a[1]", "a"}) {
    auto const grid = randomGrid<openvdb::FloatGrid>(unsigned(file.grids.size()) + 1);
    grid->setName(name);
    grid->setSaveFloatAsHalf(file.grids.size() == 2);
    file.grids.push_back(grid);
  }
  VdbImport const import = importGrids(file);
  Removed const ours{scratch("in-turn")}, peers{scratch("at-once")};
  std::vector<std::string> stages;
  exportVdb(import.volumes, ours.path.string(),
            [&](char const* stage, double) { stages.emplace_back(stage); });
  openvdb::io::File(peers.path.string()).write(exportedGrids(import));
  EXPECT_TRUE(withoutIdentity(ours.path) == withoutIdentity(peers.path));
  std::vector<std::string> wanted(file.grids.size(), "building the grids");
  wanted.insert(wanted.end(), {"writing", "done"});
  EXPECT_EQ(stages, wanted);
}

TEST(VdbExport, RequirementReleasedVolumesGiveTheSameFile) {
  openvdb::initialize();
  VdbFile file;
  file.path = "memory";
  // Two volumes; grids with states and without, of several types, a mask among them.
  file.grids = {randomGrid<openvdb::FloatGrid>(1), randomGrid<openvdb::Vec3SGrid>(2),
                randomGrid<openvdb::BoolGrid>(3), openvdb::MaskGrid::create(),
                openvdb::FloatGrid::create(1.0f)};
  openvdb::gridPtrCast<openvdb::MaskGrid>(file.grids[3])->tree().setValueOn({1, 2, 3});
  auto const cube = openvdb::gridPtrCast<openvdb::FloatGrid>(file.grids[4]);
  cube->denseFill({{-90, -90, -90}, {90, 90, 90}}, 2.0f);
  cube->tree().voxelizeActiveTiles();
  for (std::size_t n = 0; n < file.grids.size(); ++n) file.grids[n]->setName("grid " + std::to_string(n));
  cube->setTransform(openvdb::math::Transform::createLinearTransform(0.5));
  VdbImport import = importGrids(file);
  ASSERT_EQ(import.volumes.size(), 2u);
  Removed const kept{scratch("kept")}, released{scratch("released")};
  exportVdb(import, kept.path.string());
  exportVdbReleasing(import, released.path.string());
  EXPECT_TRUE(import.volumes.empty());
  EXPECT_TRUE(withoutIdentity(kept.path) == withoutIdentity(released.path));
}

TEST(VdbExport, NegativeFailedWriteLeavesWhatWasThere) {
  openvdb::initialize();
  VdbFile file;
  file.path = "memory";
  file.grids = {randomGrid<openvdb::FloatGrid>(5)};
  VdbImport const import = importGrids(file);
  EXPECT_ANY_THROW(exportVdb(import.volumes, "/nonexistent-folder/out.vdb"));
  EXPECT_ANY_THROW(exportVdb(import.volumes, fs::temp_directory_path().string()));
}

TEST(VdbExport, RequirementEveryRealFile) {
  if (std::string(VLN_TEST_DATA_DIR).empty()) GTEST_SKIP() << "the real volumes are not here";
  openvdb::initialize();
  for (auto const& entry : fs::directory_iterator(fs::path(VLN_TEST_DATA_DIR) / "vdb")) {
    if (entry.path().extension() != ".vdb") continue;
    openvdb::MetaMap::Ptr metadata;
    auto const grids = readBack(entry.path(), metadata);
    expectSame(grids, metadata, entry.path().filename().string());
  }
}
