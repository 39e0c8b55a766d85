// vln convert between formats, as a user meets it.
#include "support/ReadAll.h"
#include "support/TempFolder.h"
#include "support/VlnProgram.h"

#include <filesystem>

namespace {

using namespace VLN::Test;

class FormatsProgramTest : public testing::Test {
protected:
  FormatsProgramTest()
      : m_torus(m_folder / "torus.vdb") {
    EXPECT_EQ(vln({"make", "torus", m_torus, "--voxels", "20000"}).code, 0);
  }
  void convert(std::string const& from, std::string const& to, std::vector<std::string> options = {}) {
    options.insert(options.begin(), {"convert", from, to});
    RunResult const run = vln(options);
    EXPECT_EQ(run.code, 0) << run.err;
    EXPECT_TRUE(std::filesystem::exists(to)) << to;
  }
  /// Of the first channel.
  nlohmann::ordered_json channelOf(std::string const& file) {
    RunResult const run = vln({"info", "--json", file});
    EXPECT_EQ(run.code, 0) << run.err;
    return nlohmann::ordered_json::parse(run.out)["objects"][0]["channels"][0];
  }

  TempFolder m_folder;
  std::string m_torus;
};

TEST_F(FormatsProgramTest, RequirementNvdbGoesThereAndBack) {
  convert(m_torus, m_folder / "a.nvdb");
  convert(m_folder / "a.nvdb", m_folder / "b.vdb");
  auto const before = channelOf(m_torus), nano = channelOf(m_folder / "a.nvdb"),
             after = channelOf(m_folder / "b.vdb");
  for (char const* key : {"name", "type", "active", "min", "max", "class", "background"}) {
    EXPECT_EQ(before[key], after[key]) << key;
    EXPECT_EQ(before[key], nano[key]) << key;
  }
}

TEST_F(FormatsProgramTest, RequirementALevelSetGoesToAMeshAndBack) {
  convert(m_torus, m_folder / "a.ply", {"--adaptivity", "0.1"});
  convert(m_folder / "a.ply", m_folder / "b.vdb", {"--voxel-size", "0.05", "--band", "4"});
  auto const after = channelOf(m_folder / "b.vdb");
  EXPECT_EQ(after["name"], "surface");
  EXPECT_EQ(after["class"], "level set");
  EXPECT_NEAR(after["max"].get<double>(), 0.2, 0.01);
  EXPECT_NEAR(after["min"].get<double>(), -0.2, 0.01);
  // Without faces it is points, as ever.
  EXPECT_EQ(channelOf(m_folder / "a.ply")["name"], "surface");
}

TEST_F(FormatsProgramTest, RequirementASceneHasItsFileBesideIt) {
  convert(m_torus, m_folder / "scene.usda");
  EXPECT_NE(readAll(m_folder / "scene.usda").find("@./scene.vdb@"), std::string::npos);
  EXPECT_EQ(channelOf(m_folder / "scene.vdb"), channelOf(m_torus));
}

TEST_F(FormatsProgramTest, NegativeDamagedFilesEndInOneLine) {
  convert(m_torus, m_folder / "a.nvdb");
  std::string const bytes = readAll(m_folder / "a.nvdb");
  writeAll(m_folder / "a.nvdb", bytes.substr(0, bytes.size() / 2));
  writeAll(m_folder / "b.obj", "v 0 0 0\nf 1 2 3\n");
  writeAll(m_folder / "c.stl", "nothing");
  for (char const* name : {"a.nvdb", "b.obj", "c.stl", "none.stl"}) {
    RunResult const run = vln({"convert", m_folder / name, m_folder / "out.vdb"});
    EXPECT_EQ(run.code, 1) << name;
    EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1) << run.err;
    EXPECT_EQ(run.err.rfind("vln: " + (m_folder / name) + ": ", 0), 0u) << run.err;
    EXPECT_FALSE(std::filesystem::exists(m_folder / "out.vdb"));
  }
}

TEST_F(FormatsProgramTest, NegativeAFlatBufferHasNoGrids) {
  ASSERT_EQ(vln({"flatten", m_torus, m_folder / "a.nvtt"}).code, 0);
  for (char const* name : {"b.vdb", "b.nvdb", "b.usda", "b.ply"})
    expectFailure(vln({"convert", m_folder / "a.nvtt", m_folder / name}),
                  (m_folder / "a.nvtt") +
                      ": is a flat buffer, which has no grids: what is active is not in it");
}

} // namespace
