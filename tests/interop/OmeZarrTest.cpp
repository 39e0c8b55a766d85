// .zarr folders. Every value is compared with python3-zarr in the tests of the Python module; here is what
// needs no reader, and how folders are replaced.
#include "Interop/OmeZarrWrite.h"

#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/OutputFile.h"
#include "Interop/OutputFolder.h"
#include "Interop/VdbImportImpl.h"
#include "Interop/VolumeExport.h"
#include "support/ReadAll.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <filesystem>

namespace VLN::Test {
namespace {

using namespace VLN::Interop;
namespace fs = std::filesystem;

VdbImport twoFarVoxels(float background) {
  openvdb::initialize();
  VdbFile file;
  file.path = "memory";
  auto const grid = openvdb::FloatGrid::create(background);
  grid->setName("density");
  grid->tree().setValueOn({0, 0, 0}, 1.5f);
  grid->tree().setValueOn({100000, 70000, 5}, 2.5f);
  grid->setTransform(openvdb::math::Transform::createLinearTransform(0.5));
  file.grids = {grid};
  return importGrids(file);
}

std::string refusal(auto const& call) {
  try {
    call();
  } catch (FileError const& error) { return error.reason(); }
  return "";
}

std::size_t entries(std::string const& folder) {
  return static_cast<std::size_t>(std::distance(fs::directory_iterator(folder), fs::directory_iterator()));
}

TEST(OmeZarrTest, RequirementEmptyChunksAreLeftOut) {
  TempFolder const folder;
  exportVolumes(twoFarVoxels(0.25f), folder / "a.zarr");
  std::string const array = readAll(folder / "a.zarr/0/.zarray");
  // A box of 10^11 voxels, of which two chunks hold something.
  EXPECT_NE(array.find("\"shape\": [6, 70001, 100001]"), std::string::npos) << array;
  EXPECT_NE(array.find("\"chunks\": [6, 64, 64]"), std::string::npos) << array;
  EXPECT_NE(array.find("\"fill_value\": 0.25"), std::string::npos) << array;
  EXPECT_TRUE(fs::exists(folder / "a.zarr/0/0/0/0"));
  EXPECT_TRUE(fs::exists(folder / "a.zarr/0/0/1093/1562"));
  std::size_t files = 0;
  for (auto const& entry : fs::recursive_directory_iterator(folder / "a.zarr/0"))
    files += entry.is_regular_file();
  EXPECT_EQ(files, 3u);
  std::string const attributes = readAll(folder / "a.zarr/.zattrs");
  EXPECT_NE(attributes.find("\"scale\": [0.5, 0.5, 0.5]"), std::string::npos) << attributes;
  EXPECT_NE(attributes.find("\"version\": \"0.4\""), std::string::npos) << attributes;
}

TEST(OmeZarrTest, RequirementAnOldFolderGoesWhenTheNewOneIsWhole) {
  TempFolder const folder;
  exportVolumes(twoFarVoxels(0), folder / "a.zarr");
  writeAll(folder / "a.zarr/0/0/0/7", "left from before");
  auto content = twoFarVoxels(1);
  EXPECT_THROW(exportVolumes(content, folder / "a.zarr",
                             [](char const*, double done) {
                               if (done > 0.2) throw std::runtime_error("enough");
                             }),
               std::runtime_error);
  EXPECT_TRUE(fs::exists(folder / "a.zarr/0/0/0/7"));
  EXPECT_EQ(entries(folder / ""), 1u);
  exportVolumes(content, folder / "a.zarr/");
  EXPECT_FALSE(fs::exists(folder / "a.zarr/0/0/0/7"));
  EXPECT_EQ(entries(folder / ""), 1u);
  EXPECT_EQ(fs::status(folder / "a.zarr").permissions() & fs::perms::owner_all, fs::perms::owner_all);
}

TEST(OmeZarrTest, RequirementALinkLeadsToTheFolderThatIsReplaced) {
  TempFolder const folder;
  exportVolumes(twoFarVoxels(0), folder / "a.zarr");
  fs::create_directory_symlink("a.zarr", folder / "b.zarr");
  exportVolumes(twoFarVoxels(4), folder / "b.zarr");
  EXPECT_TRUE(fs::is_symlink(folder / "b.zarr"));
  EXPECT_NE(readAll(folder / "a.zarr/0/.zarray").find("\"fill_value\": 4.0"), std::string::npos);
}

TEST(OmeZarrTest, NegativeOtherFoldersAndFilesAreNotReplaced) {
  TempFolder const folder;
  auto const content = twoFarVoxels(0);
  fs::create_directory(folder / "a.zarr");
  exportVolumes(content, folder / "a.zarr"); // it is empty
  fs::create_directory(folder / "b.zarr");
  writeAll(folder / "b.zarr/letter.txt", "dear");
  EXPECT_NE(refusal([&] { exportVolumes(content, folder / "b.zarr"); }).find("something else"),
            std::string::npos);
  EXPECT_EQ(readAll(folder / "b.zarr/letter.txt"), "dear");
  writeAll(folder / "c.zarr", "a file");
  EXPECT_NE(refusal([&] { exportVolumes(content, folder / "c.zarr"); }).find("is a file"), std::string::npos);
  EXPECT_NE(refusal([&] { checkOutputFor(FileContent::kExports, folder / "none/a.zarr"); }), "");
  EXPECT_EQ(entries(folder / ""), 3u);
}

TEST(OmeZarrTest, RequirementAnInterruptedFolderIsRemoved) {
  TempFolder const folder;
  {
    OutputFolder const out(folder / "a.zarr", kZarrMark);
    out.write("0/1/2/3", std::string("values"));
    out.write(".zgroup", std::string("{}"));
    EXPECT_EQ(entries(folder / ""), 1u);
    removeUnfinishedOutput();
    EXPECT_EQ(entries(folder / ""), 0u);
  }
  EXPECT_EQ(entries(folder / ""), 0u);
}

TEST(OmeZarrTest, NegativeATurnedVolumeIsRefused) {
  TempFolder const folder;
  VdbFile file;
  file.path = "memory";
  auto const grid = openvdb::FloatGrid::create();
  grid->tree().setValueOn({0, 0, 0}, 1);
  grid->transform().preRotate(0.5, openvdb::math::X_AXIS);
  file.grids = {grid};
  auto const content = importGrids(file);
  EXPECT_NE(refusal([&] { exportVolumes(content, folder / "a.zarr"); }).find("turns"), std::string::npos);
  EXPECT_EQ(entries(folder / ""), 0u);
}

} // namespace
} // namespace VLN::Test
