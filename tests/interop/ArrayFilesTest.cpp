// .npz and .vti files there and back. What numpy and VTK write is read in the tests of the Python module.
#include "Interop/ArrayFiles.h"

#include "Interop/ChannelValues.h"
#include "Interop/FileError.h"
#include "Interop/VdbImportImpl.h"
#include "Interop/VolumeExport.h"
#include "Interop/VolumeFile.h"
#include "support/ArrayCase.h"
#include "support/FuzzReplay.h"

#include <algorithm>

namespace VLN::Test {
namespace {

using namespace VLN::Interop;

template <class GridT>
openvdb::GridBase::Ptr grid(std::string const& name, typename GridT::ValueType background,
                            auto const& valueAt) {
  auto const made = GridT::create(background);
  auto accessor = made->getAccessor();
  for (int z = 0; z < 6; ++z)
    for (int y = 0; y < 5; ++y)
      for (int x = 0; x < 13; ++x)
        if ((x + y + z) % 3 || x == 0 || x == 12)
          accessor.setValueOn({x - 7, y + 2, z - 3},
                              static_cast<typename GridT::ValueType>(valueAt(x, y, z)));
  made->setName(name);
  return made;
}

VdbImport volume(bool turned) {
  using namespace openvdb;
  openvdb::initialize();
  VdbFile file;
  file.path = "memory";
  auto const f = [](int x, int y, int z) { return 0.1 * x - y + 1000.0 * z; };
  auto const n = [](int x, int y, int z) { return x + 100 * y - 10000 * z; };
  file.grids = {
      grid<FloatGrid>("density", 3.5f, f),
      grid<DoubleGrid>("e", -0.25, f),
      grid<Int32Grid>("a/b <&> \"c\"", 7, n),
      grid<Int64Grid>("l", -9, n),
      grid<BoolGrid>("b", false, [](int, int, int) { return true; }),
      grid<Vec3SGrid>("v", Vec3s(1, 2, 3),
                      [&](int x, int y, int z) { return Vec3s(Vec3d(f(x, y, z), x, y)); }),
      grid<Vec3DGrid>("w", Vec3d(0, 0, 0), [&](int x, int y, int z) { return Vec3d(f(x, y, z), x, 1); }),
      grid<Vec3IGrid>("x", Vec3i(4), [&](int x, int y, int z) { return Vec3i(n(x, y, z), x, y); })};
  auto const transform = math::Transform::createLinearTransform(0.5);
  if (turned) transform->preRotate(0.7, math::Z_AXIS);
  transform->preScale(Vec3d(1, 2, 0.25));
  transform->postTranslate(Vec3d(3, -1, 8));
  for (auto const& g : file.grids) g->setTransform(transform);
  return importGrids(file);
}

/// All values in and round the box, and where they are.
void expectEqual(VdbImport const& before, VdbImport const& after) {
  ASSERT_EQ(after.volumes.size(), 1u);
  EXPECT_TRUE(after.skipped.empty());
  auto const &one = before.volumes[0], &two = after.volumes[0];
  ASSERT_EQ(one.channels.size(), two.channels.size());
  for (std::size_t c = 0; c < one.channels.size(); ++c) {
    auto const was = ChannelValues::of(one, one.channels[c].name),
               is = ChannelValues::of(two, two.channels[c].name);
    ASSERT_TRUE(was && is) << one.channels[c].name;
    for (int z = -5; z < 5; ++z)
      for (int y = 0; y < 9; ++y)
        for (int x = -9; x < 8; ++x)
          ASSERT_EQ(was->text({x, y, z}), is->text({x, y, z}))
              << one.channels[c].name << " " << x << " " << y << " " << z;
    auto const p = one.indexToWorld.toWorld({1, 2, 3}), q = two.indexToWorld.toWorld({1, 2, 3});
    for (int a = 0; a < 3; ++a) EXPECT_NEAR(p[a], q[a], 1e-12);
  }
}

TEST(ArrayFilesTest, RequirementNpzGoesThereAndBack) {
  TempFolder const folder;
  auto const before = volume(true);
  exportVolumes(before, folder / "a.npz");
  auto const after = importVolumes(folder / "a.npz");
  expectEqual(before, after);
  EXPECT_EQ(after.volumes[0].channels[0].name, "density");
  auto const& channels = after.volumes[0].channels;
  EXPECT_TRUE(std::any_of(channels.begin(), channels.end(), [](auto const& c) { return c.type == "bool"; }));
}

// regression: a channel that is called as the background of the next one
TEST(ArrayFilesTest, RegressionNamesOfBackgroundsAreFreeToo) {
  using namespace openvdb;
  openvdb::initialize();
  VdbFile file;
  file.path = "memory";
  for (int n = 0; n < 2; ++n) {
    auto const made = FloatGrid::create(float(n));
    made->tree().setValueOn(Coord(1, 2, 3), 5.0f + float(n));
    made->setName(n ? "a" : "a.background");
    file.grids.push_back(made);
  }
  TempFolder const folder;
  for (bool const sparse : {false, true}) {
    exportVolumes(importGrids(file), folder / "a.npz", {}, {.surface = {}, .voxelByVoxel = sparse});
    auto const after = importVolumes(folder / "a.npz");
    EXPECT_TRUE(after.skipped.empty());
    ASSERT_EQ(after.volumes[0].channels.size(), 2u);
    for (int n = 0; n < 2; ++n) {
      auto const values = ChannelValues::of(after.volumes[0], after.volumes[0].channels[std::size_t(n)].name);
      ASSERT_TRUE(values);
      EXPECT_EQ(values->text({1, 2, 3}), n ? "6" : "5");
      EXPECT_EQ(values->text({90, 2, 3}), n ? "1" : "0");
    }
  }
}

TEST(ArrayFilesTest, RequirementVoxelsOneByOneKeepWhatIsActive) {
  TempFolder const folder;
  auto const before = volume(true);
  exportVolumes(before, folder / "a.npz", {}, {.surface = {}, .voxelByVoxel = true});
  auto const after = importVolumes(folder / "a.npz");
  expectEqual(before, after);
  for (std::size_t c = 0; c < before.volumes[0].channels.size(); ++c)
    EXPECT_EQ(before.volumes[0].channels[c].activeVoxels, after.volumes[0].channels[c].activeVoxels);
}

TEST(ArrayFilesTest, RequirementVtiGoesThereAndBack) {
  TempFolder const folder;
  for (bool const turned : {false, true}) {
    auto const before = volume(turned);
    exportVolumes(before, folder / "a.vti");
    auto const after = importVolumes(folder / "a.vti");
    expectEqual(before, after);
    auto const& channels = after.volumes[0].channels;
    EXPECT_TRUE(std::any_of(channels.begin(), channels.end(),
                            [](auto const& c) { return c.gridName == "a/b <&> \"c\""; }));
  }
}

TEST(ArrayFilesTest, RequirementAFilterChoosesArrays) {
  TempFolder const folder;
  exportVolumes(volume(false), folder / "a.npz");
  VdbReadLimits limits;
  limits.channels = "d*";
  EXPECT_EQ(importVolumes(folder / "a.npz", limits).volumes[0].channels.size(), 1u);
}

std::string refused(std::string const& file, std::string const& bytes) {
  writeAll(file, bytes);
  try {
    importVolumes(file);
  } catch (FileError const& error) { return error.reason(); }
  return "";
}

std::string image(std::string const& attributes, std::string const& inside) {
  return "<VTKFile type=\"ImageData\" " + attributes + "><ImageData WholeExtent=\"0 1 0 1 0 1\">" + inside +
         "</ImageData></VTKFile>";
}
std::string piece(std::string const& extent, std::string const& array) {
  return "<Piece Extent=\"" + extent + "\"><PointData>" + array + "</PointData></Piece>";
}

TEST(ArrayFilesTest, NegativeWhatIsWrongIsToldInOneLine) {
  TempFolder const folder;
  std::string const npz = folder / "a.npz", vti = folder / "a.vti";
  EXPECT_EQ(refused(npz, ""), "is empty");
  EXPECT_NE(refused(npz, "nothing of that kind, and long enough").find("is no .npz file"), std::string::npos);
  EXPECT_NE(refused(vti, "nothing of that kind").find("is no image of VTK"), std::string::npos);
  std::string const array =
      "<DataArray type=\"Float32\" Name=\"a\" format=\"ascii\">1 2 3 4 5 6 7 8</DataArray>";
  EXPECT_EQ(refused(vti, image("", piece("0 1 0 1 0 1", array))), "");
  EXPECT_NE(refused(vti, image("", piece("0 1 0 1 0 2", array))).find("not as long"), std::string::npos);
  EXPECT_NE(refused(vti, image("", piece("0 1 0 1 0 400000000", array))).find("not as long"),
            std::string::npos);
  EXPECT_NE(refused(vti, image("", piece("0 1 0 1 0 4000000000", array))).find("indices"), std::string::npos);
  EXPECT_NE(
      refused(vti, image("compressor=\"vtkLZ4DataCompressor\"", piece("0 1 0 1 0 1", array))).find("packed"),
      std::string::npos);
  EXPECT_NE(
      refused(vti, image("", piece("0 1 0 1 0 1", "<DataArray type=\"Int8\" Name=\"a\">1 2 3 4 5 6 7 200<"
                                                  "/DataArray>")))
          .find("does not fit"),
      std::string::npos);
}

TEST(ArrayFilesTest, BoundaryPiecesMakeOneGrid) {
  TempFolder const folder;
  std::string const first = "<DataArray type=\"Int16\" Name=\"a\" format=\"ascii\">1 2 3 4</DataArray>",
                    second = "<DataArray type=\"Int16\" Name=\"a\" format=\"ascii\">5 6 7 -8</DataArray>";
  writeAll(folder / "a.vti", image("", piece("0 1 0 1 0 0", first) + piece("0 1 0 1 1 1", second)));
  auto const content = importVolumes(folder / "a.vti");
  ASSERT_EQ(content.volumes.size(), 1u);
  auto const values = ChannelValues::of(content.volumes[0], "a");
  EXPECT_EQ(values->text({1, 0, 0}), "2");
  EXPECT_EQ(values->text({1, 1, 1}), "-8");
}

std::vector<std::string> npzSeeds() {
  TempFolder const folder;
  std::vector<std::string> list;
  auto content = volume(false);
  content.volumes[0].channels.resize(1);
  exportVolumes(content, folder / "a.npz");
  list.push_back(readAll(folder / "a.npz"));
  exportVolumes(content, folder / "b.npz", {}, {.surface = {}, .voxelByVoxel = true});
  list.push_back(readAll(folder / "b.npz"));
  return list;
}
std::vector<std::string> vtiSeeds() {
  TempFolder const folder;
  auto content = volume(true);
  content.volumes[0].channels.resize(1);
  exportVolumes(content, folder / "a.vti");
  std::string const ascii =
                        "<DataArray type=\"Float32\" Name=\"a\" format=\"ascii\">1 2 3 4 5 6 7 8</DataArray>",
                    // 8 bytes: their number in four bytes before them
      binary = "<DataArray type=\"UInt8\" Name=\"a\" format=\"binary\">CAAAAAECAwQFBgcI</DataArray>";
  return {readAll(folder / "a.vti"), image("", piece("0 1 0 1 0 1", ascii)),
          image("", piece("0 1 0 1 0 1", binary))};
}

TEST(NpzFuzz, RequirementSeedsAreRead) { Support::replay<Support::NpzCase>("npz", npzSeeds()); }
TEST(VtiFuzz, RequirementSeedsAreRead) { Support::replay<Support::VtiCase>("vti", vtiSeeds()); }

/// Cut short at many places, and with changed bytes.
template <class Case> void damage(std::vector<std::string> const& seeds, std::string const& alphabet) {
  for (auto const& seed : seeds)
    for (std::size_t n = 0; n < 24; ++n) {
      std::string const cut = seed.substr(0, seed.size() * n / 24);
      try {
        Support::runCase<Case>(cut);
      } catch (Support::FuzzFailure const& failure) {
        FAIL() << failure.what() << " when cut at " << cut.size();
      }
    }
  Support::replayMutations<Case>(seeds, 120, alphabet);
}

TEST(NpzFuzz, RequirementDamagedFilesAreReadOrRefusedWithOneLine) {
  damage<Support::NpzCase>(npzSeeds(), "\xFF\x7F");
}
TEST(VtiFuzz, RequirementDamagedFilesAreReadOrRefusedWithOneLine) {
  damage<Support::VtiCase>(vtiSeeds(), " \n0123456789-.\"<>=\xFF");
}

} // namespace
} // namespace VLN::Test
