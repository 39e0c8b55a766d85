#include "Interop/UsdaWrite.h"

#include "Interop/FileError.h"
#include "Interop/VdbMake.h"
#include "support/ReadAll.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <filesystem>

namespace VLN::Test {
namespace {

using namespace VLN::Interop;

TEST(UsdaTest, RequirementASceneNamesEachFieldOfTheFileBesideIt) {
  TempFolder const folder;
  makeTorus(folder / "torus.vdb", 20000);
  auto const content = importVdb(folder / "torus.vdb");
  writeUsda(folder / "my scene.usda", content);
  std::string const text = readAll(folder / "my scene.usda");
  auto const has = [&](std::string const& part) {
    EXPECT_NE(text.find(part), std::string::npos) << part << text;
  };
  EXPECT_EQ(text.rfind("#usda 1.0\n", 0), 0u);
  has("defaultPrim = \"my_scene\"");
  has("metersPerUnit = 1");
  has("upAxis = \"Y\"");
  has("def Xform \"my_scene\"");
  has("def Volume \"volume\"");
  has("rel field:surface = </my_scene/volume/surface>");
  has("def OpenVDBAsset \"surface\"");
  has("asset filePath = @./my scene.vdb@");
  has("token fieldName = \"surface\"");
  has("token fieldClass = \"levelSet\"");
  has("token fieldDataType = \"float\"");
  EXPECT_EQ(std::count(text.begin(), text.end(), '{'), std::count(text.begin(), text.end(), '}'));
  // The torus: a ring of radius 1 about z, a tube of 0.4.
  double low[3], high[3];
  ASSERT_EQ(std::sscanf(text.c_str() + text.find("extent = "), "extent = [(%lf, %lf, %lf), (%lf, %lf, %lf)]",
                        low, low + 1, low + 2, high, high + 1, high + 2),
            6);
  double const reach = 3.5 * content.volumes[0].voxelSize;
  for (int a = 0; a < 3; ++a) {
    EXPECT_NEAR(low[a], a == 2 ? -0.4 : -1.4, reach);
    EXPECT_NEAR(high[a], a == 2 ? 0.4 : 1.4, reach);
    EXPECT_LT(low[a], a == 2 ? -0.4 : -1.4);
  }
  EXPECT_TRUE(readAll(folder / "my scene.vdb") == readAll(folder / "torus.vdb"));
}

TEST(UsdaTest, RequirementTheFileThatItComesFromIsNotWritten) {
  TempFolder const folder;
  makeTorus(folder / "torus.vdb", 20000);
  auto const before = std::filesystem::last_write_time(folder / "torus.vdb");
  std::filesystem::last_write_time(folder / "torus.vdb", before - std::chrono::hours(1));
  writeUsda(folder / "torus.usda", importVdb(folder / "torus.vdb"));
  EXPECT_EQ(std::filesystem::last_write_time(folder / "torus.vdb"), before - std::chrono::hours(1));
  EXPECT_NE(readAll(folder / "torus.usda").find("@./torus.vdb@"), std::string::npos);
}

TEST(UsdaTest, NegativeNeitherFileWhereOneCannotBeWritten) {
  TempFolder const folder;
  makeTorus(folder / "torus.vdb", 20000);
  auto const content = importVdb(folder / "torus.vdb");
  std::filesystem::create_directory(folder / "a.vdb");
  EXPECT_THROW(writeUsda(folder / "a.usda", content), FileError);
  EXPECT_FALSE(std::filesystem::exists(folder / "a.usda"));
  EXPECT_THROW(writeUsda(folder / "a@b.usda", content), FileError);
  EXPECT_FALSE(std::filesystem::exists(folder / "a@b.usda"));
  EXPECT_THROW(writeUsda("/dev/full", content), FileError);
}

} // namespace
} // namespace VLN::Test
