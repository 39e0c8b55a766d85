// vln convert into dense files.
#include "support/ReadAll.h"
#include "support/TempFolder.h"
#include "support/VlnProgram.h"

#include <filesystem>

namespace {

using namespace VLN::Test;

class ConvertDenseTest : public testing::Test {
protected:
  ConvertDenseTest()
      : m_torus(m_folder / "torus.vdb") {
    EXPECT_EQ(vln({"make", "torus", m_torus, "--voxels", "20000"}).code, 0);
  }

  TempFolder m_folder;
  std::string m_torus;
};

TEST_F(ConvertDenseTest, RequirementTheSuffixChoosesTheFormat) {
  for (std::string const suffix : {"npz", "vti", "VTI"}) {
    std::string const out = m_folder / ("a." + suffix);
    RunResult const run = vln({"convert", m_torus, out});
    EXPECT_EQ(run.code, 0) << run.err;
    EXPECT_EQ(readAll(out).substr(0, 2), suffix == "npz" ? "PK" : "<?");
  }
}

TEST_F(ConvertDenseTest, RequirementFlatFilesAreTakenToo) {
  std::string const flat = m_folder / "a.nvtt", out = m_folder / "a.npz";
  ASSERT_EQ(vln({"flatten", m_torus, flat}).code, 0);
  RunResult const run = vln({"convert", flat, out});
  EXPECT_EQ(run.code, 0) << run.err;
  EXPECT_TRUE(std::filesystem::exists(out));
}

TEST_F(ConvertDenseTest, NegativeAFolderThatIsNoneIsToldBeforeTheWork) {
  std::string const out = m_folder / "none/a.npz";
  RunResult const run = vln({"convert", m_torus, out});
  EXPECT_EQ(run.code, 1);
  EXPECT_EQ(run.err.rfind("vln: " + out + ": ", 0), 0u) << run.err;
}

} // namespace
