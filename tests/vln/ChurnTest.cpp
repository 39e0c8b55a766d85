// What vln tells about memory.
#include "support/VlnProgram.h"

#include <algorithm>

namespace {

using namespace VLN::Test;
using Json = nlohmann::ordered_json;

class ChurnTest : public testing::Test {
protected:
  ChurnTest() { EXPECT_EQ(vln({"make", "torus", m_path, "--voxels", "20000"}).code, 0); }
  TempFolder m_folder;
  std::string m_path = m_folder / "torus.vdb";
};

// requirement: the keys of the report are fixed
TEST_F(ChurnTest, AsJsonHasStableKeys) {
  RunResult const run = vln({"churn", m_path, "--limit", "200MB", "--rounds", "4", "--json"});
  ASSERT_EQ(run.code, 0) << run.err;
  EXPECT_EQ(run.err, "");
  Json const j = Json::parse(run.out);
  EXPECT_EQ(keysOf(j), (std::vector<std::string>{"rounds", "limit", "with_pools", "without_pools"}));
  EXPECT_EQ(j["rounds"], 4);
  EXPECT_EQ(j["limit"], 200 * 1024 * 1024);
  for (char const* part : {"with_pools", "without_pools"}) {
    EXPECT_EQ(keysOf(j[part]), (std::vector<std::string>{"seconds", "peak_rss"}));
    EXPECT_GT(j[part]["seconds"], 0);
    EXPECT_GT(j[part]["peak_rss"], 1000000);
  }

  // What the program itself takes depends on the build; the rounds on twenty thousand voxels add little.
  std::string const small = m_folder / "small.vdb";
  ASSERT_EQ(vln({"make", "torus", small, "--voxels", "1000"}).code, 0);
  RunResult const least = vln({"churn", small, "--limit", "200MB", "--rounds", "4", "--json"});
  ASSERT_EQ(least.code, 0) << least.err;
  EXPECT_LT(j["with_pools"]["peak_rss"].get<double>(),
            Json::parse(least.out)["with_pools"]["peak_rss"].get<double>() + 32e6);
}

// requirement
TEST_F(ChurnTest, AsTableTellsTimeMemoryAndWhatThePoolsHold) {
  RunResult const run = vln({"churn", m_path, "--limit", "200MB", "--rounds", "2"});
  ASSERT_EQ(run.code, 0) << run.err;
  EXPECT_EQ(run.err, "");
  for (char const* text : {" active voxels, 2 rounds, limit 209.7 MB\n", "time a round", "peak resident",
                           "\n  with pools ", "\n  without pools ", "channels ", "arrays ", "blocks "})
    EXPECT_NE(run.out.find(text), std::string::npos) << text << "\n" << run.out;
}

// negative
TEST_F(ChurnTest, RefusesWhatItCannotUse) {
  RunResult run = vln({"churn", m_path});
  EXPECT_EQ(run.code, 1);
  EXPECT_NE(run.err.find("--limit"), std::string::npos) << run.err;
  for (char const* limit : {"much", "-5MB", "0", "12"}) {
    run = vln({"churn", m_path, "--limit", limit});
    EXPECT_EQ(run.code, 1) << limit;
    EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1) << run.err;
  }
  run = vln({"churn", m_folder / "missing.vdb", "--limit", "100MB"});
  EXPECT_EQ(run.code, 1);
  EXPECT_EQ(run.out, "");
  EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1) << run.err;
  EXPECT_NE(run.err.find("missing.vdb"), std::string::npos) << run.err;
}

// requirement
TEST_F(ChurnTest, InfoTellsWhatAccountsForMemory) {
  RunResult const run = vln({"info", m_path, "--memory"});
  ASSERT_EQ(run.code, 0) << run.err;
  for (char const* text :
       {"BaseLogger.allocationStats.begin\n", "base = surface, ", "base = voxel_tile_tree, ",
        "BaseLogger.names.end\n", "Total mem occupied by data: used = ", "BaseLogger.stats.end\n",
        "ArrayPool:Content of array pool:\n", "ChannelPool:Content of channel pool:\n", "blocks: "})
    EXPECT_NE(run.out.find(text), std::string::npos) << text << "\n" << run.out;
  EXPECT_EQ(vln({"info", m_path, "--memory", "--json"}).code, 1) << "JSON has no place for it";
}

} // namespace
