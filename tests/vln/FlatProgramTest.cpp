// vln flatten and validate, and flat buffers as input of the other commands.
#include "support/RealVolumes.h"
#include "support/TempFolder.h"
#include "support/VlnProgram.h"

#include <cstdint>
#include <fstream>

namespace VLN::Test {
namespace {

class FlatProgramTest : public testing::Test {
protected:
  FlatProgramTest() { EXPECT_EQ(vln({"make", "torus", m_vdb, "--voxels", "20000"}).code, 0); }

  TempFolder m_folder;
  std::string m_vdb = m_folder / "torus.vdb", m_flat = m_folder / "torus.nvtt";
};

// requirement: what the tree gives, the buffer gives
TEST_F(FlatProgramTest, RequirementReadsAsTheFileItCameFrom) {
  for (std::vector<std::string> const& options : {std::vector<std::string>{},
                                                  {"--halo", "1", "--morton"},
                                                  {"--coalesce", "--halo", "0.4"},
                                                  {"--halo", "1", "--textures"},
                                                  {"--traversal", "--neighbours", "--checksum", "full"}}) {
    std::vector<std::string> command{"flatten", m_vdb, m_flat};
    command.insert(command.end(), options.begin(), options.end());
    RunResult const made = vln(command);
    ASSERT_EQ(made.code, 0) << made.err;
    EXPECT_NE(made.out.find("bytes per active voxel"), std::string::npos) << made.out;
    RunResult const sound = vln({"validate", m_flat});
    EXPECT_EQ(sound.code, 0) << sound.err;
    EXPECT_NE(sound.out.find(": sound; "), std::string::npos);
    std::vector<std::string> probe{"probe", m_vdb, "--channel", "surface"};
    for (int n = 0; n < 60; ++n) probe.push_back(std::to_string(n % 3 == 2 ? 0.01 * n - 0.3 : 0.7 * n - 21));
    RunResult const expected = vln(probe);
    probe[1] = m_flat;
    RunResult const got = vln(probe);
    EXPECT_EQ(got.code, 0) << got.err;
    EXPECT_EQ(got.out, expected.out);
    EXPECT_EQ(vln({"slice", m_flat, "--channel", "surface", "--axis", "z", "-o", m_folder / "s.png"}).code,
              0);
    auto const info = nlohmann::json::parse(vln({"info", "--json", m_flat}).out);
    auto const source = nlohmann::json::parse(vln({"info", "--json", m_vdb}).out);
    EXPECT_EQ(info["objects"][0]["channels"][0]["active"], source["objects"][0]["channels"][0]["active"]);
    EXPECT_EQ(info["objects"][0]["channels"][0]["min"], source["objects"][0]["channels"][0]["min"]);
  }
}

// requirement
TEST_F(FlatProgramTest, RequirementTellsTheErrorOfCodes) {
  double last = 1e30;
  for (std::string const build : {"fp4", "fp8", "fp16", "fpn"}) {
    RunResult const made = vln({"flatten", m_vdb, m_flat, "--quantise", build, "--tolerance", "0.001"});
    ASSERT_EQ(made.code, 0) << made.err;
    auto const at = made.out.find("error       largest ");
    ASSERT_NE(at, std::string::npos) << made.out;
    double const error = std::stod(made.out.substr(at + 20));
    if (build == "fpn")
      EXPECT_LE(error, 0.001);
    else
      EXPECT_LT(error, last);
    EXPECT_GT(error, 0);
    last = error;
    EXPECT_EQ(vln({"validate", m_flat}).code, 0);
  }
}

// requirement
TEST_F(FlatProgramTest, RequirementChoosesChannels) {
  EXPECT_EQ(vln({"flatten", m_vdb, m_flat, "--channels", "surf* !nothing"}).code, 0);
  expectFailure(vln({"flatten", m_vdb, m_flat, "--channels", "den*"}),
                m_vdb + ": has no channel that passes 'den*' and that a flat buffer can hold");
  expectFailure(vln({"info", m_vdb, "--channels", "a$"}),
                m_vdb + ": the filter 'a$' is none: Expression Invalid");
  RunResult const info = vln({"info", "--brief", m_vdb, "--channels", "!surface"});
  EXPECT_EQ(info.out.find(m_vdb + ": no grid"), 0u) << info.out;
  EXPECT_EQ(vln({"convert", m_vdb, m_folder / "none.vdb", "--channels", "den*"}).code, 1);
}

// negative
TEST_F(FlatProgramTest, NegativeOptionsThatExcludeEachOther) {
  auto const refused = [&](std::vector<std::string> const& options) {
    std::vector<std::string> command{"flatten", m_vdb, m_flat};
    command.insert(command.end(), options.begin(), options.end());
    RunResult const run = vln(command);
    EXPECT_EQ(run.code, 1) << options.front();
    EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1) << run.err;
    EXPECT_FALSE(std::ifstream(m_flat).good()) << options.front();
  };
  refused({"--textures"});
  refused({"--coalesce", "--quantise", "fp8"});
  refused({"--coalesce", "--neighbours"});
  refused({"--coarser-levels", "--quantise", "fpn"});
  refused({"--halo", "1.5"});
  refused({"--halo", "nan"});
  refused({"--finest-level", "20"});
  refused({"--quantise", "fp5"});
  expectFailure(vln({"flatten", m_vdb, m_folder / "torus.vtk"}),
                m_folder / "torus.vtk" + std::string(": flat buffers are written as .nvtt"));
}

// negative: damage anywhere is found, and is one line
TEST_F(FlatProgramTest, NegativeDamageIsLocated) {
  ASSERT_EQ(vln({"flatten", m_vdb, m_flat}).code, 0);
  std::ifstream in(m_flat, std::ios::binary);
  std::string const whole((std::istreambuf_iterator<char>(in)), {});
  for (std::size_t n = 0; n < 40; ++n) {
    std::string bytes = whole;
    bytes[whole.size() / 40 * n + n] ^= 0x10;
    std::ofstream(m_folder / "damaged.nvtt", std::ios::binary) << bytes;
    RunResult const run = vln({"validate", m_folder / "damaged.nvtt"});
    EXPECT_EQ(run.code, 1) << n;
    EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1) << run.err;
  }
  std::ofstream(m_folder / "cut.nvtt", std::ios::binary) << whole.substr(0, whole.size() / 2);
  for (std::string const command : {"validate", "info"})
    EXPECT_EQ(vln({command, m_folder / "cut.nvtt"}).code, 1);
  EXPECT_EQ(vln({"validate", m_vdb}).code, 1);
}

class FlatRealFile : public testing::TestWithParam<char const*> {};

// requirement
TEST_P(FlatRealFile, RequirementFlattensAndComesBack) {
  std::string const path = dataFile(std::string("vdb/") + GetParam());
  if (path.empty()) GTEST_SKIP() << "no shared test data";
  TempFolder folder;
  RunResult const made = vln({"flatten", path, folder / "flat.nvtt", "--halo", "0.2"});
  if (made.code == 1) {
    EXPECT_NE(made.err.find("has no channel that passes '*'"), std::string::npos) << made.err; // points alone
    return;
  }
  ASSERT_EQ(made.code, 0) << made.err;
  EXPECT_EQ(vln({"validate", folder / "flat.nvtt"}).code, 0);
  RunResult const info = vln({"info", "--json", folder / "flat.nvtt"});
  ASSERT_EQ(info.code, 0) << info.err;
  EXPECT_FALSE(nlohmann::json::parse(info.out)["objects"][0]["channels"].empty());
}

INSTANTIATE_TEST_SUITE_P(Shared, FlatRealFile, realVolumes(), volumeName);

} // namespace
} // namespace VLN::Test
